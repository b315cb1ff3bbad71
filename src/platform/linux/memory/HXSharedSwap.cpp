#include "platform/linux/memory/HXSharedSwap.h"

#include "platform/HXHostRecords.h"

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

class Marker {
  public:
    Marker(const HXCountSwapped &countSwapped, uint64_t limit) : _countSwapped(countSwapped), _left(limit) {}

    void mark(uint64_t first, std::span<int32_t> dispositions) {
        if (_left == 0 || dispositions.empty()) return;
        std::optional<uint64_t> counted;
        if (_callsLeft > 0) counted = _countSwapped(first, dispositions.size());
        _callsLeft = counted ? _callsLeft - 1 : 0;
        const uint64_t swapped = counted.value_or(dispositions.size());
        if (swapped == 0) return;
        if (swapped >= dispositions.size() || _callsLeft == 0) return markFirst(swapped, dispositions);
        const size_t half = dispositions.size() / 2;
        mark(first, dispositions.first(half));
        mark(first + half, dispositions.subspan(half));
    }
    uint64_t left() const { return _left; }

  private:
    void markFirst(uint64_t swapped, std::span<int32_t> dispositions) {
        for (int32_t &disposition : dispositions) {
            if (_left == 0 || swapped == 0) return;
            if (disposition != 0) continue;
            disposition = VM_PAGE_QUERY_PAGE_PAGED_OUT;
            swapped--;
            _left--;
        }
    }

    const HXCountSwapped &_countSwapped;
    uint64_t _left;
    uint32_t _callsLeft = 16384; // some 10 ms for pages that are swapped here and there
};

} // namespace

uint64_t HXMarkSwapped(const HXCountSwapped &countSwapped, uint64_t first, uint64_t limit,
                       std::span<int32_t> dispositions) {
    Marker marker(countSwapped, limit);
    marker.mark(first, dispositions);
    return limit - marker.left();
}

uint64_t HXMarkSwapped(const HXDescriptor &file, uint64_t first, uint32_t pageShift, uint64_t limit,
                       std::span<int32_t> dispositions) {
    const HXCountSwapped countSwapped = [&](uint64_t page, uint64_t count) -> std::optional<uint64_t> {
        CacheRange range{page << pageShift, count << pageShift};
        CacheFigures figures{};
        if (!file || ::syscall(kCacheStatCall, file.get(), &range, &figures, 0) != 0) return std::nullopt;
        return figures.evicted;
    };
    return HXMarkSwapped(countSwapped, first, limit, dispositions);
}
