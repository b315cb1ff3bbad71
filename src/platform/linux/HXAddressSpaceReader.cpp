#include "platform/linux/HXAddressSpaceReader.h"

#include "platform/linux/HXMapsParser.h"
#include "platform/linux/HXProcFile.h"
#include "platform/linux/HXProcText.h"
#include "platform/linux/HXTextNumber.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace {

class Reader {
  public:
    Reader(int directory, const HXReaderSetting &setting)
        : _directory(directory), _setting(setting), _addressSpace(std::make_unique<HXAddressSpace>()) {
        _lookup.directory = directory;
    }

    std::unique_ptr<HXAddressSpace> read(std::optional<uint64_t> threadCount);

  private:
    void readMappings(const HXDescriptor &file);
    void take(const HXMapsEntry &entry);
    HXFileSystemKind fileSystemOf(const HXMapping &mapping, const HXMappedPath &path);
    bool isDeviceFile(const HXMapping &mapping, const HXMappedPath &path) const;
    kern_return_t endError(const HXDescriptor &file) const;
    bool isSingleThreaded(std::optional<uint64_t> threadCount) const;

    const int _directory;
    const HXReaderSetting &_setting;
    HXFileSystemLookup _lookup;
    std::unique_ptr<HXAddressSpace> _addressSpace;
    bool _readFailed = false;
    bool _sawStack = false;
    bool _sawGate = false;
};

std::optional<HXStatRecord> readStat(int directory) {
    char buffer[2048];
    const auto text = HXReadOnce(directory, "stat", buffer);
    return text ? HXParseStat(*text) : std::nullopt;
}

kern_return_t errorOfOpening(int error) {
    static constexpr struct {
        int error;
        kern_return_t answer;
    } answers[] = {
        {EMFILE, KERN_RESOURCE_SHORTAGE}, {ENFILE, KERN_RESOURCE_SHORTAGE}, {ENOMEM, KERN_RESOURCE_SHORTAGE},
        {EACCES, KERN_NO_ACCESS},         {EPERM, KERN_NO_ACCESS},
    };
    for (const auto &entry : answers)
        if (entry.error == error) return entry.answer;
    return MACH_SEND_INVALID_DEST;
}

uint64_t readIpcNamespace(int directory) {
    char buffer[64];
    const auto link = HXReadLink(directory, "ns/ipc", buffer);
    if (!link) return 0;
    HXTextCursor cursor{link->substr(std::min(link->find('[') + 1, link->size()))};
    uint64_t number = 0;
    cursor.number(&number);
    return number;
}

std::unique_ptr<HXAddressSpace> Reader::read(std::optional<uint64_t> threadCount) {
    const HXDescriptor file = HXOpenAt(_directory, "smaps");
    if (!file) {
        _addressSpace->endError = errorOfOpening(errno);
        return std::move(_addressSpace);
    }
    readMappings(file);
    _addressSpace->endError = endError(file);
    if (!_sawStack || !isSingleThreaded(threadCount)) HXTagThreadStacks(_directory, _addressSpace.get());
    return std::move(_addressSpace);
}

void Reader::readMappings(const HXDescriptor &file) {
    HXMapsParser parser(_setting.pageShift);
    HXMapsEntry entry;
    const std::span<char> buffer = HXScratchBuffer();
    size_t length = 0;
    for (bool complete = false; !complete;) {
        // The kernel hands out a page or so at a time; as much as fits is parsed together.
        const ssize_t got = HXReadFully(file.get(), buffer.subspan(length));
        _readFailed = got < 0;
        complete = got <= 0 || length + static_cast<size_t>(got) < buffer.size();
        length += static_cast<size_t>(std::max<ssize_t>(got, 0));
        std::string_view text(buffer.data(), length);
        while (parser.next(&text, complete, &entry))
            take(entry);
        if (text.size() == buffer.size()) text = {}; // no mapping's text is that long
        std::memmove(buffer.data(), text.data(), text.size());
        length = text.size();
    }
}

void Reader::take(const HXMapsEntry &entry) {
    HXMapping mapping = entry.mapping;
    mapping.path = _addressSpace->intern(entry.path);
    const HXMappedPath &path = _addressSpace->path(mapping.path);
    const HXFileSystemKind fileSystem = fileSystemOf(mapping, path);
    const uint32_t sharedMemory = mapping.inode == 0 ? 0 : _setting.fileSystems->sharedMemoryDevice();
    HXClassifyMapping(path.kind, fileSystem, sharedMemory, path.namedTag, &mapping);
    if (path.kind == HXPathKind::stack) _sawStack = true;
    if (path.kind == HXPathKind::special && path.text == "[vsyscall]") _sawGate = true;
    if (path.kind == HXPathKind::systemV && _addressSpace->ipcNamespace == 0)
        _addressSpace->ipcNamespace = readIpcNamespace(_directory);
    _addressSpace->append(mapping);
}

HXFileSystemKind Reader::fileSystemOf(const HXMapping &mapping, const HXMappedPath &path) {
    if (mapping.inode == 0 || (path.kind != HXPathKind::file && path.kind != HXPathKind::deletedFile &&
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
    struct statx status;
    const std::string below = "root" + path.text;
    const int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC;
    if (::statx(_directory, below.c_str(), flags, STATX_TYPE | STATX_INO, &status) != 0) return true;
    return !S_ISREG(status.stx_mode) || status.stx_ino != mapping.inode;
}

kern_return_t Reader::endError(const HXDescriptor &file) const {
    if (_readFailed) return MACH_SEND_INVALID_DEST;
    // The gate page of some machines is the last line of every whole list.
    if (_sawGate) return KERN_INVALID_ADDRESS;
    // A file of an address space that is gone reads as empty; a whole one still has its first line.
    char byte;
    if (::pread(file.get(), &byte, 1, 0) > 0) return KERN_INVALID_ADDRESS;
    if (_addressSpace->count() > 0) return MACH_SEND_INVALID_DEST;
    const auto stat = readStat(_directory);
    return stat && !stat->isZombie() ? KERN_INVALID_ADDRESS : MACH_SEND_INVALID_DEST;
}

bool Reader::isSingleThreaded(std::optional<uint64_t> threadCount) const {
    if (threadCount) return *threadCount <= 1;
    const auto stat = readStat(_directory);
    return !stat || stat->threadCount <= 1;
}

} // namespace

std::unique_ptr<HXAddressSpace> HXReadAddressSpace(int directory, const HXReaderSetting &setting,
                                                   std::optional<uint64_t> threadCount) {
    return Reader(directory, setting).read(threadCount);
}
