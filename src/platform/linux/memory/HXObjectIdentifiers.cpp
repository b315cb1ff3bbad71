#include "platform/linux/memory/HXObjectIdentifiers.h"

#include "platform/linux/memory/HXMappingClass.h"

#include <sys/random.h>

#include <memory>
#include <mutex>

namespace {

constexpr uint32_t kProcessBits = 17, kPageBits = 35; // and one: 53
constexpr uint32_t kSmallestPageShift = 12;
// The higher bits of the table's identifiers, all set, far from the kernel's own and from those of memory
// graphs, which are small.
constexpr uint64_t kHighBits = uint64_t{0x1FFFFF} << 32;

// Finaliser of a 64-bit linear generator; every bit of the result depends on every bit of the value.
uint64_t mix(uint64_t value) {
    value += 0x9E3779B97F4A7C15;
    value = (value ^ (value >> 30)) * 0xBF58476D1CE4E5B9;
    value = (value ^ (value >> 27)) * 0x94D049BB133111EB;
    return value ^ (value >> 31);
}

uint64_t newSeed() {
    uint64_t seed = 0;
    // Without it the table is only slower for whoever chooses his keys.
    [[maybe_unused]] const ssize_t got = ::getrandom(&seed, sizeof seed, GRND_NONBLOCK);
    return seed;
}

} // namespace

size_t HXObjectIdentifiers::KeyHash::operator()(const Key &key) const {
    return mix(mix(mix(seed ^ static_cast<uint64_t>(key.kind) << 32 ^ key.device) ^ key.first) ^ key.second);
}

size_t HXObjectIdentifiers::KeyHash::operator()(uint32_t number) const {
    return mix(seed ^ number);
}

HXObjectIdentifiers::HXObjectIdentifiers() : HXObjectIdentifiers(KeyHash{newSeed()}) {}

HXObjectIdentifiers::HXObjectIdentifiers(KeyHash hash) : _processNumbers((1 << kProcessBits) - 1, hash) {
    for (uint32_t i = 0; i < kShards; i++)
        _shards.emplace_back(hash);
}

uint32_t HXObjectIdentifiers::numberOfProcess(int32_t pid) {
    const std::lock_guard lock(_processMutex);
    const auto key = static_cast<uint32_t>(pid);
    const auto number = _processNumbers.of(key, key % ((1 << kProcessBits) - 1));
    return number ? *number + 1 : 0;
}

// What this thread was told: most processes map the same files.
struct HXObjectIdentifiers::Remembered {
    uint64_t table = 0;
    uint64_t identifier = 0;
    Key key = {};
};

uint64_t HXObjectIdentifiers::interned(const Key &key) {
    // Not by the seed: it is to be the same in every run.
    const auto preferred = static_cast<uint32_t>(KeyHash{0}(key) >> 33);
    constexpr size_t most = 256;
    thread_local const auto known = std::make_unique<Remembered[]>(most);
    Remembered &remembered = known[preferred % most];
    if (remembered.table == _table && remembered.key == key) return remembered.identifier;
    const uint32_t shardIndex = preferred % kShards;
    Shard &shard = _shards[shardIndex];
    uint32_t number = 0;
    {
        const std::lock_guard lock(shard.mutex);
        number = shard.numbers.of(key, preferred / kShards).value_or(0); // more have room in no memory
    }
    const uint64_t identifier = kHighBits | (kFirstLowBits + uint64_t{2} * (number * kShards + shardIndex));
    remembered = {_table, identifier, key};
    return identifier;
}

uint64_t HXObjectIdentifiers::of(const HXMapping &mapping, const HXMappingOwner &owner) {
    if (mapping.kind == HXPathKind::vdso) return interned({Kind::vdso, 0, 0, mapping.end - mapping.start});
    if (HXHoldsOwnPages(mapping)) {
        const uint64_t page = mapping.start >> kSmallestPageShift;
        if (HXIsPrivateAnonymous(mapping) && owner.processNumber != 0 && page >> kPageBits == 0)
            return uint64_t{owner.processNumber} << (kPageBits + 1) | page << 1 | 1;
        return interned({Kind::mapping, 0, static_cast<uint32_t>(owner.pid), mapping.start});
    }
    return ofObject(mapping, owner.ipcNamespace);
}

uint64_t HXObjectIdentifiers::ofObject(const HXMapping &mapping, uint64_t ipcNamespace) {
    // System V memory's inode number is its identifier, which says nothing outside its namespace and which
    // other shared memory may have, too.
    if (mapping.kind == HXPathKind::systemV)
        return interned({Kind::systemV, mapping.device, ipcNamespace, mapping.inode});
    return interned({Kind::file, mapping.device, 0, mapping.inode});
}

uint64_t HXObjectIdentifiers::ofShared(int32_t pid, uint64_t start, uint64_t set) {
    return interned({Kind::shared, static_cast<uint32_t>(pid), set, start});
}

uint64_t HXObjectIdentifiers::ofPageTables(int32_t pid) {
    return interned({Kind::pageTables, 0, static_cast<uint32_t>(pid), 0});
}

uint64_t HXObjectIdentifiers::ofFileSystem(uint32_t device) {
    return interned({Kind::fileSystem, device, 0, 0});
}
