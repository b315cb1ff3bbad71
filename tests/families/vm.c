// Two processes in one address space: "vm clone" (and a third one, forked from it) or "vm vfork".
// Says which they are, as family.py does, and ends with its standard input.
#define _GNU_SOURCE
#include <sched.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

enum { kMiB = 1 << 20 };
static char stack[64 * 1024] __attribute__((aligned(16)));

static int untilTheEnd(void *unused) {
    char byte;
    (void)unused;
    while (read(STDIN_FILENO, &byte, 1) > 0) {
    }
    while (wait(NULL) > 0) {
    }
    _exit(0);
}

int main(int argc, char **argv) {
    char *payload = mmap(NULL, 8 * kMiB, PROT_READ | PROT_WRITE | PROT_EXEC, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (argc != 2 || payload == MAP_FAILED) return 1;
    memset(payload, 1, 8 * kMiB);
    if (!strcmp(argv[1], "vfork")) {
        const int parent = getpid();
        if (vfork() != 0) _exit(0); // the child has ended
        dprintf(STDOUT_FILENO, "{\"pids\": {\"parent\": %d, \"child\": %d}, \"known\": {\"anonymous code\": {\"parent child\": %d}}}\n",
                parent, getpid(), 8 * kMiB);
        untilTheEnd(NULL);
    }
    const int twin = clone(untilTheEnd, stack + sizeof stack, CLONE_VM | SIGCHLD, NULL);
    int ready[2];
    if (twin < 0 || pipe(ready)) return 1;
    const int child = fork();
    if (child == 0) {
        memset(payload, 2, kMiB);
        if (write(ready[1], "", 1) != 1) _exit(1);
        untilTheEnd(NULL);
    }
    char byte;
    if (child < 0 || read(ready[0], &byte, 1) != 1) return 1;
    dprintf(STDOUT_FILENO,
            "{\"pids\": {\"parent\": %d, \"twin\": %d, \"child\": %d}, \"known\": {\"anonymous code\": "
            "{\"parent twin\": %d, \"child\": %d, \"parent twin child\": %d}}}\n",
            getpid(), twin, child, kMiB, kMiB, 7 * kMiB);
    untilTheEnd(NULL);
}
