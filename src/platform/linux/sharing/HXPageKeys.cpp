#include "platform/linux/sharing/HXPageKeys.h"

#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <sys/mman.h>

namespace {

constexpr size_t kHugeSize = 2 << 20, kZerosSize = 2 * kHugeSize;

uint64_t entryOf(const HXDescriptor &pagemap, uint64_t address, uint32_t pageShift) {
    uint64_t entry = 0;
    if (pagemap.readAt((address >> pageShift) * sizeof entry, &entry, sizeof entry) != sizeof entry) return 0;
    return entry;
}

} // namespace

HXPageEntries::HXPageEntries(uint32_t pageShift) {
    void *const memory = ::mmap(nullptr, kZerosSize, PROT_READ | PROT_WRITE,
                                MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) return;
    _zeros = memory;
    learnZeros(pageShift);
}

HXPageEntries::~HXPageEntries() {
    if (_zeros != nullptr) ::munmap(_zeros, kZerosSize);
}

// A page that was read but never written is one of zeros.
void HXPageEntries::learnZeros(uint32_t pageShift) {
    const HXDescriptor pagemap = HXOpenAt(AT_FDCWD, "/proc/self/pagemap");
    if (!pagemap) return;
    const auto start = reinterpret_cast<uint64_t>(_zeros), mask = uint64_t{kHugeSize} - 1;
    const uint64_t huge = (start + mask) & ~mask;
    const uint64_t small = huge == start ? huge + kHugeSize : start; // outside of the huge one
    ::madvise(reinterpret_cast<void *>(huge), kHugeSize, MADV_HUGEPAGE);
    ::madvise(reinterpret_cast<void *>(small), size_t{1} << pageShift, MADV_NOHUGEPAGE);
    [[maybe_unused]] const char zeros[] = {*reinterpret_cast<const volatile char *>(huge),
                                           *reinterpret_cast<const volatile char *>(small)};
    _zeroFrame = entryOf(pagemap, small, pageShift) & kFrame;
    const uint64_t hugeFrame = entryOf(pagemap, huge, pageShift) & kFrame;
    if (hugeFrame == 0 || hugeFrame == _zeroFrame) return;
    _hugeZeroFrame = hugeFrame;
    _hugeZeroFrames = kHugeSize >> pageShift;
}

HXPageEntries::Kind HXPageEntries::readSwapped(uint64_t entry, HXPageKey *key) {
    // Types of swap entries that are no swap space (include/linux/swap.h): a page on its way from one frame
    // to another, whose old frame the offset tells, and marks without a page.
    constexpr uint64_t typeBits = 5, firstMoving = 24, mark = 31;
    const uint64_t type = entry & ((1 << typeBits) - 1);
    if (type == mark) return nothing;
    if (type < firstMoving) {
        *key = kSwappedKey | (entry & kFrame);
        return swapped;
    }
    if ((entry & kFile) != 0) return file;
    *key = (entry & kFrame) >> typeBits;
    return *key == 0 ? nothing : anonymous;
}

std::atomic<uint64_t> &HXSeenKeys::Cursor::wordOf(HXPageKey key) {
    const uint64_t number = key >> kChunkShift;
    Known &known = _known[number % _known.size()];
    if (known.number != number) known = {number, _seen.chunk(number)};
    return known.words[(key & ((uint64_t{1} << kChunkShift) - 1)) / 64];
}

std::atomic<uint64_t> *HXSeenKeys::chunk(uint64_t number) {
    const std::lock_guard lock(_mutex);
    auto &chunk = _chunks[number];
    if (!chunk) chunk = std::make_unique<Chunk>();
    return chunk->data();
}
