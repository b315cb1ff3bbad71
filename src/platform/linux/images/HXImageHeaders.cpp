#include "platform/linux/images/HXImageHeaders.h"

#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>

#include <mutex>
#include <optional>
#include <string>
#include <utility>

namespace {

struct Outcome {
    bool isRead = false;
    std::optional<HXElfHeaders> headers;
};

// `length` bytes of a file from `offset`; none when not all can be had.
std::optional<std::string> readBytes(const HXDescriptor &file, uint64_t offset, uint64_t length) {
    std::string bytes(length, '\0');
    if (file.readAt(offset, bytes.data(), length) != static_cast<ssize_t>(length)) return std::nullopt;
    return bytes;
}

Outcome readHeaders(const HXDescriptor &file) {
    const auto beginning = readBytes(file, 0, HXElfFileHeaderSize);
    if (!beginning) return {};
    const auto place = HXParseElfFileHeader(*beginning);
    if (!place) return {true, std::nullopt};
    const auto bytes = readBytes(file, place->offset, place->size());
    if (!bytes) return {};
    return {true, HXParseElfProgramHeaders(*bytes, *place)};
}

// The mapping's file by its path, in the process's root or else, for a process that left its root, in ours.
HXDescriptor locateByPath(const HXMapping &mapping, const std::string &path, const HXDescriptor &process) {
    HXDescriptor place = HXLocateBelowRoot(process, path);
    if (place && HXIsMappedFile(mapping, place)) return place;
    return HXLocateBelowRoot(HXOpenAt(AT_FDCWD, "/proc/self", O_PATH | O_DIRECTORY), path);
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
    const HXShortageWatch watch;
    const HXDescriptor opened = _fileSystems.openLocal(process, mapping, [&] {
        HXDescriptor place = HXLocateMapped(process, mapping);
        return place ? std::move(place)
                     : locateByPath(mapping, std::string(addressSpace.path(mapping.path).text), process);
    });
    Outcome outcome;
    if (opened) outcome = readHeaders(opened);
    const std::lock_guard lock(_mutex);
    File &file = _files[key];
    if (watch.seen()) file.tries--; // the file is not to blame
    if (!file.isRead && outcome.isRead) {
        file.isRead = true;
        file.headers = std::move(outcome.headers);
    }
    return file.headers ? &*file.headers : nullptr;
}
