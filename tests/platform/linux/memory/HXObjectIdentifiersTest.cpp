#include "platform/linux/memory/HXObjectIdentifiers.h"

#include <gtest/gtest.h>

#include <set>

namespace {

constexpr uint32_t kDisk = 0xfe00000, kKernel = 1;

HXMapping mapping(HXPathKind kind, uint32_t device, uint64_t inode, bool isShared = false) {
    HXMapping mapping;
    mapping.start = 0x10000;
    mapping.end = 0x20000;
    mapping.device = device;
    mapping.inode = inode;
    mapping.kind = kind;
    mapping.flags = isShared ? HXMappingShared : 0;
    return mapping;
}

class HXObjectIdentifiersTest : public testing::Test {
  protected:
    uint64_t id(const HXMapping &of, int32_t pid, uint64_t ipcNamespace = 0) {
        return identifiers.of(of, {pid, identifiers.numberOfProcess(pid), ipcNamespace});
    }
    HXObjectIdentifiers identifiers;
    const HXMapping file = mapping(HXPathKind::file, kDisk, 7);
};

TEST_F(HXObjectIdentifiersTest, TellObjectsApart) {
    HXMapping written = file, swappedOut = file, huge = file, elsewhere = file;
    written.anonymousPages = swappedOut.swappedPages = huge.hugePages = 1;
    elsewhere.start = 0x1000;
    const HXMapping anonymous = mapping(HXPathKind::none, 0, 0);
    const HXMapping systemV = mapping(HXPathKind::systemV, kKernel, 7, true);
    HXMapping vdso = mapping(HXPathKind::vdso, 0, 0), narrowVdso = vdso;
    narrowVdso.end += 0x1000;
    HXMapping high = anonymous, gate = anonymous; // beyond what needs no table
    high.start = uint64_t{1} << 48;
    gate.start = 0xffffffffff600000;
    EXPECT_EQ(id(file, 1), id(elsewhere, 2)) << "one object for every mapping of a file";
    EXPECT_EQ(id(vdso, 1), id(vdso, 2));
    HXMapping otherFile = file, sameNumber = file, otherSegment = systemV, hugeSegment = systemV;
    otherFile.inode++;
    sameNumber.device++;
    otherSegment.inode++;
    hugeSegment.device++;
    const HXMapping memfd = mapping(HXPathKind::memfd, kKernel, 7, true);
    std::multiset<uint64_t> ids;
    for (const HXMapping &each : {file, otherFile, sameNumber, memfd, vdso, narrowVdso})
        ids.insert(id(each, 1));
    for (const HXMapping &segment : {systemV, otherSegment, hugeSegment})
        for (const uint64_t ipcNamespace : {8, 9})
            ids.insert(id(segment, 1, ipcNamespace));
    constexpr int32_t largePid = 1 + 0x1FFFF; // which prefers the number of pid 1
    for (const HXMapping &own : {written, anonymous, high, gate})
        for (const int32_t pid : {1, 2, largePid})
            ids.insert(id(own, pid));
    for (const int32_t pid : {1, 2, largePid})
        ids.insert(identifiers.ofPageTables(pid));
    for (const HXMapping &own : {swappedOut, huge})
        EXPECT_EQ(id(own, 1), id(written, 1));
    EXPECT_EQ(std::set<uint64_t>(ids.begin(), ids.end()).size(), ids.size());
    EXPECT_GT(*ids.begin(), 0xFFFFFFFFU) << "those of memory graphs";
    EXPECT_LT(*ids.rbegin(), uint64_t{1} << 53);
    HXObjectIdentifiers otherRun;
    EXPECT_EQ(otherRun.of(file, {}), id(file, 1));
}

// What anybody can work out of the first numbers of a key, to choose the last one by.
uint64_t mix(uint64_t value) {
    value += 0x9E3779B97F4A7C15;
    value = (value ^ (value >> 30)) * 0xBF58476D1CE4E5B9;
    value = (value ^ (value >> 27)) * 0x94D049BB133111EB;
    return value ^ (value >> 31);
}

// Files with inode numbers chosen so that all would have one number, by the present rule and by that of a
// plain hash of kind, device and inode; and so many that some meet by chance.
TEST_F(HXObjectIdentifiersTest, CannotBeForged) {
    std::set<uint64_t> lowBits;
    size_t files = 0;
    const auto add = [&](uint32_t device, uint64_t inode) {
        const uint64_t identifier = id(mapping(HXPathKind::file, device, inode), 1);
        EXPECT_EQ(identifier % 2, 0u) << "odd ones are private mappings'";
        EXPECT_LT(identifier, uint64_t{1} << 53);
        lowBits.insert(static_cast<uint32_t>(identifier)); // others are those that pids are put in
        files++;
    };
    for (uint32_t device = 1; device <= 1000; device++) {
        add(device, mix(mix(uint64_t{1} << 32 ^ device)));
        add(device, mix(mix(1) ^ device));
    }
    for (uint64_t inode = 1; inode <= 200000; inode++)
        add(kDisk, inode);
    EXPECT_EQ(lowBits.size(), files);
    EXPECT_EQ(id(mapping(HXPathKind::none, 0, 0), 1) % 2, 1u);
}

} // namespace
