#include "platform/linux/memory/HXFileSystemKind.h"

HXFileSystemKind HXFileSystemKindOf(std::string_view type) {
    using Kind = HXFileSystemKind;
    // A type that is not listed is taken for one that may hang.
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
        {"aufs", Kind::layered},     {"ubifs", Kind::local},          {"cramfs", Kind::local},
    };
    for (const auto &entry : known)
        if (entry.type == type) return entry.kind;
    return Kind::remote;
}
