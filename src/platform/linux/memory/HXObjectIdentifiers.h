// Identifiers of memory objects: two objects never have the same one in a run, whatever addresses and inode
// numbers a program manages to get.
//
// All are below 2^53. Their lowest bit tells two kinds apart:
//
//   1  A private mapping without a file: its process's number from bit 36 on, its page's from bit 1 on.
//      Distinct by construction, which no table is needed for.
//   0  Everything else, by a table. The lower 32 bits are its own; the higher ones are the same for all.
//
// What a process has copied on write is told apart from others' by its pid in the bits from 32 on (HXHeft),
// which happens to the second kind alone; so its lower bits decide.
#pragma once

#include "platform/HXAdaptiveMutex.h"
#include "platform/linux/procfs/HXMapping.h"

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <deque>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

// Whose a mapping is.
struct HXMappingOwner {
    int32_t pid = 0;
    uint32_t processNumber = 0; // HXObjectIdentifiers::numberOfProcess
    uint64_t ipcNamespace = 0;  // tells System V identifiers of different namespaces apart
};

// Numbers below `limit`, of which each key has its own. Nearly all have the one that they prefer.
template <typename Key, typename Hash>
class HXNumberTable {
  public:
    // `limit`: at most UINT32_MAX.
    HXNumberTable(uint32_t limit, Hash hash) : _limit(limit), _hash(hash), _displaced(0, hash) {}

    // The key's number: from the first time it is asked for on `preferred`, if no other key has that, else
    // any that is free; none when all are given. Takes no longer the more are.
    std::optional<uint32_t> of(const Key &key, uint32_t preferred) {
        if (preferred < _limit && give(preferred, key).first == key) return preferred;
        const auto [entry, isNew] = _displaced.try_emplace(key, _limit);
        for (bool isFound = !isNew; !isFound && _next < _limit; _next++) {
            isFound = give(_next, key).second;
            if (isFound) entry->second = _next;
        }
        return entry->second < _limit ? std::optional(entry->second) : std::nullopt;
    }

  private:
    struct Given {
        uint32_t number = UINT32_MAX; // none
        Key key = {};
    };

    // The key that has the number, and whether it is given to this one now.
    std::pair<const Key &, bool> give(uint32_t number, const Key &key) {
        if (_givenCount + _givenCount / 3 >= _given.size()) grow();
        Given &given = slotOf(number);
        const bool isNew = given.number != number;
        if (isNew) {
            given = {number, key};
            _givenCount++;
        }
        return {given.key, isNew};
    }
    // Where the number is, or may be put.
    Given &slotOf(uint32_t number) {
        size_t place = _hash(number) & (_given.size() - 1);
        while (_given[place].number != number && _given[place].number != UINT32_MAX)
            place = (place + 1) & (_given.size() - 1);
        return _given[place];
    }
    void grow() {
        constexpr size_t least = 16;
        const auto before = std::exchange(_given, std::vector<Given>(std::max(least, _given.size() * 2)));
        for (const Given &given : before)
            if (given.number != UINT32_MAX) slotOf(given.number) = given;
    }

    const uint32_t _limit;
    const Hash _hash;
    uint32_t _next = 0;        // all below have been given
    std::vector<Given> _given; // by hash of the number; a power of two, a quarter of them free
    size_t _givenCount = 0;
    std::unordered_map<Key, uint32_t, Hash> _displaced;
};

// Any thread.
class HXObjectIdentifiers {
  public:
    HXObjectIdentifiers();

    // The number of a process, from 1 on: equal for equal pids and another for another; 0 when none is left.
    uint32_t numberOfProcess(int32_t pid);

    // The identifier of what a classified mapping maps. The same in every run for what is the same on the
    // machine, unless something else has taken its number first.
    uint64_t of(const HXMapping &mapping, const HXMappingOwner &owner);
    // The identifier of pages that several processes share: those that the lowest of them, `pid`, has in its
    // mapping at `start`. `set` tells the sets of processes apart whose lowest member that is.
    uint64_t ofShared(int32_t pid, uint64_t start, uint64_t set);

    // That of the file or shared object, whatever pages of its own the mapping holds: by its kind, device and
    // inode.
    uint64_t ofObject(const HXMapping &mapping, uint64_t ipcNamespace);
    // That of a process's page tables.
    uint64_t ofPageTables(int32_t pid);
    // That of all files on a device.
    uint64_t ofFileSystem(uint32_t device);

  private:
    enum class Kind : uint32_t { file = 1, mapping, systemV, vdso, shared, fileSystem, pageTables };
    struct Key {
        Kind kind;
        uint32_t device;
        uint64_t first;
        uint64_t second;

        bool operator==(const Key &) const = default;
    };
    // With a seed of this run, so that nobody can choose keys that meet in one bucket.
    struct KeyHash {
        uint64_t seed;
        size_t operator()(const Key &key) const;
        size_t operator()(uint32_t number) const;
    };
    static constexpr uint32_t kShards = 64;
    // Where the lower bits of the table's identifiers begin, behind what the kernel's own have there.
    static constexpr uint32_t kFirstLowBits = 1 << 16;
    static constexpr uint32_t kNumbers = ((uint32_t{1} << 31) - kFirstLowBits / 2) / kShards; // of a shard
    // Keys are spread by the number that they prefer, and so each shard has numbers of its own.
    struct Shard {
        explicit Shard(KeyHash hash) : numbers(kNumbers, hash) {}
        HXAdaptiveMutex mutex;
        HXNumberTable<Key, KeyHash> numbers;
    };

    struct Remembered; // by a thread

    explicit HXObjectIdentifiers(KeyHash hash);
    uint64_t interned(const Key &key);

    inline static std::atomic<uint64_t> _tables = 0; // that there were
    const uint64_t _table = ++_tables;
    std::deque<Shard> _shards;
    HXAdaptiveMutex _processMutex;
    HXNumberTable<uint32_t, KeyHash> _processNumbers; // by pid
};
