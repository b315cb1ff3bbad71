#include "support/HXMadeUpMachine.h"

#include "process/HXProcess.h"

#include <regex>
#include <stdexcept>

std::unique_ptr<HXMachine> HXLoadMachine(const std::string &records, std::string *reason) {
    const std::string file = "heft-machine 1\n" + std::regex_replace(records, std::regex("  "), "\t");
    return HXMachine::loadText(file, reason);
}

HXMadeUpParts::HXMadeUpParts(const std::string &text) {
    std::string reason;
    realServices.setWorkerCount(3);
    machine = HXLoadMachine(text, &reason);
    if (!machine) throw std::runtime_error("bad machine file: " + reason);
}

HXMadeUpMachine::HXMadeUpMachine(const std::string &text)
    : HXMadeUpParts(text), HXReplayPlatform(*machine, realServices) {
    setCurrent(this);
    HXProcess::_clearGlobalErrors();
}

HXMadeUpMachine::~HXMadeUpMachine() {
    HXProcess::_clearGlobalErrors();
    setCurrent(nullptr);
}
