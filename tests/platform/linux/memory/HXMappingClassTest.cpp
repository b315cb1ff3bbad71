#include "platform/linux/memory/HXMappingClass.h"

#include "platform/HXRegionTags.h"

#include <gtest/gtest.h>

#include <set>

namespace {

constexpr uint32_t kernelDevice = 1, diskDevice = 0xfe00000, tmpfsDevice = 40;
constexpr uint8_t given = 120;
constexpr uint16_t R = HXMappingReadable, W = HXMappingWritable, X = HXMappingExecutable, S = HXMappingShared,
                   H = HXMappingHugePages;

HXMapping classified(const char *path, uint16_t flags, uint32_t device, uint8_t namedTag = 0) {
    HXMapping mapping;
    mapping.start = 0x10000;
    mapping.end = 0x20000;
    mapping.offset = 0x3000;
    mapping.device = device;
    mapping.inode = device == 0 ? 0 : 7;
    mapping.flags = flags;
    const auto fileSystem = device == tmpfsDevice  ? HXFileSystemKind::swapBacked
                            : device == diskDevice ? HXFileSystemKind::local
                                                   : HXFileSystemKind::unknown;
    HXClassifyMapping(HXPathKindOf(path), fileSystem, kernelDevice, namedTag, &mapping);
    mapping.residentPages = 8;
    return mapping;
}

TEST(HXMappingClass, TagsPagersAndShareModes) {
    static const struct {
        const char *path;
        uint16_t flags;
        uint32_t device;
        uint8_t namedTag;
        uint32_t tag;
        uint8_t pager, shareMode;
        bool swapBacked;
    } cases[] = {
        {"", R | W, 0, 0, HXHostTagAnonymous, 0, SM_PRIVATE, false},
        {"", R | W | X, 0, 0, HXHostTagAnonymousCode, 0, SM_PRIVATE, false},
        {"[heap]", R | W, 0, 0, HXHostTagHeap, 0, SM_PRIVATE, false},
        {"[stack]", R | W, 0, 0, HXHostTagStack, 0, SM_PRIVATE, false},
        {"[vdso]", R | X, 0, 0, HXHostTagAnonymousCode, 0, SM_COW, false},
        {"", 0, 0, 0, HXHostTagGuard, 0, SM_PRIVATE, false}, // written before access was taken away
        {"[anon:arena]", R | W, 0, given, given, 0, SM_PRIVATE, false},
        {"[anon:arena]", R | W, 0, 0, HXHostTagAnonymous, 0, SM_PRIVATE, false}, // no tag was left
        {"[anon_shmem:ring]", R | W | S, kernelDevice, given, given, 0, SM_SHARED, true},
        {"/dev/zero (deleted)", R | W | S, kernelDevice, 0, HXHostTagSharedAnonymous, 0, SM_SHARED, true},
        {"/SYSV00000042 (deleted)", R | W | S, kernelDevice, 0, HXHostTagSystemVSharedMemory, 0, SM_SHARED,
         true},
        {"/memfd:ring (deleted)", R | W | S, kernelDevice, 0, HXHostTagMemfd, 0, SM_SHARED, true},
        {"/memfd:ring (deleted)", R, kernelDevice, 0, HXHostTagMemfd, 0, SM_COW, true},
        {"/anon_hugepage (deleted)", R | W | H, 15, 0, HXHostTagHugePages, 0, SM_PRIVATE, false},
        {"/mnt/huge/pool", R | W | S | H, 15, 0, 0, 1, SM_SHARED, false},
        {"/dev/shm/ring", R | W | S, tmpfsDevice, 0, 0, 1, SM_SHARED, true},
        {"/dev/shm/ring (deleted)", R | W | S, tmpfsDevice, 0, HXHostTagDeletedSharedMemory, 0, SM_SHARED,
         true},
        {"/usr/lib/libc.so", R | X, diskDevice, 0, 0, 1, SM_COW, false},
        // Files on a disk that bear the names of the kernel's objects.
        {"/memfd:ring (deleted)", R | W | S, diskDevice, 0, 0, 1, SM_SHARED, false},
    };
    for (const auto &item : cases) {
        const HXMapping mapping = classified(item.path, item.flags, item.device, item.namedTag);
        const auto info = HXRegionInfo(mapping, {1, 0, true});
        const std::string what = std::string(item.path) + " " + std::to_string(item.flags);
        EXPECT_EQ(info.user_tag, item.tag) << what;
        EXPECT_EQ(info.external_pager, item.pager) << what;
        EXPECT_EQ(info.share_mode, item.shareMode) << what;
        EXPECT_EQ(mapping.has(HXMappingSwapBacked), item.swapBacked) << what;
        EXPECT_EQ(info.user_wired_count, (item.flags & H) != 0) << what;
        EXPECT_EQ(uint64_t{info.offset}, info.share_mode == SM_PRIVATE || item.device == 0 ? 0u : 0x3000u)
            << what;
    }
    HXMapping empty = classified("", 0, 0);
    empty.residentPages = 0;
    EXPECT_EQ(HXRegionInfo(empty, {}).share_mode, SM_EMPTY);
    empty.swappedPages = 1;
    EXPECT_EQ(HXRegionInfo(empty, {}).share_mode, SM_PRIVATE);
}

TEST(HXMappingClass, FiguresInBothModes) {
    static const struct {
        const char *path;
        uint16_t flags;
        uint32_t device;
        uint32_t anonymous, lazyFree, huge;
        uint32_t charged, seenByObject; // of 8 resident, 3 dirty pages
    } cases[] = {
        {"", R | W, 0, 8, 2, 0, 6, 8},
        {"/usr/bin/x", R | W, diskDevice, 2, 0, 0, 2, 3},
        {"/usr/bin/x", R | W | S, diskDevice, 0, 0, 0, 0, 3},
        {"/dev/shm/x", R | W | S, tmpfsDevice, 0, 0, 0, 8, 8},
        {"/memfd:x (deleted)", R | W | S, kernelDevice, 0, 0, 0, 8, 8},
        {"", R | W, 0, 1, 5, 0, 0, 8}, // figures that were read at two moments
    };
    for (const auto &item : cases) {
        HXMapping mapping = classified(item.path, item.flags, item.device);
        mapping.anonymousPages = item.anonymous;
        mapping.lazyFreePages = item.lazyFree;
        mapping.dirtyPages = 3;
        mapping.swappedPages = 4;
        const auto charge = HXRegionInfo(mapping, {1, 0, true});
        EXPECT_EQ(charge.pages_dirtied, item.charged) << item.path;
        EXPECT_EQ(charge.pages_resident, 8u);
        EXPECT_EQ(HXRegionInfo(mapping, {1, 0, false}).pages_dirtied, item.seenByObject) << item.path;
    }
    HXMapping huge = classified("/anon_hugepage (deleted)", R | W | S | H, 15);
    huge.residentPages = 0;
    huge.hugePages = 1024;
    EXPECT_EQ(HXRegionInfo(huge, {1, 0, true}).pages_dirtied, 1024u);
    EXPECT_EQ(HXRegionInfo(huge, {1, 0, true}).pages_resident, 1024u);
}

uint64_t id(const HXMapping &mapping, int32_t pid, uint64_t ipcNamespace = 0) {
    return HXObjectIdentifier(mapping, {pid, ipcNamespace, true});
}

TEST(HXMappingClass, Identifiers) {
    const HXMapping file = classified("/usr/lib/libc.so", R, diskDevice);
    HXMapping written = file, swappedOut = file, elsewhere = file;
    written.anonymousPages = 1;
    swappedOut.swappedPages = 1;
    elsewhere.start = 0x1000;
    EXPECT_EQ(id(file, 1), id(elsewhere, 2)) << "one object for every mapping of a file";
    for (const HXMapping &own : {written, swappedOut, classified("", R | W, 0)})
        EXPECT_NE(id(own, 1), id(own, 2)) << "pages of its own";

    const HXMapping systemV = classified("/SYSV00000001 (deleted)", R | W | S, kernelDevice);
    const HXMapping memfd = classified("/memfd:x (deleted)", R | W | S, kernelDevice);
    const HXMapping vdso = classified("[vdso]", R | X, 0);
    EXPECT_EQ(id(vdso, 1), id(vdso, 2));
    HXMapping narrowVdso = vdso, otherFile = file, sameNumber = file;
    narrowVdso.end += 0x1000;
    otherFile.inode++;
    sameNumber.device++;
    // What must not be taken for each other, the same inode number in different roles among it.
    const std::set<uint64_t> ids = {
        id(file, 1),  id(written, 1),    id(otherFile, 1), id(sameNumber, 1), id(systemV, 1, 8),
        id(memfd, 1), id(systemV, 1, 9), id(vdso, 1),      id(narrowVdso, 1), 0,
        UINT64_MAX};
    EXPECT_EQ(ids.size(), 11u);
}

} // namespace
