#include "platform/linux/HXProgressLine.h"

#include "support/HXBuilders.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <pty.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>

namespace {

// Work that is looked at twice, says something and comes to its end.
void work() {
    HXLinuxServices services;
    HXProgressLine line(services, std::chrono::milliseconds(0));
    const HXDispatchQueue queue{"q", 0, "reading", [](size_t i) { return "p " + std::to_string(i); }};
    line.looked(queue, 1, 9, std::nullopt);
    std::fputs("message\n", stderr);
    line.looked(queue, 2, 9, 7);
    line.ended();
    line.ended();
    std::fputs("report\n", stderr);
}

// What a terminal of so many columns gets.
std::string shownOn(const char *kind, unsigned short columns) {
    const winsize size = {25, columns, 0, 0};
    int terminal = -1;
    const pid_t pid = forkpty(&terminal, nullptr, nullptr, &size);
    if (pid == 0) {
        setenv("TERM", kind, 1);
        work();
        _exit(0);
    }
    std::string text;
    char buffer[256];
    for (ssize_t got = 0; (got = read(terminal, buffer, sizeof buffer)) > 0;)
        text.append(buffer, static_cast<size_t>(got));
    close(terminal);
    waitpid(pid, nullptr, 0);
    return text;
}

TEST(HXProgressLine, IsErasedBeforeAnythingElse) {
    const int terminal = ::posix_openpt(O_RDWR | O_NOCTTY);
    if (terminal < 0) GTEST_SKIP() << "no pseudoterminals (devpts)";
    ::close(terminal);
    const std::string erase = "\r\033[K";
    EXPECT_EQ(shownOn("xterm", 80), "\rheft: reading: 1 of 9\033[K" + erase + "message\r\n" +
                                        "\rheft: reading: 2 of 9, waiting for p 7\033[K" + erase +
                                        "report\r\n");
    EXPECT_EQ(shownOn("xterm", 10),
              "\rheft: rea\033[K" + erase + "message\r\n\rheft: rea\033[K" + erase + "report\r\n");
    EXPECT_EQ(shownOn("dumb", 80), "message\r\nreport\r\n");
}

TEST(HXProgressLine, IsNotWhereNobodyLooks) {
    EXPECT_EQ(printedBy(work).err, "message\nreport\n");
}

} // namespace
