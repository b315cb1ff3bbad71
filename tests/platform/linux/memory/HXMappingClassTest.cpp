#include "platform/linux/memory/HXMappingClass.h"

#include "platform/HXRegionTags.h"

#include <gtest/gtest.h>

#include <set>

namespace {

constexpr uint32_t kKernel = 1, kDisk = 0xfe00000; // devices
constexpr uint16_t R = HXMappingReadable, W = HXMappingWritable, X = HXMappingExecutable, S = HXMappingShared;

HXMapping classified(const char *path, uint16_t flags, uint32_t device) {
    HXMapping mapping;
    mapping.start = 0x10000;
    mapping.end = 0x20000;
    mapping.device = device;
    mapping.inode = device == 0 ? 0 : 7;
    mapping.flags = flags;
    mapping.residentPages = 8;
    HXClassifyMapping(HXPathKindOf(path), HXFileSystemKind::local, kKernel, 0, &mapping);
    return mapping;
}

uint64_t id(const HXMapping &mapping, int32_t pid, uint64_t ipcNamespace = 0) {
    return HXRegionInfo(mapping, {pid, ipcNamespace, true}).object_id_full;
}

TEST(HXMappingClass, Identifiers) {
    const HXMapping file = classified("/usr/lib/libc.so", R, kDisk);
    HXMapping written = file, swappedOut = file, huge = file, elsewhere = file;
    written.anonymousPages = swappedOut.swappedPages = huge.hugePages = 1;
    elsewhere.start = 0x1000;
    EXPECT_EQ(id(file, 1), id(elsewhere, 2)) << "one object for every mapping of a file";
    for (const HXMapping &own : {written, swappedOut, huge, classified("", R | W, 0)})
        EXPECT_NE(id(own, 1), id(own, 2)) << "pages of its own";

    const HXMapping systemV = classified("/SYSV00000001 (deleted)", R | W | S, kKernel);
    const HXMapping memfd = classified("/memfd:x (deleted)", R | W | S, kKernel);
    const HXMapping vdso = classified("[vdso]", R | X, 0);
    EXPECT_EQ(id(vdso, 1), id(vdso, 2));
    HXMapping narrowVdso = vdso, otherFile = file, sameNumber = file, otherSegment = systemV;
    narrowVdso.end += 0x1000;
    otherFile.inode++;
    sameNumber.device++;
    otherSegment.inode++;
    // Files of which the mixed numbers are those that no object may have.
    HXMapping zero = file, allOnes = file;
    zero.inode = 0x6c08cdee6ac8ca52;
    allOnes.inode = 0x3ca2c15e915c7812;
    EXPECT_EQ(id(zero, 1), id(allOnes, 1));
    // What must not be taken for each other, the same inode number in different roles among it.
    const std::set<uint64_t> ids = {
        id(file, 1),       id(written, 1), id(otherFile, 1),       id(sameNumber, 1),
        id(systemV, 1, 8), id(memfd, 1),   id(systemV, 1, 9),      id(vdso, 1),
        id(narrowVdso, 1), id(zero, 1),    id(otherSegment, 1, 8), 0,
        UINT64_MAX};
    EXPECT_EQ(ids.size(), 13u);
}

TEST(HXMappingClass, NamedMemoryForWhichNoTagIsLeftIsAnonymous) {
    EXPECT_EQ(classified("[anon:arena]", R | W, 0).tag, HXHostTagAnonymous);
}

} // namespace
