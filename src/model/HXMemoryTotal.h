#pragma once

#include "model/HXSizes.h"

// The sizes of some regions: of an object, a category or all categories of a table; and how many they are.
struct HXMemoryTotal : HXSizes {
    uint32_t regionCount = 0;

    HXMemoryTotal &operator+=(const HXMemoryTotal &other) {
        HXSizes::operator+=(other);
        regionCount += other.regionCount;
        return *this;
    }
    bool operator==(const HXMemoryTotal &) const = default;
};
