#include "platform/linux/memory/HXFileSystems.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <string>

uint32_t HXFileSystems::sharedMemoryDevice() {
    const uint32_t device = _sharedMemoryDevice.load(std::memory_order_relaxed);
    if (device != UINT32_MAX || _lookedForSharedMemory.load(std::memory_order_acquire)) return device;
    const HXDescriptor file(::memfd_create("", MFD_CLOEXEC));
    struct stat status;
    if (file && ::fstat(file.get(), &status) == 0)
        _sharedMemoryDevice = HXDeviceNumber(major(status.st_dev), minor(status.st_dev));
    _lookedForSharedMemory.store(true, std::memory_order_release);
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
        readMounts(lookup->directory, "mountinfo");
        kind = known(device);
    }
    if (kind == HXFileSystemKind::unknown) {
        // The file may have come from another mount namespace.
        std::call_once(_commonMountsOnce, [&] {
            readMounts(lookup->directory, "../1/mountinfo");
            readMounts(lookup->directory, "../self/mountinfo");
        });
        kind = known(device);
    }
    constexpr uint32_t firstBlockDevice = HXDeviceNumber(1, 0);
    if (kind == HXFileSystemKind::unknown && device >= firstBlockDevice) kind = HXFileSystemKind::local;
    lookup->lastDevice = device;
    lookup->lastKind = kind;
    return kind;
}

void HXFileSystems::readMounts(int directory, const char *name) {
    constexpr size_t limit = 16 << 20;
    const auto text = HXReadText(directory, name, limit);
    if (!text) return;
    const std::unique_lock lock(_mutex);
    HXParseMountInfo(*text, [this](uint32_t device, std::string_view type) {
        _kinds.try_emplace(device, HXFileSystemKindOf(type));
    });
}
