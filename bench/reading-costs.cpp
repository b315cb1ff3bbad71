// What the kernel's files about a process's memory cost, by mapping and by page, on this machine: the figures
// that the choice between them rests on (docs/performance.md). Needs root.
//
//   reading-costs

#include "platform/linux/pages/HXPageScan.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

namespace {

constexpr size_t kPage = 4096;

// A process that has `mappings` mappings of its own with `pages` pages each, and rests. Its pid.
pid_t startSubject(size_t mappings, size_t pages) {
    int ready[2];
    if (pipe(ready) != 0) exit(1);
    const pid_t pid = fork();
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        for (size_t i = 0; i < mappings; i++) {
            // Every other is read-only, so that the kernel keeps them apart.
            void *all =
                mmap(nullptr, pages * kPage, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
            if (all == MAP_FAILED) _exit(1);
            madvise(all, pages * kPage, MADV_NOHUGEPAGE);
            memset(all, 1, pages * kPage);
            if (i % 2 == 1) mprotect(all, pages * kPage, PROT_READ);
        }
        if (write(ready[1], "", 1) != 1) _exit(1);
        for (;;)
            pause();
    }
    char byte;
    close(ready[1]);
    if (read(ready[0], &byte, 1) != 1) exit(1);
    close(ready[0]);
    return pid;
}

double processorNanoseconds() {
    timespec time{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) * 1e9 + static_cast<double>(time.tv_nsec);
}

// The least of some readings: what disturbs only adds.
double costOf(const std::function<void()> &read) {
    constexpr int readings = 100;
    double least = 1e18;
    for (int i = 0; i < readings; i++) {
        const double before = processorNanoseconds();
        read();
        least = std::min(least, processorNanoseconds() - before);
    }
    return least;
}

void readFile(pid_t pid, const char *name) {
    static std::vector<char> buffer(1 << 18);
    const HXDescriptor file(
        open(("/proc/" + std::to_string(pid) + "/" + name).c_str(), O_RDONLY | O_CLOEXEC));
    while (file && read(file.get(), buffer.data(), buffer.size()) > 0) {
    }
}

void scan(pid_t pid) {
    static std::array<HXPageRun, HXPageScan::kMostRuns> runs;
    const HXDescriptor pagemap(
        open(("/proc/" + std::to_string(pid) + "/pagemap").c_str(), O_RDONLY | O_CLOEXEC));
    constexpr uint64_t end = uint64_t{1} << 47;
    for (uint64_t start = 0; start < end - kPage;) {
        const auto found = HXPageScan::find(pagemap, true, start, end - kPage, runs);
        if (!found) return;
        start = found->end;
    }
}

struct Cost {
    const char *name;
    std::function<void(pid_t)> read;
};

} // namespace

int main() {
    const Cost costs[] = {
        {"maps", [](pid_t pid) { readFile(pid, "maps"); }},
        {"smaps", [](pid_t pid) { readFile(pid, "smaps"); }},
        {"smaps_rollup", [](pid_t pid) { readFile(pid, "smaps_rollup"); }},
        {"page scan", scan},
    };
    constexpr size_t many = 500, large = 64;
    const pid_t subjects[] = {startSubject(0, 0), startSubject(many, 1), startSubject(many, large)};
    printf("%-14s %12s %16s %14s\n", "", "each process", "each mapping ns", "each page ns");
    for (const Cost &cost : costs) {
        double took[3];
        for (size_t i = 0; i < 3; i++)
            took[i] = costOf([&] { cost.read(subjects[i]); });
        const double page = (took[2] - took[1]) / (many * (large - 1));
        printf("%-14s %9.1f us %16.0f %14.1f\n", cost.name, took[0] / 1e3, (took[1] - took[0]) / many - page,
               page);
    }
    for (const pid_t pid : subjects) {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
    return 0;
}
