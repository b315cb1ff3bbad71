#include "platform/linux/sharing/HXPageKeys.h"

#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <sys/mman.h>

#include <algorithm>
#include <mutex>

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
    char *const start = static_cast<char *>(_zeros);
    char *const huge = start + (kHugeSize - reinterpret_cast<uint64_t>(start) % kHugeSize) % kHugeSize;
    char *const small = huge == start ? huge + kHugeSize : start; // outside of the huge one
    ::madvise(huge, kHugeSize, MADV_HUGEPAGE);
    ::madvise(small, size_t{1} << pageShift, MADV_NOHUGEPAGE);
    [[maybe_unused]] const char zeros[] = {*static_cast<const volatile char *>(huge),
                                           *static_cast<const volatile char *>(small)};
    _zeroFrame = entryOf(pagemap, reinterpret_cast<uint64_t>(small), pageShift) & kFrame;
    const uint64_t hugeFrame = entryOf(pagemap, reinterpret_cast<uint64_t>(huge), pageShift) & kFrame;
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

namespace {
constexpr const char *kFlagsPath = "/proc/kpageflags";
}

bool HXFrameFlags::areTold() {
    uint64_t flags = 0;
    return HXOpenAt(AT_FDCWD, kFlagsPath).readAt(0, &flags, sizeof flags) == sizeof flags;
}

HXFrameFlags::HXFrameFlags() : _file(HXOpenAt(AT_FDCWD, kFlagsPath)) {}

void HXFrameFlags::findLazilyFreed(std::vector<uint64_t> *frames, std::vector<uint64_t> *found) {
    constexpr uint64_t anonymous = 1 << 12, swapBacked = 1 << 14; // KPF_ANON, KPF_SWAPBACKED
    constexpr uint64_t smallGap = 16, mostFrames = 4096;          // that are asked for at once
    std::sort(frames->begin(), frames->end());
    for (size_t first = 0, next = 0; first < frames->size(); first = next) {
        const uint64_t start = (*frames)[first];
        for (next = first + 1; next < frames->size(); next++)
            if ((*frames)[next] - (*frames)[next - 1] > smallGap || (*frames)[next] - start >= mostFrames)
                break;
        _flags.assign((*frames)[next - 1] - start + 1, 0); // which a file that ends tells nothing of
        (void)_file.readAt(start * sizeof _flags[0], _flags.data(), _flags.size() * sizeof _flags[0]);
        for (size_t i = first; i < next; i++)
            if ((_flags[(*frames)[i] - start] & (anonymous | swapBacked)) == anonymous)
                found->push_back((*frames)[i]);
    }
}

std::atomic<uint64_t> &HXSeenKeys::Cursor::wordOf(HXPageKey key) {
    const uint64_t number = key >> kChunkShift;
    Known &known = _known[number % _known.size()];
    if (known.number != number) known = {number, _seen.chunk(number)};
    return known.words[(key & ((uint64_t{1} << kChunkShift) - 1)) / 64];
}

void HXSeenKeys::Cursor::add(std::span<const HXPageKey> keys, std::vector<HXPageKey> *metAgain) {
    const auto bitOf = [](HXPageKey key) { return uint64_t{1} << (key & 63); };
    for (size_t first = 0, next = 0; first < keys.size(); first = next) {
        const HXPageKey word = keys[first] >> 6;
        uint64_t bits = 0;
        for (; next < keys.size() && keys[next] >> 6 == word && (bits & bitOf(keys[next])) == 0; next++)
            bits |= bitOf(keys[next]);
        if (word == 0) bits &= ~uint64_t{1};
        const uint64_t known =
            bits == 0 ? 0 : wordOf(keys[first]).fetch_or(bits, std::memory_order_relaxed) & bits;
        for (size_t i = first; known != 0 && i < next; i++)
            if ((known & bitOf(keys[i])) != 0) metAgain->push_back(keys[i]);
    }
}

void HXSeenKeys::clear() {
    const std::lock_guard lock(_mutex);
    _chunks.clear();
}

std::atomic<uint64_t> *HXSeenKeys::chunk(uint64_t number) {
    {
        const std::lock_guard lock(_mutex);
        const auto known = _chunks.find(number);
        if (known != _chunks.end()) return known->second->data();
    }
    auto chunk = std::make_unique<Chunk>(); // clearing it takes a while
    const std::lock_guard lock(_mutex);
    return _chunks.try_emplace(number, std::move(chunk)).first->second->data();
}
