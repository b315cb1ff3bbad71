// The built program on processes of the user's own.
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace {

bool contains(const std::string &text, const std::string &part) {
    return text.find(part) != std::string::npos;
}

// A folder of the test's own, removed with it.
class Folder {
  public:
    Folder() {
        std::string made = (std::filesystem::temp_directory_path() / "heft-XXXXXX").string();
        if (mkdtemp(made.data())) _path = made;
        std::filesystem::permissions(_path, std::filesystem::perms(0755));
    }
    ~Folder() { std::filesystem::remove_all(_path); }
    std::string file(const std::string &name) const { return _path + "/" + name; }
    void writeProgram(const std::string &name, const std::string &text) const {
        std::ofstream(file(name)) << text;
        chmod(file(name).c_str(), 0755);
    }

  private:
    std::string _path;
};

constexpr char kUsageStart[] =
    "Gather memory information about a process or set of processes\nUsage: heft [args]";

TEST(HXProgram, SaysWhatIsWrongWithItsArguments) {
    const struct {
        std::vector<std::string> arguments;
        int status;
        const char *err; // contained in standard error
        bool usage;
    } cases[] = {
        {{"--help"}, 0, "", true},
        {{}, 1, "Must specify at least one process or memgraph\n", true},
        {{"--nonsense"}, 1, "nonsense", true},
        {{"-f", "Bytes", "1"}, 1, "Accepted arguments: 'bytes', 'formatted', 'pages'.\n", true},
        {{"--sort", "size", "1"},
         1,
         "Unrecognized argument 'size' to --sort.\nAccepted arguments: dirty, swapped",
         true},
        {{"--pid", "abc"}, 1, "'abc' is not a valid integer for --pid.\n\nUse -p / --proc", true},
        {{"no such process"},
         1,
         "Unable to find pid for process matching 'no such process'\nUnable to find any",
         false},
        {{"--pid", "4194305"}, 1, "Unable to analyze process with pid 4194305 (try as root?)\n", false},
        {{"/"}, 1, "Error opening memgraph /: ", true},
        {{"-j", "/nowhere/file", std::to_string(getpid())},
         1,
         "heft: /nowhere/file: No such file or directory\n",
         false},
    };
    for (const auto &each : cases) {
        const HXProgramRun run = HXRunHeft(each.arguments);
        const std::string label = each.arguments.empty() ? "(none)" : each.arguments.front();
        EXPECT_EQ(run.status, each.status) << label;
        EXPECT_TRUE(contains(run.err, each.err)) << label << ": " << run.err;
        EXPECT_EQ(contains(run.out, kUsageStart), each.usage) << label;
        EXPECT_EQ(run.out.empty(), !each.usage) << label;
    }
}

TEST(HXProgram, LeavesQuietlyWhenNobodyReads) {
    const Folder folder;
    const std::string pid = std::to_string(getpid());
    for (const std::string &json : {std::string(), " -j " + folder.file("json")}) {
        const std::string line = std::string(HEFT_PROGRAM) + " -v " + pid + json + " | head -c 1";
        const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line});
        EXPECT_EQ(run.status, 0);
        EXPECT_EQ(run.err, "");
    }
    EXPECT_EQ(HXRunProgram({"/usr/bin/env", "jq", "-c", ".\"bytes per unit\"", folder.file("json")}).out,
              "1\n");
}

TEST(HXProgram, CompletesTheTextWhenTheDocumentCannotBeWritten) {
    if (!std::filesystem::exists("/dev/full")) GTEST_SKIP() << "no /dev/full";
    const HXProgramRun run = HXRunHeft({"-j", "/dev/full", std::to_string(getpid())});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(contains(run.err, "heft: /dev/full: No space left on device\n")) << run.err;
    EXPECT_TRUE(contains(run.out, "phys_heft_peak: "));
}

TEST(HXProgram, NamesScriptsAfterTheScriptAndProgramsAfterTheirFile) {
    const Folder folder;
    folder.writeProgram("my script", "#!/bin/sh\nkill -STOP $$\n");
    std::filesystem::copy_file("/bin/sh", folder.file("my shell"));
    {
        const HXSubject subject(folder.file("my script"), {});
        ASSERT_TRUE(subject.stopped());
        const HXProgramRun run = HXRunHeft({"-p", "my script"});
        EXPECT_TRUE(contains(run.out, "my script [" + std::to_string(subject.pid()) + "]: 64-bit\tHeft: "))
            << run.err;
    }
    const HXSubject subject(folder.file("my shell"), {"-c", "kill -STOP $$"});
    ASSERT_TRUE(subject.stopped());
    std::filesystem::remove(folder.file("my shell"));
    const HXProgramRun run = HXRunHeft({"-p", "my shell", "-v", "-w"});
    EXPECT_TRUE(contains(run.out, "my shell [" + std::to_string(subject.pid()) + "]: 64-bit\tHeft: "))
        << run.err;
    // Its segments are read though the file is gone.
    EXPECT_TRUE(contains(run.out, "__TEXT " + folder.file("my shell") + " (deleted)")) << run.out;
    EXPECT_TRUE(contains(run.out, "__DATA " + folder.file("my shell") + " (deleted)"));
}

TEST(HXProgram, TellsThirtyTwoBitProgramsApart) {
    const Folder folder;
    // kill(getpid(), SIGSTOP), for ever, by the 32-bit system call gate.
    std::ofstream(folder.file("stop.s"))
        << ".globl _start\n.data\nword: .long 1\n.text\n_start: movl $20, %eax\n"
           "int $0x80\nmovl $1, word\nmovl %eax, %ebx\nmovl $19, %ecx\n"
           "movl $37, %eax\nint $0x80\njmp _start\n";
    const std::string build = "as --32 -o " + folder.file("stop.o") + " " + folder.file("stop.s") +
                              " && ld -m elf_i386 -o " + folder.file("stop") + " " + folder.file("stop.o");
    if (HXRunProgram({"/bin/sh", "-c", build}).status != 0)
        GTEST_SKIP() << "no 32-bit program can be built here";
    const HXSubject subject(folder.file("stop"), {});
    if (!subject.stopped()) GTEST_SKIP() << "the kernel runs no 32-bit programs";
    const HXProgramRun run = HXRunHeft({"-p", "stop", "-v"});
    EXPECT_TRUE(contains(run.out, "stop [" + std::to_string(subject.pid()) + "]: 32-bit\tHeft: ")) << run.out;
    EXPECT_TRUE(contains(run.out, "__TEXT .../stop")) << run.out;
    EXPECT_TRUE(contains(run.out, "__DATA .../stop")) << run.out;
}

TEST(HXProgram, PrintsHostileNamesAsPlainText) {
    const Folder folder;
    const std::string hostile = "a\x1b[31m\"b\"\nc\xff\\n";
    std::filesystem::copy_file("/bin/sh", folder.file(hostile));
    const HXSubject subject(folder.file(hostile), {"-c", "kill -STOP $$"});
    ASSERT_TRUE(subject.stopped());
    const std::string json = folder.file("report");
    const HXProgramRun run = HXRunHeft({std::to_string(subject.pid()), "-v", "-w", "-j", json});
    EXPECT_EQ(run.status, 0);
    EXPECT_TRUE(contains(run.out, "a?[31m'b'?c??n [" + std::to_string(subject.pid()) + "]: 64-bit"))
        << run.out;
    for (const char c : run.out)
        EXPECT_TRUE(c == '\n' || c == '\t' || static_cast<unsigned char>(c) >= 0x20);
    EXPECT_EQ(HXRunProgram({"/usr/bin/env", "jq", "-e", ".processes[0].heft > 0", json}).out, "true\n");
}

// Two processes share a memfd and a tmpfs file, and each has memory of its own.
TEST(HXProgram, CountsSharedMemoryOnce) {
    constexpr size_t mib = 1 << 20;
    const int memfd = static_cast<int>(syscall(SYS_memfd_create, "heft-shared", 0));
    std::string path = "/dev/shm/heft-XXXXXX";
    const int tmpfs = mkstemp(path.data());
    ASSERT_TRUE(memfd >= 0 && tmpfs >= 0);
    ASSERT_TRUE(ftruncate(memfd, 3 * mib) == 0 && ftruncate(tmpfs, 2 * mib) == 0);
    const auto share = [&](size_t own) {
        return [=]() -> std::vector<HXExpectedRegion> {
            const auto map = [](size_t size, int flags, int file) {
                void *all = mmap(nullptr, size, PROT_READ | PROT_WRITE, flags, file, 0);
                madvise(all, size, MADV_NOHUGEPAGE);
                memset(all, 1, size);
            };
            map(3 * mib, MAP_SHARED, memfd);
            map(2 * mib, MAP_SHARED, tmpfs);
            const int mine = static_cast<int>(syscall(SYS_memfd_create, "heft-own", 0));
            if (ftruncate(mine, static_cast<off_t>(own)) != 0) return {};
            map(own, MAP_SHARED, mine);
            return {};
        };
    };
    const HXSubject first(share(5 * mib));
    const HXSubject second(share(7 * mib));
    const std::string json = path + ".json";
    const HXProgramRun run =
        HXRunHeft({std::to_string(first.pid()), std::to_string(second.pid()), "-f", "bytes", "-j", json});
    unlink(path.c_str());
    EXPECT_EQ(run.status, 0);
    const auto query = [&](const std::string &filter) {
        std::string out = HXRunProgram({"/usr/bin/env", "jq", "-c", filter, json}).out;
        return out.substr(0, out.find('\n'));
    };
    const std::string pids = "[" + std::to_string(first.pid()) + "," + std::to_string(second.pid()) + "]";
    EXPECT_EQ(query("[.shared[].categories.memfd | select(.) | .dirty] | unique"), "[3145728]");
    EXPECT_EQ(query(".shared[] | select(.categories.memfd) | .pids"), pids);
    EXPECT_EQ(query("[.processes[] | .categories.memfd.dirty] | sort"), "[5242880,7340032]");
    EXPECT_EQ(query(".summary.memfd.dirty"), std::to_string(15 * mib));
    EXPECT_EQ(query(".summary.\"mapped file\".dirty"), std::to_string(2 * mib));
    unlink(json.c_str());
}

// Processes that come, map, unmap and go while they are examined.
TEST(HXProgram, SurvivesProcessesThatComeAndGo) {
    const HXSubject parent([]() -> std::vector<HXExpectedRegion> {
        if (fork() != 0) return {};
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        setpgid(0, 0);
        std::signal(SIGCHLD, SIG_IGN);
        for (int children = 0;; children++) {
            if (fork() == 0) {
                prctl(PR_SET_PDEATHSIG, SIGKILL);
                for (int i = 0; i < 40; i++) {
                    char *all = static_cast<char *>(
                        mmap(nullptr, 1 << 20, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
                    for (size_t page = 0; page < 256; page += 4)
                        all[page * 4096] = 1;
                    if (i % 2) munmap(all, 1 << 20);
                    usleep(500);
                }
                _exit(0);
            }
            usleep(200);
        }
    });
    ASSERT_TRUE(parent.stopped());
    for (int i = 0; i < 20; i++) {
        const HXProgramRun run = HXRunHeft({"-t", "-f", "bytes", std::to_string(parent.pid())});
        ASSERT_EQ(run.status, 0) << run.err;
        ASSERT_TRUE(run.out.ends_with("\n\n") || contains(run.out, "TOTAL")) << run.out;
    }
}

} // namespace
