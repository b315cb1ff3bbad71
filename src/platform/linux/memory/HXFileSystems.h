// The kinds of the file systems of this machine, by device: learned from the mount tables of the processes
// that map their files (mount namespaces differ), and kept for the run.
#pragma once

#include "platform/linux/memory/HXFileSystemKind.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <cstdint>
#include <mutex>
#include <shared_mutex>
#include <unordered_map>

// What one process's mappings need of file systems; belongs to the reading of one address space.
struct HXFileSystemLookup {
    const HXDescriptor &process; // its directory in /proc
    bool readMounts = false;
    uint32_t lastDevice = UINT32_MAX;
    HXFileSystemKind lastKind = HXFileSystemKind::unknown;
};

class HXFileSystems {
  public:
    // `sharedMemoryDevice`: UINT32_MAX to find it out on first need.
    explicit HXFileSystems(uint32_t sharedMemoryDevice) : _sharedMemoryDevice(sharedMemoryDevice) {}

    // The device of the kernel's own tmpfs (memfd, System V and shared anonymous memory), which no mount
    // table lists; UINT32_MAX when it cannot be told.
    uint32_t sharedMemoryDevice();
    // Any thread.
    HXFileSystemKind kindOf(uint32_t device, HXFileSystemLookup *lookup);

  private:
    void readMounts(const HXDescriptor &process, const char *name);
    HXFileSystemKind known(uint32_t device) const;

    std::once_flag _sharedMemoryOnce;
    uint32_t _sharedMemoryDevice;
    mutable std::shared_mutex _mutex;
    std::unordered_map<uint32_t, HXFileSystemKind> _kinds;
    std::once_flag _commonMountsOnce;
};
