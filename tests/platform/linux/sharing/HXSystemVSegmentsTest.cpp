#include "platform/linux/sharing/HXSystemVSegments.h"

#include <gtest/gtest.h>

#include <sstream>

TEST(HXSystemVSegments, AreToldByTheirTitles) {
    std::ostringstream told;
    const std::string text = "       key      shmid perms size cpid lpid nattch uid gid cuid cgid rss swap\n"
                             "1357 2 1600 18446744073709551615 77 78 0 1 1 1000 1 8192 4096\n"
                             "-9 32768 600 1 0 78 3 1 1 0 1 0 18446744073709551615\n"
                             "1 3 600 1 77 78 0 1 1 1000 1 8192\n" // cut
                             "1 4 600 1 77 78 -1 1 1 1000 1 1 1\n";
    for (const std::string &whole :
         {text, text.substr(0, text.find('\n')), std::string(), std::string("\n1")})
        for (const HXSystemVSegment &segment : HXParseSystemVSegments(whole))
            told << segment.identifier << " by " << segment.creatorPid << "," << segment.creatorUser << " x"
                 << segment.attachedCount << ": " << segment.residentSize << "+" << segment.swappedSize
                 << "\n";
    EXPECT_EQ(told.str(), "2 by 77,1000 x0: 8192+4096\n32768 by 0,0 x3: 0+18446744073709551615\n");
}
