#include "platform/linux/sharing/HXSharerSets.h"

#include <algorithm>
#include <bit>

HXSharerSets::HXSharerSets(size_t members, size_t limit)
    : _wordCount((members + 63) / 64), _limit(limit), _slots(64, kNone) {}

uint32_t HXSharerSets::first(Bits bits) {
    size_t i = 0;
    while (bits[i] == 0)
        i++;
    return static_cast<uint32_t>(i * 64) + static_cast<uint32_t>(std::countr_zero(bits[i]));
}

// Where the set is, or where it may be put.
size_t HXSharerSets::slotOf(Bits wanted) const {
    uint64_t hash = 0;
    for (const uint64_t word : wanted)
        hash = (std::rotl(hash, 23) ^ word) * 0x9E3779B97F4A7C15;
    size_t slot = (hash >> 32) & (_slots.size() - 1);
    while (_slots[slot] != kNone && !std::ranges::equal(bits(_slots[slot]), wanted))
        slot = (slot + 1) & (_slots.size() - 1);
    return slot;
}

void HXSharerSets::grow() {
    _slots.assign(_slots.size() * 2, kNone);
    for (uint32_t number = 0; number < _size; number++)
        _slots[slotOf(bits(number))] = number;
}

uint32_t HXSharerSets::number(Bits wanted) {
    size_t slot = slotOf(wanted);
    if (_slots[slot] != kNone) return _slots[slot];
    if (_size == _limit) return kNone;
    _words.insert(_words.end(), wanted.begin(), wanted.end());
    const auto added = static_cast<uint32_t>(_size++);
    _slots[slot] = added;
    if (_size * 2 > _slots.size()) grow();
    return added;
}
