#include "support/HXBuilders.h"

#include "support/HXCaseFile.h"
#include "support/HXTemporaryFolder.h"

#include <algorithm>
#include <cstdlib>
#include <gtest/gtest.h>
#include <sstream>
#include <utility>

namespace {
constexpr std::pair<char, uint64_t HXSizes::*> kAmounts[] = {{'d', &HXSizes::dirty},
                                                             {'s', &HXSizes::swapped},
                                                             {'c', &HXSizes::clean},
                                                             {'r', &HXSizes::reclaimable},
                                                             {'w', &HXSizes::wired}};

uint64_t hexadecimal(const std::string &text) {
    return std::strtoull(text.c_str(), nullptr, 16);
}

// Reads an amount into `sizes`, anything else fails the test.
void readAmount(const std::string &word, HXSizes &sizes) {
    for (const auto &[letter, amount] : kAmounts)
        if (word[0] == letter) {
            sizes.*amount = hexadecimal(word.substr(1));
            return;
        }
    ADD_FAILURE() << "not in the notation: " << word;
}

HXRange rangeOf(const std::string &word) {
    return {word.starts_with("nowhere") ? kNoAddress : hexadecimal(word),
            hexadecimal(word.substr(word.find('+') + 1))};
}

// What a word of a region begins with, and what takes its rest.
using Region = HXMemoryRegion;
const std::pair<std::string, void (*)(Region &, const std::string &)> kRegionWords[] = {
    {"#", [](Region &region, const std::string &rest) { region.setObject_id(hexadecimal(rest)); }},
    {"@", [](Region &region, const std::string &rest) { region.setOffset(hexadecimal(rest)); }},
    {"tag=", [](Region &region, const std::string &rest) { region.setUser_tag(hexadecimal(rest)); }},
    {"name=", [](Region &region, const std::string &rest) { region.setName(HXString::intern(rest)); }},
    {"detail=",
     [](Region &region, const std::string &rest) { region.setDetailedName(HXString::intern(rest)); }},
    {"wired", [](Region &region, const std::string &) { region.setWired(true); }},
    {"owned", [](Region &region, const std::string &) { region.setOwnedExclusivelyByParentProcess(true); }},
    {"cache", [](Region &region, const std::string &) { region.setInSharedCache(true); }},
    {"unused", [](Region &region, const std::string &) { region.setUnusedSharedCacheRegion(true); }},
    {"cow", [](Region &region, const std::string &) { region.setShare_mode(SM_COW); }},
    {"private", [](Region &region, const std::string &) { region.setShare_mode(SM_PRIVATE); }},
    {"aliased", [](Region &region, const std::string &) { region.setShare_mode(SM_PRIVATE_ALIASED); }},
    {"large", [](Region &region, const std::string &) { region.setShare_mode(SM_LARGE_PAGE); }},
    {"text", [](Region &region, const std::string &) { region.setSegment(HXSegmentText); }},
    {"data", [](Region &region, const std::string &) { region.setSegment(HXSegmentData); }},
    {"linkedit", [](Region &region, const std::string &) { region.setSegment(HXSegmentLinkedit); }},
};

// Any word of a region but an amount.
bool readFact(const std::string &word, HXMemoryRegion &region) {
    for (const auto &[start, set] : kRegionWords)
        if (word.starts_with(start)) {
            set(region, word.substr(start.size()));
            return true;
        }
    if (word.find('+') == std::string::npos) return false;
    region.setStart(rangeOf(word).location);
    region.setSize(rangeOf(word).length);
    return true;
}
} // namespace

std::string told(const HXSizes &sizes) {
    std::ostringstream text;
    for (const auto &[letter, amount] : kAmounts)
        if (sizes.*amount != 0) text << ' ' << letter << std::hex << sizes.*amount;
    return text.str();
}

std::string told(const HXRangeList &runs) {
    std::ostringstream text;
    const char *separator = "";
    for (const auto &[location, run] : runs.nodes())
        text << std::exchange(separator, ", ") << std::hex << location << '+' << run.length << told(run);
    return text.str();
}

std::vector<HXRangeListNode> runsOf(const std::string &text) {
    std::vector<HXRangeListNode> runs;
    for (const std::string &word : HXWordsOf(text))
        if (word.find('+') != std::string::npos)
            runs.push_back({rangeOf(word), {}});
        else
            readAmount(word, runs.back());
    return runs;
}

HXMemoryRegion makeRegion(const std::string &text) {
    HXMemoryRegion region;
    region.setShare_mode(SM_SHARED);
    region.setSegment(HXSegmentNoImage);
    region.setName(std::string_view("memory"));
    HXSizes sizes;
    const size_t bar = std::min(text.find('|'), text.size());
    for (const std::string &word : HXWordsOf(text.substr(0, bar)))
        if (!readFact(word, region)) readAmount(word, sizes);
    region.setDirtySize(sizes.dirty);
    region.setSwappedSize(sizes.swapped);
    region.setCleanNonSpecSize(sizes.clean);
    region.setReclaimableSize(sizes.reclaimable);
    if (bar < text.size())
        for (const HXRangeListNode &run : runsOf(text.substr(bar + 1)))
            region.addSubrange(run, run, 16384);
    return region;
}

HXPrinted printedBy(const std::function<void()> &work) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    work();
    const std::string err = testing::internal::GetCapturedStderr();
    return {testing::internal::GetCapturedStdout(), err};
}

std::string contentOf(std::FILE *file) {
    std::string content;
    std::rewind(file);
    char part[65536];
    while (const size_t length = std::fread(part, 1, sizeof part, file))
        content.append(part, length);
    std::fclose(file);
    return content;
}

std::string contentOf(const std::string &path) {
    std::FILE *file = std::fopen(path.c_str(), "r");
    return file ? contentOf(file) : "";
}

std::string temporaryPath() {
    static HXTemporaryFolder folder;
    static int count = 0;
    return folder / std::to_string(++count);
}
