// Sets of the members of a family, each kept once.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

class HXSharerSets {
  public:
    // As words of 64 bits, a bit for each member from the lowest bit of the first word on.
    using Bits = std::span<const uint64_t>;
    static constexpr uint32_t kNone = UINT32_MAX;

    // `limit`: how many sets are kept at most.
    HXSharerSets(size_t members, size_t limit);

    // The number of a set, of those that came before or the next one; kNone when there is no room for
    // another.
    uint32_t number(Bits bits);
    Bits bits(uint32_t number) const { return Bits(_words).subspan(number * _wordCount, _wordCount); }
    size_t size() const { return _size; }
    size_t wordCount() const { return _wordCount; }

    // Calls `each` with the members, ascending.
    template <typename Each>
    static void forEachMember(Bits bits, Each each) {
        for (size_t i = 0; i < bits.size(); i++)
            for (uint64_t rest = bits[i]; rest != 0; rest &= rest - 1)
                each(static_cast<uint32_t>(i * 64 + static_cast<size_t>(__builtin_ctzll(rest))));
    }
    // The lowest member of a set that is not empty.
    static uint32_t first(Bits bits);

  private:
    size_t slotOf(Bits bits) const;
    void grow();

    const size_t _wordCount, _limit;
    size_t _size = 0;
    std::vector<uint64_t> _words;
    std::vector<uint32_t> _slots; // numbers by hash; twice as many as sets at least, a power of two
};
