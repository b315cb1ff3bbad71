// Where shared memory can be without being mapped: the memory file systems and the IPC namespaces that
// processes live in.
#pragma once

#include "platform/linux/memory/HXFileSystems.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcText.h"
#include "platform/linux/sharing/HXSystemVSegments.h"

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

// A tmpfs or the devtmpfs.
struct HXMemoryFileSystem {
    uint32_t device = 0;
    std::string name;             // its type and the place where it was first found; safe text
    std::optional<uint64_t> size; // bytes in use; none when it has no limit or is out of reach
};

// Any thread.
class HXHeldPlaces {
  public:
    HXHeldPlaces(std::string procPath, HXFileSystems &fileSystems)
        : _procPath(std::move(procPath)), _fileSystems(fileSystems) {}

    // Learns of the places of a process (its directory in /proc), once for those of one namespace. Asks a
    // file system only that the mount table says to be in memory, and finds it without asking another.
    void learn(const HXDescriptor &process);
    // The same for the machine's first process and the running one.
    void learnOwn();

    // What has been learned.
    std::vector<HXMemoryFileSystem> fileSystems() const;
    // With the number of the namespace of each.
    std::vector<std::pair<uint64_t, HXSystemVSegment>> segments() const;
    // Whether a file opened through that mount (HXMount::identifier) is in memory.
    bool isMemoryMount(uint64_t mount);

  private:
    bool learnMounts(const HXDescriptor &process);
    std::optional<uint64_t> usedSize(const HXDescriptor &process, const HXMount &mount) const;
    bool isNew(const std::string &place) const;

    const std::string _procPath;
    HXFileSystems &_fileSystems;
    mutable std::mutex _mutex;
    std::set<std::string> _known; // places, by the names of their namespaces
    std::set<uint64_t> _mounts;
    std::map<uint32_t, HXMemoryFileSystem> _memory; // by device
    std::map<uint64_t, std::vector<HXSystemVSegment>> _segments;
};
