// Caches of strings that nearly every process asks for: each worker finds them without taking a lock.
#pragma once

#include "model/HXString.h"

#include <atomic>
#include <cstdint>
#include <string_view>
#include <vector>

// A fixed number of slots, each empty or holding one string for the rest of the run. Slots are filled by
// compare-and-swap and never change afterwards.
class HXStringSlots {
  public:
    HXStringSlots(size_t slotCount, size_t probeCount) : _slots(slotCount), _probeCount(probeCount) {}

    // The string of that text, looked for in `probeCount` slots from `firstSlot` on (modulo the slots) and
    // stored in the first empty one; when all of them hold other strings it is not cached.
    HXString find(size_t firstSlot, std::string_view text);

  private:
    std::vector<std::atomic<const std::string *>> _slots;
    size_t _probeCount;
};

// The paths of images in the shared region, by the image's base address.
HXString HXSharedImagePath(uint64_t baseAddress, std::string_view path);

// The names of segments.
HXString HXSegmentName(std::string_view name);
