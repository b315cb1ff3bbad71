#include "platform/linux/sharing/HXHeldPlaces.h"

#include "platform/HXSafeText.h"
#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTaskFiles.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/mman.h>
#include <sys/vfs.h>

#include <algorithm>
#include <climits>

namespace {

bool isMemory(const HXMount &mount) {
    return mount.type == "tmpfs" || mount.type == "devtmpfs";
}

// A path of a mount table without its escapes (\040).
std::string plainPath(std::string_view path) {
    constexpr size_t digits = 3;
    std::string plain;
    while (!path.empty()) {
        unsigned letter = 0;
        HXTextCursor escaped{path.substr(1, digits)};
        if (path.front() == '\\' && escaped.number(&letter, 8) && escaped.rest.empty()) {
            plain += static_cast<char>(letter);
            path.remove_prefix(1 + digits);
        } else {
            plain += path.front();
            path.remove_prefix(1);
        }
    }
    return plain;
}

} // namespace

bool HXHeldPlaces::isNew(const std::string &place) const {
    const std::lock_guard lock(_mutex);
    return !_known.contains(place);
}

// Two threads may learn the same at a time; none waits for the other, who may be stuck.
void HXHeldPlaces::learn(const HXDescriptor &process) {
    const std::string mounts = "mnt " + std::to_string(HXReadNamespace(process, "ns/mnt"));
    if (isNew(mounts)) {
        char buffer[PATH_MAX];
        const auto root = HXReadLink(process, "root", buffer);
        // Another root of the same namespace may show less.
        const std::string place = root == "/" ? mounts : mounts + " " + std::string(root.value_or(""));
        if (isNew(place) && learnMounts(process)) {
            const std::lock_guard lock(_mutex);
            _known.insert(place);
        }
    }
    const uint64_t space = HXReadNamespace(process, "ns/ipc");
    const std::string segments = "ipc " + std::to_string(space);
    if (space == 0 || !isNew(segments)) return;
    auto found = HXReadSystemVSegments(_procPath, process);
    const std::lock_guard lock(_mutex);
    _segments[space] = std::move(found);
    _known.insert(segments);
}

void HXHeldPlaces::learnOwn() {
    for (const char *name : {"/self", "/1"})
        if (const auto process = HXOpenAt(AT_FDCWD, (_procPath + name).c_str(), O_PATH | O_DIRECTORY))
            learn(process);
}

// Whether the table could be read.
bool HXHeldPlaces::learnMounts(const HXDescriptor &process) {
    const auto table = HXReadText(process, "mountinfo");
    if (!table) return false;
    bool isRootLocal = false;
    HXParseMountInfo(*table, [&](const HXMount &mount) {
        if (mount.point == "/")
            isRootLocal = _fileSystems.isLocalNow(process, mount.device, mount.identifier);
    });
    HXParseMountInfo(*table, [&](const HXMount &mount) {
        if (!isMemory(mount)) return;
        const auto size = isRootLocal ? usedSize(process, mount) : std::nullopt;
        const std::lock_guard lock(_mutex);
        _mounts.insert(mount.identifier);
        HXMemoryFileSystem &known = _memory[mount.device];
        known.device = mount.device;
        if (known.name.empty())
            known.name = std::string(mount.type) + " " + HXSafeText(plainPath(mount.point));
        if (size) known.size = size;
    });
    return true;
}

// Of several mounts at one point the uppermost answers, which need not be this.
std::optional<uint64_t> HXHeldPlaces::usedSize(const HXDescriptor &process, const HXMount &mount) const {
    const HXDescriptor place = HXLocateBelowRoot(process, plainPath(mount.point));
    if (!place || HXMountOf(place) != mount.identifier) return std::nullopt;
    struct statfs figures;
    if (::fstatfs(place.get(), &figures) != 0 || figures.f_type != TMPFS_MAGIC || figures.f_blocks == 0)
        return std::nullopt;
    return (figures.f_blocks - figures.f_bfree) * static_cast<uint64_t>(figures.f_bsize);
}

std::vector<HXMemoryFileSystem> HXHeldPlaces::fileSystems() const {
    const std::lock_guard lock(_mutex);
    std::vector<HXMemoryFileSystem> all;
    for (const auto &[device, fileSystem] : _memory)
        all.push_back(fileSystem);
    return all;
}

std::vector<std::pair<uint64_t, HXSystemVSegment>> HXHeldPlaces::segments() const {
    const std::lock_guard lock(_mutex);
    std::vector<std::pair<uint64_t, HXSystemVSegment>> all;
    for (const auto &[space, segments] : _segments)
        for (const HXSystemVSegment &segment : segments)
            all.emplace_back(space, segment);
    return all;
}

bool HXHeldPlaces::isMemoryMount(uint64_t mount) {
    // The kernel's own tmpfs, which no table lists.
    static const std::optional<uint64_t> own = [] {
        const HXDescriptor file(::memfd_create("", MFD_CLOEXEC));
        return file ? HXMountOf(file) : std::nullopt;
    }();
    const std::lock_guard lock(_mutex);
    return own == mount || _mounts.contains(mount);
}
