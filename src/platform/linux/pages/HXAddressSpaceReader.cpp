#include "platform/linux/pages/HXAddressSpaceReader.h"

#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/pages/HXPageScan.h"
#include "platform/linux/pages/HXScanFigures.h"
#include "platform/linux/procfs/HXMapsParser.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTaskFiles.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string>

namespace {

class Reader {
  public:
    Reader(const HXReadRequest &request, const HXReaderSetting &setting)
        : _request(request), _setting(setting), _lookup{request.process} {}

    std::unique_ptr<HXAddressSpace> read();

  private:
    bool mapsMaySuffice();
    bool mapsSuffice() const;
    bool hasFreedLazily() const;
    bool readMapsAndScan();
    HXDescriptor readFile(const char *name);
    HXDescriptor readOpen(HXDescriptor file);
    void readMappings(const HXDescriptor &file);
    void take(const HXMapsEntry &entry);
    HXFileSystemKind fileSystemOf(const HXMapping &mapping, const HXMappedPath &path);
    bool isDeviceFile(const HXMapping &mapping, const HXMappedPath &path) const;
    bool mayHoldHugePages(const HXMapping &mapping, HXPathKind kind, HXFileSystemKind fileSystem) const;
    kern_return_t endError(const HXDescriptor &file) const;
    bool isSingleThreaded() const;

    HXReadRequest _request;
    const HXReaderSetting &_setting;
    HXFileSystemLookup _lookup;
    std::unique_ptr<HXAddressSpace> _addressSpace;
    bool _readFailed = false;
    bool _sawStack = false;
    bool _sawGate = false;
    bool _sawSwapBacked = false;
    bool _mayHoldHugePages = false;
};

kern_return_t errorOfOpening(int error) {
    if (error == EACCES || error == EPERM) return KERN_NO_ACCESS;
    return HXShortageWatch::isShortage(error) ? KERN_RESOURCE_SHORTAGE : MACH_SEND_INVALID_DEST;
}

// A file of an address space that is gone reads as empty; one that lives still has its first line.
bool isAlive(const HXDescriptor &file) {
    char byte;
    return file.readAt(0, &byte, sizeof byte) > 0;
}

std::unique_ptr<HXAddressSpace> Reader::read() {
    if (!mapsMaySuffice() || !readMapsAndScan()) {
        readFile("smaps");
        _addressSpace->knowsDirtyPages = true;
    }
    if (_addressSpace->count() > 0 && (!_sawStack || !isSingleThreaded()))
        HXTagThreadStacks(_request.process, _addressSpace.get());
    return std::move(_addressSpace);
}

// Locked mappings and dirty file pages show in smaps alone; pages of the huge-page pool are left to it, too.
bool Reader::mapsMaySuffice() {
    if (!_setting.mayScan || _request.needsDirtyPages || !HXPageScan::isComplete()) return false;
    if (!_request.status) _request.status = HXReadStatus(_request.process);
    if (!_request.status) return false;
    const HXStatusRecord &status = *_request.status;
    return status.lockedSize.value_or(0) == 0 && status.hugePageSize.value_or(0) == 0;
}

bool Reader::readMapsAndScan() {
    const bool isOpen = _request.maps != nullptr && *_request.maps;
    HXDescriptor maps = isOpen ? readOpen(std::move(*_request.maps)) : readFile("maps");
    // Since it was opened the process may have executed another program.
    if (isOpen && _addressSpace->count() == 0) maps = readFile("maps");
    if (_addressSpace->endError != KERN_INVALID_ADDRESS || _addressSpace->count() == 0) return true;
    if (!mapsSuffice()) return false;
    _addressSpace->lacksPrivatePages = _request.leavesPrivatePages;
    if (!HXScanFigures(_request.process, _setting.pageShift, _request.status->swapSize.value_or(0),
                       _addressSpace.get()))
        return false;
    // If the process executed another program before its page tables were opened, those are not of this.
    if (!isAlive(maps)) _addressSpace->endError = MACH_SEND_INVALID_DEST;
    return true;
}

bool Reader::mapsSuffice() const {
    // The pool's mappings are told by their flags in smaps alone, even those that nobody has touched.
    if (_mayHoldHugePages) return false;
    // Page tables do not show which pages of shared memory are swapped out.
    if (_sawSwapBacked && _setting.machine->usesSwap()) return false;
    if (_request.leavesLazyFree) return true;
    return !_setting.machine->hasFreedLazily(_request.opened) || !hasFreedLazily();
}

// Whether the process holds lazily freed pages, which look like others in the page tables; also true where
// smaps costs less than to find out. Both walk all pages for that, so that the time goes with the pages, and
// only what smaps writes for each mapping, as long as looking at some hundred pages, can be saved.
bool Reader::hasFreedLazily() const {
    constexpr uint64_t fewPagesPerMapping = 128;
    const uint64_t pages = _request.status->residentSize.value_or(0) >> _setting.pageShift;
    if (pages > fewPagesPerMapping * _addressSpace->count()) return true;
    char buffer[4096]; // of some 25 lines
    const auto text = HXReadOnce(_request.process.get(), "smaps_rollup", buffer);
    return !text || HXParseLabelled(*text, "LazyFree:").value_or(1) != 0;
}

// Answers the open file.
HXDescriptor Reader::readFile(const char *name) {
    return readOpen(HXOpenAt(_request.process.get(), name));
}

HXDescriptor Reader::readOpen(HXDescriptor file) {
    _addressSpace = std::make_unique<HXAddressSpace>();
    _readFailed = _sawStack = _sawGate = _sawSwapBacked = _mayHoldHugePages = false;
    if (!file) {
        _addressSpace->endError = errorOfOpening(errno);
        return file;
    }
    readMappings(file);
    _addressSpace->endError = endError(file);
    return file;
}

void Reader::readMappings(const HXDescriptor &file) {
    HXMapsParser parser(_setting.pageShift);
    HXMapsEntry entry;
    const std::span<char> buffer = HXScratchBuffer();
    size_t length = 0;
    for (bool complete = false; !complete;) {
        // The kernel hands out a page or so at a time; as much as fits is parsed together.
        const ssize_t got = file.readFully(buffer.subspan(length));
        _readFailed = got < 0;
        complete = got <= 0 || length + static_cast<size_t>(got) < buffer.size();
        length += static_cast<size_t>(std::max<ssize_t>(got, 0));
        std::string_view text(buffer.data(), length);
        while (parser.next(&text, complete, &entry))
            take(entry);
        if (text.size() == buffer.size()) text.remove_prefix(text.size()); // no mapping's text is that long
        std::memmove(buffer.data(), text.data(), text.size());
        length = text.size();
    }
}

void Reader::take(const HXMapsEntry &entry) {
    HXMapping mapping = entry.mapping;
    mapping.path = _addressSpace->intern(entry.path, *_setting.namedTags);
    const HXMappedPath &path = _addressSpace->path(mapping.path);
    const HXFileSystemKind fileSystem = fileSystemOf(mapping, path);
    const uint32_t sharedMemory = !mapping.isFile() ? 0 : _setting.fileSystems->sharedMemoryDevice();
    HXClassifyMapping(path.kind, fileSystem, sharedMemory, path.namedTag, &mapping);
    if (mapping.has(HXMappingSwapBacked)) _sawSwapBacked = true;
    if (mayHoldHugePages(mapping, path.kind, fileSystem)) _mayHoldHugePages = true;
    if (path.kind == HXPathKind::stack) _sawStack = true;
    if (path.kind == HXPathKind::special && path.text == "[vsyscall]") _sawGate = true;
    if (path.kind == HXPathKind::systemV && _addressSpace->ipcNamespace == 0)
        _addressSpace->ipcNamespace = HXReadNamespace(_request.process, "ns/ipc");
    _addressSpace->append(mapping);
}

HXFileSystemKind Reader::fileSystemOf(const HXMapping &mapping, const HXMappedPath &path) {
    if (!mapping.isFile() || (path.kind != HXPathKind::file && path.kind != HXPathKind::deletedFile &&
                              path.kind != HXPathKind::memfd && path.kind != HXPathKind::systemV))
        return HXFileSystemKind::unknown;
    if (mapping.device == _setting.fileSystems->sharedMemoryDevice() || path.text.front() != '/')
        return HXFileSystemKind::unknown;
    const HXFileSystemKind kind = _setting.fileSystems->kindOf(mapping.device, &_lookup);
    if (kind != HXFileSystemKind::deviceNodes) return kind;
    return isDeviceFile(mapping, path) ? HXFileSystemKind::unknown : HXFileSystemKind::swapBacked;
}

// Whether a path on a devtmpfs leads to a device (what its driver maps is no tmpfs page) and not to a plain
// file.
bool Reader::isDeviceFile(const HXMapping &mapping, const HXMappedPath &path) const {
    HXDescriptor place = HXLocateMapped(_request.process, mapping);
    if (!place) place = HXLocateBelowRoot(_request.process, std::string(path.text));
    return !place || !HXIsMappedFile(mapping, place);
}

// By the path and the file system, which is all that maps tells of the huge-page pool.
bool Reader::mayHoldHugePages(const HXMapping &mapping, HXPathKind kind, HXFileSystemKind fileSystem) const {
    if (kind == HXPathKind::anonymousHuge || fileSystem == HXFileSystemKind::hugePages) return true;
    return (kind == HXPathKind::memfd || kind == HXPathKind::systemV) &&
           mapping.device != _setting.fileSystems->sharedMemoryDevice();
}

kern_return_t Reader::endError(const HXDescriptor &file) const {
    if (_readFailed) return MACH_SEND_INVALID_DEST;
    // The gate page of some machines is the last line of every whole list.
    if (_sawGate) return KERN_INVALID_ADDRESS;
    if (isAlive(file)) return KERN_INVALID_ADDRESS;
    if (_addressSpace->count() > 0) return MACH_SEND_INVALID_DEST;
    const auto stat = HXReadStat(_request.process);
    return stat && !stat->hasEnded() ? KERN_INVALID_ADDRESS : MACH_SEND_INVALID_DEST;
}

bool Reader::isSingleThreaded() const {
    if (_request.status) return _request.status->threadCount.value_or(1) <= 1;
    const auto stat = HXReadStat(_request.process);
    return !stat || stat->threadCount <= 1;
}

} // namespace

std::unique_ptr<HXAddressSpace> HXReadAddressSpace(const HXReadRequest &request,
                                                   const HXReaderSetting &setting) {
    return Reader(request, setting).read();
}
