#include "support/HXMadeUpMachine.h"

#include "process/HXProcess.h"

#include <stdexcept>

std::unique_ptr<HXMachine> HXLoadMachine(const std::string &records, std::string *reason) {
    std::string file = "heft-machine 1\n";
    for (size_t i = 0; i < records.size(); i++) {
        const bool isTab = records.compare(i, 2, "  ") == 0;
        file += isTab ? '\t' : records[i];
        i += isTab;
    }
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
