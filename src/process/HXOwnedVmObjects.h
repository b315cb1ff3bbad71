// The VM objects that a task owns, by object id, in the order in which the kernel listed them.
#pragma once

#include "platform/HXHostRecords.h"

#include <cstdint>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

class HXOwnedVmObjects {
  public:
    // A later record with the same id replaces the earlier one.
    void add(const owned_vmobject &object) {
        const auto [position, isNew] = _index.try_emplace(object.object_id, _objects.size());
        if (isNew) _objects.emplace_back();
        _objects[position->second] = object;
    }
    // Removes the object of that id and gives it back; none when there is none.
    std::optional<owned_vmobject> take(uint64_t id) {
        const auto found = _index.find(id);
        return found == _index.end() ? std::nullopt : std::exchange(_objects[found->second], std::nullopt);
    }
    // Calls `each` for the objects that were not taken.
    template <typename Each>
    void forEach(Each each) const {
        for (const auto &object : _objects)
            if (object) each(*object);
    }

  private:
    std::vector<std::optional<owned_vmobject>> _objects; // none: taken
    std::unordered_map<uint64_t, size_t> _index;
};
