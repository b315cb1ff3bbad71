#!/usr/bin/env python3
"""Few pages in very large shared mappings: heft, heft-record and heft-replay end within LIMIT seconds each.

usage: tests/attack/sparse_mappings.py [FOLDER_OF_THE_PROGRAMS]
"""
import mmap
import os
import subprocess
import sys
import tempfile
import time

LIMIT = 5
FOLDER = sys.argv[1] if len(sys.argv) > 1 else "build/default"
TIB = 1 << 40


def run(*command):
    begin = time.monotonic()
    done = subprocess.run(command, stdout=subprocess.PIPE, timeout=600)
    took = time.monotonic() - begin
    print(f"{took:6.2f} s, status {done.returncode}: {' '.join(command)}")
    return took <= LIMIT and done.returncode == 0


def main():
    memory = os.memfd_create("sparse")
    os.ftruncate(memory, 64 * TIB)
    mapped = mmap.mmap(memory, 64 * TIB)
    mapped[0] = mapped[32 * TIB] = mapped[64 * TIB - 1] = 1
    pid = str(os.getpid())
    results = [run(f"{FOLDER}/heft", pid, "-v")]
    with tempfile.TemporaryDirectory() as folder:
        recorded, made_up = folder + "/recorded", folder + "/made-up"
        results.append(run(f"{FOLDER}/heft-record", "machine", recorded, pid))
        results.append(run(f"{FOLDER}/heft-replay", recorded, "-v", pid))
        with open(made_up, "w") as file:
            file.write("heft-machine 1\nhost\tpage_size=4096\tself_region_heft=1\nprocess\tpid=5\tname=p\n")
            for i in range(200):
                file.write(f"region\tpid=5\taddress={(i + 1) << 36}\tsize={1 << 36}\tresident=2\tdirtied=2"
                           f"\tshare_mode=4\tobject_id={i + 1}\tpages=1*9,{(1 << 24) - 2}*0,1*9\n")
        results.append(run(f"{FOLDER}/heft-replay", made_up, "-v", "5"))
    return 0 if all(results) else 1


if __name__ == "__main__":
    sys.exit(main())
