// Reads the address space of a process.
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/memory/HXFileSystems.h"
#include "platform/linux/memory/HXMachineFacts.h"
#include "platform/linux/procfs/HXProcText.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>

// What the readings of all address spaces share.
struct HXReaderSetting {
    HXFileSystems *fileSystems;
    HXMachineFacts *machine;
    HXNamedTags *namedTags;
    uint32_t pageShift;
    // Whether figures may be counted from the page tables where that is enough, which is faster than smaps.
    bool mayScan;
};

// What a reader of one process knows and wants.
struct HXReadRequest {
    const HXDescriptor &process;                    // its directory in /proc
    std::optional<HXStatusRecord> status;           // where it has been read already
    bool needsDirtyPages = true;                    // HXMapping::dirtyPages
    std::chrono::steady_clock::time_point opened{}; // when the process was
    // Where page tables are counted, those of mappings that HXMayShareAfterFork are left to the caller.
    bool leavesPrivatePages = false;
    // He also finds out whether any of them are lazily freed.
    bool leavesLazyFree = false;
    // The process's open "maps" of which nothing has been read, if there is one; whoever reads it takes it.
    HXDescriptor *maps = nullptr;
};

// Reads the mappings of a process and classifies them. A process that vanishes leaves what was read until
// then.
std::unique_ptr<HXAddressSpace> HXReadAddressSpace(const HXReadRequest &request,
                                                   const HXReaderSetting &setting);

// Gives the mappings that hold the stack pointers of threads the user tag of stacks. Threads that keep
// running, and those beyond the first few thousand, are left out.
void HXTagThreadStacks(const HXDescriptor &process, HXAddressSpace *addressSpace);
