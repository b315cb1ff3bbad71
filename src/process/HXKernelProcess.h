// The record of the kernel itself: its wired memory by zone and allocation site instead of an address space.
#pragma once

#include "process/HXProcess.h"

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

class HXKernelProcess : public HXProcess {
  public:
    // Information on the loaded kernel extensions, by load tag.
    using KextTags = std::unordered_map<uint64_t, OSKextInfo>;

    bool initWithBsdInfo(const proc_bsdinfo &info) override;

    // Asks the kernel for its memory and makes a region of each zone and site. When the kernel refuses, that
    // becomes an error and there are no regions.
    void gatherData() override;

    // A container "Maps" with the kernel's counters in bytes, none of them aggregating.
    HXAuxTree auxData() const override;

    // Appends a region for each site; counters go to the auxiliary data instead.
    void _addWiredData(const mach_memory_info_record *records, uint32_t count,
                       const mach_zone_name *zoneNames, uint32_t zoneCount, HXMemoryRegionList &regions);

    // Of several extensions with one load tag the last counts.
    static KextTags _kextTagsWithKextInfo(const std::vector<OSKextInfo> &kextInfo);
    // The extensions loaded now.
    static KextTags kextTags();
    // A symbolicator for the running kernel, to be given back with `RVRelease`; null when there is none.
    static RVSymbolicator *_createSymbolicator();
    // What a site or counter is called. `symbolicator` and `zoneNames` may be null; with zone names, a site
    // within a zone carries that zone's name too.
    static std::string _nameForWiredInfo(const mach_memory_info_record &info, const KextTags &kexts,
                                         RVSymbolicator *symbolicator, const mach_zone_name *zoneNames,
                                         uint32_t zoneCount);
    // Sets the name and, for a kernel function whose source is known, its position as detail.
    static void _setNameForRegion(HXMemoryRegion &region, const mach_memory_info_record &info,
                                  const KextTags &kexts, RVSymbolicator *symbolicator,
                                  const mach_zone_name *zoneNames, uint32_t zoneCount);

  protected:
    bool _populateTask() override { return true; }
    bool _isAlive() const override { return true; }

  private:
    void release(const void *array, uint64_t bytes) const;

    std::shared_ptr<HXAuxDictionary> _auxData = std::make_shared<HXAuxDictionary>();
};
