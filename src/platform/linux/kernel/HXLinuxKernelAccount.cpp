#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include "platform/HXSafeText.h"

#include <algorithm>
#include <cstring>
#include <string>
#include <unordered_map>

namespace {

// Kernel tags and counters, by the numbers of the host's published tables.
constexpr uint64_t kTagStack = 8, kTagCpu = 9, kTagPmap = 10, kTagPageTables = 11, kTagCompressor = 14,
                   kTagLockedUserMemory = 24;
constexpr uint64_t kCounterManaged = 0, kCounterReserved = 1, kCounterWired = 2, kCounterStolen = 4,
                   kCounterMapKernel = 6, kCounterMapZone = 7, kCounterMapKalloc = 8;

uint64_t hashOf(std::string_view text, uint64_t hash = 0xCBF29CE484222325) {
    for (const char c : text) // FNV-1a
        hash = (hash ^ static_cast<uint8_t>(c)) * 0x100000001B3;
    return hash;
}

uint64_t difference(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
}

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

bool endsWith(std::string_view text, std::string_view suffix) {
    return text.size() >= suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

// Stores safe text, cut to the field's width; the field ends in a zero only when there is room.
template <size_t Width>
void storeName(char (&field)[Width], std::string_view name) {
    const std::string safe = HXSafeName(name);
    const std::string_view cut = HXCutText(safe, Width);
    std::memcpy(field, cut.data(), cut.size());
}

// A function's name without what the compiler appends to the copies that it makes (".isra.0", ".part.0").
std::string_view plainFunction(std::string_view function) {
    return function.substr(0, function.find('.'));
}

template <size_t Count>
bool isOneOf(std::string_view name, const std::string_view (&names)[Count]) {
    return std::find(std::begin(names), std::end(names), name) != std::end(names);
}

// Who asks vmalloc for the stacks of tasks: the allocator itself, or the functions that the compiler inlined
// it into and their callers (kernel/fork.c, from 4.9 on).
constexpr std::string_view kStackAllocators[] = {
    "alloc_thread_stack_node",
    "dup_task_struct",
    "copy_process",
    "_do_fork",
    "do_fork",
    "kernel_clone",
    "fork_idle",
    "kernel_thread",
    "create_io_thread",
    "vhost_task_create",
    "user_mode_thread",
};

// Who asks it for the code and data of modules (kernel/module, mm/execmem.c, arch/*/kernel/module.c).
constexpr std::string_view kModuleAllocators[] = {
    "load_module",         "layout_and_allocate", "move_module",      "module_alloc",
    "module_memory_alloc", "execmem_vmap",        "execmem_vmalloc",  "execmem_alloc",
    "execmem_cache_add",   "execmem_cache_alloc", "execmem_alloc_rw",
};

// Caches that the kernel makes with SLAB_RECLAIM_ACCOUNT, for machines whose sysfs does not say so; beside
// these, all whose names end as below.
constexpr std::string_view kReclaimableCaches[] = {
    "dentry",
    "radix_tree_node",
    "buffer_head",
    "extent_status",
    "ext4_extent_status",
    "ext4_allocation_context",
    "ext4_prealloc_space",
    "ext4_free_data",
    "ext4_io_end",
    "jbd2_journal_head",
    "jbd2_revoke_record_s",
    "jbd2_revoke_table_s",
    "jbd2_transaction_s",
    "jbd2_journal_handle",
    "mb_cache_entry",
    "mbcache",
    "dquot",
    "xfs_inode",
    "xfs_ili",
    "xfs_buf",
    "btrfs_inode",
    "btrfs_extent_map",
    "btrfs_extent_buffer",
    "ovl_inode",
    "fuse_inode",
    "erofs_inode",
    "dax_cache",
    "pending_reservation",
    "fscrypt_inode_info",
    "fscrypt_info",
};
// Inode caches that are nevertheless not reclaimable: their memory lives as long as the files.
constexpr std::string_view kPinnedInodeCaches[] = {
    "shmem_inode_cache",
    "mqueue_inode_cache",
    "hugetlbfs_inode_cache",
    "lsm_inode_cache",
};

bool isReclaimableByName(std::string_view name) {
    if (startsWith(name, "kmalloc-rcl-") || isOneOf(name, kReclaimableCaches)) return true;
    return endsWith(name, "inode_cache") && !isOneOf(name, kPinnedInodeCaches);
}

bool isKmallocCache(std::string_view name) {
    return startsWith(name, "kmalloc-") || startsWith(name, "dma-kmalloc-") || startsWith(name, "size-");
}

// ---- Zones

class ZoneBuilder {
  public:
    explicit ZoneBuilder(const HXLinuxKernelReadings &readings) : _readings(readings) {}

    void build(HXLinuxKernelAccount *account);
    // Bytes of the general-purpose caches.
    uint64_t kmallocSize() const { return _kmallocSize; }

  private:
    struct Zone {
        std::string_view name;
        uint64_t size = 0;
        uint64_t activeObjects = 0;
        uint64_t objectSize = 0;
        bool reclaimable = false;
        // Bytes that go with the other kind; only where the kind was guessed by name.
        uint64_t otherSize = 0;
    };

    void addCaches();
    void correctGuesses();
    static void shift(std::vector<Zone> &zones, bool reclaimable, uint64_t kindSize, uint64_t excessSize);
    void addRemainder(std::string_view name, uint64_t size, bool reclaimable);
    uint64_t sizeOfKind(bool reclaimable) const;
    static mach_zone_info infoOf(const Zone &zone);

    const HXLinuxKernelReadings &_readings;
    std::vector<Zone> _zones;
    bool _kindsGuessed = true;
    uint64_t _kmallocSize = 0;
};

void ZoneBuilder::addCaches() {
    for (const HXSlabCache &cache : *_readings.caches) {
        const uint64_t size = cache.slabs * cache.pagesPerSlab * _readings.pageSize;
        if (size == 0) continue; // it holds no memory now
        _zones.push_back({cache.name, size, cache.activeObjects, cache.objectSize,
                          cache.reclaimable.value_or(isReclaimableByName(cache.name)), 0});
        _kindsGuessed &= !cache.reclaimable.has_value();
        if (isKmallocCache(cache.name)) _kmallocSize += size;
    }
}

uint64_t ZoneBuilder::sizeOfKind(bool reclaimable) const {
    uint64_t size = 0;
    for (const Zone &zone : _zones)
        size += zone.reclaimable == reclaimable ? zone.size - zone.otherSize : zone.otherSize;
    return size;
}

// Takes `excessSize` of the `kindSize` bytes that the zones of one kind hold to be of the other, in
// proportion.
void ZoneBuilder::shift(std::vector<Zone> &zones, bool reclaimable, uint64_t kindSize, uint64_t excessSize) {
    const double share = static_cast<double>(excessSize) / static_cast<double>(kindSize);
    for (Zone &zone : zones)
        if (zone.reclaimable == reclaimable)
            zone.otherSize =
                std::min(zone.size, static_cast<uint64_t>(static_cast<double>(zone.size) * share));
}

// Where no kind is known, names may mislead; the kernel's two sums then say how much of the zones is what.
void ZoneBuilder::correctGuesses() {
    const uint64_t reclaimableSize = sizeOfKind(true);
    const uint64_t unreclaimableSize = sizeOfKind(false);
    const HXKernelMeminfo &meminfo = _readings.meminfo;
    if (reclaimableSize > meminfo.slabReclaimableSize)
        shift(_zones, true, reclaimableSize, reclaimableSize - meminfo.slabReclaimableSize);
    else if (unreclaimableSize > meminfo.slabUnreclaimableSize)
        shift(_zones, false, unreclaimableSize, unreclaimableSize - meminfo.slabUnreclaimableSize);
}

void ZoneBuilder::addRemainder(std::string_view name, uint64_t size, bool reclaimable) {
    if (size > 0) _zones.push_back({name, size, 1, size, reclaimable, 0});
}

mach_zone_info ZoneBuilder::infoOf(const Zone &zone) {
    mach_zone_info info{};
    info.mzi_cur_size = info.mzi_max_size = info.mzi_alloc_size = zone.size;
    info.mzi_elem_size = zone.objectSize;
    info.mzi_collectable = zone.reclaimable || zone.otherSize > 0;
    if (!info.mzi_collectable) info.mzi_count = zone.activeObjects;
    if (zone.otherSize == 0) return info;
    // A mixed zone: what can't be taken back is given as elements of one byte.
    info.mzi_elem_size = 1;
    info.mzi_count = zone.reclaimable ? zone.otherSize : zone.size - zone.otherSize;
    return info;
}

void ZoneBuilder::build(HXLinuxKernelAccount *account) {
    const HXKernelMeminfo &meminfo = _readings.meminfo;
    if (_readings.caches) {
        addCaches();
        if (_kindsGuessed) correctGuesses();
        const uint64_t largeSize = difference(meminfo.slabUnreclaimableSize, sizeOfKind(false));
        _kmallocSize += largeSize;
        addRemainder("kmalloc-large", largeSize, false);
    } else {
        addRemainder("slab", meminfo.slabUnreclaimableSize, false);
        addRemainder("reclaimable slab", meminfo.slabReclaimableSize, true);
    }
    for (const Zone &zone : _zones) {
        mach_zone_name name{};
        storeName(name.mzn_name, zone.name);
        account->zoneNames.push_back(name);
        account->zones.push_back(infoOf(zone));
    }
}

// ---- Sites

class SiteBuilder {
  public:
    SiteBuilder(const HXLinuxKernelReadings &readings, HXLinuxKernelAccount *account)
        : _readings(readings), _records(account->records) {}

    void build(uint64_t kmallocSize);

  private:
    struct Site {
        uint64_t address = 0; // 0: named by its function
        std::string_view function, module;
        uint64_t size = 0;
    };

    void sortAreas();
    void addToSite(const HXVmallocArea &area);
    void addStacks();
    void addModules();
    void addCounters(uint64_t kmallocSize);

    void addRecord(uint64_t flags, uint64_t site, uint64_t size);
    void addNamed(std::string_view name, uint64_t size);
    void addFunction(const Site &site);
    void addCounter(uint64_t counter, uint64_t size);

    uint64_t compressedSize() const { return _readings.meminfo.zswapSize + _readings.zramSize; }

    const HXLinuxKernelReadings &_readings;
    std::vector<mach_memory_info_record> &_records;
    std::vector<Site> _sites; // in order of appearance
    std::unordered_map<uint64_t, size_t> _siteIndices;
    uint64_t _areasSize = 0, _stackAreasSize = 0, _moduleAreasSize = 0, _moduleSize = 0;
    bool _modulesFound = false; // whether the areas of the modules were recognised
};

// Sums the areas by what they are for. If the areas recognised as modules' are fewer than the modules need,
// the callers have other names in this kernel: then all are left among the other areas.
void SiteBuilder::sortAreas() {
    const auto isModuleArea = [](const HXVmallocArea &area) {
        return area.module.empty() && isOneOf(plainFunction(area.function), kModuleAllocators);
    };
    for (const HXKernelModule &module : _readings.modules)
        _moduleSize += module.size;
    for (const HXVmallocArea &area : _readings.areas)
        if (isModuleArea(area)) _moduleAreasSize += area.pages * _readings.pageSize;
    _modulesFound = _moduleAreasSize >= _moduleSize;
    for (const HXVmallocArea &area : _readings.areas) {
        const uint64_t size = area.pages * _readings.pageSize;
        _areasSize += size;
        if (area.module.empty() && isOneOf(plainFunction(area.function), kStackAllocators))
            _stackAreasSize += size;
        else if (!_modulesFound || !isModuleArea(area))
            addToSite(area);
    }
}

void SiteBuilder::addToSite(const HXVmallocArea &area) {
    const uint64_t key =
        area.callerAddress ? area.callerAddress : HXKernelSiteForFunction(area.function, area.module);
    const auto [entry, isNew] = _siteIndices.try_emplace(key, _sites.size());
    if (isNew) _sites.push_back({area.callerAddress, area.function, area.module, 0});
    _sites[entry->second].size += area.pages * _readings.pageSize;
}

void SiteBuilder::addRecord(uint64_t flags, uint64_t site, uint64_t size) {
    if (size == 0) return;
    mach_memory_info_record record{};
    record.flags = flags;
    record.site = site;
    record.size = record.mapped = size;
    if ((flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_TAG) record.tag = static_cast<uint16_t>(site);
    _records.push_back(record);
}

void SiteBuilder::addNamed(std::string_view name, uint64_t size) {
    if (size == 0) return;
    addRecord(VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED | VM_KERN_SITE_NAMED,
              HXKernelSiteForFunction(name, {}), size);
    storeName(_records.back().name, name);
}

void SiteBuilder::addFunction(const Site &site) {
    if (site.address != 0)
        return addRecord(VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED, site.address, site.size);
    std::string name(site.function.empty() ? "vmalloc" : site.function);
    if (!site.module.empty()) name.append(" [").append(site.module).append("]");
    addNamed(name, site.size);
    if (site.size > 0) _records.back().site = HXKernelSiteForFunction(site.function, site.module);
}

void SiteBuilder::addCounter(uint64_t counter, uint64_t size) {
    addRecord(VM_KERN_SITE_COUNTER, counter, size);
}

// Kernels with CONFIG_VMAP_STACK take all task stacks from vmalloc and keep some for the next task when one
// exits; KernelStack counts those in use. Other kernels take none from there.
void SiteBuilder::addStacks() {
    const uint64_t usedSize = _readings.meminfo.kernelStackSize;
    const bool inVmalloc = _stackAreasSize > 0;
    addRecord(VM_KERN_SITE_TAG | VM_KERN_SITE_WIRED, kTagStack,
              inVmalloc ? std::min(usedSize, _stackAreasSize) : usedSize);
    addNamed("free kernel stacks", difference(_stackAreasSize, usedSize));
}

// Modules lie in vmalloc space. Where their areas can't be told from others, they are shown hidden,
// uncharged.
void SiteBuilder::addModules() {
    const uint64_t flags = VM_KERN_SITE_KMOD | VM_KERN_SITE_WIRED | (_modulesFound ? 0 : VM_KERN_SITE_HIDE);
    for (const HXKernelModule &module : _readings.modules)
        addRecord(flags, HXKernelLoadTagForModule(module.name), module.size);
    if (_modulesFound) addNamed("module memory", _moduleAreasSize - _moduleSize);
}

void SiteBuilder::addCounters(uint64_t kmallocSize) {
    const HXKernelMeminfo &meminfo = _readings.meminfo;
    const uint64_t stackSize = _stackAreasSize > 0 ? 0 : meminfo.kernelStackSize;
    addCounter(kCounterManaged, meminfo.totalSize);
    addCounter(kCounterReserved, difference(_readings.presentPages * _readings.pageSize, meminfo.totalSize));
    addCounter(kCounterWired, meminfo.slabUnreclaimableSize + _areasSize + stackSize + meminfo.perCpuSize +
                                  compressedSize() + meminfo.pageTableSize + meminfo.secondaryPageTableSize +
                                  meminfo.mlockedSize);
    addCounter(kCounterStolen, meminfo.hardwareCorruptedSize + meminfo.balloonSize);
    addCounter(kCounterMapKernel, std::max(meminfo.vmallocUsedSize, _areasSize));
    addCounter(kCounterMapZone, meminfo.slabReclaimableSize + meminfo.slabUnreclaimableSize);
    addCounter(kCounterMapKalloc, kmallocSize);
}

void SiteBuilder::build(uint64_t kmallocSize) {
    const HXKernelMeminfo &meminfo = _readings.meminfo;
    const uint64_t tagFlags = VM_KERN_SITE_TAG | VM_KERN_SITE_WIRED;
    sortAreas();
    addStacks();
    addRecord(tagFlags, kTagCpu, meminfo.perCpuSize);
    addRecord(tagFlags, kTagCompressor, compressedSize());
    addRecord(tagFlags | VM_KERN_SITE_HIDE, kTagPageTables, meminfo.pageTableSize);
    addRecord(tagFlags | VM_KERN_SITE_HIDE, kTagPmap, meminfo.secondaryPageTableSize);
    addRecord(tagFlags, kTagLockedUserMemory, meminfo.mlockedSize);
    addModules();
    for (const Site &site : _sites)
        addFunction(site);
    addCounters(kmallocSize);
}

} // namespace

HXLinuxKernelAccount HXAccountForKernelMemory(const HXLinuxKernelReadings &readings) {
    HXLinuxKernelAccount account;
    ZoneBuilder zones(readings);
    zones.build(&account);
    SiteBuilder(readings, &account).build(zones.kmallocSize());
    return account;
}

uint64_t HXKernelSiteForFunction(std::string_view function, std::string_view module) {
    const uint64_t hash = hashOf(module, hashOf(function) * 0x100000001B3);
    return hash | 0x8000000000000000; // above every number that a tag or load tag has
}

uint64_t HXKernelLoadTagForModule(std::string_view name) {
    const uint64_t hash = hashOf(name);
    const uint64_t tag = (hash ^ hash >> 32) & 0xFFFFFFFF;
    return tag ? tag : 1;
}
