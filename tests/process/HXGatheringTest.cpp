// Gathering of single processes, as cases in a file: after a line "== TITLE" the records of a machine whose
// first process is gathered, after a line "-- MODE" what is found. The modes: charge, as programs run;
// objects, a kernel that does not break down the heft; hidden, a process that gets no report.
//
// A region is told as START+SIZE NAME DETAIL, its sizes (dDIRTY sSWAPPED cCLEAN rRECLAIMABLE, none when 0),
// what it is, #OBJECT and @OFFSET where not 0, and after a bar its page runs, each LOCATION+LENGTH and the
// amounts; all numbers hexadecimal. Then come warnings, errors, auxiliary data and the lines on standard
// error.
#include "process/HXProcessSnapshot.h"
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>
#include <sstream>

namespace {

std::string told(const HXMemoryRegion &region) {
    std::ostringstream line;
    line << std::hex;
    region.start() == kNoAddress ? line << "nowhere" : line << region.start();
    HXSizes sizes = region.sizes();
    sizes.wired = 0; // all of it or none
    line << '+' << region.size() << ' ' << region.fullName() << told(sizes);
    if (region.wired()) line << " wired";
    if (region.ownedExclusivelyByParentProcess()) line << " owned";
    if (region.inSharedCache()) line << (region.unusedSharedCacheRegion() ? " unused" : " cache");
    if (region.object_id() != 0) line << " #" << region.object_id();
    if (region.offset() != 0) line << " @" << region.offset();
    if (region.subrangeList() != nullptr) line << " | " << told(*region.subrangeList());
    return line.str() + "\n";
}

std::string gathered(const std::string &machine, bool hidden) {
    const HXMadeUpMachine current(machine);
    HXProcessSnapshot snapshot;
    std::unique_ptr<HXProcess> process;
    const HXPrinted printed = printedBy([&] {
        process = HXProcess::processWithBsdInfo(snapshot.listAllBsdInfo()->front(), snapshot);
        process->setHiddenFromDisplay(hidden);
        process->gatherData();
    });
    std::string text;
    for (const HXMemoryRegion &region : process->memoryRegions())
        text += told(region);
    for (const std::string &warning : process->warnings())
        text += "warning " + warning + "\n";
    for (const std::string &error : process->errors())
        text += "error " + error + "\n";
    if (const HXAuxTree aux = process->auxData()) {
        text += "aux " + aux->jsonRepresentation() + "\n";
        EXPECT_EQ(aux->mergeWithData(nullptr), nullptr); // no process's figure adds to another's
    }
    for (const std::string &line : HXLinesOf(printed.err))
        text += "prints " + line + "\n";
    return text;
}

} // namespace

TEST(HXGatheringTest, FindsWhatEachCaseExpects) {
    const std::string breakDown = "self_region_heft=1";
    for (const HXCase &each : HXReadCases("gathering.txt"))
        for (const auto &[mode, expected] : each.expected) {
            std::string machine = each.input;
            if (mode == "objects")
                machine.replace(machine.find(breakDown), breakDown.size(), "self_region_heft=0");
            EXPECT_EQ(gathered(machine, mode == "hidden"), expected) << each.title << ", " << mode;
        }
}
