// The kinds of the file systems of this machine, by device: learned from the mount tables of the processes
// that map their files (mount namespaces differ), and kept for the run.
#pragma once

#include "platform/linux/memory/HXFileSystemKind.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXMapping.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <unordered_map>

// What one process's mappings need of file systems; belongs to the reading of one address space.
struct HXFileSystemLookup {
    const HXDescriptor &process; // its directory in /proc
    bool readMounts = false;
    uint32_t lastDevice = UINT32_MAX;
    HXFileSystemKind lastKind = HXFileSystemKind::unknown;
};

// Answers a descriptor that only names a file (O_PATH).
using HXLocateFile = std::function<HXDescriptor()>;

class HXFileSystems {
  public:
    // `sharedMemoryDevice`: UINT32_MAX to find it out on first need.
    HXFileSystems(std::string procPath, uint32_t sharedMemoryDevice)
        : _procPath(std::move(procPath)), _sharedMemoryDevice(sharedMemoryDevice) {}

    // The device of the kernel's own tmpfs (memfd, System V and shared anonymous memory), which no mount
    // table lists; UINT32_MAX when it cannot be told. Any thread.
    uint32_t sharedMemoryDevice();
    // `unknown` for a device in none of the mount tables. Any thread.
    HXFileSystemKind kindOf(uint32_t device, HXFileSystemLookup *lookup);

    // Opens for reading the plain file that a mapping maps, which `locate` finds. Not open unless it is known
    // to lie on this machine, whatever the process does meanwhile. Any thread.
    HXDescriptor openLocal(const HXDescriptor &process, const HXMapping &mapping, const HXLocateFile &locate);
    // Whether a file on that device, or mount of it, lies on this machine, by the mount tables as they are
    // now; see HXIsLocalMount. Any thread.
    bool isLocalNow(const HXDescriptor &process, uint32_t device, std::optional<uint64_t> mount) const;

  private:
    void readMounts(HXDirectoryView directory, const char *name);
    HXFileSystemKind known(uint32_t device) const;

    const std::string _procPath;
    std::atomic<uint32_t> _sharedMemoryDevice;
    mutable std::shared_mutex _mutex;
    std::unordered_map<uint32_t, HXFileSystemKind> _kinds;
    std::atomic<bool> _hasCommonMounts = false;
};
