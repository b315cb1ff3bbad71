// Processes that come, go and change in every way there is: chaos COUNT keeps COUNT of them busy until it is
// killed.
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

void rest(unsigned random) {
    const timespec time{0, static_cast<long>(random % 5000) * 1000};
    nanosleep(&time, nullptr);
}

void churnMemory(unsigned random) {
    const size_t size = (1 + random % 256) * 4096;
    void *memory = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) return;
    std::memset(memory, 1, size);
    void *moved = mremap(memory, size, 2 * size, MREMAP_MAYMOVE);
    munmap(moved == MAP_FAILED ? memory : moved, moved == MAP_FAILED ? size : 2 * size);
}

[[noreturn]] void execute(unsigned random) {
    const char *const program = random % 2 ? "/bin/true" : "/bin/sleep";
    execl(program, program, "0.003", nullptr);
    _exit(127);
}

int shareMemory(void *) {
    rest(3000);
    return 0;
}

void *outlive(void *) {
    rest(4000);
    return nullptr;
}

// One child of some kind; whether it is to be waited for.
pid_t start(unsigned random) {
    static thread_local char stack[65536];
    if (random % 8 == 0) return clone(shareMemory, stack + sizeof stack, CLONE_VM | SIGCHLD, nullptr);
    if (random % 8 == 1) {
        const pid_t child = vfork();
        if (child == 0) execute(random >> 3);
        return child;
    }
    const pid_t child = fork();
    if (child != 0) return child;
    switch (random % 8) {
    case 2:
        execute(random >> 3);
    case 3: // its leading thread ends first
        pthread_t thread;
        pthread_create(&thread, nullptr, outlive, nullptr);
        pthread_exit(nullptr);
    case 4:
        ptrace(PTRACE_TRACEME, 0, nullptr, nullptr);
        raise(SIGSTOP);
        break;
    case 5:
        raise(SIGSTOP);
        break;
    case 6:
        churnMemory(random >> 3);
        break;
    default:
        break;
    }
    _exit(0);
}

[[noreturn]] void work(unsigned seed) {
    for (;;) {
        const auto random = static_cast<unsigned>(rand_r(&seed));
        const pid_t child = start(random);
        churnMemory(random);
        rest(random); // a child that has ended is a zombie meanwhile
        if (child <= 0) continue;
        kill(child, SIGCONT);
        if (random % 8 != 0) kill(child, SIGKILL);
        waitpid(child, nullptr, __WALL);
    }
}

} // namespace

int main(int argc, char *argv[]) {
    const int count = argc > 1 ? std::atoi(argv[1]) : 200;
    for (int i = 0; i < count; i++) {
        if (fork() != 0) continue;
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        work(static_cast<unsigned>(i));
    }
    pause();
}
