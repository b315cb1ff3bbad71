// What breaks the form of captures, and how files are read.
#include "platform/capture/GXProcessObjectGraph.h"
#include "platform/capture/HXMachine.h"
#include "platform/capture/HXMemgraphFormat.h"
#include "platform/linux/HXLinuxServices.h"
#include "support/HXBuilders.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>

namespace {

// The cases of tests/cases/captures/forms; a file whose first line names a memory graph is loaded as one.
TEST(HXCaptureForms, NameTheLineThatBreaksThem) {
    std::ifstream cases(TEST_CASES "/captures/forms");
    std::string line, expected, file;
    int count = -1; // the comment on top is no case
    const auto check = [&] {
        std::string reason;
        HXNamedTags tags;
        const bool isGraph = file.starts_with(HXMemgraphFormat::format.header);
        const bool loaded = isGraph
                                ? GXProcessObjectGraph::directedGraphWithData(file, tags, &reason) != nullptr
                                : HXMachine::loadText(file, &reason) != nullptr;
        EXPECT_EQ(loaded, reason.empty());
        EXPECT_EQ(expected.empty() ? reason : reason.substr(0, expected.size()), expected) << file << reason;
        count++;
    };
    for (expected = "not a machine file"; std::getline(cases, line);) {
        if (line.starts_with("=>")) {
            check();
            expected = line.substr(std::min<size_t>(line.size(), 3));
            file.clear();
        } else {
            file += line + "\n";
        }
    }
    check();
    EXPECT_GT(count, 50);
    std::string reason;
    for (const size_t length : {size_t{1} << 20, (size_t{1} << 20) + 1}) {
        const std::string longest = "\nzone\tname=" + std::string(length - 10, 'x'); // without a last newline
        EXPECT_EQ(HXMachine::loadText("heft-machine 1" + longest, &reason) != nullptr, length == 1 << 20);
    }
    EXPECT_EQ(reason, "line 2: the record is longer than 1 MiB");
}

// Records lie anywhere across the pieces in which a file is read.
TEST(HXMachineReader, ReadsFilesInPiecesAsItReadsText) {
    HXLinuxServices services;
    std::string reason;
    const auto load = [&](const std::string &text) {
        const std::string path = temporaryPath();
        std::ofstream(path) << text;
        return HXMachine::load(services, path, &reason);
    };
    const auto pathOf = [](uint64_t i) { return "/" + std::string(i % 89, 'p') + std::to_string(i % 10); };
    constexpr uint64_t regions = 5000;
    std::string text = "heft-machine 1\nprocess\tpid=7\n";
    for (uint64_t i = 1; i <= regions; i++) {
        text += "#" + std::string(i % 1000 == 0 ? i * 100 : i % 97, 'c') +
                "\nregion\tpid=7\taddress=" + std::to_string(i << 14) + "\tsize=16384\tpath=" + pathOf(i) +
                "\n";
    }
    const auto machine = load(text);
    ASSERT_TRUE(machine) << reason;
    const auto &read = *machine->process(7)->regions;
    ASSERT_EQ(read.size(), regions);
    for (uint64_t i = 1; i <= regions; i++) {
        EXPECT_EQ(read[i - 1].address, i << 14);
        EXPECT_EQ(machine->strings.text(read[i - 1].path), pathOf(i));
    }
    const std::string large(40 << 20, 'x');
    const std::pair<std::string, std::string> broken[] = {
        {text + "x\n", "line 10003: unknown record \"x\""},
        {text + std::string(60, 'x') + "\n", "line 10003: unknown record \"" + std::string(60, 'x') + "\""},
        {text + std::string(61, 'x') + "\n", "line 10003: unknown record \"" + std::string(60, 'x') + "…\""},
        {text + "zone\tname=" + large, "line 10003: the record is longer than 1 MiB"},
        {text + "#" + large + "\nx", "line 10004: unknown record \"x\""},
        {large, "not a machine file"},
    };
    for (const auto &[content, expected] : broken) {
        EXPECT_FALSE(load(content));
        EXPECT_EQ(reason, expected);
    }
    EXPECT_FALSE(HXMachine::load(services, "/nonexistent/machine", &reason));
    EXPECT_EQ(reason, "No such file or directory");
}

} // namespace
