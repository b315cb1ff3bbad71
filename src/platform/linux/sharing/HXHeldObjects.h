// Shared memory of a live machine by who holds it: what HXPlatform tells of held objects, and how it is found
// out without asking a file system that may not answer.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/memory/HXMachineFacts.h"
#include "platform/linux/memory/HXObjectIdentifiers.h"
#include "platform/linux/sharing/HXHeldPlaces.h"

#include <mutex>
#include <unordered_map>

// Any thread. `process`: its directory in /proc.
class HXHeldObjects {
  public:
    // What is given outlives this.
    HXHeldObjects(const std::string &procPath, HXFileSystems &fileSystems, const HXMachineFacts &machine,
                  HXObjectIdentifiers &identifiers)
        : _procPath(procPath), _fileSystems(fileSystems), _machine(machine), _identifiers(identifiers),
          _places(procPath, fileSystems) {}

    // What a process maps. How much there is of it only those may ask who may follow map_files (proc(5)).
    std::vector<task_held_object> mapped(const HXDescriptor &process, const HXAddressSpace &addressSpace);
    // What a process has descriptors of, without a name. The links of all descriptors are read; followed are
    // only those of files that are in memory by their mount. None where the process shows no descriptor.
    // `descriptors`: its directory "fd".
    std::optional<std::vector<task_held_object>> open(const HXDescriptor &descriptors);
    // The memory file systems and the segments that nobody has attached, of the places of all processes that
    // were asked for before; and, as their container, all shared memory.
    std::vector<task_held_object> ofKernel();

  private:
    // An object, bytes.
    struct Amount {
        uint64_t size = 0; // resident or swapped
        uint64_t swappedSize = 0;
        bool hasName = false;
    };
    // A file as it was found.
    struct Found {
        uint32_t device;
        uint64_t inode;
        Amount amount;
    };
    std::optional<Found> find(const HXDescriptor &process, const char *name) const;
    // What was found of an object first holds for all its holders.
    const Amount *known(uint64_t object) const;
    task_held_object held(uint64_t object, uint32_t device, HXPathKind kind, const Amount *amount);

    const std::string _procPath;
    HXFileSystems &_fileSystems;
    const HXMachineFacts &_machine;
    HXObjectIdentifiers &_identifiers;
    HXHeldPlaces _places;
    mutable std::mutex _mutex;
    std::unordered_map<uint64_t, Amount> _amounts; // by object; entries stay
};
