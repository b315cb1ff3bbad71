// The program headers of the files that processes map, read once a run for each file.
#pragma once

#include "platform/linux/images/HXElfHeaders.h"
#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/memory/HXFileSystems.h"

#include <cstdint>
#include <mutex>
#include <optional>
#include <unordered_map>

class HXImageHeaders {
  public:
    HXImageHeaders(HXFileSystems &fileSystems, uint64_t pageSize)
        : _fileSystems(fileSystems), _pageSize(pageSize) {}

    // The headers of the file that the mapping maps; null when it is no image or can't be read. `directory`:
    // the process's in /proc. Any thread; never waits on a file system that may hang. What is handed out
    // lives as long as this.
    const HXElfHeaders *headersOf(const HXAddressSpace &addressSpace, size_t index, int directory);

  private:
    struct FileKey {
        uint32_t device;
        uint64_t inode;
        bool operator==(const FileKey &) const = default;
    };
    struct FileKeyHash {
        size_t operator()(const FileKey &key) const {
            return static_cast<size_t>(key.inode * 0x9E3779B97F4A7C15 ^ key.device);
        }
    };
    // A file that could not be read in one process may be readable in another one.
    static constexpr uint32_t maximumTries = 3;
    struct File {
        uint32_t tries = 0;
        bool isRead = false;
        std::optional<HXElfHeaders> headers; // none: no image
    };

    HXFileSystems &_fileSystems;
    const uint64_t _pageSize;
    std::mutex _mutex;
    std::unordered_map<FileKey, File, FileKeyHash> _files;
};
