#include "platform/linux/images/HXImageHeaders.h"

#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/memory/HXPageScan.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>

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

std::optional<std::string> readExactly(const HXDescriptor &file, uint64_t position, uint64_t length) {
    std::string bytes(length, '\0');
    if (file.readAt(position, bytes.data(), length) != static_cast<ssize_t>(length)) return std::nullopt;
    return bytes;
}

// Reads the file system's own pages, where they are in memory anyway, through the process: none for a page
// that the process has made its own.
Outcome readThroughProcess(const HXMapping &mapping, const HXDescriptor &process, uint64_t pageSize) {
    const HXDescriptor pagemap = HXOpenAt(process, "pagemap");
    const HXDescriptor memory = HXOpenAt(process, "mem");
    const auto isCached = [&](uint64_t page) {
        constexpr uint8_t wanted = HXPageRun::present | HXPageRun::file;
        uint8_t facts = 0;
        return HXReadPageFacts(pagemap, page, {&facts, 1}) == 1 && (facts & wanted) == wanted;
    };
    const auto read = [&](uint64_t offset, uint64_t length) -> std::optional<std::string> {
        const uint64_t start = mapping.start + (offset - mapping.offset);
        const bool isMapped = offset >= mapping.offset && start >= mapping.start && start <= mapping.end &&
                              length <= mapping.end - start;
        if (!isMapped) return std::nullopt;
        for (uint64_t page = start / pageSize; page * pageSize < start + length; page++)
            if (!isCached(page)) return std::nullopt;
        return readExactly(memory, start, length);
    };
    if (!pagemap || !memory) return {};
    Outcome outcome = readHeaders(read);
    if (!outcome.isRead) return outcome;
    // Was it that file, or has the process mapped another one there meanwhile? Only root may ask.
    const HXDescriptor file = HXLocateMapped(process, mapping);
    if (file && !HXIsMappedFile(mapping, file)) return {};
    return outcome;
}

// The mapping's file by its path, in the process's root or else, for a process that left its root, in ours.
HXDescriptor locateByPath(const HXMapping &mapping, const std::string &path, const HXDescriptor &process) {
    HXDescriptor place = HXLocateBelowRoot(process, path);
    if (place && HXIsMappedFile(mapping, place)) return place;
    return HXLocateBelowRoot(HXOpenAt(AT_FDCWD, "/proc/self", O_PATH | O_DIRECTORY), path);
}

Outcome readFile(const HXMapping &mapping, const std::string &path, const HXDescriptor &process) {
    HXDescriptor place = HXLocateMapped(process, mapping);
    if (!place) place = locateByPath(mapping, path, process);
    if (!place || !HXIsMappedFile(mapping, place)) return {};
    const HXDescriptor file = HXOpenLocated(place);
    if (!file) return {};
    return readHeaders([&](uint64_t offset, uint64_t length) { return readExactly(file, offset, length); });
}

// The mapping of the file's beginning, which mostly lies just before its code; else the mapping itself.
const HXMapping &beginningOfFile(const HXAddressSpace &addressSpace, size_t index) {
    constexpr size_t reach = 8; // linkers make four loads or five, of which a protection may cut some
    const HXMapping &mapping = addressSpace[index];
    for (size_t i = index + 1; i-- > 0 && index - i < reach;) {
        const HXMapping &other = addressSpace[i];
        if (other.inode == mapping.inode && other.device == mapping.device && other.offset == 0) return other;
    }
    return mapping;
}

} // namespace

const HXElfHeaders *HXImageHeaders::headersOf(const HXAddressSpace &addressSpace, size_t index,
                                              const HXDescriptor &process) {
    const HXMapping &mapping = addressSpace[index];
    const FileKey key{mapping.device, mapping.inode};
    {
        const std::lock_guard lock(_mutex);
        File &file = _files[key];
        if (file.isRead) return file.headers ? &*file.headers : nullptr;
        if (file.tries == kMostTries) return nullptr;
        file.tries++;
    }
    Outcome outcome = readThroughProcess(beginningOfFile(addressSpace, index), process, _pageSize);
    if (!outcome.isRead) {
        HXFileSystemLookup lookup{process};
        const bool isShared = mapping.device == _fileSystems.sharedMemoryDevice();
        const HXFileSystemKind kind = _fileSystems.kindOf(mapping.device, &lookup);
        if (isShared || kind == HXFileSystemKind::local || kind == HXFileSystemKind::swapBacked)
            outcome = readFile(mapping, addressSpace.path(mapping.path).text, process);
    }
    const std::lock_guard lock(_mutex);
    File &file = _files[key];
    if (!file.isRead && outcome.isRead) {
        file.isRead = true;
        file.headers = std::move(outcome.headers);
    }
    return file.headers ? &*file.headers : nullptr;
}
