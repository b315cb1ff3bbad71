"""What the kernel says of memory: the mappings of processes, their pages, and its own counters. Needs root."""
import array
import collections
import ctypes
import glob
import mmap
import os
import re
import sys

PAGE = mmap.PAGESIZE
MIB = 1 << 20
HEADER = re.compile(r"([0-9a-f]+)-([0-9a-f]+) (\S{4}) \S+ ([0-9a-f]+):([0-9a-f]+) \d+ *(.*)")
FIGURE = re.compile(r"(\w+):\s+(\d+) kB")

# The entries of /proc/PID/pagemap, see the kernel's Documentation/admin-guide/mm/pagemap.rst.
PRESENT, SWAPPED, FILE, GUARD = 1 << 63, 1 << 62, 1 << 61, 1 << 58
FRAME = (1 << 55) - 1
MARKER_TYPE, MIGRATION_TYPES = 31, range(24, 31)  # in place of a swap file's number

Mapping = collections.namedtuple("Mapping", "start end rights device name figures")


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
            result.append(Mapping(int(start, 16), int(end, 16), rights, device, name, collections.Counter()))
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
    return sum(own_bytes(mapping) for mapping in mappings(pid) if mapping.rights.endswith("p"))


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
        return array.array("Q", os.pread(file.fileno(), (end - start) // PAGE * 8, start // PAGE * 8))


def zero_frames():
    """The frames of the zero page and of the huge one, with the mappings that keep the latter in place."""
    frames, areas = set(), []
    for size in (2 * figures("/proc/meminfo", "Hugepagesize"), 16 * PAGE):
        areas.append(mmap.mmap(-1, size or PAGE, flags=mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS))
        if size > 16 * PAGE:
            areas[-1].madvise(mmap.MADV_HUGEPAGE)
        for offset in range(0, size, PAGE):
            areas[-1][offset]
        start = ctypes.addressof(ctypes.c_char.from_buffer(areas[-1]))
        frames |= {entry & FRAME for entry in pagemap("self", start, start + size) if entry & PRESENT}
    return frames, areas


ZERO_FRAMES, ZERO_AREAS = zero_frames()


flags = None  # /proc/kpageflags, while there is a family that frees memory lazily


def is_lazily_freed(frame):
    """Private memory that is dropped without swapping: KPF_ANON without KPF_SWAPBACKED."""
    entry = int.from_bytes(os.pread(flags.fileno(), 8, frame * 8), sys.byteorder)
    return entry & (1 << 12 | 1 << 14) == 1 << 12


def page_key(entry):
    """The frame or swap slot that an entry tells; none where it is nobody's page."""
    if not entry & (PRESENT | SWAPPED) or entry & GUARD:
        return None
    number, kind = entry & FRAME, entry & 31
    if entry & PRESENT:
        return None if number in ZERO_FRAMES or flags and is_lazily_freed(number) else number << 1
    if kind in MIGRATION_TYPES:
        return number >> 5 << 1
    return None if kind == MARKER_TYPE else number << 1 | 1


def page_keys(pid, wanted=lambda mapping: True):
    """The frame or swap slot behind each page that a process's private mappings hold."""
    keys = []
    for mapping in mappings(pid):
        if mapping.rights.endswith("s") or mapping.name.startswith(("[vvar", "[vsyscall")) or not wanted(mapping):
            continue
        entries = (entry for entry in pagemap(pid, mapping.start, mapping.end) if not entry & FILE)
        keys += [key for key in map(page_key, entries) if key is not None]
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


def out_of_reach():
    """The anonymous memory of processes that root may not examine either, which no report can count."""
    total = 0
    for path in glob.glob("/proc/[0-9]*"):
        try:
            open(path + "/smaps").close()
        except PermissionError:
            total += figures(path + "/status", "RssAnon", "VmSwap")
        except (FileNotFoundError, ProcessLookupError):
            pass  # has ended
    return total


def user_memory():
    """Anonymous and shared memory, resident or swapped, of all that root may examine."""
    read("/proc/sys/vm/stat_refresh")  # has the counts of all CPUs added up
    return figures("/proc/meminfo", "AnonPages", "Shmem", "SwapTotal") - figures("/proc/meminfo", "SwapFree") - out_of_reach()
