#include "model/HXHeftSwitches.h"
#include "model/HXMemoryCategory.h"
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>

namespace {
std::string told(const HXMemoryTotal &total) {
    return told(static_cast<const HXSizes &>(total)) + " x" + std::to_string(total.regionCount);
}

// Adds a region or sets the owner, as a line of the table says.
void readLine(const std::string &line, HXMemoryRegionList &regions, HXMemoryObject &object) {
    const size_t blank = line.find(' ');
    if (line.starts_with("owner")) {
        object.setOwnerPid(std::stoi(line.substr(blank)));
        return;
    }
    HXMemoryRegion &region = regions.emplace_back(makeRegion(line.substr(blank)));
    if (const int pid = std::stoi(line); pid == 0)
        object.addRegion(region, 16384);
    else
        object.addRegion(region, HXMadeUpProcess(pid, "p"));
}

std::string finished(const std::string &lines) {
    HXMemoryRegionList regions;
    HXMemoryObject object;
    for (const std::string &line : HXLinesOf(lines))
        readLine(line, regions, object);
    object.finalize();
    EXPECT_EQ(object.wholeView(), (HXMemoryTotal{object.sizes(), object.wholeView().regionCount}));
    std::string text = "all" + told(object.wholeView()) + "\n";
    for (const int32_t pid : {10, 20, 30}) {
        const HXMemoryObjectView view = object.viewForProcess(HXMadeUpProcess(pid, "p"));
        if (!view.isWhole) text += std::to_string(pid) + told(view) + "\n";
        EXPECT_TRUE(!view.isWhole || view == object.wholeView());
    }
    const std::string name = object._canonicalRegion()->fullName();
    std::string names;
    for (const HXMemoryRegion &region : regions) {
        names += (names.empty() ? ": " : ", ") + region.name().str();
        EXPECT_EQ(region.subrangeList(), nullptr);
    }
    return name == "memory" ? text : text + "called " + name + names + "\n";
}
} // namespace

TEST(HXMemoryObjectTest, IsWhatItsTableSays) {
    const HXMadeUpMachine platform;
    for (const HXCase &each : HXReadCases("objects.txt"))
        for (const auto &[mode, expected] : each.expected) {
            HXHeftSwitches::setBreakDownPhysHeft(mode == "charge");
            EXPECT_EQ(finished(each.input), expected) << each.title << ", " << mode;
        }
}

TEST(HXMemoryObjectTest, CategoriesAddUpObjectsOfOneName) {
    const HXMadeUpMachine platform;
    // The last has the same text in other parts.
    const std::vector<std::string> contents[] = {
        {"0+10000 #1 d4000 name=a detail=/x", "0+4000 #1 @20000 wired"},
        {"0+10000 #2 s5 name=a detail=/y"},
        {"0+4000 #3 c6 \"name=a /x\""}};
    HXCategoryMap summary(true), detailed(false);
    for (const auto &content : contents) {
        HXMemoryRegionList regions;
        HXMemoryObject object;
        for (const std::string &text : content)
            object.addRegion(regions.emplace_back(makeRegion(text)), 16384);
        object.finalize();
        for (HXCategoryMap *map : {&summary, &detailed})
            map->categoryForObject(object).addMemoryObject(object.wholeView());
    }
    const auto totalsOf = [](const HXCategoryMap &map) {
        std::string totals;
        for (const HXMemoryCategory &category : map.categories())
            totals += category.fullName() + ":" + told(category.total()) + "\n";
        return totals;
    };
    EXPECT_EQ(totalsOf(summary), "a: d4000 s5 w4000 x3\na /x: c6 x1\n");
    EXPECT_EQ(totalsOf(detailed), "a /x: d4000 c6 w4000 x3\na /y: s5 x1\n");
}
