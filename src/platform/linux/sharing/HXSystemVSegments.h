// System V shared memory (sysvipc(7)) as the kernel lists it for an IPC namespace.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

struct HXSystemVSegment {
    uint64_t identifier{}; // the inode number of mappings of it
    int64_t creatorPid{};  // as the reader's namespaces number it, like the user
    uint64_t creatorUser{};
    uint64_t attachedCount{};
    uint64_t residentSize{}; // bytes
    uint64_t swappedSize{};
};

// The segments that the text of /proc/sysvipc/shm tells, whose columns its first line names.
std::vector<HXSystemVSegment> HXParseSystemVSegments(std::string_view text);

// The segments of the IPC namespace of a process (its directory in /proc); none without the right to enter
// it. `procPath`: where procfs is mounted.
std::vector<HXSystemVSegment> HXReadSystemVSegments(const std::string &procPath, const HXDescriptor &process);
