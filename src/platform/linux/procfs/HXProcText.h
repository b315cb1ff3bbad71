// Parsers of a process's text files in /proc (proc(5)). They touch no system.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

// /proc/PID/stat, as far as it is read.
struct HXStatRecord {
    static constexpr uint32_t kernelThreadFlag = 0x00200000; // PF_KTHREAD
    int32_t pid{};
    uint8_t commLength{};
    char commBytes[64]; // as the kernel has it, not safe text
    char state = '?';
    int32_t ppid{};
    uint32_t pgid{};
    uint32_t flags{};
    uint32_t threadCount{};
    uint64_t startTime{};   // clock ticks since boot
    uint64_t virtualSize{}; // bytes
    uint64_t startStack{};  // an address; 0 when the reader may not know it

    std::string_view comm() const { return {commBytes, commLength}; }
    bool isKernelThread() const { return (flags & kernelThreadFlag) != 0; }
    // Of a thread of a process: it has ended, or gives its address space back on its way there, which takes a
    // while where that is large.
    bool isEnding() const { return state == 'Z' || state == 'X' || state == 'x' || virtualSize == 0; }
    // Of a process: no thread of it runs any more.
    bool hasEnded() const { return isEnding() && threadCount <= 1; }
    // Of a process: its leading thread has ended, others (may) run. What /proc/PID tells of memory is then
    // empty.
    bool lacksLeader() const { return isEnding() && threadCount > 1; }
};
// None when the text is no stat line. The name may hold blanks, parentheses and newlines.
std::optional<HXStatRecord> HXParseStat(std::string_view text);

// /proc/PID/status, as far as it is read; sizes in bytes. What the text lacks is none: kernel threads and
// processes that have ended show no memory at all, and kernels lack lines that came later.
struct HXStatusRecord {
    // The charge is made of these. All but the huge pages are needed: kernels from 4.5 on show them for every
    // process that has memory, those without a huge-page pool leave HugetlbPages out.
    std::optional<uint64_t> rssAnonSize, rssShmemSize, swapSize, pageTableSize;
    std::optional<uint64_t> hugePageSize;
    std::optional<uint64_t> residentSize, peakResidentSize, lockedSize;
    std::optional<uint64_t> threadCount;

    // 0 for a process without memory; none when it has some and a needed figure is missing.
    std::optional<uint64_t> heftSize() const;
    // The kernel keeps no peak of the charge itself. None as above.
    std::optional<uint64_t> peakHeftSize() const;
    // The page tables, 0 for a process without memory; none as above.
    std::optional<uint64_t> pageTablesHeld() const;

  private:
    bool hasNoMemory() const;
};
HXStatusRecord HXParseStatus(std::string_view text);

// The number behind `label` (with its colon) at the beginning of a line, as of smaps_rollup and vmstat; none
// when there is no such line.
std::optional<uint64_t> HXParseLabelled(std::string_view text, std::string_view label);

// A device number as maps and mountinfo print it (MAJOR:MINOR), in one word.
constexpr uint32_t HXDeviceNumber(uint32_t major, uint32_t minor) {
    return major << 20 | (minor & 0xFFFFF);
}

// A line of /proc/PID/mountinfo. Blanks, tabs, newlines and backslashes in its texts stay escaped (\040).
struct HXMount {
    uint64_t identifier;
    uint32_t device; // HXDeviceNumber
    std::string_view point;
    std::string_view type;    // of the file system
    std::string_view options; // of the file system, with commas between them
};
// Calls `each` for every mount, in the order of the text.
void HXParseMountInfo(std::string_view text, const std::function<void(const HXMount &mount)> &each);

// /proc/PID/task/TID/syscall: the stack pointer; none for a thread that is running or whose line has none.
std::optional<uint64_t> HXParseStackPointer(std::string_view text);
