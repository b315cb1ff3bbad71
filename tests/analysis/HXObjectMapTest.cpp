#include "analysis/HXObjectMap.h"

#include "model/HXMemoryObject.h"

#include <deque>
#include <gtest/gtest.h>
#include <unordered_map>

// Whether it grew by itself or had room, and whatever keys have in common.
TEST(HXObjectMapTest, FindsWhatWasPutIn) {
    for (const size_t room : {0, 3, 20000}) {
        HXObjectMap map;
        map.reserve(room);
        std::deque<HXMemoryObject> objects;
        std::unordered_map<uint64_t, HXMemoryObject *> expected;
        for (const uint64_t step :
             {uint64_t{1}, uint64_t{2} << 36, UINT64_MAX - 4095, uint64_t{0x9E3779B97F4A7C15}})
            for (uint64_t i = 1; i <= 3000; i++) {
                const uint64_t key = i * step;
                if (key == 0) continue;
                map.announce(key);
                HXMemoryObject *&object = map[key];
                ASSERT_EQ(object, expected[key]) << room << ": " << key;
                if (!object) expected[key] = object = &objects.emplace_back();
            }
        for (const auto &[key, object] : expected)
            ASSERT_EQ(map[key], object) << room << ": " << key;
    }
}
