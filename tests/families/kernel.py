"""What the kernel says of memory: the mappings of processes, their pages, and its own counters. Needs root."""
import array
import collections
import ctypes
import mmap
import os
import re

PAGE = mmap.PAGESIZE
MIB = 1 << 20
HEADER = re.compile(r"([0-9a-f]+)-([0-9a-f]+) (\S{4}) \S+ ([0-9a-f]+):([0-9a-f]+) \d+ *(.*)")
FIGURE = re.compile(r"(\w+):\s+(\d+) kB")

# The entries of /proc/PID/pagemap, see the kernel's Documentation/admin-guide/mm/pagemap.rst.
PRESENT, SWAPPED, FILE, GUARD = 1 << 63, 1 << 62, 1 << 61, 1 << 58
FRAME = (1 << 55) - 1
MARKER_TYPE, MIGRATION_TYPES = 31, range(24, 31)  # in place of a swap file's number

Mapping = collections.namedtuple("Mapping", "start end rights is_private device name figures")


def read(path):
    with open(path) as file:
        return file.read()


def figures(path, *names):
    """The sum of some figures of a file like /proc/meminfo, in bytes."""
    found = dict(FIGURE.findall(read(path)))
    return sum(int(found.get(name, 0)) * 1024 for name in names)


def mappings(pid):
    result = []
    for line in read(f"/proc/{pid}/smaps").splitlines():
        if header := HEADER.fullmatch(line):
            start, end, rights, major, minor, name = header.groups()
            device = os.makedev(int(major, 16), int(minor, 16))
            result.append(Mapping(int(start, 16), int(end, 16), rights, rights[3] == "p", device, name, collections.Counter()))
        elif figure := FIGURE.match(line):
            result[-1].figures[figure[1]] = int(figure[2]) * 1024
    return result


def swap_backed_devices():
    """All that tmpfs mounts show, and the kernel's own mount of memfd, System V and shared anonymous memory."""
    devices = set()
    for line in read("/proc/self/mountinfo").splitlines():
        mount, _, system = line.partition(" - ")
        if system.split()[0] == "tmpfs":
            devices.add(os.makedev(*map(int, mount.split()[2].split(":"))))
    memory = os.memfd_create("device")
    devices.add(os.fstat(memory).st_dev)
    os.close(memory)
    return devices


SWAP_BACKED = swap_backed_devices()


def own_bytes(mapping):
    """What a mapping holds that is not in the page cache and not lazily freed."""
    f = mapping.figures
    return f["Anonymous"] - f["LazyFree"] + f["Private_Hugetlb"] + f["Shared_Hugetlb"] + f["Swap"]


def private_bytes(pid):
    return sum(own_bytes(mapping) for mapping in mappings(pid) if mapping.is_private)


def charge(pid):
    """The heft of a process that holds nothing without mapping it."""
    total = figures(f"/proc/{pid}/status", "VmPTE")
    for mapping in mappings(pid):
        total += own_bytes(mapping)
        if mapping.device in SWAP_BACKED:
            total += mapping.figures["Rss"] - mapping.figures["Anonymous"]
    return total


def pagemap(pid, start, end):
    with open(f"/proc/{pid}/pagemap", "rb", buffering=0) as file:
        entries = array.array("Q")
        while len(entries) < (end - start) // PAGE:
            file.seek((start // PAGE + len(entries)) * 8)
            entries.frombytes(file.read(((end - start) // PAGE - len(entries)) * 8))
        return entries


def zero_frames():
    """The frames of the zero page and of the huge one, with what keeps the latter in place."""
    size = 2 * figures("/proc/meminfo", "Hugepagesize")
    area = mmap.mmap(-1, size, flags=mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS)
    small = mmap.mmap(-1, 16 * PAGE, flags=mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS)
    frames = set()
    if size:
        area.madvise(mmap.MADV_HUGEPAGE)
    for memory in (area, small):
        for offset in range(0, len(memory), PAGE):
            memory[offset]
        start = ctypes.addressof(ctypes.c_char.from_buffer(memory))
        frames |= {entry & FRAME for entry in pagemap("self", start, start + len(memory)) if entry & PRESENT}
    return frames, (area, small)


ZERO_FRAMES, ZERO_MAPPINGS = zero_frames()


def page_keys(pid, wanted=lambda mapping: True):
    """The frame or swap slot behind each page that a process's private mappings hold."""
    keys = []
    for mapping in mappings(pid):
        if not mapping.is_private or mapping.name in ("[vvar]", "[vvar_vclock]", "[vsyscall]") or not wanted(mapping):
            continue
        for entry in pagemap(pid, mapping.start, mapping.end):
            if not entry & (PRESENT | SWAPPED) or entry & (FILE | GUARD):
                continue
            number, kind = entry & FRAME, entry & 31
            if entry & PRESENT:
                if number not in ZERO_FRAMES:
                    keys.append(number << 1)
            elif kind in MIGRATION_TYPES:
                keys.append(number >> 5 << 1)
            elif kind != MARKER_TYPE:
                keys.append(number << 1 | 1)
    return keys


def page_sets(pids, wanted=lambda mapping: True):
    """The bytes of each exact set of processes that share private pages, and the pages that each process maps."""
    members, counts = {}, {}
    for index, pid in enumerate(pids):
        keys = page_keys(pid, wanted)
        counts[pid] = len(keys)
        for key in keys:
            members[key] = members.get(key, 0) | 1 << index
    sets = collections.Counter(members.values())
    named = {frozenset(pid for i, pid in enumerate(pids) if mask >> i & 1): n * PAGE for mask, n in sets.items()}
    return named, counts


def user_memory():
    """Anonymous and shared memory, resident or swapped, of the whole machine."""
    read("/proc/sys/vm/stat_refresh")  # has the counts of all CPUs added up
    found = {name: int(value) * 1024 for name, value in FIGURE.findall(read("/proc/meminfo"))}
    return found["AnonPages"] + found["Shmem"] + found["SwapTotal"] - found["SwapFree"]
