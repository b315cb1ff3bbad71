#include "platform/linux/sharing/HXPageKeys.h"

#include <gtest/gtest.h>

namespace {

using Keys = std::vector<HXPageKey>;

// What a word of bits takes together, what it splits, and what is no key at all.
TEST(HXSeenKeys, TellWhatIsMetAgain) {
    HXSeenKeys seen;
    HXSeenKeys::Cursor cursor(seen);
    const auto metAgain = [&](const Keys &keys) {
        Keys again;
        cursor.add(keys, &again);
        return again;
    };
    const HXPageKey slot = kSwappedKey | 5;
    EXPECT_EQ(metAgain({0, 1, 63, 64, 0, 0, 65, slot}), Keys());
    EXPECT_EQ(metAgain({0, 2, 64, 63, 66, slot, 0}), (Keys{64, 63, slot}));
    EXPECT_EQ(metAgain({100, 101, 100, 99, 99}), (Keys{100, 99})) << "twice in one word";
    EXPECT_EQ(metAgain({5, uint64_t{1} << 40, 5}), (Keys{5})) << "chunks far apart";
    EXPECT_TRUE(cursor.add(66));
    EXPECT_FALSE(cursor.add(67));
    EXPECT_FALSE(cursor.contains(0));

    HXSeenKeys::Cursor other(seen); // another thread's
    EXPECT_TRUE(other.contains(101));
    EXPECT_FALSE(other.contains(102));
}

} // namespace
