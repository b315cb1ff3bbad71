// Whether who is examined is held up: a process maps, touches and unmaps memory in four threads, which all
// need the lock of its address space, while another reads it in a loop. How long each round takes it, by the
// reader. The process has many mappings, so that a reader that held the lock for long would show. Needs root.
//
//   target-latency HEFT [SECONDS]

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

using Clock = std::chrono::steady_clock;

constexpr size_t kPage = 4096, kPages = 16, kThreads = 4, kMappings = 4000;

// What the reader has to read: every other page of a stretch, which the kernel cannot merge.
void makeMappings() {
    void *all = mmap(nullptr, kMappings * kPage, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (all == MAP_FAILED) exit(1);
    for (size_t i = 0; i < kMappings; i += 2) {
        static_cast<char *>(all)[i * kPage] = 1;
        mprotect(static_cast<char *>(all) + i * kPage, kPage, PROT_READ);
    }
}

// The microseconds that each round took one thread, until told to end.
std::vector<float> work(const std::atomic<bool> &hasEnded) {
    std::vector<float> took;
    took.reserve(size_t{1} << 22);
    while (!hasEnded && took.size() < took.capacity()) {
        const auto start = Clock::now();
        void *all = mmap(nullptr, kPages * kPage, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (all == MAP_FAILED) exit(1);
        for (size_t page = 0; page < kPages; page++)
            static_cast<volatile char *>(all)[page * kPage] = 1;
        munmap(all, kPages * kPage);
        took.push_back(std::chrono::duration<float, std::micro>(Clock::now() - start).count());
        std::this_thread::sleep_for(std::chrono::microseconds(200)); // a server waits for its clients, too
    }
    return took;
}

// Runs the command again and again, in a process group of its own, until it is killed.
pid_t startReader(const std::string &command) {
    const pid_t reader = fork();
    if (reader != 0) return reader;
    setpgid(0, 0);
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    const int null = open("/dev/null", O_WRONLY);
    dup2(null, 1);
    dup2(null, 2);
    execl("/bin/sh", "sh", "-c", ("while :; do " + command + "; done").c_str(), nullptr);
    _exit(127);
}

void measure(const char *name, const std::string &command, int seconds) {
    const pid_t reader = command.empty() ? 0 : startReader(command);
    std::atomic<bool> hasEnded = false;
    std::vector<float> took[kThreads];
    {
        std::vector<std::thread> threads;
        for (auto &each : took)
            threads.emplace_back([&each, &hasEnded] { each = work(hasEnded); });
        std::this_thread::sleep_for(std::chrono::seconds(seconds));
        hasEnded = true;
        for (std::thread &thread : threads)
            thread.join();
    }
    if (reader != 0) {
        kill(-reader, SIGKILL);
        waitpid(reader, nullptr, 0);
    }
    std::vector<float> all;
    for (const auto &each : took)
        all.insert(all.end(), each.begin(), each.end());
    std::sort(all.begin(), all.end());
    const auto percentile = [&all](double part) {
        return all[static_cast<size_t>(part * static_cast<double>(all.size() - 1))];
    };
    printf("%-28s %9zu %9.1f %9.1f %9.1f %9.1f\n", name, all.size(), percentile(0.5), percentile(0.99),
           percentile(0.999), all.back());
    fflush(stdout);
}

} // namespace

int main(int argc, char *argv[]) {
    if (argc < 2) {
        fprintf(stderr, "usage: target-latency HEFT [SECONDS]\n");
        return 1;
    }
    const int seconds = argc > 2 ? std::max(1, atoi(argv[2])) : 10;
    const std::string heft = argv[1], self = std::to_string(getpid());
    makeMappings();
    printf("%-28s %9s %9s %9s %9s %9s\n", "microseconds, while", "rounds", "median", "99 %", "99.9 %",
           "longest");
    measure("nobody reads", "", seconds);
    measure("cat smaps, this one", "cat /proc/" + self + "/smaps", seconds);
    measure("heft, this one", heft + " " + self, seconds);
    measure("cat smaps, all", "cat /proc/[0-9]*/smaps", seconds);
    measure("heft -a", heft + " -a", seconds);
    return 0;
}
