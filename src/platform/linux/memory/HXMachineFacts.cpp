#include "platform/linux/memory/HXMachineFacts.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <fcntl.h>
#include <sys/sysinfo.h>
#include <sys/utsname.h>

#include <algorithm>
#include <cstdio>

bool HXMachineFacts::usesSwap() const {
    struct sysinfo info;
    return ::sysinfo(&info) != 0 || info.freeswap != info.totalswap;
}

uint64_t HXMachineFacts::counterErrorPages(uint64_t threads) const {
    constexpr uint64_t counters = 3;                      // of anonymous, shared and swapped pages
    constexpr uint64_t threadBatch = 64, leastBatch = 32; // TASK_RSS_EVENTS_THRESH; lib/percpu_counter.c
    static const bool countsByThread = [] {               // before 6.2
        utsname names{};
        unsigned major = 0, minor = 0;
        ::uname(&names);
        return std::sscanf(names.release, "%u.%u", &major, &minor) == 2 &&
               (major < 6 || (major == 6 && minor < 2));
    }();
    static const auto processors = static_cast<uint64_t>(::get_nprocs()); // which reads a file
    return counters *
           (countsByThread ? threads * threadBatch : processors * std::max(leastBatch, 2 * processors));
}

bool HXMachineFacts::hasFreedLazily(std::chrono::steady_clock::time_point since) {
    constexpr size_t limit = 1 << 20;
    const std::lock_guard lock(_mutex);
    // It never becomes false again: the kernel counts events.
    if (_hasFreedLazily || _lookedUp > since) return _hasFreedLazily;
    _lookedUp = std::chrono::steady_clock::now();
    const auto text = HXReadText(AT_FDCWD, _vmstatPath.c_str(), limit);
    _hasFreedLazily = !text || HXParseLabelled(*text, "pglazyfree ").value_or(1) != 0;
    return _hasFreedLazily;
}
