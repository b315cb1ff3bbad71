// What merging looks memory objects up in.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <utility>
#include <vector>

class HXMemoryObject;

// Objects by key, which is never 0. Only grows. The entries lie side by side (open addressing), so that a
// lookup waits for memory once, or not at all if it was announced some lookups before. Where a key belongs is
// different in each map: a program that chooses its addresses chooses keys.
class HXObjectMap {
  public:
    // Makes room for so many keys at once.
    void reserve(size_t keys) {
        if (roomFor(keys) > _entries.size()) grow(roomFor(keys));
    }

    // To be called a few lookups before `operator[]`.
    void announce(uint64_t key) const {
        if (!_entries.empty()) __builtin_prefetch(&_entries[placeOf(key)], 1);
    }

    // The object of that key, null when the key is new. Valid until the next call.
    HXMemoryObject *&operator[](uint64_t key) {
        if (roomFor(_count + 1) > _entries.size()) grow(roomFor(2 * _count + kLeast));
        Entry &entry = entryOf(key);
        if (entry.key == 0) {
            entry.key = key;
            _count++;
        }
        return entry.object;
    }

  private:
    static constexpr size_t kLeast = 64;
    struct Entry {
        uint64_t key = 0; // 0: free
        HXMemoryObject *object = nullptr;
    };

    // A seventh stays free: what collides is then found some entries on, most of it in the same cache line.
    static size_t roomFor(size_t keys) { return keys + keys / 6 + 1; }

    // A key's low bits tell little: object identifiers are often numbered or aligned.
    size_t placeOf(uint64_t key) const {
        const uint64_t product = (key ^ (key >> 32)) * _multiplier;
        const uint64_t hash = ((product ^ (product >> 32)) * 0x9E3779B97F4A7C15) >> 32;
        return static_cast<size_t>((hash * _entries.size()) >> 32);
    }

    // Odd, and known to nobody before: to the nanosecond, where time is told so.
    static uint64_t newMultiplier() {
        const auto now = std::chrono::steady_clock::now().time_since_epoch().count();
        return (static_cast<uint64_t>(now) * 0xBF58476D1CE4E5B9) | 1;
    }

    // That of the key, or the free one where it belongs.
    Entry &entryOf(uint64_t key) {
        size_t place = placeOf(key);
        while (_entries[place].key != key && _entries[place].key != 0)
            place = place + 1 == _entries.size() ? 0 : place + 1;
        return _entries[place];
    }

    void grow(size_t room) {
        const std::vector<Entry> before = std::exchange(_entries, std::vector<Entry>(room));
        for (const Entry &entry : before)
            if (entry.key != 0) entryOf(entry.key) = entry;
    }

    const uint64_t _multiplier = newMultiplier();
    std::vector<Entry> _entries;
    size_t _count = 0;
};
