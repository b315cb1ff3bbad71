// Made-up regions and processes, and what the program prints.
#pragma once

#include "model/HXMemoryRegion.h"
#include "process/HXProcess.h"

#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <vector>

// ---- The notation of case files: amounts, runs of pages and regions; all numbers are hexadecimal ----

// dDIRTY sSWAPPED cCLEAN rRECLAIMABLE wWIRED with a blank before each, those that are 0 left out.
std::string told(const HXSizes &sizes);
// Each run LOCATION+LENGTH and its amounts; a comma between two.
std::string told(const HXRangeList &runs);
std::vector<HXRangeListNode> runsOf(const std::string &text);

// A region, in any order: START+SIZE ("nowhere" for none), amounts, what it is (see kRegionWords), #OBJECT,
// @OFFSET, tag=TAG, name=NAME, detail=DETAIL, and after a bar its page runs. Shared memory that no image
// covers, unless it says so.
HXMemoryRegion makeRegion(const std::string &text);

class HXMadeUpProcess : public HXProcess {
  public:
    HXMadeUpProcess(int32_t pid, const std::string &name, const std::vector<std::string> &regions = {}) {
        setPid(pid);
        setName(name);
        setDisplayString(name + " [" + std::to_string(pid) + "]");
        setPageSize(16384);
        setIs64bit(true);
        for (const std::string &region : regions)
            _found.push_back(makeRegion(region));
    }
    void gatherData() override {
        if (whenGathered) whenGathered();
        _memoryRegions = std::move(_found);
        if (whenEnded) whenEnded();
    }

    std::function<void()> whenGathered, whenEnded;

  private:
    HXMemoryRegionList _found;
};

// What `work` writes to standard output and standard error, stdio's and the descriptors' own.
struct HXPrinted {
    std::string out;
    std::string err;
};
HXPrinted printedBy(const std::function<void()> &work);

// The whole content of a file, which is closed.
std::string contentOf(std::FILE *file);
// Empty when there is no such file.
std::string contentOf(const std::string &path);
// A path for a file of the running test, different for every call; removed at the end of the program.
std::string temporaryPath();
