#include "model/HXAuxData.h"

#include <gtest/gtest.h>

namespace {
HXAuxNode summed(int64_t value) {
    return std::make_shared<HXAuxData>(value, true);
}
HXAuxNode own(int64_t value) {
    return std::make_shared<HXAuxData>(value, false);
}
std::shared_ptr<HXAuxDictionary> tree(const std::vector<std::pair<const char *, HXAuxNode>> &entries) {
    auto dictionary = std::make_shared<HXAuxDictionary>();
    for (const auto &[key, node] : entries)
        dictionary->set(key, node);
    return dictionary;
}
} // namespace

TEST(HXAuxDataTest, MergesKeepWhatAggregates) {
    struct {
        std::shared_ptr<HXAuxDictionary> first, second;
        const char *json; // null: nothing is left
    } cases[] = {
        {tree({{"a", summed(5)}}), tree({{"a", summed(7)}}), R"({"a":12})"},
        {tree({{"a", own(5)}}), tree({{"a", summed(7)}}), nullptr},
        {tree({{"a", summed(5)}}), tree({{"a", own(7)}}), R"({"a":12})"},
        {tree({{"m", tree({{"x", summed(1)}, {"y", own(2)}})}}), nullptr, R"({"m":{"x":1}})"},
        {tree({{"m", tree({{"y", own(2)}})}, {"b", summed(1)}}), nullptr, R"({"b":1})"},
        {tree({}), tree({{"b", summed(3)}, {"c", own(4)}}), R"({"b":3})"},
        {tree({{"m", tree({{"x", summed(1)}})}}), tree({{"m", tree({{"x", summed(-3)}, {"z", summed(4)}})}}),
         R"({"m":{"x":-2,"z":4}})"},
    };
    for (const auto &test : cases) {
        const auto merged = test.first->mergeWithData(test.second.get());
        EXPECT_EQ(merged ? merged->jsonRepresentation() : "none", test.json ? test.json : "none");
    }
}
