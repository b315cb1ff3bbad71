// What the members of a family are told of the pages that they share.
#pragma once

#include "platform/linux/memory/HXObjectIdentifiers.h"
#include "platform/linux/pages/HXLinuxTask.h"
#include "platform/linux/sharing/HXFamily.h"

#include <cstdint>
#include <vector>

// Of one member, in the order of the family's.
struct HXFamilyTask {
    HXLinuxTask *task;
    const HXAddressSpace *addressSpace;
};

// Works out what each member is told. The largest sets are told exactly: kExactSets of them, and all of at
// least kExactSize bytes. What all smaller ones share is one object.
// `pages`: all that was read of the family.
inline constexpr size_t kExactSets = 64;
inline constexpr uint64_t kExactSize = 1 << 20;
std::vector<HXSharedPages> HXSharesOfFamily(const std::vector<HXFamilyTask> &tasks, HXFamilyPages pages,
                                            uint32_t pageShift, HXObjectIdentifiers &identifiers);
