#include "platform/linux/pages/HXPageScan.h"

#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <sys/ioctl.h>
#include <sys/mman.h>

#include <algorithm>
#include <cerrno>
#include <memory>

namespace {

// The C library's headers may not have these declarations yet.
struct Region {
    uint64_t start;
    uint64_t end;
    uint64_t categories;
};
struct Argument {
    uint64_t size;
    uint64_t flags;
    uint64_t start;
    uint64_t end;
    uint64_t walkEnd;
    uint64_t vector;
    uint64_t vectorLength;
    uint64_t maximumPages;
    uint64_t invertedCategories;
    uint64_t requiredCategories;
    uint64_t anyOfCategories;
    uint64_t returnedCategories;
};
constexpr unsigned long kScanRequest = _IOWR('f', 16, Argument);
constexpr uint64_t kFile = 1 << 2, kPresent = 1 << 3, kSwapped = 1 << 4, kZero = 1 << 5;
constexpr uint64_t kGuard = 1 << 8; // kernel 6.15

struct BitMeaning {
    uint64_t bit;
    uint8_t fact;
};
constexpr BitMeaning kCategories[] = {
    {kPresent, HXPageRun::present}, {kFile, HXPageRun::file},     {kSwapped, HXPageRun::swapped},
    {kZero, HXPageRun::nothing},    {kGuard, HXPageRun::nothing},
};
// Of an entry of pagemap.
constexpr BitMeaning kEntryBits[] = {
    {uint64_t{1} << 63, HXPageRun::present},
    {uint64_t{1} << 62, HXPageRun::swapped},
    {uint64_t{1} << 61, HXPageRun::file},
    {uint64_t{1} << 58, HXPageRun::nothing}, // a guard
};

uint8_t factsOf(uint64_t bits, std::span<const BitMeaning> meanings) {
    uint8_t found = 0;
    for (const BitMeaning &meaning : meanings)
        if (bits & meaning.bit) found |= meaning.fact;
    return found;
}

// Answers how many regions were found, -1 with errno.
int scan(const HXDescriptor &pagemap, uint64_t categories, uint64_t start, uint64_t end,
         std::span<Region> regions, uint64_t *walkEnd) {
    Argument argument{};
    argument.size = sizeof argument;
    argument.start = start;
    argument.end = end;
    argument.vector = reinterpret_cast<uint64_t>(regions.data());
    argument.vectorLength = regions.size();
    argument.anyOfCategories = kPresent | kSwapped;
    argument.returnedCategories = categories;
    HXGiveWay();
    const int count = ::ioctl(pagemap.get(), kScanRequest, &argument);
    *walkEnd = argument.walkEnd;
    return count;
}

// What this kernel can do, found out by asking it about memory of the program's own.
struct Support {
    bool isSupported = false;
    bool isComplete = false;
    uint64_t categories = kPresent | kSwapped | kFile | kZero;
};

// Whether the huge page of zeros is told as one; true where there is none.
bool knowsHugeZeros(const HXDescriptor &pagemap, const Support &support) {
    constexpr size_t hugeSize = 2 << 20, length = 2 * hugeSize;
    void *memory =
        ::mmap(nullptr, length, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) return false;
    ::madvise(memory, length, MADV_HUGEPAGE);
    const uint64_t past = reinterpret_cast<uint64_t>(memory) % hugeSize;
    const volatile char *page = static_cast<const volatile char *>(memory) + (hugeSize - past) % hugeSize;
    [[maybe_unused]] const char zero = *page;
    const auto start = reinterpret_cast<uint64_t>(page);
    Region region{};
    uint64_t walkEnd = 0;
    const int count = scan(pagemap, support.categories, start, start + hugeSize, {&region, 1}, &walkEnd);
    ::munmap(memory, length);
    return count == 1 && (region.categories & kZero) != 0;
}

// Kernels that have guards without telling them (6.13, 6.14) show them as swapped.
bool hasGuards() {
    constexpr int installGuard = 102; // MADV_GUARD_INSTALL
    const auto length = static_cast<size_t>(::sysconf(_SC_PAGESIZE));
    void *memory = ::mmap(nullptr, length, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) return true;
    const bool installed = ::madvise(memory, length, installGuard) == 0;
    ::munmap(memory, length);
    return installed;
}

Support findSupport() {
    Support support;
    const HXDescriptor pagemap = HXOpenAt(AT_FDCWD, "/proc/self/pagemap");
    if (!pagemap) return support;
    Region region{};
    uint64_t walkEnd = 0;
    const auto address = reinterpret_cast<uint64_t>(&region) & ~uint64_t{0xFFFF};
    const auto answers = [&](uint64_t categories) {
        return scan(pagemap, categories, address, address + 0x10000, {&region, 1}, &walkEnd) >= 0;
    };
    support.isSupported = answers(support.categories);
    const bool knowsGuards = support.isSupported && answers(support.categories | kGuard);
    if (knowsGuards) support.categories |= kGuard;
    support.isComplete =
        support.isSupported && (knowsGuards || !hasGuards()) && knowsHugeZeros(pagemap, support);
    return support;
}

const Support &support() {
    static const Support found = findSupport();
    return found;
}

} // namespace

bool HXPageScan::isComplete() {
    return support().isComplete;
}

std::optional<HXPageScan::Walk> HXPageScan::find(const HXDescriptor &pagemap, bool tellsFiles, uint64_t start,
                                                 uint64_t end, std::span<HXPageRun> runs) {
    if (!support().isSupported) return std::nullopt;
    thread_local const auto regions = std::make_unique_for_overwrite<Region[]>(kMostRuns);
    const std::span room(regions.get(), std::min(kMostRuns, runs.size()));
    const uint64_t categories = support().categories & ~(tellsFiles ? 0 : kFile);
    Walk walk{};
    const int found = scan(pagemap, categories, start, end, room, &walk.end);
    if (found < 0) return std::nullopt;
    walk.count = static_cast<size_t>(found);
    for (size_t i = 0; i < walk.count; i++)
        runs[i] = {room[i].start, room[i].end, factsOf(room[i].categories, kCategories)};
    // A walk that the kernel did in several steps may tell the end of an earlier one: all of [start, end) has
    // been walked if there was room to spare, and what has been found is behind it in any case.
    if (walk.count < room.size()) walk.end = end;
    if (walk.count > 0) walk.end = std::max(walk.end, runs[walk.count - 1].end);
    if (walk.end <= start) return std::nullopt;
    return walk;
}

size_t HXReadPageFacts(const HXDescriptor &pagemap, uint64_t page, std::span<uint8_t> facts) {
    constexpr size_t step = 4096; // 32 KiB of entries: 16 MiB of small pages
    thread_local const auto entries = std::make_unique_for_overwrite<uint64_t[]>(step);
    const size_t length = std::min(facts.size(), step) * sizeof entries[0];
    const ssize_t got = pagemap.readAt(page * sizeof entries[0], entries.get(), length);
    const size_t count = got < 0 ? 0 : static_cast<size_t>(got) / sizeof entries[0];
    for (size_t i = 0; i < count; i++)
        facts[i] = factsOf(entries[i], kEntryBits);
    return count;
}
