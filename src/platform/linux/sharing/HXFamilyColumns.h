// Reads the pages of a family by columns: the same addresses of all members side by side.
#pragma once

#include "platform/linux/sharing/HXFamily.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <vector>

// Numbers of pages.
struct HXPageStretch {
    uint64_t first;
    uint64_t end;
};

// Stretches that together hold all ranges of the family and can be read side by side; a page lies in one.
std::vector<HXPageStretch> HXStretchesOfFamily(const HXFamily &family);

// How long it takes to read one, compared with others.
uint64_t HXCostOfStretch(const HXFamily &family, const HXPageStretch &stretch);

struct HXColumnRequest {
    std::shared_ptr<const HXFamily> family;
    HXPageStretch stretch;
    uint32_t pageShift;
    // Pages that lie at several places, which are told one by one (HXFamilyPages::repeated) instead of being
    // counted by sets; null in the first reading, which finds them.
    std::shared_ptr<HXSeenKeys> repeated;
    bool findsLazilyFreed; // HXFamilyPages::mayBeLazilyFreed
};

// *reading: the member that is being read, for whoever waits. A member that has gone shows nothing.
std::unique_ptr<HXFamilyPages> HXReadColumns(const HXColumnRequest &request, std::atomic<uint32_t> *reading);
