#include "platform/linux/memory/HXMachineFacts.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <fcntl.h>
#include <sys/sysinfo.h>

bool HXMachineFacts::usesSwap() const {
    struct sysinfo info;
    return ::sysinfo(&info) != 0 || info.freeswap != info.totalswap;
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
