// A machine as a machine file describes it: data to be looked up, no behaviour.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/capture/HXStringTable.h"

#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

inline constexpr uint32_t kNoString = 0xFFFFFFFF;

// Consecutive pages of one disposition; the first run begins at the region's first page.
struct HXMachinePageRun {
    uint32_t endPage; // counted from the region's first page
    int32_t disposition;
};

// The facts of a region that most regions share with many others; kept once per combination. What regions
// have on their own (HXRegionFields.h) is 0 in `info`.
struct HXMachineRegionTraits {
    vm_region_submap_info_64 info{};
    std::optional<int32_t> purge;
    bool shortRecord = false;
    bool heftOnly = false;

    bool operator<(const HXMachineRegionTraits &other) const;
};

// What few regions have.
struct HXMachineRegionExtra {
    uint32_t sharedNowPrivatePages = 0;
    uint32_t reusablePages = 0;
    bool hasPageRuns = false;
    uint32_t pageRunCount = 0;
    size_t firstPageRun = 0; // in the machine's page runs
    size_t firstShare = 0;   // in the machine's shares
    uint32_t shareCount = 0;
};

struct HXMachineRegion {
    uint64_t address;
    uint64_t size; // bytes
    uint64_t offset;
    uint64_t fullObjectID;
    uint32_t objectID;
    uint32_t traits; // index into the machine's traits
    uint32_t extra;  // index into the machine's extras, 0 for none of them
    uint32_t path;   // string number or kNoString
    uint32_t residentPages;
    uint32_t swappedPages;
    uint32_t dirtiedPages;
    uint32_t dirtiedObjectPages;

    uint64_t end() const { return address + size; }
};
static_assert(sizeof(HXMachineRegion) == 64);

struct HXMachineTop {
    uint64_t address;
    uint64_t size;
    vm_region_basic_info_64 info;

    uint64_t end() const { return address + size; }
};

struct HXMachineSegment {
    uint64_t start;
    uint64_t size;
    uint32_t name;
};

// The segments of an image are those of the process from `firstSegment` up to the next image's first.
struct HXMachineImage {
    uint64_t base;
    uint32_t path;
    uint32_t firstSegment;
};

enum class HXMachineCall : uint8_t { region, regionRecurse, pageRangeQuery };
inline constexpr size_t kMachineCallCount = 3;
enum class HXMachineFate : uint8_t { alive, gone, zombie };

// Calls of one kind fail with `error` from the `from`-th on; an error of 0 is no fault.
struct HXMachineFault {
    kern_return_t error = 0;
    uint32_t from = 0;
    HXMachineFate becomes = HXMachineFate::alive;
};
struct HXMachineFaults {
    HXMachineFault ofCall[kMachineCallCount];
};

struct HXMachineProcess {
    int32_t pid = 0;
    int32_t ppid = 0;
    uint32_t flags = 0;
    uint32_t status = 0;
    uint32_t comm = kNoString;
    uint32_t name = kNoString;
    uint32_t argsPath = kNoString;
    uint32_t argc = 1;
    kern_return_t taskError = 0;
    uint32_t ownedError = 2; // ENOENT
    std::optional<uint32_t> dirtyFlags;
    bool listed = true;
    bool readable = true;
    bool ownedNone = false;
    std::optional<uint64_t> heft; // bytes
    uint64_t heftPeak = 0;
    std::optional<int64_t> pageTable; // bytes
    uint64_t pageTableObject = UINT64_MAX;

    // Both ascending and without overlap. Made with the first region.
    std::unique_ptr<std::deque<HXMachineRegion>> regions;
    std::vector<HXMachineTop> tops;
    std::vector<HXMachineImage> images;
    std::vector<HXMachineSegment> segments;
    std::vector<owned_vmobject> owned;
    std::vector<task_held_object> held;
    std::unique_ptr<HXMachineFaults> faults;
};

struct HXMachineSymbol {
    uint64_t size;
    uint32_t name;
    uint32_t path;
    int32_t line;
};

struct HXMachineHost {
    uint32_t pageSize = 16384;
    uint32_t argMax = 1048576;
    int32_t pid = 1;
    uint32_t euid = 0;
    std::optional<int32_t> selfRegionHeft;
    bool sharedRegion = true;
    bool listPidsError = false;
    std::optional<std::vector<std::string>> ledger;
    kern_return_t memoryInfoError = 0;
};

class HXMachine {
  public:
    // The machine that the file at `path` describes; null with the reason when it cannot be read or breaks
    // the form. `files` is the host that holds the file.
    static std::unique_ptr<HXMachine> load(HXServices &files, const std::string &path, std::string *reason);
    // The machine that the text of a machine file describes.
    static std::unique_ptr<HXMachine> loadText(std::string_view text, std::string *reason);

    // The process of that pid, or null.
    const HXMachineProcess *process(int32_t pid) const;

    const HXMachineRegionTraits &traits(const HXMachineRegion &region) const {
        return regionTraits[region.traits];
    }
    const HXMachineRegionExtra &extra(const HXMachineRegion &region) const {
        return regionExtras[region.extra];
    }
    // All that the leaf query tells of the region, as it is with the heft breakdown.
    vm_region_submap_info_64 info(const HXMachineRegion &region) const;
    // The symbol whose range holds `address`, or null.
    const HXMachineSymbol *symbol(uint64_t address) const;

    HXMachineHost host;
    std::deque<HXMachineProcess> processes; // in the order of their records
    std::vector<HXMachineRegionTraits> regionTraits;
    std::deque<HXMachineRegionExtra> regionExtras; // the first stands for regions without one
    std::deque<HXMachinePageRun> pageRuns;
    std::deque<vm_region_share> shares;
    HXStringTable strings;

    std::vector<mach_zone_name> zoneNames;
    std::vector<mach_zone_info> zones;
    std::vector<mach_memory_info_record> sites;
    std::vector<OSKextInfo> kexts;
    std::map<uint64_t, HXMachineSymbol> symbols; // by address, without overlap
    std::map<uint32_t, std::string> tagNames;

    std::unordered_map<int32_t, uint32_t> processIndices; // by pid
};
