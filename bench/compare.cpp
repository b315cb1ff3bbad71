// Times whole programs on populations of processes: heft, reading the kernel's own files, and peers that are
// installed. Commands take turns, so that a noisy machine disturbs all alike; medians are printed.
//
//   heft-compare DIRECTORY-OF-PROGRAMS [ROUNDS [POPULATION...]]

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sched.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

constexpr size_t kPage = 4096;
constexpr size_t kMiB = 1 << 20;

// What a member of a population does before it rests.

char *mapPrivate(size_t size) {
    void *all =
        mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (all == MAP_FAILED) _exit(1);
    madvise(all, size, MADV_NOHUGEPAGE);
    return static_cast<char *>(all);
}

// `count` mappings, of which every other holds a page: the kernel cannot merge them.
void manyMappings(size_t count) {
    char *all = mapPrivate(count * kPage);
    for (size_t i = 0; i + 1 < count; i += 2) {
        all[i * kPage] = 1;
        mprotect(all + (i + 1) * kPage, kPage, PROT_NONE);
    }
}

void smallPages(size_t mebibytes) {
    memset(mapPrivate(mebibytes * kMiB), 1, mebibytes * kMiB);
}

// Some mebibytes in a handful of mappings, as ordinary programs have them.
void ordinary(size_t number) {
    manyMappings(2 + number % 20);
    for (size_t i = 0; i < 3; i++)
        smallPages(1 + (number + i) % 3);
}

void forks(size_t mebibytes, size_t children) {
    smallPages(mebibytes);
    for (size_t i = 0; i < children; i++) {
        if (fork() == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            for (;;)
                pause();
        }
    }
}

void sharers(size_t mebibytes, size_t children) {
    const int file = memfd_create("bench", 0);
    if (file < 0 || ftruncate(file, static_cast<off_t>(mebibytes * kMiB)) != 0) _exit(1);
    void *all = mmap(nullptr, mebibytes * kMiB, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    if (all == MAP_FAILED) _exit(1);
    memset(all, 1, mebibytes * kMiB);
    for (size_t i = 0; i < children; i++) {
        if (fork() != 0) continue;
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        volatile char sum = 0;
        for (size_t at = 0; at < mebibytes * kMiB; at += kPage)
            sum = static_cast<char>(sum + static_cast<char *>(all)[at]);
        for (;;)
            pause();
    }
    sleep(1); // until the children have touched it
}

struct Kind {
    const char *name;
    void (*work)(size_t first, size_t second);
};
const Kind kKinds[] = {
    {"mappings", [](size_t count, size_t) { manyMappings(count); }},
    {"pages", [](size_t mebibytes, size_t) { smallPages(mebibytes); }},
    {"ordinary", [](size_t number, size_t) { ordinary(number); }},
    {"forks", forks},
    {"sharers", sharers},
};

// Runs in a program of its own, so that only those are a family that are meant to be.
int beMember(char *argv[]) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    for (const Kind &kind : kKinds)
        if (strcmp(argv[0], kind.name) == 0)
            kind.work(strtoul(argv[1], nullptr, 10), strtoul(argv[2], nullptr, 10));
    if (write(1, "", 1) != 1) return 1;
    for (;;)
        pause();
}

struct Members {
    size_t count;
    const char *kind;
    size_t first, second; // of `ordinary` the first is the member's number
};
struct PopulationPlan {
    const char *name;
    std::vector<Members> members;
};
const PopulationPlan kPlans[] = {
    {"large",
     {{300, "mappings", 80, 0}, {1, "mappings", 20000, 0}, {1, "pages", 4096, 0}, {1, "forks", 256, 32}}},
    {"mix",
     {{250, "mappings", 10, 0},
      {10, "mappings", 2000, 0},
      {1, "mappings", 20000, 0},
      {4, "pages", 1024, 0},
      {1, "forks", 256, 32},
      {1, "sharers", 128, 24}}},
    {"ordinary", {{300, "ordinary", 0, 0}}},
    {"families", {{3, "forks", 256, 32}, {30, "forks", 32, 5}}},
};

// Processes that were started, each in its own group so that its children end with it.
class Population {
  public:
    explicit Population(const PopulationPlan &plan) {
        for (const Members &members : plan.members)
            for (size_t i = 0; i < members.count; i++)
                start(members, strcmp(members.kind, "ordinary") == 0 ? i : members.first);
    }
    ~Population() {
        for (const pid_t pid : _pids)
            kill(-pid, SIGKILL);
        for (const pid_t pid : _pids)
            waitpid(pid, nullptr, 0);
    }
    const std::vector<pid_t> &pids() const { return _pids; }

  private:
    void start(const Members &members, size_t first) {
        int ready[2];
        if (pipe2(ready, O_CLOEXEC) != 0) exit(1);
        const pid_t pid = fork();
        if (pid == 0) {
            setpgid(0, 0);
            dup2(ready[1], 1);
            execl("/proc/self/exe", "heft-compare", "--member", members.kind, std::to_string(first).c_str(),
                  std::to_string(members.second).c_str(), nullptr);
            _exit(127);
        }
        close(ready[1]);
        char byte;
        if (read(ready[0], &byte, 1) != 1) exit(1);
        close(ready[0]);
        _pids.push_back(pid);
    }

    std::vector<pid_t> _pids;
};

struct Command {
    std::string name;
    std::string shell;
    bool neverFreedLazily = false; // runs where /proc/vmstat says so
    std::vector<double> seconds = {}, processorSeconds = {}, serialSeconds = {};
    long peakKilobytes = 0;
};

// A copy of /proc/vmstat by which nobody ever freed lazily: its name. It goes with the program.
const std::string &otherVmstat() {
    static const std::string path = [] {
        static std::string made = "/tmp/heft-vmstat-" + std::to_string(getpid());
        const std::string copy = "sed 's/^pglazyfree .*/pglazyfree 0/' /proc/vmstat >" + made;
        if (system(copy.c_str()) != 0) exit(1);
        atexit([] { unlink(made.c_str()); });
        return made;
    }();
    return path;
}

// Puts it in place for this process alone.
void showNothingFreedLazily() {
    if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
        mount(otherVmstat().c_str(), "/proc/vmstat", nullptr, MS_BIND, nullptr) != 0)
        _exit(126);
}

double secondsOf(const timeval &time) {
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}

// What heft-variant says at its end: the processor time of its main thread.
std::optional<double> readSerialSeconds(int file) {
    char text[64] = {};
    if (pread(file, text, sizeof text - 1, 0) <= 0) return std::nullopt;
    return strtod(text, nullptr);
}

void run(Command &command) {
    const int serial = memfd_create("serial", 0);
    if (command.neverFreedLazily) otherVmstat();
    const auto before = std::chrono::steady_clock::now();
    const pid_t pid = fork();
    if (pid == 0) {
        const int null = open("/dev/null", O_WRONLY);
        dup2(null, 1);
        dup2(null, 2);
        dup2(serial, 9);
        if (command.neverFreedLazily) showNothingFreedLazily();
        execl("/bin/sh", "sh", "-c", ("exec " + command.shell).c_str(), nullptr);
        _exit(127);
    }
    int status = 0;
    rusage usage{};
    wait4(pid, &status, 0, &usage);
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - before;
    command.seconds.push_back(took.count());
    command.processorSeconds.push_back(secondsOf(usage.ru_utime) + secondsOf(usage.ru_stime));
    command.peakKilobytes = std::max(command.peakKilobytes, usage.ru_maxrss);
    if (const auto seconds = readSerialSeconds(serial)) command.serialSeconds.push_back(*seconds);
    close(serial);
    if (!WIFEXITED(status) || WEXITSTATUS(status) > 1)
        fprintf(stderr, "%s ended badly\n", command.name.c_str());
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values.empty() ? 0 : values[values.size() / 2];
}

size_t countMappings() {
    std::FILE *lines = popen("cat /proc/[0-9]*/maps 2>/dev/null | wc -l", "r");
    size_t count = 0;
    if (!lines || fscanf(lines, "%zu", &count) != 1) count = 0;
    if (lines) pclose(lines);
    return count;
}

std::vector<Command> commandsFor(const std::string &programs, const std::vector<pid_t> &pids) {
    const std::string heft = programs + "/heft";
    const std::string variant = programs + "/bench/heft-variant ";
    std::string named;
    for (const pid_t pid : pids)
        named += " " + std::to_string(pid);
    std::vector<Command> commands = {
        {"cat smaps", "cat /proc/[0-9]*/smaps"},
        {"cat smaps_rollup", "cat /proc/[0-9]*/smaps_rollup"},
        {"heft -a", heft + " -a"},
        {"heft -a --json", heft + " -a --json /dev/null"},
        {"heft -a, one worker", "taskset -c 0 " + heft + " -a"},
        {"heft -a, from smaps alone", variant + "smaps -a"},
        {"heft -a, from maps and scans", variant + "maps -a"},
        {"heft PID...", heft + named},
        {"Where nobody ever freed lazily:", ""},
        {"heft -a", heft + " -a", true},
        {"heft -a --json", heft + " -a --json /dev/null", true},
        {"heft -a, one worker", "taskset -c 0 " + heft + " -a", true},
        {"heft -a, from maps and scans", variant + "maps -a", true},
    };
    commands.push_back({"Peers:", ""});
    for (const char *peer : {"smem", "smemstat", "ps_mem"})
        if (system((std::string("command -v ") + peer + " >/dev/null 2>&1").c_str()) == 0)
            commands.push_back({peer, peer});
    return commands;
}

void compare(const PopulationPlan &plan, const std::string &programs, int rounds) {
    const Population population(plan);
    std::vector<Command> commands = commandsFor(programs, population.pids());
    const size_t mappings = countMappings();
    // In another order each round: whoever comes behind one that uses a single processor finds the others'
    // caches cold and their clocks slow.
    std::vector<Command *> order;
    for (Command &command : commands)
        if (!command.shell.empty()) order.push_back(&command);
    std::mt19937 random; // always the same
    for (int round = 0; round < rounds; round++) {
        std::shuffle(order.begin(), order.end(), random);
        for (Command *command : order)
            run(*command);
    }

    const Command &reference = commands.front();
    const auto memory =
        static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES)) * static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
    printf("%s: %zu mappings, %d rounds; peak memory of 40 MiB, 250 bytes a mapping and 64 KiB a GiB would "
           "be %zu KiB\n",
           plan.name, mappings, rounds, 40 * 1024 + mappings * 250 / 1024 + (memory >> 24));
    printf("%-30s %10s %12s %10s %12s %10s %9s\n", "", "wall ms", "x cat smaps", "CPU ms", "x cat smaps",
           "peak KiB", "serial");
    for (const Command &command : commands) {
        if (command.seconds.empty()) {
            printf("%s\n", command.name.c_str());
            continue;
        }
        const double wall = median(command.seconds), processor = median(command.processorSeconds);
        printf("%-30s %10.1f %12.2f %10.1f %12.2f %10ld", command.name.c_str(), wall * 1e3,
               wall / median(reference.seconds), processor * 1e3,
               processor / median(reference.processorSeconds), command.peakKilobytes);
        if (!command.serialSeconds.empty())
            printf(" %7.1f %%", median(command.serialSeconds) / processor * 100);
        printf("\n");
    }
    printf("\n");
}

} // namespace

int main(int argc, char *argv[]) {
    if (argc == 5 && strcmp(argv[1], "--member") == 0) return beMember(argv + 2);
    if (argc < 2) {
        fprintf(stderr, "usage: heft-compare DIRECTORY-OF-PROGRAMS [ROUNDS [POPULATION...]]\n");
        return 1;
    }
    const int rounds = argc > 2 ? std::max(1, atoi(argv[2])) : 7;
    for (const PopulationPlan &plan : kPlans) {
        const bool isWanted = argc <= 3 || std::any_of(argv + 3, argv + argc, [&](const char *name) {
                                  return strcmp(name, plan.name) == 0;
                              });
        if (isWanted) compare(plan, argv[1], rounds);
    }
    return 0;
}
