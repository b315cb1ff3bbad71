// Made-up regions and processes, and what the program prints.
#pragma once

#include "model/HXMemoryRegion.h"
#include "process/HXProcess.h"

#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <utility>

// The facts of a region, to be named one by one: HXRegionFacts{.object = 7, .size = 4096}.
struct HXRegionFacts {
    uint64_t object = 0;
    uint64_t start = 0x1000;
    uint64_t size = 0;
    uint64_t offset = 0;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint8_t shareMode = SM_SHARED;
    uint32_t tag = 0;
    HXSegment segment = HXSegmentNoImage;
    const char *name = "memory";
    const char *detail = nullptr;
    bool wired = false;
    bool sharedCache = false;
    bool unused = false;
    bool owned = false;
};
inline HXMemoryRegion makeRegion(const HXRegionFacts &facts) {
    HXMemoryRegion region;
    region.setObject_id(facts.object);
    region.setStart(facts.start);
    region.setSize(facts.size);
    region.setOffset(facts.offset);
    region.setDirtySize(facts.dirty);
    region.setSwappedSize(facts.swapped);
    region.setCleanNonSpecSize(facts.clean);
    region.setReclaimableSize(facts.reclaimable);
    region.setShare_mode(facts.shareMode);
    region.setUser_tag(facts.tag);
    region.setSegment(facts.segment);
    region.setName(std::string_view(facts.name));
    if (facts.detail != nullptr) region.setDetailedName(std::string_view(facts.detail));
    region.setWired(facts.wired);
    region.setInSharedCache(facts.sharedCache);
    region.setUnusedSharedCacheRegion(facts.unused);
    region.setOwnedExclusivelyByParentProcess(facts.owned);
    return region;
}

class HXMadeUpProcess : public HXProcess {
  public:
    HXMadeUpProcess(int32_t pid, const std::string &name, const std::vector<HXRegionFacts> &regions = {}) {
        setPid(pid);
        setName(name);
        setDisplayString(name + " [" + std::to_string(pid) + "]");
        setPageSize(16384);
        setIs64bit(true);
        for (const HXRegionFacts &facts : regions)
            _found.push_back(makeRegion(facts));
    }
    void gatherData() override {
        if (whenGathered) whenGathered();
        _memoryRegions = std::move(_found);
        if (whenEnded) whenEnded();
    }
    void addError(const std::string &text) { _errors.push_back(text); }

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
