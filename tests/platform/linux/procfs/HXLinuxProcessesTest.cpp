#include "platform/linux/procfs/HXLinuxProcesses.h"

#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace {

std::vector<size_t> inTurn(size_t count, const std::function<void(size_t)> &work) {
    for (size_t i = 0; i < count; i++)
        work(i);
    return {};
}

TEST(HXLinuxProcesses, DescribeByWidthOfTheirStack) {
    HXTemporaryFolder proc;
    const auto process = [&](const std::string &stack) {
        proc.write("7/stat", "7 (tool) S 1 7 7 0 -1 4194560 0 0 0 0 0 0 0 0 20 0 1 0 9 4096 0 0 0 0 " +
                                 stack + " 0 0\n");
    };
    HXLinuxProcesses processes(proc.path(), inTurn);
    process("0"); // kept secret
    proc_bsdinfo info;
    ASSERT_EQ(processes.proc_pidinfo(7, PROC_PIDTBSDINFO, &info, sizeof info), 136);
    EXPECT_EQ(info.pbi_flags, PROC_FLAG_LP64);
    process("4294967040");
    ASSERT_EQ(processes.proc_pidinfo(7, PROC_PIDTBSDINFO, &info, sizeof info), 136);
    EXPECT_EQ(info.pbi_flags, 0u);
    EXPECT_EQ(processes.proc_pidinfo(7, PROC_PIDTBSDINFO, &info, sizeof info - 1), 0);
    EXPECT_EQ(errno, ENOMEM);
    ASSERT_EQ(processes.proc_pidinfo(0, PROC_PIDTBSDINFO, &info, sizeof info), 136);
    EXPECT_EQ(info.pbi_flags, PROC_FLAG_SYSTEM | PROC_FLAG_LP64);
    EXPECT_EQ(processes.proc_pidinfo(7, 1, &info, sizeof info), 0);
    EXPECT_EQ(errno, EINVAL);
    EXPECT_EQ(HXLinuxProcesses(proc / "none", inTurn).proc_listallpids(nullptr, 0), -1);
}

} // namespace
