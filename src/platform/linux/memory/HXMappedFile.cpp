#include "platform/linux/memory/HXMappedFile.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <cerrno>
#include <cinttypes>
#include <cstdio>

namespace {

// Never waits for a server: the attributes may be old ones, but not the identity.
bool readIdentity(const HXDescriptor &place, struct statx *status) {
    constexpr int flags = AT_EMPTY_PATH | AT_STATX_DONT_SYNC;
    return ::statx(place.get(), "", flags, STATX_TYPE | STATX_INO, status) == 0;
}

} // namespace

bool HXIsMappedFile(const HXMapping &mapping, const HXDescriptor &place) {
    struct statx status;
    return readIdentity(place, &status) && S_ISREG(status.stx_mode) && status.stx_ino == mapping.inode;
}

uint32_t HXDeviceOf(const HXDescriptor &place) {
    struct statx status;
    if (!readIdentity(place, &status)) return UINT32_MAX;
    return HXDeviceNumber(status.stx_dev_major, status.stx_dev_minor);
}

std::optional<uint64_t> HXMountOf(const HXDescriptor &place) {
    char buffer[512]; // three or four short lines
    const std::string name = "/proc/self/fdinfo/" + std::to_string(place.get());
    const auto text = HXReadOnce(AT_FDCWD, name.c_str(), buffer);
    return text ? HXParseLabelled(*text, "mnt_id:") : std::nullopt;
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
        if (!file) HXShortageWatch::note(errno);
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
    // Opening a device may do anything, and a file of another device may have been mapped meanwhile.
    if (!place || !HXIsMappedFile(mapping, place) || HXDeviceOf(place) != mapping.device) return {};
    return HXOpenLocated(place);
}
