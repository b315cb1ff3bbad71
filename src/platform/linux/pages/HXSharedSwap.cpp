#include "platform/linux/pages/HXSharedSwap.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>

namespace {

// cachestat(2), kernel 6.5. Of shared memory, `evicted` counts the pages that are swapped out.
struct CacheRange {
    uint64_t offset;
    uint64_t length;
};
struct CacheFigures {
    uint64_t cached;
    uint64_t dirty;
    uint64_t writeback;
    uint64_t evicted;
    uint64_t recentlyEvicted;
};
constexpr long kCacheStatCall = 451; // on every machine

class Finder {
  public:
    Finder(const HXCountSwapped &countSwapped, HXSwapSearch &search)
        : _countSwapped(countSwapped), _search(search) {}

    void find(const HXPageSpan &span) {
        if (_search.pagesLeft == 0 || span.count == 0) return;
        std::optional<uint64_t> counted;
        if (_search.callsLeft > 0) counted = _countSwapped(span);
        _search.callsLeft = counted ? _search.callsLeft - 1 : 0;
        const uint64_t swapped = std::min(counted.value_or(span.count), span.count);
        if (swapped == 0) return;
        if (swapped == span.count || _search.callsLeft == 0) return add({span.first, swapped});
        const uint64_t half = span.count / 2;
        find({span.first, half});
        find({span.first + half, span.count - half});
    }
    std::vector<HXPageSpan> found;

  private:
    void add(HXPageSpan span) {
        span.count = std::min(span.count, _search.pagesLeft);
        _search.pagesLeft -= span.count;
        if (!found.empty() && found.back().first + found.back().count == span.first)
            found.back().count += span.count;
        else
            found.push_back(span);
    }

    const HXCountSwapped &_countSwapped;
    HXSwapSearch &_search;
};

} // namespace

std::vector<HXPageSpan> HXFindSwapped(const HXCountSwapped &countSwapped, const HXPageSpan &span,
                                      HXSwapSearch *search) {
    Finder finder(countSwapped, *search);
    finder.find(span);
    return std::move(finder.found);
}

// Pages of a range of bytes; of length 0 for all that follow.
static std::optional<uint64_t> countSwappedIn(const HXDescriptor &file, CacheRange range) {
    CacheFigures figures{};
    if (!file || ::syscall(kCacheStatCall, file.get(), &range, &figures, 0) != 0) return std::nullopt;
    return figures.evicted;
}

std::optional<uint64_t> HXSwappedSize(const HXDescriptor &file) {
    const auto pages = countSwappedIn(file, {0, 0});
    if (!pages) return std::nullopt;
    return *pages * static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
}

std::vector<HXPageSpan> HXFindSwapped(const HXDescriptor &file, uint32_t pageShift, const HXPageSpan &span,
                                      HXSwapSearch *search) {
    const HXCountSwapped countSwapped = [&](const HXPageSpan &part) {
        return countSwappedIn(file, {part.first << pageShift, part.count << pageShift});
    };
    return HXFindSwapped(countSwapped, span, search);
}
