#!/usr/bin/env python3
"""Runs heft on a process that moves 1 GB with mremap(2) every millisecond, over many small mappings. Every report must have the
memory, or warn that it changed.

usage: tests/attack/moving.py FOLDER-OF-THE-PROGRAMS [RUNS]"""
import ctypes, os, re, signal, subprocess, sys, time

SIZE, LOW, HIGH = 1 << 30, 0x100000000000, 0x300000000000
libc = ctypes.CDLL(None)
for call in (libc.mmap, libc.mremap): call.restype = ctypes.c_void_p
libc.mmap.argtypes = [ctypes.c_void_p, ctypes.c_size_t, ctypes.c_int, ctypes.c_int, ctypes.c_int, ctypes.c_long]
libc.mremap.argtypes = [ctypes.c_void_p, ctypes.c_size_t, ctypes.c_size_t, ctypes.c_int, ctypes.c_void_p]

def move(ready):
    libc.mmap(LOW, SIZE, 3, 0x32, -1, 0)
    ctypes.memset(LOW, 1, SIZE)
    for i in range(20000): libc.mmap(0x200000000000 + i * 8192, 4096, 1, 0x32, -1, 0)
    os.write(ready, b'r')
    while True:
        for source, target in ((LOW, HIGH), (HIGH, LOW)):
            libc.mremap(source, SIZE, SIZE, 3, target)  # MREMAP_MAYMOVE | MREMAP_FIXED
            time.sleep(0.001)

def main():
    if len(sys.argv) < 2: sys.exit(__doc__)
    runs = int((sys.argv[2:] or ['30'])[0])
    reading, writing = os.pipe()
    pid = os.fork()
    if pid == 0: move(writing)
    os.read(reading, 1)
    whole = warned = silent = 0
    try:
        for _ in range(runs):
            report = subprocess.run([os.path.join(sys.argv[1], 'heft'), '-f', 'bytes', str(pid)], capture_output=True, text=True)
            heft = int(re.search(r'Heft: (\d+) B', report.stdout)[1])
            if 'memory changed while it was read' in report.stdout + report.stderr: warned += 1
            elif SIZE <= heft < 1.1 * SIZE: whole += 1
            else: silent += 1
    finally:
        os.kill(pid, signal.SIGKILL)
        os.waitpid(pid, 0)
    print(f'{whole} whole, {warned} warned of, {silent} wrong without a word')
    sys.exit(silent > 0)

main()
