// Whole runs of the program over made-up machines.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct HXRun {
    int status = -1;
    std::string out;
    std::string err;
    std::string json; // the document, where one was asked for with report()
};

// One run of the driver over a machine, with the arguments after the program's name.
HXRun run(const std::string &machine, const std::vector<std::string> &arguments);

// The same, wide, in bytes and with a JSON document beside the text; fails the test unless the run exits 0
// and checkReport() holds for both.
HXRun report(const std::string &machine, const std::vector<std::string> &arguments);

// A region record: `facts` as in a machine file.
std::string region(int32_t pid, uint64_t address, uint64_t size, const std::string &facts);
