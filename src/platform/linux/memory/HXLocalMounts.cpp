#include "platform/linux/memory/HXLocalMounts.h"

#include "platform/linux/procfs/HXProcText.h"

#include <algorithm>

namespace {

bool isHere(HXFileSystemKind kind) {
    return kind == HXFileSystemKind::local || kind == HXFileSystemKind::swapBacked;
}

bool isBelow(std::string_view path, std::string_view point) {
    if (point == "/") return true;
    return path.starts_with(point) && (path.size() == point.size() || path[point.size()] == '/');
}

// The kind of the file system that `path` lies on by `table`: that of the mount with the longest point, of
// several at one point the last.
HXFileSystemKind kindOfPath(std::string_view table, std::string_view path) {
    HXFileSystemKind kind = HXFileSystemKind::unknown;
    size_t longest = 0;
    HXParseMountInfo(table, [&](const HXMount &mount) {
        if (mount.point.size() < longest || !isBelow(path, mount.point)) return;
        longest = mount.point.size();
        kind = HXFileSystemKindOfType(mount.type);
    });
    return kind;
}

bool isLayerHere(const HXMountTables &tables, std::string_view path) {
    // Relative to a folder that nobody knows, with letters of a meaning of their own, or on its way
    // elsewhere.
    if (path.front() != '/' || path.find('\\') != std::string_view::npos ||
        path.find("/..") != std::string_view::npos)
        return false;
    return isHere(kindOfPath(tables.table, path)) || isHere(kindOfPath(tables.host, path));
}

// Takes what comes before the next `separator` off *text.
std::string_view takePart(std::string_view *text, char separator) {
    const size_t end = text->find(separator);
    const std::string_view part = text->substr(0, end);
    text->remove_prefix(end == std::string_view::npos ? text->size() : end + 1);
    return part;
}

// Whether all layers that the options of an overlay name lie here
// (Documentation/filesystems/overlayfs.rst).
bool areLayersHere(const HXMountTables &tables, std::string_view options) {
    static constexpr std::string_view layerOptions[] = {"lowerdir", "lowerdir+", "datadir+", "upperdir"};
    bool hasLayers = false;
    while (!options.empty()) {
        std::string_view paths = takePart(&options, ',');
        const std::string_view key = takePart(&paths, '=');
        if (std::find(std::begin(layerOptions), std::end(layerOptions), key) == std::end(layerOptions))
            continue;
        while (!paths.empty()) {
            const std::string_view path = takePart(&paths, ':');
            if (path.empty()) continue; // two colons come before layers of data alone
            if (!isLayerHere(tables, path)) return false;
            hasLayers = true;
        }
    }
    return hasLayers;
}

} // namespace

HXFileSystemKind HXFileSystemKindOfType(std::string_view type) {
    using Kind = HXFileSystemKind;
    static constexpr struct {
        std::string_view type;
        Kind kind;
    } known[] = {
        {"tmpfs", Kind::swapBacked}, {"devtmpfs", Kind::deviceNodes}, {"hugetlbfs", Kind::hugePages},
        {"ext4", Kind::local},       {"ext3", Kind::local},           {"ext2", Kind::local},
        {"xfs", Kind::local},        {"btrfs", Kind::local},          {"overlay", Kind::layered},
        {"f2fs", Kind::local},       {"squashfs", Kind::local},       {"erofs", Kind::local},
        {"zfs", Kind::local},        {"bcachefs", Kind::local},       {"jfs", Kind::local},
        {"reiserfs", Kind::local},   {"nilfs2", Kind::local},         {"vfat", Kind::local},
        {"exfat", Kind::local},      {"ntfs3", Kind::local},          {"iso9660", Kind::local},
        {"udf", Kind::local},        {"ramfs", Kind::local},          {"rootfs", Kind::local},
        {"ubifs", Kind::local},      {"cramfs", Kind::local},
    };
    for (const auto &entry : known)
        if (entry.type == type) return entry.kind;
    return Kind::remote;
}

bool HXIsLocalMount(const HXMountTables &tables, uint32_t device, std::optional<uint64_t> mount) {
    bool isLocal = false;
    HXParseMountInfo(tables.table, [&](const HXMount &each) {
        if (isLocal || each.device != device || (mount && each.identifier != *mount)) return;
        const HXFileSystemKind kind = HXFileSystemKindOfType(each.type);
        const bool isLayered = kind == HXFileSystemKind::layered && tables.isRoots;
        isLocal = isHere(kind) || (isLayered && areLayersHere(tables, each.options));
    });
    return isLocal;
}
