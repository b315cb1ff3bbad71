#include "platform/linux/images/HXImageHeaders.h"

#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <functional>
#include <optional>
#include <string>

namespace {

// Reads `length` bytes of a file from `offset`; none when not all can be had.
using ReadBytes = std::function<std::optional<std::string>(uint64_t offset, uint64_t length)>;

struct Outcome {
    bool isRead = false;
    std::optional<HXElfHeaders> headers;
};

Outcome readHeaders(const ReadBytes &read) {
    const auto beginning = read(0, HXElfFileHeaderSize);
    if (!beginning) return {};
    const auto place = HXParseElfFileHeader(*beginning);
    if (!place) return {true, std::nullopt};
    const auto bytes = read(place->offset, place->size());
    if (!bytes) return {};
    return {true, HXParseElfProgramHeaders(*bytes, *place)};
}

std::optional<std::string> readExactly(int file, uint64_t position, uint64_t length) {
    std::string bytes(length, '\0');
    if (::pread(file, bytes.data(), length, static_cast<off_t>(position)) != static_cast<ssize_t>(length))
        return std::nullopt;
    return bytes;
}

// The file system's own page, where it is in memory anyway, read through the process. A page that the process
// has made its own is not taken.
class MemoryReader {
  public:
    MemoryReader(int directory, const HXMapping &mapping, uint64_t pageSize)
        : _mapping(mapping), _pageSize(pageSize), _pagemap(HXOpenAt(directory, "pagemap")),
          _memory(HXOpenAt(directory, "mem")) {}

    std::optional<std::string> read(uint64_t offset, uint64_t length) const {
        if (!_pagemap || !_memory || offset < _mapping.offset) return std::nullopt;
        const uint64_t start = _mapping.start + (offset - _mapping.offset);
        if (start < _mapping.start || start + length < start || start + length > _mapping.end)
            return std::nullopt;
        for (uint64_t page = start / _pageSize; page * _pageSize < start + length; page++)
            if (!isCached(page)) return std::nullopt;
        return readExactly(_memory.get(), start, length);
    }

  private:
    bool isCached(uint64_t page) const {
        constexpr uint64_t present = uint64_t{1} << 63, ofFile = uint64_t{1} << 61;
        uint64_t entry = 0;
        const auto position = static_cast<off_t>(page * sizeof entry);
        if (::pread(_pagemap.get(), &entry, sizeof entry, position) != sizeof entry) return false;
        return (entry & (present | ofFile)) == (present | ofFile);
    }

    const HXMapping &_mapping;
    const uint64_t _pageSize;
    const HXDescriptor _pagemap, _memory;
};

Outcome readThroughProcess(const HXMapping &mapping, int directory, uint64_t pageSize) {
    const MemoryReader reader(directory, mapping, pageSize);
    Outcome outcome =
        readHeaders([&](uint64_t offset, uint64_t length) { return reader.read(offset, length); });
    if (!outcome.isRead) return outcome;
    // Was it that file, or has the process mapped another one there meanwhile? Only root may ask.
    const HXDescriptor file = HXLocateMapped(directory, mapping);
    if (file && !HXIsMappedFile(mapping, file.get())) return {};
    return outcome;
}

// The mapping's file by its path, in the process's root or else, for a process that left its root, in ours.
HXDescriptor locateByPath(const HXMapping &mapping, const std::string &path, int directory) {
    HXDescriptor place = HXLocateBelowRoot(directory, path);
    if (place && HXIsMappedFile(mapping, place.get())) return place;
    const HXDescriptor self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
    return HXLocateBelowRoot(self.get(), path);
}

Outcome readFile(const HXMapping &mapping, const std::string &path, int directory) {
    HXDescriptor place = HXLocateMapped(directory, mapping);
    if (!place) place = locateByPath(mapping, path, directory);
    if (!place || !HXIsMappedFile(mapping, place.get())) return {};
    const HXDescriptor file = HXOpenLocated(place);
    if (!file) return {};
    return readHeaders([&](uint64_t offset, uint64_t length) -> std::optional<std::string> {
        return readExactly(file.get(), offset, length);
    });
}

// The mapping of the file's beginning, which mostly lies just before its code; else the mapping itself.
const HXMapping &beginningOfFile(const HXAddressSpace &addressSpace, size_t index) {
    constexpr size_t reach = 8;
    const HXMapping &mapping = addressSpace[index];
    for (size_t i = index + 1; i-- > 0 && index - i < reach;) {
        const HXMapping &other = addressSpace[i];
        if (other.inode == mapping.inode && other.device == mapping.device && other.offset == 0) return other;
    }
    return mapping;
}

} // namespace

const HXElfHeaders *HXImageHeaders::headersOf(const HXAddressSpace &addressSpace, size_t index,
                                              int directory) {
    const HXMapping &mapping = addressSpace[index];
    const FileKey key{mapping.device, mapping.inode};
    {
        const std::lock_guard lock(_mutex);
        File &file = _files[key];
        if (file.isRead) return file.headers ? &*file.headers : nullptr;
        if (file.tries == maximumTries) return nullptr;
        file.tries++;
    }
    Outcome outcome = readThroughProcess(beginningOfFile(addressSpace, index), directory, _pageSize);
    if (!outcome.isRead) {
        HXFileSystemLookup lookup;
        lookup.directory = directory;
        const bool isShared = mapping.device == _fileSystems.sharedMemoryDevice();
        const HXFileSystemKind kind = _fileSystems.kindOf(mapping.device, &lookup);
        if (isShared || kind == HXFileSystemKind::local || kind == HXFileSystemKind::swapBacked)
            outcome = readFile(mapping, addressSpace.path(mapping.path).text, directory);
    }
    const std::lock_guard lock(_mutex);
    File &file = _files[key];
    if (!file.isRead && outcome.isRead) {
        file.isRead = true;
        file.headers = std::move(outcome.headers);
    }
    return file.headers ? &*file.headers : nullptr;
}
