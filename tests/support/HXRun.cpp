#include "support/HXRun.h"

#include "cli/HXHeftMain.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "platform/replay/HXReplayPlatform.h"
#include "process/HXProcess.h"
#include "support/HXBuilders.h"
#include "support/HXCheckReport.h"

#include <gtest/gtest.h>
#include <stdexcept>

namespace {
std::string machineFile(const std::string &text) {
    std::string file = "heft-machine 1\n";
    for (size_t i = 0; i < text.size(); i++)
        if (text.compare(i, 2, "  ") == 0)
            file += '\t', i++;
        else
            file += text[i];
    return file;
}
} // namespace

struct HXMadeUpMachine::Parts {
    HXLinuxPlatform services; // the real machine's files, streams, queues and signals
    std::unique_ptr<const HXMachine> machine;
    std::unique_ptr<HXReplayPlatform> platform;
};

HXMadeUpMachine::HXMadeUpMachine(const std::string &text) : _parts(std::make_unique<Parts>()) {
    _parts->services.setWorkerCount(3);
    std::string reason;
    _parts->machine = HXMachine::loadText(machineFile(text), &reason);
    if (!_parts->machine) throw std::runtime_error("bad machine file: " + reason);
    _parts->platform = std::make_unique<HXReplayPlatform>(*_parts->machine, _parts->services);
    HXPlatform::setCurrent(_parts->platform.get());
    HXProcess::_clearGlobalErrors();
}

HXMadeUpMachine::~HXMadeUpMachine() {
    HXProcess::_clearGlobalErrors();
    HXPlatform::setCurrent(nullptr);
}

HXPlatform &HXMadeUpMachine::platform() {
    return *_parts->platform;
}

HXRun run(const std::string &machine, const std::vector<std::string> &arguments) {
    const HXMadeUpMachine current(machine);
    std::vector<std::string> words{"heft"};
    words.insert(words.end(), arguments.begin(), arguments.end());
    std::vector<char *> argv;
    for (std::string &word : words)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    HXRun result;
    const HXPrinted printed =
        printedBy([&] { result.status = HXHeftMain(static_cast<int>(words.size()), argv.data()); });
    result.out = printed.out;
    result.err = printed.err;
    return result;
}

HXRun report(const std::string &machine, const std::vector<std::string> &arguments) {
    const std::string path = temporaryPath();
    std::vector<std::string> all = arguments;
    all.insert(all.end(), {"-f", "bytes", "--json", path});
    HXRun result = run(machine, all);
    EXPECT_EQ(result.status, 0) << result.err;
    result.json = contentOf(path);
    checkReport(result.out, result.json);
    return result;
}

std::string region(int32_t pid, uint64_t address, uint64_t size, const std::string &facts) {
    return "region  pid=" + std::to_string(pid) + "  address=" + std::to_string(address) +
           "  size=" + std::to_string(size) + "  " + facts + "\n";
}
