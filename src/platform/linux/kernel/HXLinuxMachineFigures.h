// What the machine counts of its memory, and where that is.
#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

struct HXLinuxKernelReadings;

struct HXMachineFigure {
    std::string_view name; // lives as long as the program
    uint64_t size;         // bytes
};

// Figures of all memory, for a report to be added up to what free(1) says. "memory total" is MemTotal. All
// other names that begin with "memory " tell kinds of it that do not overlap, and "memory other" is what they
// leave: so these add up to the total, unless the kernel's counts are out of step by more than the rest.
// "available memory" is an estimate across kinds, and "swap …" is no memory.
//
// `vmallocSize`: bytes that vmalloc holds, without kernel stacks. Figures that the kernel does not tell are
// 0.
std::vector<HXMachineFigure> HXMachineFigures(const HXLinuxKernelReadings &readings, uint64_t vmallocSize);
