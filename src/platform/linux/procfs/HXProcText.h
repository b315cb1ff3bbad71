// Parsers of a process's text files in /proc (proc(5)). They touch no system.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// /proc/PID/stat, as far as it is read.
struct HXStatRecord {
    static constexpr uint32_t kernelThreadFlag = 0x00200000; // PF_KTHREAD
    int32_t pid = 0;
    uint8_t commLength = 0;
    char commBytes[64]; // as the kernel has it, not safe text
    char state = '?';
    int32_t ppid = 0;
    uint32_t pgid = 0;
    uint32_t flags = 0;
    uint32_t threadCount = 0;
    uint64_t startTime = 0;  // clock ticks since boot
    uint64_t startStack = 0; // an address; 0 when the reader may not know it

    std::string_view comm() const { return {commBytes, commLength}; }
    bool isKernelThread() const { return (flags & kernelThreadFlag) != 0; }
    bool isZombie() const { return state == 'Z' || state == 'X' || state == 'x'; }
};
// None when the text is no stat line. The name may hold blanks, parentheses and newlines.
std::optional<HXStatRecord> HXParseStat(std::string_view text);

// /proc/PID/status, as far as it is read; sizes in bytes. What the text lacks is 0.
struct HXStatusRecord {
    uint64_t rssAnonSize = 0;
    uint64_t rssShmemSize = 0;
    uint64_t swapSize = 0;
    uint64_t pageTableSize = 0;
    uint64_t hugePageSize = 0;
    uint64_t peakResidentSize = 0;
    uint64_t residentSize = 0;
    uint64_t lockedSize = 0;
    uint64_t threadCount = 0;

    uint64_t heftSize() const { return rssAnonSize + rssShmemSize + swapSize + pageTableSize + hugePageSize; }
    // The kernel keeps no peak of the charge itself.
    uint64_t peakHeftSize() const;
};
HXStatusRecord HXParseStatus(std::string_view text);

// The number behind `label` (with its colon) at the beginning of a line, as of smaps_rollup and vmstat; none
// when there is no such line.
std::optional<uint64_t> HXParseLabelled(std::string_view text, std::string_view label);

// A device number as maps and mountinfo print it (MAJOR:MINOR), in one word.
constexpr uint32_t HXDeviceNumber(uint32_t major, uint32_t minor) {
    return major << 20 | (minor & 0xFFFFF);
}

// /proc/PID/mountinfo: calls `each` with the device and the file system type of every mount.
void HXParseMountInfo(std::string_view text,
                      const std::function<void(uint32_t device, std::string_view type)> &each);

// /proc/PID/auxv.
struct HXAuxiliaryVector {
    bool is64bit = true;       // width of its words
    uint64_t execFileName = 0; // AT_EXECFN: address of the path that was executed; 0 when it is missing
};
// None when the bytes hold no entry.
std::optional<HXAuxiliaryVector> HXParseAuxiliaryVector(std::string_view bytes);

// /proc/PID/cmdline: the arguments; the last one needs no zero.
std::vector<std::string_view> HXSplitArguments(std::string_view text);

// /proc/PID/task/TID/syscall: the stack pointer; none for a thread that is running or whose line has none.
std::optional<uint64_t> HXParseStackPointer(std::string_view text);

// What follows the last slash of `path`.
std::string_view HXBaseName(std::string_view path);
