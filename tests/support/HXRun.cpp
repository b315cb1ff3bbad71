#include "support/HXRun.h"

#include "cli/HXHeftMain.h"
#include "support/HXBuilders.h"
#include "support/HXCheckReport.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>

HXRun run(const std::string &machine, const std::vector<std::string> &arguments) {
    const HXMadeUpMachine current(machine);
    std::vector<std::string> words{"heft"};
    words.insert(words.end(), arguments.begin(), arguments.end());
    std::vector<char *> argv;
    for (std::string &word : words)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    int status = -1;
    const HXPrinted printed =
        printedBy([&] { status = HXHeftMain(static_cast<int>(words.size()), argv.data()); });
    return {status, printed.out, printed.err, {}};
}

HXRun report(const std::string &machine, const std::vector<std::string> &arguments) {
    const std::string path = temporaryPath();
    std::vector<std::string> all = arguments;
    all.insert(all.end(), {"-w", "-f", "bytes", "--json", path});
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
