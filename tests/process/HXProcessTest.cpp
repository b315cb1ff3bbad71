#include "process/HXUserProcess.h"
#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"

#include <cstring>
#include <gtest/gtest.h>

namespace {
// Answers the argument area of every process with given bytes.
class ArgumentAreas : public HXBarePlatform {
  public:
    std::optional<uint32_t> argMax = 64;
    std::optional<std::string> area;

    int32_t sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) override {
        if (nameLength == 2 && name[0] == 1 && name[1] == 8 && argMax && *oldBytes == 4) {
            std::memcpy(old, &*argMax, 4);
            return 0;
        }
        if (nameLength == 3 && name[0] == 1 && name[1] == 49 && name[2] == 123 && area) {
            std::memcpy(old, area->data(), *oldBytes = std::min(area->size(), *oldBytes));
            return 0;
        }
        return -1;
    }
};

proc_bsdinfo record(const std::string &name, const std::string &comm) {
    proc_bsdinfo info{};
    info.pbi_pid = 123;
    std::memcpy(info.pbi_name, name.data(), name.size());
    std::memcpy(info.pbi_comm, comm.data(), comm.size());
    return info;
}
} // namespace

TEST(HXProcessTest, IsNamedAfterItsExecutableOrItsRecord) {
    using namespace std::string_literals;
    ArgumentAreas platform;
    struct {
        std::optional<std::string> area;
        std::string name, comm;
        std::string expected;
    } cases[] = {
        {"\1\0\0\0/usr/libexec/tool\0arg\0"s, "n", "c", "tool"},
        {"\2\1\0\0/usr/bin/many\0"s, "n", "c", "many"}, // 258 arguments: three bytes before the path
        {"\1\0\0\0\0\0/bin/late\0"s, "n", "c", "late"}, // more zeros before the path
        {"\1\0\0\0/usr/bin/dir/\0"s, "n", "c", "dir"},  // trailing slashes are ignored
        {"\1\0\0\0/\0"s, "n", "c", "/"},
        {"\1\0\0\0/bin/cut"s, "n", "c", "cu"}, // the last byte becomes the zero
        {"\1\0\0\0\0\0\0\0"s, "n", "c", "n"},  // no path at all
        {"\1\0\0\0"s, "n", "c", "n"},
        {""s, "n", "c", "n"},
        {std::nullopt, "process name", "command", "process name"},
        {std::nullopt, "", "command", "command"},
        {std::nullopt, "", "", "Unknown"},
        {std::nullopt, "", "0123456789abcdef", "0123456789abcdef"},
        {std::nullopt, "0123456789abcdef0123456789abcdef", "c", "0123456789abcdef0123456789abcdef"},
    };
    for (const auto &test : cases) {
        platform.area = test.area;
        EXPECT_EQ(HXProcess::_nameForBsdInfo(record(test.name, test.comm)), test.expected);
    }
    platform.area = "\1\0\0\0/usr/libexec/tool\0"s;
    for (const auto argMax : {std::optional<uint32_t>(), std::optional<uint32_t>(0)}) {
        platform.argMax = argMax;
        EXPECT_EQ(HXProcess::_nameForBsdInfo(record("n", "c")), "n");
    }
}

TEST(HXProcessTest, RecordsCompareByPidAndKeepTheirLists) {
    const HXBarePlatform platform;
    HXMadeUpProcess process(123, "foo");
    EXPECT_TRUE(process.isEqual(HXMadeUpProcess(123, "other")));
    EXPECT_FALSE(process.isEqual(HXMadeUpProcess(124, "foo")));
    process.addError("one");
    const auto errors = process.errors();
    process.addError("two");
    EXPECT_EQ(errors.size(), 1u); // a copy
    EXPECT_EQ(process.errors().size(), 2u);
    EXPECT_FALSE(HXProcess().initWithBsdInfo(record("n", "c"), nullptr)); // the base class takes no task
}

TEST(HXProcessTest, DirtyFlagsAndLayoutsAreTold) {
    const HXBarePlatform platform;
    HXUserProcess process;
    EXPECT_EQ(process.idleExitStatus(), HXIdleExitUnknown);
    for (uint32_t flags = 0; flags < 12; flags++) {
        process._setIdleExitStatusFromDirtyFlags(flags);
        EXPECT_EQ(process.idleExitStatus(), flags == 7                  ? HXIdleExitDirty
                                            : flags == 3 || flags == 11 ? HXIdleExitClean
                                                                        : HXIdleExitNotSupported);
    }

    const uint64_t layouts[][2] = {{0x90000000, 0x20000000},
                                   {0x7FFF00000000, 0xFFE00000},
                                   {0x40000000, 0x40000000},
                                   {0x180000000, 0x100000000},
                                   {0x1A000000, 0x40000000}};
    for (int32_t code = 0; code < 5; code++) {
        EXPECT_TRUE(process._setSharedRegionFromPlatform(code));
        EXPECT_EQ(process.sharedRegion().base, layouts[code][0]) << code;
        EXPECT_EQ(process.sharedRegion().size, layouts[code][1]) << code;
    }
    for (const int32_t code : {5, -1, 100}) {
        const auto printed = printedBy([&] { EXPECT_FALSE(process._setSharedRegionFromPlatform(code)); });
        EXPECT_EQ(printed.err, "Unable to determine platform architecture of target\n");
        EXPECT_EQ(process.sharedRegion().base, layouts[4][0]);
    }
}
