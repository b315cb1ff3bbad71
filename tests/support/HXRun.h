// Whole runs of the program over made-up machines.
#pragma once

#include <memory>
#include <string>
#include <vector>

class HXPlatform;

// A machine that is the current platform while it lives. `text` is a machine file without its first line, in
// which two blanks stand for the TAB before a field.
class HXMadeUpMachine {
  public:
    explicit HXMadeUpMachine(const std::string &text);
    ~HXMadeUpMachine();
    HXMadeUpMachine(const HXMadeUpMachine &) = delete;
    HXMadeUpMachine &operator=(const HXMadeUpMachine &) = delete;
    HXPlatform &platform();

  private:
    struct Parts;
    std::unique_ptr<Parts> _parts;
};

struct HXRun {
    int status = -1;
    std::string out;
    std::string err;
    std::string json; // the document, where one was asked for with report()
};

// One run of the driver over a machine, with the arguments after the program's name.
HXRun run(const std::string &machine, const std::vector<std::string> &arguments);

// The same in bytes format and with a JSON document beside the text; fails the test unless the run exits 0
// and checkReport() holds for both.
HXRun report(const std::string &machine, const std::vector<std::string> &arguments);

// A region record: `facts` as in a machine file.
std::string region(int32_t pid, uint64_t address, uint64_t size, const std::string &facts);
