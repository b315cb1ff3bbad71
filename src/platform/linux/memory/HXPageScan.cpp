#include "platform/linux/memory/HXPageScan.h"

#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <sys/ioctl.h>
#include <sys/mman.h>

#include <algorithm>
#include <array>
#include <cerrno>

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
constexpr unsigned long scanRequest = _IOWR('f', 16, Argument);
constexpr uint64_t fileCategory = 1 << 2, presentCategory = 1 << 3, swappedCategory = 1 << 4;
constexpr uint64_t zeroCategory = 1 << 5;
constexpr uint64_t guardCategory = 1 << 8; // kernel 6.15

uint8_t factsOf(uint64_t categories) {
    static constexpr struct {
        uint64_t category;
        uint8_t fact;
    } facts[] = {
        {presentCategory, HXPageRun::present}, {fileCategory, HXPageRun::file},
        {swappedCategory, HXPageRun::swapped}, {zeroCategory, HXPageRun::nothing},
        {guardCategory, HXPageRun::nothing},
    };
    uint8_t found = 0;
    for (const auto &entry : facts)
        if (categories & entry.category) found |= entry.fact;
    return found;
}

int scan(int pagemap, uint64_t categories, uint64_t start, uint64_t end, std::span<Region> regions,
         uint64_t *walkEnd) {
    Argument argument{};
    argument.size = sizeof argument;
    argument.start = start;
    argument.end = end;
    argument.vector = reinterpret_cast<uint64_t>(regions.data());
    argument.vectorLength = regions.size();
    argument.anyOfCategories = presentCategory | swappedCategory;
    argument.returnedCategories = categories;
    const int count = ::ioctl(pagemap, scanRequest, &argument);
    *walkEnd = argument.walkEnd;
    return count;
}

// What this kernel can do, found out by asking it about memory of the program's own.
struct Support {
    bool isSupported = false;
    bool isComplete = false;
    uint64_t categories = presentCategory | swappedCategory | fileCategory | zeroCategory;
};

// Whether the huge page of zeros is told as one; true where there is none.
bool knowsHugeZeros(int pagemap, const Support &support) {
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
    return count == 1 && (region.categories & zeroCategory) != 0;
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
        return scan(pagemap.get(), categories, address, address + 0x10000, {&region, 1}, &walkEnd) >= 0;
    };
    support.isSupported = answers(support.categories);
    const bool knowsGuards = support.isSupported && answers(support.categories | guardCategory);
    if (knowsGuards) support.categories |= guardCategory;
    support.isComplete =
        support.isSupported && (knowsGuards || !hasGuards()) && knowsHugeZeros(pagemap.get(), support);
    return support;
}

const Support &support() {
    static const Support found = findSupport();
    return found;
}

} // namespace

bool HXPageScan::isSupported() {
    return support().isSupported;
}

bool HXPageScan::isComplete() {
    return support().isComplete;
}

int HXPageScan::find(int pagemap, bool tellsFiles, uint64_t start, uint64_t end, std::span<HXPageRun> runs,
                     uint64_t *walkEnd) {
    thread_local std::array<Region, 1024> regions;
    const auto room = std::span(regions).first(std::min(regions.size(), runs.size()));
    const uint64_t categories = support().categories & ~(tellsFiles ? 0 : fileCategory);
    const int count = scan(pagemap, categories, start, end, room, walkEnd);
    for (int i = 0; i < count; i++) {
        const Region &region = regions[static_cast<size_t>(i)];
        runs[static_cast<size_t>(i)] = {region.start, region.end, factsOf(region.categories)};
    }
    // A walk that the kernel did in several steps may tell the end of an earlier one: all of [start, end) has
    // been walked if there was room to spare, and what has been found is behind it in any case.
    if (count >= 0 && static_cast<size_t>(count) < room.size()) *walkEnd = end;
    if (count > 0) *walkEnd = std::max(*walkEnd, room[static_cast<size_t>(count) - 1].end);
    return count;
}
