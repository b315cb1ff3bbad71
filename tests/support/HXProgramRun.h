// Runs a built program as a user would.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

struct HXProgramRun {
    int status = -1; // exit status; 128 + N when signal N ended the program
    std::string out;
    std::string err;
    long peakKilobytes = 0; // most resident memory
};

// Runs `arguments` (the first is the program's path) with empty standard input; as another user where `user`
// is not 0.
HXProgramRun HXRunProgram(const std::vector<std::string> &arguments, uid_t user = 0);
// The same for heft.
HXProgramRun HXRunHeft(std::vector<std::string> arguments, uid_t user = 0);
