#include "platform/linux/procfs/HXProcMount.h"

#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

namespace {

// A mount of /proc, that of another place before it, and a status.
bool hides(const std::string &options, const std::string &status) {
    return HXHidesProcesses("20 1 0:30 / / rw - ext4 /dev/x rw,hidepid=2\n"
                            "21 20 0:31 / /proc rw - proc proc rw\n"
                            "22 21 0:32 / /proc rw,nosuid - proc proc rw" +
                                options + "\n",
                            "Name:\tx\n" + status, "/proc");
}

TEST(HXProcMount, HidesProcessesFromWhoMayNotTraceThem) {
    const std::string plain = "Gid:\t5\t6\t5\t5\nGroups:\t7 8 \nCapEff:\t000001ffffd7ffff\n";
    const std::string tracer = "Gid:\t5\t6\t5\t5\nGroups:\t \nCapEff:\t0000000000080000\n";
    for (const char *const none : {"", ",hidepid=0", ",hidepid=off,gid=3"})
        EXPECT_FALSE(hides(none, plain)) << none;
    for (const char *const some : {",hidepid=1", ",hidepid=2,gid=5", ",gid=9,hidepid=noaccess",
                                   ",hidepid=invisible", ",hidepid=4,gid=7", ",gid=6,hidepid=ptraceable"}) {
        EXPECT_EQ(hides(some, plain), true) << some;
        EXPECT_FALSE(hides(some, tracer)) << some;
    }
    for (const char *const exempt : {",hidepid=2,gid=6", ",gid=7,hidepid=invisible", ",hidepid=1,gid=8"})
        EXPECT_FALSE(hides(exempt, plain)) << exempt;
}

TEST(HXProcMount, IsMissedWhereThereIsNone) {
    const HXTemporaryFolder folder;
    const std::string path = folder.path();
    EXPECT_EQ(HXProcessesNotTold(path, false), path + " is not mounted");
    folder.link("self", "1"); // of another pid namespace
    EXPECT_EQ(HXProcessesNotTold(path, true), std::nullopt);
}

} // namespace
