// A writer of the report. The analysis calls every formatter with the same pieces in the same order: per
// shown process printProcessHeader, printProcessTotal (unless it had errors), endProcessHeader,
// printProcessCategories or printSharedCategories per group, printProcessAuxData; then the lists of warnings
// and errors, the summary, the global auxiliary data and end. The region listings, if any, come before the
// first process, what groups hold as a whole after the last one, each for the formatters that offer it.
#pragma once

#include "model/HXAuxData.h"
#include "model/HXMemoryCategory.h"
#include "model/HXMemoryTotal.h"
#include "model/HXProcessGroup.h"
#include "process/HXProcess.h"

#include <cstdint>
#include <string>
#include <vector>

// What is to be said of the whole analysis, not of one process.
struct HXGlobalMessages {
    std::vector<std::string> errors;
    std::vector<std::string> warnings;
};

class HXOutputFormatter {
  public:
    using Processes = std::vector<const HXProcess *>;

    virtual ~HXOutputFormatter() = default;
    virtual void printProcessHeader(const HXProcess &process) = 0;
    virtual void endProcessHeader(const HXProcess &process) = 0;
    // `heft` in bytes.
    virtual void printProcessTotal(uint64_t heft, const HXProcess &process) = 0;
    virtual void printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &total) = 0;
    // `hasProcessView`: the categories show what `process` sees, which is not the same for all of the group.
    // The formatter may keep the categories.
    virtual void printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                                       const HXProcessGroup &group, const HXProcess &process,
                                       bool hasProcessView, const HXMemoryTotal &total) = 0;
    virtual void printProcessAuxData(const HXAuxDictionary *data) = 0;
    virtual void printProcessesWithWarnings(const Processes &withWarnings, const Processes &withErrors,
                                            const HXGlobalMessages &messages) = 0;
    virtual void printSummaryCategories(const HXCategoryMap &categories, const HXMemoryTotal &total,
                                        bool hadErrors) = 0;
    virtual void printGlobalAuxData(const HXAuxDictionary *data) = 0;
    virtual void end() = 0;

    // Optional: the full listing of a process's regions. A formatter that does not offer it is passed over.
    virtual bool printsAtlasLikeOutput() const { return false; }
    virtual void printAtlasLikeOutputForProcess(const HXProcess &, const HXMemoryRegionList &) {}

    // Optional: what each group of several processes holds, every byte once, whatever its members see of it.
    virtual bool printsWholeGroups() const { return false; }
    virtual void printWholeGroup(const HXProcessGroup &, const HXCategoryMap &) {}
};
