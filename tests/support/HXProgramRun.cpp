#include "support/HXProgramRun.h"

#include "support/HXBuilders.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {
// A program in memory, for a user who may not enter the folder that it was built in.
int copyOf(const char *path) {
    const int program = open(path, O_RDONLY | O_CLOEXEC), copy = memfd_create("program", MFD_CLOEXEC);
    while (sendfile(copy, program, nullptr, 1 << 30) > 0)
        continue;
    fchmod(copy, 0755);
    close(program);
    const int result = open(("/proc/self/fd/" + std::to_string(copy)).c_str(), O_RDONLY | O_CLOEXEC);
    close(copy); // what is open for writing is not executed
    return result;
}
} // namespace

HXProgramRun HXRunProgram(const std::vector<std::string> &arguments, uid_t user) {
    HXProgramRun run;
    std::FILE *out = tmpfile();
    std::FILE *err = tmpfile();
    if (!out || !err) return run;
    const pid_t pid = fork();
    if (pid == 0) {
        const int program = user != 0 ? copyOf(arguments[0].c_str()) : -1;
        dup2(open("/dev/null", O_RDONLY), 0);
        dup2(fileno(out), 1);
        dup2(fileno(err), 2);
        if (user != 0 && (setgroups(0, nullptr) != 0 || setgid(user) != 0 || setuid(user) != 0)) _exit(126);
        std::vector<char *> argv;
        for (const std::string &argument : arguments)
            argv.push_back(const_cast<char *>(argument.c_str()));
        argv.push_back(nullptr);
        user != 0 ? fexecve(program, argv.data(), environ) : execv(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    rusage usage{};
    wait4(pid, &status, 0, &usage);
    run.peakKilobytes = usage.ru_maxrss;
    run.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    run.out = contentOf(out);
    run.err = contentOf(err);
    return run;
}

HXProgramRun HXRunHeft(std::vector<std::string> arguments, uid_t user) {
    arguments.insert(arguments.begin(), HEFT_PROGRAM);
    return HXRunProgram(arguments, user);
}
