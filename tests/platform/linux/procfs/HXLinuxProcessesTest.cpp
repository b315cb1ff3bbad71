#include "platform/linux/procfs/HXLinuxProcesses.h"

#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <bit>
#include <cerrno>
#include <unistd.h>

namespace {

using namespace std::literals;

template <size_t Count>
std::string bytes(const std::array<uint64_t, Count> &words) {
    const auto raw = std::bit_cast<std::array<char, sizeof words>>(words);
    return {raw.begin(), raw.end()};
}

// A process that runs a script, on a kernel that keeps its stack secret. A path of its memory crosses a page.
TEST(HXLinuxProcesses, AScriptIsNamedByItsOwnMemory) {
    const auto pageSize = static_cast<size_t>(::sysconf(_SC_PAGESIZE));
    constexpr uint64_t own = uint64_t{1} << 63, ofFile = uint64_t{1} << 61;
    HXTemporaryFolder proc;
    proc.write("7/stat", "7 (tool) S 1 7 7 0 -1 4194560 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0 0 0 0 0 0 0\n");
    proc.write("7/comm", "tool\n");
    proc.link("7/exe", "/usr/bin/python3");
    proc.write("7/cmdline", "python3\0-E\0-s\0-u\0/opt/tool\0-x"s);
    proc.write("7/auxv", bytes<4>({31, pageSize - 5, 0, 0}));
    proc.write("7/mem", std::string(pageSize - 5, 'x') + "/opt/tool" + std::string(pageSize, '\0'));
    HXLinuxProcesses processes(proc.path());
    const std::pair<std::array<uint64_t, 2>, std::string> cases[] = {
        {{own, own}, "/opt/tool"}, {{own, own | ofFile}, "/usr/bin/python3"}, {{own, 0}, "/usr/bin/python3"}};
    for (const auto &[pages, expected] : cases) {
        proc.write("7/pagemap", bytes(pages));
        std::string area(200, '?');
        size_t length = area.size();
        ASSERT_EQ(processes.copyArguments(7, area.data(), &length), 0);
        EXPECT_EQ(area.substr(4, expected.size() + 1), expected + '\0');
        EXPECT_EQ(area[0], 6) << "arguments";
    }

    proc_bsdinfo info;
    ASSERT_EQ(processes.proc_pidinfo(7, PROC_PIDTBSDINFO, &info, sizeof info), 136);
    EXPECT_EQ(info.pbi_flags, PROC_FLAG_LP64);
    proc.write("7/auxv", bytes<2>({uint64_t{4096} << 32 | 6, 0})); // words of 32 bits
    ASSERT_EQ(processes.proc_pidinfo(7, PROC_PIDTBSDINFO, &info, sizeof info), 136);
    EXPECT_EQ(info.pbi_flags, 0u);
    EXPECT_EQ(processes.proc_pidinfo(7, PROC_PIDTBSDINFO, &info, sizeof info - 1), 0);
    EXPECT_EQ(errno, ENOMEM);
    ASSERT_EQ(processes.proc_pidinfo(0, PROC_PIDTBSDINFO, &info, sizeof info), 136);
    EXPECT_EQ(info.pbi_flags, PROC_FLAG_SYSTEM | PROC_FLAG_LP64);
    EXPECT_EQ(processes.proc_pidinfo(7, 1, &info, sizeof info), 0);
    EXPECT_EQ(errno, EINVAL);
    EXPECT_EQ(HXLinuxProcesses(proc / "none").proc_listallpids(nullptr, 0), -1);
}

} // namespace
