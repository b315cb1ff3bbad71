#include "output/HXOutputFormatterJSON.h"

#include "support/HXMadeUpMachine.h"

#include <cerrno>
#include <filesystem>
#include <gtest/gtest.h>

TEST(HXOutputFormatterJSONTest, SaysWhenNothingCanBeWritten) {
    const HXMadeUpMachine platform;
    EXPECT_EQ(HXOutputFormatterJSON::withPath("/no such directory/file"), nullptr);
    EXPECT_EQ(errno, ENOENT);
    if (!std::filesystem::exists("/dev/full")) GTEST_SKIP() << "no /dev/full";
    for (const size_t length : {1, 100000}) { // what is written at the end, and what is written before
        const auto formatter = HXOutputFormatterJSON::withPath("/dev/full");
        ASSERT_TRUE(formatter);
        formatter->printProcessesWithWarnings({}, {}, {std::vector<std::string>(length, "a report"), {}});
        formatter->printSummaryCategories(HXCategoryMap(), {}, false);
        formatter->printGlobalAuxData(nullptr);
        formatter->end();
        EXPECT_EQ(formatter->writeError(), ENOSPC);
    }
}
