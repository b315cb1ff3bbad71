#include "platform/linux/memory/HXMappingClass.h"

#include "platform/HXRegionTags.h"

#include <gtest/gtest.h>

#include <set>

namespace {

constexpr uint32_t kKernel = 1, kDisk = 0xfe00000, kTmpfs = 40, kPool = 15; // devices
constexpr uint8_t kGiven = 120;
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
    const auto fileSystem = device == kTmpfs  ? HXFileSystemKind::swapBacked
                            : device == kDisk ? HXFileSystemKind::local
                                              : HXFileSystemKind::unknown;
    HXClassifyMapping(HXPathKindOf(path), fileSystem, kKernel, namedTag, &mapping);
    mapping.residentPages = 8;
    return mapping;
}

TEST(HXMappingClass, TagsPagersAndShareModes) {
    static const struct {
        const char *path;
        uint16_t flags;
        uint32_t device;
        uint32_t tag; // kGiven: as the program named it
        uint8_t pager, shareMode;
        bool swapBacked;
    } cases[] = {
        {"", R | W, 0, HXHostTagAnonymous, 0, SM_PRIVATE, false},
        {"", R | W | X, 0, HXHostTagAnonymousCode, 0, SM_PRIVATE, false},
        {"[heap]", R | W, 0, HXHostTagHeap, 0, SM_PRIVATE, false},
        {"[stack]", R | W, 0, HXHostTagStack, 0, SM_PRIVATE, false},
        {"[vdso]", R | X, 0, HXHostTagAnonymousCode, 0, SM_COW, false},
        {"", 0, 0, HXHostTagGuard, 0, SM_PRIVATE, false}, // written before access was taken away
        {"[anon:arena]", R | W, 0, kGiven, 0, SM_PRIVATE, false},
        {"[anon_shmem:ring]", R | W | S, kKernel, kGiven, 0, SM_SHARED, true},
        {"/dev/zero (deleted)", R | W | S, kKernel, HXHostTagSharedAnonymous, 0, SM_SHARED, true},
        {"/SYSV00000042 (deleted)", R | W | S, kKernel, HXHostTagSystemVSharedMemory, 0, SM_SHARED, true},
        {"/memfd:ring (deleted)", R | W | S, kKernel, HXHostTagMemfd, 0, SM_SHARED, true},
        {"/memfd:ring (deleted)", R, kKernel, HXHostTagMemfd, 0, SM_COW, true},
        {"/anon_hugepage (deleted)", R | W | H, kPool, HXHostTagHugePages, 0, SM_PRIVATE, false},
        {"/mnt/huge/pool", R | W | S | H, kPool, 0, 1, SM_SHARED, false},
        {"/mnt/huge/pool (deleted)", R | W | S | H, kPool, HXHostTagHugePages, 0, SM_SHARED, false},
        {"/dev/shm/ring", R | W | S, kTmpfs, 0, 1, SM_SHARED, true},
        {"/dev/shm/ring (deleted)", R | W | S, kTmpfs, HXHostTagDeletedSharedMemory, 0, SM_SHARED, true},
        {"/usr/lib/libc.so", R | X, kDisk, 0, 1, SM_COW, false},
        // A file on a disk that bears the name of the kernel's object.
        {"/memfd:ring (deleted)", R | W | S, kDisk, 0, 1, SM_SHARED, false},
    };
    for (const auto &item : cases) {
        const HXMapping mapping =
            classified(item.path, item.flags, item.device, item.tag == kGiven ? kGiven : 0);
        const auto info = HXRegionInfo(mapping, 1, true);
        const std::string what = std::string(item.path) + " " + std::to_string(item.flags);
        EXPECT_EQ(info.user_tag, item.tag) << what;
        EXPECT_EQ(info.external_pager, item.pager) << what;
        EXPECT_EQ(info.share_mode, item.shareMode) << what;
        EXPECT_EQ(mapping.has(HXMappingSwapBacked), item.swapBacked) << what;
        EXPECT_EQ(info.user_wired_count, (item.flags & H) != 0) << what;
        EXPECT_EQ(info.protection, item.flags & (R | W | X)) << what; // the bits are the same
        EXPECT_EQ(uint64_t{info.offset}, info.share_mode == SM_PRIVATE || item.device == 0 ? 0u : 0x3000u)
            << what;
    }
    EXPECT_EQ(classified("[anon:arena]", R | W, 0).tag, HXHostTagAnonymous) << "no tag was left";
    HXMapping empty = classified("", 0, 0);
    empty.residentPages = 0;
    EXPECT_EQ(HXRegionInfo(empty, 1, false).share_mode, SM_EMPTY);
    empty.swappedPages = 1;
    EXPECT_EQ(HXRegionInfo(empty, 1, false).share_mode, SM_PRIVATE);
}

TEST(HXMappingClass, FiguresThatFewMachinesShow) {
    HXMapping mapping = classified("", R | W, 0);
    mapping.anonymousPages = 1; // read at another moment than
    mapping.lazyFreePages = 5;
    mapping.swappedPages = 4;
    auto info = HXRegionInfo(mapping, 1, true);
    EXPECT_EQ(info.pages_dirtied, 0u);
    EXPECT_EQ(info.pages_swapped_out, 4u);
    mapping = classified("/anon_hugepage (deleted)", R | W | S | H, kPool);
    mapping.hugePages = 1024;
    info = HXRegionInfo(mapping, 1, true);
    EXPECT_EQ(info.pages_dirtied, 1024u);
    EXPECT_EQ(info.pages_resident, 1032u);
    EXPECT_EQ(HXRegionInfo(mapping, 1, false).pages_dirtied, 1032u) << "what its object sees";
}

} // namespace
