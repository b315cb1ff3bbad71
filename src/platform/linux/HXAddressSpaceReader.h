// Reads the address space of a process.
#pragma once

#include "platform/linux/HXAddressSpace.h"
#include "platform/linux/HXFileSystems.h"

#include <cstdint>
#include <memory>
#include <optional>

// What the readings of all address spaces share.
struct HXReaderSetting {
    HXFileSystems *fileSystems;
    uint32_t pageShift;
};

// Reads the mappings of the process whose directory in /proc is open as `directory`, and classifies them.
// `threadCount`: where it is known already. A process that vanishes leaves what was read until then.
std::unique_ptr<HXAddressSpace> HXReadAddressSpace(int directory, const HXReaderSetting &setting,
                                                   std::optional<uint64_t> threadCount);

// Gives the mappings that hold the stack pointers of threads the user tag of stacks. Threads that keep
// running, and those beyond the first few thousand, are left out.
void HXTagThreadStacks(int directory, HXAddressSpace *addressSpace);
