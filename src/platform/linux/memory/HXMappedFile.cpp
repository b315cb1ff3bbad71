#include "platform/linux/memory/HXMappedFile.h"

#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <cerrno>
#include <cinttypes>
#include <cstdio>

// Never waits for a server: the attributes may be old ones, but not the identity.
bool HXIsMappedFile(const HXMapping &mapping, const HXDescriptor &place) {
    struct statx status;
    if (::statx(place.get(), "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_TYPE | STATX_INO, &status) != 0)
        return false;
    // The device is not compared: file systems with subvolumes tell another one here than in maps.
    return S_ISREG(status.stx_mode) && status.stx_ino == mapping.inode;
}

HXDescriptor HXLocateMapped(const HXDescriptor &process, const HXMapping &mapping) {
    char name[64];
    std::snprintf(name, sizeof name, "map_files/%" PRIx64 "-%" PRIx64, mapping.start, mapping.end);
    return HXOpenAt(process, name, O_PATH);
}

HXDescriptor HXLocateBelowRoot(const HXDescriptor &process, const std::string &path) {
    if (path.empty() || path.front() != '/') return {};
    const HXDescriptor root = HXOpenAt(process, "root", O_PATH | O_DIRECTORY);
    if (!root) return {};
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC | O_NOFOLLOW;
    how.resolve = RESOLVE_CACHED | RESOLVE_NO_MAGICLINKS | RESOLVE_IN_ROOT;
    // A change anywhere in the cache may make the kernel give up (openat2(2)), seldom twice in a row.
    constexpr int tries = 3;
    for (int i = 0; i < tries; i++) {
        HXDescriptor file(
            static_cast<int>(::syscall(SYS_openat2, root.get(), path.c_str(), &how, sizeof how)));
        if (file || errno != EAGAIN) return file;
    }
    return {};
}

HXDescriptor HXOpenLocated(const HXDescriptor &place) {
    const std::string name = "/proc/self/fd/" + std::to_string(place.get());
    return HXOpenAt(AT_FDCWD, name.c_str());
}

HXDescriptor HXOpenMappedFile(const HXDescriptor &process, const HXMapping &mapping) {
    const HXDescriptor place = HXLocateMapped(process, mapping);
    // Opening a device may do anything.
    if (!place || !HXIsMappedFile(mapping, place)) return {};
    return HXOpenLocated(place);
}
