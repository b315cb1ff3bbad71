// The VM objects that a task owns, by object id, in the order in which the kernel listed them.
#pragma once

#include "platform/HXHostRecords.h"

#include <cstdint>
#include <optional>
#include <unordered_map>
#include <vector>

// What an owned object adds to its owner's heft, in bytes.
struct HXOwnedCharge {
    uint64_t dirty = 0;
    uint64_t swapped = 0;
};

inline HXOwnedCharge HXChargeOfOwnedObject(const owned_vmobject &object) {
    constexpr uint64_t notCharged = 1;
    if (object.flags & notCharged) return {};
    switch (object.flags >> 4 & 3) {
    case VM_PURGABLE_NONVOLATILE:
    case VM_PURGABLE_DENY:
        return {object.resident_size > object.reusable_size ? object.resident_size - object.reusable_size : 0,
                object.compressed_size};
    default:
        return {object.wired_size, 0};
    }
}

class HXOwnedVmObjects {
  public:
    // A later record with the same id replaces the earlier one.
    void add(const owned_vmobject &object) {
        const auto [position, isNew] = _index.try_emplace(object.object_id, _objects.size());
        if (isNew)
            _objects.push_back(object);
        else
            _objects[position->second] = object;
    }
    // Removes the object of that id and gives it back; none when there is none.
    std::optional<owned_vmobject> take(uint64_t id) {
        const auto found = _index.find(id);
        if (found == _index.end()) return std::nullopt;
        const owned_vmobject object = _objects[found->second];
        _index.erase(found);
        return object;
    }
    // Calls `each` for the objects that were not taken.
    template <typename Each>
    void forEach(Each each) const {
        for (size_t i = 0; i < _objects.size(); i++) {
            const auto found = _index.find(_objects[i].object_id);
            if (found != _index.end() && found->second == i) each(_objects[i]);
        }
    }

  private:
    std::vector<owned_vmobject> _objects;
    std::unordered_map<uint64_t, size_t> _index;
};
