// The program headers of the files that processes map, read once a run for each file.
#pragma once

#include "platform/HXAdaptiveMutex.h"
#include "platform/linux/images/HXElfHeaders.h"
#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/memory/HXFileSystems.h"

#include <cstdint>
#include <map>
#include <optional>
#include <utility>

class HXImageHeaders {
  public:
    explicit HXImageHeaders(HXFileSystems &fileSystems) : _fileSystems(fileSystems) {}

    // The headers of the file that the mapping maps; null when it is no image or can't be read. `process`:
    // its directory in /proc. Any thread; never waits on a file system that may hang. What is handed out
    // lives as long as this.
    const HXElfHeaders *headersOf(const HXAddressSpace &addressSpace, size_t index,
                                  const HXDescriptor &process);

  private:
    using FileKey = std::pair<uint32_t, uint64_t>; // device and inode
    // A file that could not be read in one process may be readable in another one, but each try costs as
    // much.
    static constexpr uint32_t kMostTries = 3;
    struct File {
        uint32_t tries = 0;
        bool isRead = false;
        std::optional<HXElfHeaders> headers; // none: no image
    };

    HXFileSystems &_fileSystems;
    HXAdaptiveMutex _mutex;
    std::map<FileKey, File> _files;
};
