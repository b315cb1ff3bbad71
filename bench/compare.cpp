// Times whole programs on a fixed population of processes: heft, reading the kernel's own files, and peers
// that are installed. Commands take turns, so that a noisy machine disturbs all alike; medians are printed.
//
//   heft-compare DIRECTORY-OF-PROGRAMS [ROUNDS]

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

constexpr size_t kPage = 4096;
constexpr size_t kMiB = 1 << 20;
constexpr size_t kGiB = 1 << 30;

char *mapPrivate(size_t size) {
    void *all =
        mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (all == MAP_FAILED) _exit(1);
    madvise(all, size, MADV_NOHUGEPAGE);
    return static_cast<char *>(all);
}

// `count` mappings of a page each, which the kernel cannot merge.
void manyMappings(size_t count) {
    char *all = mapPrivate(2 * count * kPage);
    for (size_t i = 0; i < count; i++) {
        all[2 * i * kPage] = 1;
        mprotect(all + (2 * i + 1) * kPage, kPage, PROT_NONE);
    }
}

void fourGigabytes() {
    memset(mapPrivate(4 * kGiB), 1, 4 * kGiB);
}

void forkingParent() {
    memset(mapPrivate(256 * kMiB), 1, 256 * kMiB);
    for (int i = 0; i < 32; i++) {
        if (fork() == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            for (;;)
                pause();
        }
    }
}

// Processes that were started, each in its own group so that its children end with it.
class Population {
  public:
    ~Population() {
        for (const pid_t pid : _pids)
            kill(-pid, SIGKILL);
        for (const pid_t pid : _pids)
            waitpid(pid, nullptr, 0);
    }
    template <typename Work>
    void start(Work work) {
        int ready[2];
        if (pipe(ready) != 0) exit(1);
        const pid_t pid = fork();
        if (pid == 0) {
            setpgid(0, 0);
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            work();
            if (write(ready[1], "", 1) != 1) _exit(1);
            for (;;)
                pause();
        }
        char byte;
        if (read(ready[0], &byte, 1) != 1) exit(1);
        close(ready[0]);
        close(ready[1]);
        _pids.push_back(pid);
    }

  private:
    std::vector<pid_t> _pids;
};

struct Command {
    std::string name;
    std::string shell;
    std::vector<double> seconds;
    long peakKilobytes = 0;
};

void run(Command &command) {
    const auto before = std::chrono::steady_clock::now();
    const pid_t pid = fork();
    if (pid == 0) {
        const int null = open("/dev/null", O_WRONLY);
        dup2(null, 1);
        dup2(null, 2);
        execl("/bin/sh", "sh", "-c", ("exec " + command.shell).c_str(), nullptr);
        _exit(127);
    }
    int status = 0;
    rusage usage{};
    wait4(pid, &status, 0, &usage);
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - before;
    command.seconds.push_back(took.count());
    command.peakKilobytes = std::max(command.peakKilobytes, usage.ru_maxrss);
    if (!WIFEXITED(status) || WEXITSTATUS(status) > 1)
        fprintf(stderr, "%s ended badly\n", command.name.c_str());
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

size_t countMappings() {
    std::FILE *lines = popen("cat /proc/[0-9]*/maps 2>/dev/null | wc -l", "r");
    size_t count = 0;
    if (!lines || fscanf(lines, "%zu", &count) != 1) count = 0;
    if (lines) pclose(lines);
    return count;
}

void addPeers(std::vector<Command> &commands) {
    for (const char *peer : {"smem", "smemstat", "ps_mem"})
        if (system((std::string("command -v ") + peer + " >/dev/null 2>&1").c_str()) == 0)
            commands.push_back({peer, peer, {}, 0});
}

} // namespace

int main(int argc, char *argv[]) {
    if (argc < 2) {
        fprintf(stderr, "usage: heft-compare DIRECTORY-OF-PROGRAMS [ROUNDS]\n");
        return 1;
    }
    const std::string programs = argv[1];
    const int rounds = argc > 2 ? std::max(1, atoi(argv[2])) : 7;
    const std::string heft = programs + "/heft -a";
    const std::string variant = programs + "/bench/heft-variant ";
    std::vector<Command> commands = {
        {"cat smaps", "cat /proc/[0-9]*/smaps", {}, 0},
        {"cat smaps_rollup", "cat /proc/[0-9]*/smaps_rollup", {}, 0},
        {"heft -a", heft, {}, 0},
        {"heft -a --json", heft + " --json /dev/null", {}, 0},
        {"heft -a, one worker", "taskset -c 0 " + heft, {}, 0},
        {"heft -a --json, one worker", "taskset -c 0 " + heft + " --json /dev/null", {}, 0},
        {"heft -a, from smaps alone", variant + "smaps -a", {}, 0},
        {"heft -a, from maps and scans", variant + "maps -a", {}, 0},
    };
    addPeers(commands);

    Population population;
    for (int i = 0; i < 300; i++)
        population.start([] { manyMappings(40); }); // and about 20 of the program itself
    population.start([] { manyMappings(10000); });
    population.start(fourGigabytes);
    population.start(forkingParent);
    const size_t mappings = countMappings();
    for (int round = 0; round < rounds; round++)
        for (Command &command : commands)
            run(command);

    const double reference = median(commands.front().seconds);
    const long budget = 40 * 1024 + static_cast<long>(mappings * 250 / 1024);
    printf("%zu mappings, %d rounds; peak memory of 40 MiB + 250 bytes per mapping would be %ld KiB\n",
           mappings, rounds, budget);
    printf("%-30s %12s %12s %14s\n", "", "median ms", "x cat smaps", "peak KiB");
    for (const Command &command : commands) {
        const double seconds = median(command.seconds);
        printf("%-30s %12.1f %12.2f %14ld\n", command.name.c_str(), seconds * 1e3, seconds / reference,
               command.peakKilobytes);
    }
    return 0;
}
