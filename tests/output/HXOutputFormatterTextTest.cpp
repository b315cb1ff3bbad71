#include "output/HXOutputFormatterText.h"

#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"
#include "support/HXRun.h"

#include <gtest/gtest.h>

TEST(HXOutputFormatterTextTest, WritesSizesInTheChosenFormat) {
    const HXMadeUpMachine platform;
    const std::string rows = HXReadCases("text-report.txt")[0].input;
    const auto answer = [](const std::string &size) {
        std::string texts;
        for (const int32_t format : {HXFormatBytes, HXFormatFormatted, HXFormatPages}) {
            HXOutputFormatterText formatter(format, 0, "Dirty");
            (void)printedBy([&] { formatter.printProcessHeader(HXMadeUpProcess(1, "p")); });
            texts += (texts.empty() ? "" : ", ") + formatter.formattedStringForSize(std::stoull(size));
        }
        return texts;
    };
    EXPECT_EQ(HXAnswered(rows, answer), rows);
}

TEST(HXOutputFormatterTextTest, SortsRowsByEveryColumn) {
    const HXCase sorting = HXReadCases("text-report.txt")[1];
    for (const auto &[column, expected] : sorting.expected) {
        std::string order;
        for (const std::string &line : HXLinesOf(run(sorting.input, {"5", "--sort", column}).out))
            if (line.size() > 5 && line.rfind("    ") == line.size() - 5) order += line.back();
        EXPECT_EQ(order + "\n", expected) << column;
    }
}

// Twenty processes are named, twenty-one are only counted.
TEST(HXOutputFormatterTextTest, NamesTheMembersOfSmallGroups) {
    for (const int count : {3, 20, 21}) {
        std::string machine, names;
        for (int pid = 1; pid <= count; pid++) {
            machine += "process  pid=" + std::to_string(pid + 10) + "  name=p\n" +
                       region(pid + 10, 0x4000, 0x4000, "object_id=7  share_mode=4  resident=1  dirtied=1");
            if (pid > 1) names += (pid > 2 ? ", p [" : " p [") + std::to_string(pid + 10) + "]";
        }
        const HXRun result = report(machine, {"-a"});
        const std::string line = count <= 20 ? "Shared with" + names + ":\n" : "Shared with 21 processes:\n";
        EXPECT_NE(result.out.find("\n" + line), std::string::npos) << count << result.out;
        EXPECT_NE(result.out.find("Summary Heft: 16384 B\n"), std::string::npos);
    }
}
