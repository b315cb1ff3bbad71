// Which mounts lie on this machine, so that reading a file of them ends in bounded time, by the text of mount
// tables (/proc/PID/mountinfo) alone: asking a file system itself might be what never ends.
#pragma once

#include "platform/linux/memory/HXFileSystemKind.h"

#include <cstdint>
#include <optional>
#include <string_view>

// The kind of a file system type as mountinfo names it. A type that is not known is taken for one that may
// hang.
HXFileSystemKind HXFileSystemKindOfType(std::string_view type);

// Mount tables for a judgement.
struct HXMountTables {
    std::string_view table; // of a process
    // Whether the namespace of `table` belongs to the initial user namespace: mounted by the machine's root.
    // In another one any user may put layers over a file system that he serves himself.
    bool isRoots = false;
    std::string_view host; // pid 1's, for the paths of layers: those who mount them mostly see its mounts
};

// Whether `table` has a mount of `device`, with the identifier `mount` if one is given, that lies on this
// machine: on a local file system, in memory, or in layers of which each does.
bool HXIsLocalMount(const HXMountTables &tables, uint32_t device, std::optional<uint64_t> mount);
