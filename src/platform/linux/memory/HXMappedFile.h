// Finding and opening the file that a mapping maps, without waiting for a file system. `process`: its
// directory in /proc.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXMapping.h"

#include <optional>
#include <string>

// Whether a descriptor (of any kind) is of a plain file with the inode number of what the mapping maps; the
// device is the caller's to check.
bool HXIsMappedFile(const HXMapping &mapping, const HXDescriptor &place);
// The device (HXDeviceNumber) of the file that a descriptor is of. File systems with subvolumes tell another
// one here than in maps. UINT32_MAX when it cannot be told.
uint32_t HXDeviceOf(const HXDescriptor &place);
// The identifier (HXMount) of the mount through which a descriptor has been opened.
std::optional<uint64_t> HXMountOf(const HXDescriptor &place);

// A descriptor that only names what the mapping maps, which may be a device; not open without the right to.
HXDescriptor HXLocateMapped(const HXDescriptor &process, const HXMapping &mapping);

// A descriptor that only names `path` below the root of the process, if the kernel has all of it in its
// cache, as it has the path of every mapped file.
HXDescriptor HXLocateBelowRoot(const HXDescriptor &process, const std::string &path);

// Opens a plain file for reading that has been located and checked.
HXDescriptor HXOpenLocated(const HXDescriptor &place);

// Opens the plain file that a mapping of shared memory maps; not open without the right to.
HXDescriptor HXOpenMappedFile(const HXDescriptor &process, const HXMapping &mapping);
