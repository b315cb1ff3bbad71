#include "platform/linux/memory/HXFileSystems.h"

#include "platform/linux/memory/HXLocalMounts.h"
#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <fcntl.h>
#include <linux/nsfs.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <cerrno>
#include <string>

namespace {

constexpr size_t kTableLimit = 16 << 20; // 100000 mounts, as many as a namespace may have (fs.mount-max)
constexpr uint32_t kFirstBlockDevice = HXDeviceNumber(1, 0);

// Whether a process's mount namespace belongs to the initial user namespace (ioctl_ns(2)).
bool isMountedByRoot(const HXDescriptor &process) {
    constexpr ino_t initialUserNamespace = 0xEFFFFFFD; // the same on every machine
    const HXDescriptor mounts = HXOpenAt(process, "ns/mnt");
    const HXDescriptor owner(mounts ? ::ioctl(mounts.get(), NS_GET_USERNS) : -1);
    if (mounts && !owner) HXShortageWatch::note(errno);
    struct stat status;
    return owner && ::fstat(owner.get(), &status) == 0 && status.st_ino == initialUserNamespace;
}

} // namespace

uint32_t HXFileSystems::sharedMemoryDevice() {
    if (_sharedMemoryDevice != UINT32_MAX) return _sharedMemoryDevice;
    const HXDescriptor file(::memfd_create("", MFD_CLOEXEC));
    if (!file) HXShortageWatch::note(errno);
    struct stat status;
    if (file && ::fstat(file.get(), &status) == 0)
        _sharedMemoryDevice = HXDeviceNumber(major(status.st_dev), minor(status.st_dev));
    return _sharedMemoryDevice;
}

HXFileSystemKind HXFileSystems::known(uint32_t device) const {
    const std::shared_lock lock(_mutex);
    const auto found = _kinds.find(device);
    return found == _kinds.end() ? HXFileSystemKind::unknown : found->second;
}

HXFileSystemKind HXFileSystems::kindOf(uint32_t device, HXFileSystemLookup *lookup) {
    if (device == lookup->lastDevice) return lookup->lastKind;
    HXFileSystemKind kind = known(device);
    if (kind == HXFileSystemKind::unknown && !lookup->readMounts) {
        lookup->readMounts = true;
        readMounts(lookup->process, "mountinfo");
        kind = known(device);
    }
    if (kind == HXFileSystemKind::unknown && !_hasCommonMounts) {
        // The file may have come from another mount namespace.
        const HXShortageWatch watch;
        readMounts(AT_FDCWD, (_procPath + "/1/mountinfo").c_str());
        readMounts(AT_FDCWD, (_procPath + "/self/mountinfo").c_str());
        _hasCommonMounts = !watch.seen();
        kind = known(device);
    }
    lookup->lastDevice = device;
    lookup->lastKind = kind;
    return kind;
}

void HXFileSystems::readMounts(HXDirectoryView directory, const char *name) {
    const auto text = HXReadText(directory, name, kTableLimit);
    if (!text) return;
    const std::unique_lock lock(_mutex);
    HXParseMountInfo(*text, [this](const HXMount &mount) {
        _kinds.try_emplace(mount.device, HXFileSystemKindOfType(mount.type));
    });
}

bool HXFileSystems::isLocalNow(const HXDescriptor &process, uint32_t device,
                               std::optional<uint64_t> mount) const {
    const auto table = HXReadText(process, "mountinfo", kTableLimit);
    if (!table) return false;
    // After the table: nobody comes from a namespace of his own into one of the machine's root.
    const bool isRoots = isMountedByRoot(process);
    const HXDescriptor first = HXOpenAt(AT_FDCWD, (_procPath + "/1").c_str(), O_PATH | O_DIRECTORY);
    const auto host = first ? HXReadText(first, "mountinfo", kTableLimit) : std::nullopt;
    const std::string_view hostTable = host ? std::string_view(*host) : std::string_view();
    if (HXIsLocalMount({*table, isRoots, hostTable}, device, mount)) return true;
    // The file may have been opened in another namespace before.
    return HXIsLocalMount({hostTable, host && isMountedByRoot(first), hostTable}, device, mount);
}

HXDescriptor HXFileSystems::openLocal(const HXDescriptor &process, const HXMapping &mapping,
                                      const HXLocateFile &locate) {
    HXFileSystemLookup lookup{process};
    const bool isKernels = mapping.device == sharedMemoryDevice();
    const HXFileSystemKind kind = kindOf(mapping.device, &lookup);
    // Even to find a file may take a remote server's answer.
    const bool isLayered = kind == HXFileSystemKind::layered && isLocalNow(process, mapping.device, {});
    const bool isHere = kind == HXFileSystemKind::local || kind == HXFileSystemKind::swapBacked;
    if (!isKernels && !isHere && !isLayered) return {};

    const HXDescriptor place = locate();
    if (!place || !HXIsMappedFile(mapping, place)) return {};
    // The process may have mapped another file there meanwhile, of a server that gives it the same number.
    // What has been found keeps its mount, so that nothing can take its identifier or device now.
    const bool isSame =
        HXDeviceOf(place) == mapping.device && (isKernels || mapping.device >= kFirstBlockDevice);
    if (!isSame) {
        const auto mount = HXMountOf(place);
        if (!mount || !isLocalNow(process, mapping.device, mount)) return {};
    }
    return HXOpenLocated(place);
}
