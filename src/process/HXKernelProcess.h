// The record of the kernel itself: its wired memory by zone and allocation site instead of an address space.
#pragma once

#include "platform/HXHostGuards.h"
#include "process/HXProcess.h"

#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

class HXKernelProcess : public HXProcess {
  public:
    // Information on the loaded kernel extensions, by load tag.
    using KextTags = std::unordered_map<uint64_t, OSKextInfo>;

    // Names of the kernel's zones, by zone.
    using ZoneNames = std::span<const mach_zone_name>;
    // What the names of sites are made of.
    struct SiteNames {
        KextTags kexts;
        HXSymbolicatorGuard symbolicator; // may be null
        ZoneNames zones;
    };

    bool initWithBsdInfo(const proc_bsdinfo &info, HXProcessSnapshot *snapshot) override;

    // Asks the kernel for its memory and makes a region of each zone and site. When the kernel refuses, that
    // becomes an error and there are no regions.
    void gatherData() override;

    // A container "Maps" with the kernel's counters in bytes, none of them aggregating.
    HXAuxTree auxData() const override;

    // Appends a region for each zone.
    void _addZones(std::span<const mach_zone_info> zones, ZoneNames names);
    // Appends a region for each site; counters go to the auxiliary data instead.
    void _addWiredData(std::span<const mach_memory_info_record> records, ZoneNames zoneNames);

    // Of several extensions with one load tag the last counts.
    static KextTags _kextTagsWithKextInfo(const std::vector<OSKextInfo> &kextInfo);
    // The extensions loaded now.
    static KextTags kextTags();
    // A symbolicator for the running kernel; null when there is none.
    static HXSymbolicatorGuard _createSymbolicator();
    // What a site or counter is called. A site within a zone carries that zone's name too.
    static std::string _nameForWiredInfo(const mach_memory_info_record &info, const SiteNames &names);
    // Sets the name and, for a kernel function whose source is known, its position as detail.
    static void _setNameForRegion(HXMemoryRegion &region, const mach_memory_info_record &info,
                                  const SiteNames &names);

  protected:
    bool _populateTask(HXProcessSnapshot *) override { return true; }
    bool _isAlive() const override { return true; }

  private:
    std::shared_ptr<HXAuxDictionary> _auxData = std::make_shared<HXAuxDictionary>();
};
