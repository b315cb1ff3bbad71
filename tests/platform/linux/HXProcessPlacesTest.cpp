#include "platform/linux/HXProcessPlaces.h"

#include "support/HXCaseFile.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

// The unit and the container on a path, each with its own path; ID is an identifier of 64 digits.
TEST(HXProcessPlacesTest, PathsNameUnitsAndContainers) {
    const std::string identifier(64, 'a');
    const auto answer = [&](std::string path) {
        for (size_t at = path.find("ID"); at != std::string::npos; at = path.find("ID"))
            path.replace(at, 2, identifier);
        const HXGroupNames names = HXNamesOnPath(path);
        const auto told = [](const HXNamedGroup &group) {
            return group.name.empty() ? "-" : group.name + " " + std::to_string(group.path.size());
        };
        return told(names.unit) + " | " + told(names.container);
    };
    const std::string rows = HXReadCases("control-groups.txt")[0].input;
    EXPECT_EQ(HXAnswered(rows, answer), rows);
}

// A process of a machine with version 2 and one of a machine with version 1 hierarchies.
TEST(HXProcessPlacesTest, FilesOfProcessesAndGroupsAreRead) {
    const HXTemporaryFolder folder;
    const std::string status = "Name:\tx\nUid:\t1\t4294967294\t3\t4\n";
    folder.write("proc/7/status", status);
    folder.write("proc/7/cgroup", "0::/system.slice/web.service\n");
    folder.write("proc/8/status", status);
    folder.write("proc/8/cgroup",
                 "4:memory:/web.service/worker\n3:cpu,cpuacct:/\n1:name=systemd:/system.slice/"
                 "web.service\n0::/\n");
    folder.write("proc/9/status", "Name:\tx\n");
    folder.write("group/system.slice/web.service/memory.current", "123456\n");
    folder.write("group/memory/web.service/memory.usage_in_bytes", "789\n");
    HXProcessPlaces places(folder / "proc", folder / "group");
    const auto unified = places.placeOf(7);
    const auto old = places.placeOf(8);
    ASSERT_TRUE(unified && old);
    EXPECT_EQ(unified->user, "4294967294"); // who has no name
    EXPECT_EQ(unified->groups.unit.name, "web.service");
    EXPECT_EQ(old->groups.unit.name, "web.service");
    EXPECT_EQ(old->memoryGroups.unit.path, "/web.service");
    EXPECT_FALSE(places.placeOf(9)); // no user
    EXPECT_FALSE(places.placeOf(10));
    EXPECT_EQ(places.memoryOf(unified->groups.unit.path, ""), 123456u);
    EXPECT_EQ(places.memoryOf("/no.service", old->memoryGroups.unit.path), 789u);
    EXPECT_EQ(places.memoryOf("/no.service", ""), std::nullopt);
}
