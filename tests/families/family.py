"""Families of processes with known answers: "family.py NAME ARGUMENT..." becomes the first process of one of them.

It says, as one line of JSON, which processes there are ("pids", by name), and what a report must say of them ("known": for each
category the bytes of every exact set of processes, named with blanks between; "kernel": what is the kernel's). All of them end with
their standard input. The private memory with known answers is executable: that is a category of its own, in which an
interpreter has nothing.
"""
import contextlib
import ctypes
import json
import mmap
import os
import random
import socket
import sys
import tempfile
import time

PAGE, MIB = mmap.PAGESIZE, 1 << 20
PAYLOAD = "anonymous code"
HUGE_POOL, MOVE_TO = 0x40000, 1 | 2  # MAP_HUGETLB, MREMAP_MAYMOVE | MREMAP_FIXED
DONTNEED, FREE, DONTFORK, MERGEABLE, HUGEPAGE, PAGEOUT = 4, 8, 10, 12, 14, 21
IPC_CREAT, IPC_RMID, IPC_PRIVATE = 0o1000, 0, 0
PRIVATE = mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS

libc = ctypes.CDLL(None, use_errno=True)


class Skip(Exception):
    pass


def call(name, *arguments):
    """A function of the C library whose arguments are numbers."""
    function = getattr(libc, name)
    function.restype = ctypes.c_long
    result = function(*map(ctypes.c_long, arguments))
    if result & 0xFFFFFFFF == 0xFFFFFFFF:  # -1, also as an int
        raise OSError(ctypes.get_errno(), name)
    return result


class Memory:
    """A mapping; offsets and sizes are in bytes."""

    def __init__(self, size, flags=PRIVATE, file=-1, code=True, align=PAGE):
        rights = mmap.PROT_READ | mmap.PROT_WRITE | (mmap.PROT_EXEC if code else 0)
        start = call("mmap", 0, size + (align if align > PAGE else 0), rights, flags, file, 0)
        self.start, self.size = -(-start // align) * align, size

    @classmethod
    def at(cls, start, size):
        memory = cls.__new__(cls)
        memory.start, memory.size = start, size
        return memory

    def write(self, start=0, end=None, value=1):
        ctypes.memset(self.start + start, value, (self.size if end is None else end) - start)
        return self

    def read(self, start, end):
        for offset in range(start, end, PAGE):
            ctypes.c_char.from_address(self.start + offset).value

    def advise(self, advice, start=0, end=None):
        call("madvise", self.start + start, (self.size if end is None else end) - start, advice)

    def move(self, start, end):
        """Moves a range to a new place; its own stays empty."""
        target = call("mmap", 0, end - start, 0, PRIVATE, -1, 0)
        call("mremap", self.start + start, end - start, end - start, MOVE_TO, target)
        return Memory.at(target, end - start)

    def unmap(self):
        call("munmap", self.start, self.size)


at_end = []  # of the first process
names_out = None


def until_the_end():
    while os.read(0, 1):
        pass
    for action in at_end:
        action()
    with contextlib.suppress(ChildProcessError):
        while True:
            os.wait()
    os._exit(0)


def fork(name, body=lambda: None):
    """A child that does `body` and waits; returns when it has done so."""
    done, tell = os.pipe()
    if os.fork() == 0:
        os.close(done)
        at_end.clear()
        body()
        os.write(names_out, f"{name} {os.getpid()}\n".encode())
        os.write(tell, b".")
        until_the_end()
    os.close(tell)
    if not os.read(done, 1):
        raise RuntimeError(f"{name} failed")
    os.close(done)


def in_mib(**sets):
    return {names.replace("_", " "): round(size * MIB) for names, size in sets.items()}


def prefork(size, children):
    """The k-th child rewrote the first k MiB."""
    payload = Memory(size * MIB).write()
    names = [f"c{k}" for k in range(1, children + 1)]
    for k, name in enumerate(names, 1):
        fork(name, lambda: payload.write(0, k * MIB, 2))
    known = {name: k * MIB for k, name in enumerate(names, 1)} | {"parent": MIB}
    known |= {" ".join(["parent"] + names[:i]): MIB for i in range(1, children)}
    return {PAYLOAD: known | {" ".join(["parent"] + names): (size - children) * MIB}}


def grandchildren():
    payload = Memory(8 * MIB).write()

    def child():
        payload.write(0, 2 * MIB, 2)
        fork("grandchild", lambda: payload.write(1 * MIB, 3 * MIB, 3))

    fork("child", child)
    payload.write(7 * MIB, 8 * MIB, 4)
    return {PAYLOAD: in_mib(parent=3, child=1, grandchild=2, child_grandchild=2, parent_child=1, parent_child_grandchild=4)}


def moved():
    payload = Memory(8 * MIB).write()
    fork("mover", lambda: payload.move(2 * MIB, 5 * MIB).write(0, MIB, 2))
    fork("other", lambda: payload.move(7 * MIB, 8 * MIB))
    payload.move(4 * MIB, 6 * MIB)
    return {PAYLOAD: in_mib(mover=1, parent_other=1, parent_mover_other=7)}


def dontfork():
    payload = Memory(8 * MIB).write()
    payload.advise(DONTFORK, 0, 3 * MIB)
    fork("child")
    return {PAYLOAD: in_mib(parent=3, parent_child=5)}


def freed_lazily(who):
    """One of them wrote to half of the memory and freed half of that lazily; an "heir" frees memory that others have, too."""
    payload = Memory(8 * MIB).write()

    other = Memory(PAGE, code=False)

    def free():
        if who != "heir":
            payload.write(0, 4 * MIB, 2)
        payload.advise(FREE, 0, 2 * MIB)
        # Each processor keeps a few such pages to itself until it locks one.
        for processor in os.sched_getaffinity(0):
            os.sched_setaffinity(0, {processor})
            call("mlock", other.start, PAGE)
            call("munlock", other.start, PAGE)

    fork("child", free if who != "parent" else lambda: None)
    fork("other")
    if who == "heir":
        return {}
    if who == "parent":
        free()
    rest = "parent other" if who == "child" else "child other"
    return {PAYLOAD: {who: 2 * MIB, rest: 4 * MIB, "parent child other": 4 * MIB}}


def transparent():
    """Huge pages, of which a child rewrote three small pages and a whole one; another child nothing."""
    payload = Memory(8 * MIB, align=2 * MIB)
    payload.advise(HUGEPAGE)
    payload.write()

    def child():
        for page in (0, 513, 700):
            payload.write(page * PAGE, (page + 1) * PAGE, 2)
        payload.write(6 * MIB, 8 * MIB, 2)

    fork("writer", child)
    fork("other")
    own = 3 * PAGE / MIB + 2
    return {PAYLOAD: in_mib(writer=own, parent_other=own, parent_writer_other=8 - own)}


def pool():
    """Needs five free pages of 2 MiB in the huge-page pool."""
    try:
        payload = Memory(8 * MIB, PRIVATE | HUGE_POOL, code=False).write()
    except OSError:
        raise Skip("the kernel has no huge pages left")
    fork("child", lambda: payload.write(2 * MIB, 4 * MIB, 2))
    return {"huge pages": in_mib(parent=2, child=2, parent_child=6)}


def private_file(folder):
    with tempfile.TemporaryFile(dir=folder) as file:
        file.write(b"x" * 4 * MIB)
        file.flush()
        payload = Memory(4 * MIB, mmap.MAP_PRIVATE, file.fileno(), code=False)
    payload.write(0, 2 * MIB)
    fork("child", lambda: payload.write(1 * MIB, 3 * MIB, 2))
    return {"mapped file": in_mib(parent=1, child=2, parent_child=1)}


def merged(name, pages, twice, *children):
    """Pages that are all different, and the same in every process of this kind; with `twice` each of them is there twice."""
    payload = Memory(pages * PAGE)
    payload.advise(MERGEABLE)

    def write(start, end, content):
        for page in range(start, end):
            payload.write(page * PAGE, (page + 1) * PAGE)
            ctypes.c_uint64.from_address(payload.start + page * PAGE).value = content + page // (twice + 1)

    write(0, pages, 4711)
    limit = time.monotonic() + 20
    while True:
        with open("/proc/self/ksm_stat") as file:
            if f"ksm_merging_pages {pages}\n" in file.read():
                break
        if time.monotonic() > limit:
            raise Skip("the kernel did not merge within 20 seconds")
        time.sleep(0.05)
    for child in children:
        fork(child, lambda: write(0, 64, 1 << 32))
    return {}


def swapped():
    payload = Memory(16 * MIB).write()
    payload.advise(PAGEOUT, 0, 8 * MIB)

    def child():
        payload.read(0, 2 * MIB)
        payload.write(8 * MIB, 10 * MIB, 2)
        payload.advise(PAGEOUT, 8 * MIB, 9 * MIB)

    fork("child", child)
    file = os.memfd_create("swapped")
    os.ftruncate(file, 4 * MIB)
    memory = Memory(4 * MIB, mmap.MAP_SHARED, file, code=False).write()
    memory.advise(PAGEOUT)
    memory.unmap()
    # The child's frames of the first 2 MiB are other pages than the parent's slots.
    return {PAYLOAD: in_mib(parent=4, child=4, parent_child=12), "memfd (unmapped)": in_mib(parent=4)}


def memfd():
    """Mapped by one; held by both; unmapped after use; mapped and touched in part; mapped by one and held by the other."""

    def create(size):
        file = os.memfd_create("some")
        os.write(file, b"x" * size * MIB)
        return file

    def shared(file):
        return Memory(os.fstat(file).st_size, mmap.MAP_SHARED, file, code=False)

    create(3)
    both = create(4)
    fork("child", lambda: shared(both).write(0, 3 * MIB))
    mapped = create(2)
    shared(mapped).write()
    os.close(mapped)
    shared(create(5)).write().unmap()
    shared(create(4)).write(0, MIB)
    return {"memfd": in_mib(child=3, parent=3), "memfd (unmapped)": in_mib(parent=8, parent_child=4)}


def system_v():
    def attach(segment):
        return Memory.at(call("shmat", segment, 0, 0), sizes[segment])

    sizes = {}
    for size in (3, 2, 4):
        segment = call("shmget", IPC_PRIVATE, size * MIB, IPC_CREAT | 0o600)
        at_end.append(lambda segment=segment: call("shmctl", segment, IPC_RMID, 0))
        sizes[segment] = size * MIB
    fork("child")
    mapped, untouched, left = sizes
    attach(mapped).write()
    for segment in (untouched, left):
        call("shmdt", attach(segment).write().start)
    attach(untouched)
    known = {"System V shared memory": in_mib(parent=3), "System V shared memory (unmapped)": in_mib(parent=2)}
    return known, {"System V shared memory (unattached)": 4 * MIB}


def tmpfs():
    """Deleted and held; deleted and mapped; with a name, and mapped and touched in part."""
    fork("child")

    def create(size, keep):
        file = tempfile.NamedTemporaryFile(dir="/dev/shm", prefix="family-", delete=False)
        file.write(b"x" * size * MIB)
        file.flush()
        if keep:
            at_end.append(lambda: os.unlink(file.name))
        return file

    held = create(3, False)
    os.dup(held.fileno())
    with create(2, False) as mapped:
        Memory(2 * MIB, mmap.MAP_SHARED, mapped.fileno(), code=False).write()
    for file in (held, mapped):
        os.unlink(file.name)
    create(6, True).close()
    with create(5, True) as named:
        Memory(5 * MIB, mmap.MAP_SHARED, named.fileno(), code=False).write(0, 2 * MIB)
    known = {"deleted shared memory": in_mib(parent=2), "deleted shared memory (unmapped)": in_mib(parent=3),
             "mapped file": in_mib(parent=2)}
    return known, {"tmpfs /dev/shm": 9 * MIB}


def in_flight():
    fork("child")
    file = os.memfd_create("flying")
    os.write(file, b"x" * 16 * MIB)
    keep = socket.socketpair()
    at_end.append(lambda: keep)
    socket.send_fds(keep[0], [b"x"], [file])
    os.close(file)
    return {}, {"shared memory without holder": 16 * MIB}


def tree(seed):
    """A random tree of forks with random memory: no known answer."""
    dice = random.Random(seed)
    ranges = [Memory(4 * MIB, align=2 * MIB), Memory(2 * MIB, align=2 * MIB)]
    if dice.random() < 0.5:
        ranges[0].advise(HUGEPAGE)
    for memory in ranges:
        memory.write()

    def around(memory, first, end):
        parts = (0, first), (end, memory.size)
        return [Memory.at(memory.start + start, stop - start) for start, stop in parts if start < stop]

    def step(action):
        """Does it to a random piece of a random range; what is moved or unmapped leaves a hole."""
        memory = dice.choice(ranges)
        first = dice.randrange(0, memory.size, PAGE)
        end = min(memory.size, first + PAGE * dice.choice((1, 3, 16, 100, 600)))
        if action == "write":
            memory.write(first, end, 3)
        elif action == "drop":
            memory.advise(DONTNEED, first, end)
        elif action == "move":
            ranges.remove(memory)
            ranges.extend([memory.move(first, end)] + around(memory, first, end))
        elif action == "unmap" and len(ranges) > 1:
            ranges.remove(memory)
            ranges.extend(around(memory, first, end))
            Memory.at(memory.start + first, end - first).unmap()

    def live(name, depth):
        dice.seed(f"{seed} {name}")
        forks = [dice.randrange(30) for _ in range(dice.randint(depth == 0, 4) if depth < 3 else 0)]
        for number in range(30):
            for child in range(forks.count(number)):
                fork(f"{name}.{number}.{child}", lambda: live(f"{name}.{number}.{child}", depth + 1))
            step(dice.choices(("write", "drop", "move", "unmap"), (8, 2, 2, 1))[0])

    live("parent", 0)
    return {}


def same(size, children):
    """Children that share all of their parent's memory."""
    payload = Memory(size * MIB).write()
    for k in range(children):
        fork(f"c{k}")
    return {}


def many(children, pages):
    """Each page was rewritten by two children drawn at random."""
    payload = Memory(pages * PAGE).write()
    dice = random.Random(1)
    rewritten = [[] for _ in range(children)]
    for page in range(pages):
        for child in dice.sample(range(children), 2):
            rewritten[child].append(page)

    def child(k):
        for page in rewritten[k]:
            ctypes.memset(payload.start + page * PAGE, 2, 1)

    for k in range(children):
        fork(f"c{k}", lambda: child(k))
    return {}


def writers(count, is_shuffled):
    """Processes that drop and write pages of memory that they share in part, about 20,000 a second in all.

    The memory that each has written goes round: upwards in its addresses, or without any order."""
    payload = Memory(64 * MIB).write()

    def walk():
        places, position, window = list(range(payload.size // PAGE // 2)), 0, 2048
        if is_shuffled:
            random.shuffle(places)
        for place in places[:window]:
            payload.write(place * PAGE, (place + 1) * PAGE, 2)
        for place in places[window:]:
            payload.advise(DONTNEED, place * PAGE, (place + 1) * PAGE)
        while os.getppid() == parent:
            for _ in range(20000 // count // 50):
                last, next_ = places[position], places[(position + window) % len(places)]
                payload.advise(DONTNEED, last * PAGE, (last + 1) * PAGE)
                payload.write(next_ * PAGE, (next_ + 1) * PAGE, 3)
                position = (position + 1) % len(places)
            time.sleep(0.02)
        os._exit(0)

    parent = os.getpid()
    for k in range(count):
        pid = os.fork()
        if pid == 0:
            os.write(names_out, f"w{k} {os.getpid()}\n".encode())
            walk()
        at_end.append(lambda pid=pid: os.kill(pid, 9))
    time.sleep(2)
    return {}


def main():
    global names_out
    names_in, names_out = os.pipe()
    family = globals()[sys.argv[1]]
    arguments = [int(text) if text.isdecimal() else text for text in sys.argv[2:]]
    try:
        known = family(*arguments)
    except Skip as reason:
        print(json.dumps({"skip": str(reason)}), flush=True)
        sys.exit()
    known, kernel = known if isinstance(known, tuple) else (known, {})
    first = sys.argv[2] if family is merged else "parent"
    os.write(names_out, f"{first} {os.getpid()}\n".encode())
    lines = os.read(names_in, 1 << 16).decode().splitlines()
    pids = {name: int(pid) for name, pid in map(str.split, lines)}
    print(json.dumps({"pids": pids, "known": known, "kernel": kernel}), flush=True)
    until_the_end()


if __name__ == "__main__":
    main()
