#include "support/HXMadeUpMachine.h"

#include "process/HXProcess.h"

#include <stdexcept>

HXMadeUpParts::HXMadeUpParts(const std::string &text) {
    std::string file = "heft-machine 1\n", reason;
    for (size_t i = 0; i < text.size(); i++) {
        const bool isTab = text.compare(i, 2, "  ") == 0;
        file += isTab ? '\t' : text[i];
        i += isTab;
    }
    realServices.setWorkerCount(3);
    machine = HXMachine::loadText(file, &reason);
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
