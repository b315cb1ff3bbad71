// The built program on processes of the user's own.
#include "support/HXBuilders.h"
#include "support/HXMemoryRecipe.h"
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <filesystem>
#include <optional>
#include <sched.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace {

bool contains(const std::string &text, const std::string &part) {
    return text.find(part) != std::string::npos;
}

// What jq's `filter` makes of a document.
std::string query(const std::string &json, const std::string &filter) {
    return HXRunProgram({"/usr/bin/env", "jq", "-c", filter, json}).out;
}

TEST(HXProgram, EndsAsItsDriverSays) {
    const HXProgramRun help = HXRunHeft({"--help"}), nothing = HXRunHeft({}),
                       absent = HXRunHeft({"no such process"});
    EXPECT_TRUE(help.status == 0 && help.err.empty());
    EXPECT_EQ(nothing.status, 1);
    EXPECT_TRUE(nothing.out == help.out && contains(help.out, "Usage: heft [args]"));
    EXPECT_TRUE(absent.status == 1 && absent.out.empty() &&
                contains(absent.err, "matching 'no such process'\n"));
}

TEST(HXProgram, LeavesQuietlyWhenNobodyReads) {
    const HXTemporaryFolder folder;
    const std::string json = folder / "json";
    const std::string command = HEFT_PROGRAM " -v " + std::to_string(getpid());
    for (const std::string &line : {command, command + " -j " + json}) {
        const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line + " | head -c 1"});
        EXPECT_EQ(run.status, 0);
        EXPECT_EQ(run.err, "");
    }
    EXPECT_EQ(query(json, ".\"bytes per unit\""), "1\n");
}

TEST(HXProgram, CompletesTheTextWhenTheDocumentCannotBeWritten) {
    if (!std::filesystem::exists("/dev/full")) GTEST_SKIP() << "no /dev/full";
    const HXProgramRun run = HXRunHeft({"-j", "/dev/full", std::to_string(getpid())});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(contains(run.err, "heft: /dev/full: No space left on device\n")) << run.err;
    EXPECT_TRUE(contains(run.out, "phys_heft_peak: "));
}

// A copy of the shell, which stops itself.
class Shell {
  public:
    explicit Shell(const std::string &name) {
        std::filesystem::copy_file("/bin/sh", folder / name);
        subject.emplace(folder / name, std::vector<std::string>{"-c", "kill -STOP $$"});
    }
    std::string header(const std::string &shownName) const {
        return shownName + " [" + std::to_string(subject->pid()) + "]: 64-bit\tHeft: ";
    }
    const HXTemporaryFolder folder;
    std::optional<HXSubject> subject;
};

TEST(HXProgram, NamesProgramsAfterTheirFileThoughItIsGone) {
    const Shell shell("my shell");
    shell.folder.remove("my shell");
    const HXProgramRun run = HXRunHeft({"-p", "my shell", "-v", "-w"});
    const std::string path = (shell.folder / "my shell").string() + " (deleted)";
    // Only root may look into a file without a name.
    const bool isRoot = ::geteuid() == 0;
    for (const std::string &text : {shell.header("my shell"), (isRoot ? "__TEXT " : "mapped file ") + path,
                                    (isRoot ? "__DATA " : "mapped file ") + path})
        EXPECT_TRUE(contains(run.out, text)) << text << " in " << run.out << run.err;
}

TEST(HXProgram, PrintsHostileNamesAsPlainText) {
    const Shell shell("a\x1b[31m\"b\"\nc\xff\\n");
    const std::string json = shell.folder / "report";
    const HXProgramRun run = HXRunHeft({std::to_string(shell.subject->pid()), "-v", "-w", "-j", json});
    EXPECT_EQ(run.status, 0);
    EXPECT_TRUE(contains(run.out, shell.header("a?[31m'b'?c??n"))) << run.out;
    for (const char c : run.out)
        EXPECT_TRUE(c == '\n' || c == '\t' || static_cast<unsigned char>(c) >= 0x20);
    EXPECT_EQ(query(json, ".processes[0].heft > 0"), "true\n");
}

// A thread holds 32 MiB; the leading one has ended.
TEST(HXProgram, FindsProcessesWhoseLeadingThreadHasEnded) {
    static int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    const pid_t pid = fork();
    if (pid == 0) {
        std::thread([] {
            constexpr size_t size = 32 << 20;
            memset(mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0), 1, size);
            if (write(ready[1], "", 1) != 1) _exit(1);
            for (;;)
                pause();
        }).detach();
        syscall(SYS_exit, 0); // of this thread alone
    }
    char byte;
    ASSERT_EQ(read(ready[0], &byte, 1), 1);
    const std::string stat = "/proc/" + std::to_string(pid) + "/stat";
    while (!contains(contentOf(stat), ") Z "))
        sched_yield();
    const std::string json = temporaryPath();
    const HXProgramRun run = HXRunHeft({std::to_string(pid), "-j", json});
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(query(json, ".processes[0].heft > 33554432"), "true\n") << run.out;
}

TEST(HXProgram, TellsThirtyTwoBitProgramsApart) {
    const HXTemporaryFolder folder;
    // kill(getpid(), SIGSTOP), for ever, by the 32-bit system call gate.
    folder.write("stop.s", ".globl _start\n.data\nword: .long 1\n.text\n_start: movl $20, %eax\n"
                           "int $0x80\nmovl $1, word\nmovl %eax, %ebx\nmovl $19, %ecx\n"
                           "movl $37, %eax\nint $0x80\njmp _start\n");
    const std::string build =
        "cd " + folder.path().string() + " && as --32 -o o stop.s && ld -m elf_i386 -o stop o";
    if (HXRunProgram({"/bin/sh", "-c", build}).status != 0)
        GTEST_SKIP() << "no 32-bit program can be built here";
    const HXSubject subject(folder / "stop", {});
    if (!subject.stopped()) GTEST_SKIP() << "the kernel runs no 32-bit programs";
    const HXProgramRun run = HXRunHeft({"-p", "stop", "-v"});
    const std::string header = "stop [" + std::to_string(subject.pid()) + "]: 32-bit\tHeft: ";
    for (const std::string &text : {header, std::string("__TEXT .../stop"), std::string("__DATA .../stop")})
        EXPECT_TRUE(contains(run.out, text)) << text << " in " << run.out;
}

// Two processes share a memfd and a tmpfs file, and each has memory of its own.
TEST(HXProgram, CountsSharedMemoryOnce) {
    if (!HXHasTmpfs()) GTEST_SKIP() << "/dev/shm is no tmpfs";
    constexpr size_t mib = 1 << 20;
    const HXTemporaryFolder folder;
    std::string path = "/dev/shm/heft-XXXXXX";
    const int memfd = memfd_create("heft-shared", 0), tmpfs = mkstemp(path.data());
    const auto share = [&](size_t own) {
        for (const auto &[file, size] :
             {std::pair(memfd, 3 * mib), {tmpfs, 2 * mib}, {memfd_create("own", 0), own}}) {
            if (ftruncate(file, static_cast<off_t>(size)) != 0) _exit(1);
            // Memory that is mapped again counts once, too.
            for (int times = file == memfd || file == tmpfs ? 1 : 3; times > 0; times--) {
                void *all = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
                madvise(all, size, MADV_NOHUGEPAGE);
                memset(all, 1, size);
            }
        }
    };
    const HXSubject first([&] { share(5 * mib); }), second([&] { share(7 * mib); });
    const std::string pids[] = {std::to_string(first.pid()), std::to_string(second.pid())};
    const std::string json = folder / "json";
    EXPECT_EQ(HXRunHeft({pids[0], pids[1], "-f", "bytes", "-j", json}).status, 0);
    unlink(path.c_str());
    EXPECT_EQ(query(json, "[.shared[].categories.memfd | select(.) | .dirty] | unique"), "[3145728]\n");
    EXPECT_EQ(query(json, "[.shared[] | select(.categories.memfd) | .pids] | unique"),
              "[[" + pids[0] + "," + pids[1] + "]]\n");
    EXPECT_EQ(query(json, "[.processes[].categories.memfd.dirty] | sort"), "[5242880,7340032]\n");
    EXPECT_EQ(query(json, ".summary | .memfd.dirty, .\"mapped file\".dirty"), "15728640\n2097152\n");
}

} // namespace
