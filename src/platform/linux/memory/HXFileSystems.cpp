#include "platform/linux/memory/HXFileSystems.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <string>

namespace {

// The kind of a file system type as mountinfo names it.
HXFileSystemKind kindOfType(std::string_view type) {
    using Kind = HXFileSystemKind;
    // A type that is not listed is taken for one that may hang.
    static constexpr struct {
        std::string_view type;
        Kind kind;
    } known[] = {
        {"tmpfs", Kind::swapBacked}, {"devtmpfs", Kind::deviceNodes}, {"hugetlbfs", Kind::hugePages},
        {"ext4", Kind::local},       {"ext3", Kind::local},           {"ext2", Kind::local},
        {"xfs", Kind::local},        {"btrfs", Kind::local},          {"overlay", Kind::layered},
        {"f2fs", Kind::local},       {"squashfs", Kind::local},       {"erofs", Kind::local},
        {"zfs", Kind::local},        {"bcachefs", Kind::local},       {"jfs", Kind::local},
        {"reiserfs", Kind::local},   {"nilfs2", Kind::local},         {"vfat", Kind::local},
        {"exfat", Kind::local},      {"ntfs3", Kind::local},          {"iso9660", Kind::local},
        {"udf", Kind::local},        {"ramfs", Kind::local},          {"rootfs", Kind::local},
        {"aufs", Kind::layered},     {"ubifs", Kind::local},          {"cramfs", Kind::local},
    };
    for (const auto &entry : known)
        if (entry.type == type) return entry.kind;
    return Kind::remote;
}

} // namespace

uint32_t HXFileSystems::sharedMemoryDevice() {
    std::call_once(_sharedMemoryOnce, [this] {
        if (_sharedMemoryDevice != UINT32_MAX) return;
        const HXDescriptor file(::memfd_create("", MFD_CLOEXEC));
        struct stat status;
        if (file && ::fstat(file.get(), &status) == 0)
            _sharedMemoryDevice = HXDeviceNumber(major(status.st_dev), minor(status.st_dev));
    });
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
    if (kind == HXFileSystemKind::unknown) {
        // The file may have come from another mount namespace.
        std::call_once(_commonMountsOnce, [&] {
            readMounts(lookup->process, "../1/mountinfo");
            readMounts(lookup->process, "../self/mountinfo");
        });
        kind = known(device);
    }
    constexpr uint32_t firstBlockDevice = HXDeviceNumber(1, 0);
    if (kind == HXFileSystemKind::unknown && device >= firstBlockDevice) kind = HXFileSystemKind::local;
    lookup->lastDevice = device;
    lookup->lastKind = kind;
    return kind;
}

void HXFileSystems::readMounts(const HXDescriptor &process, const char *name) {
    constexpr size_t limit = 16 << 20; // 100000 mounts, as many as a namespace may have (fs.mount-max)
    const auto text = HXReadText(process, name, limit);
    if (!text) return;
    const std::unique_lock lock(_mutex);
    HXParseMountInfo(*text, [this](uint32_t device, std::string_view type) {
        _kinds.try_emplace(device, kindOfType(type));
    });
}
