#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include "platform/HXSafeText.h"
#include "platform/linux/kernel/HXLinuxMachineFigures.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <string>
#include <unordered_map>

namespace {

// Kernel tags and counters, by the numbers of the host's published tables.
constexpr uint64_t kTagStack = 8, kTagCpu = 9, kTagPmap = 10, kTagPageTables = 11, kTagCompressor = 14,
                   kTagLockedUserMemory = 24;
constexpr uint64_t kCounterManaged = 0, kCounterReserved = 1, kCounterWired = 2, kCounterStolen = 4,
                   kCounterMapKernel = 6, kCounterMapZone = 7, kCounterMapKalloc = 8;

constexpr uint64_t kHashBasis = 0xCBF29CE484222325, kHashPrime = 0x100000001B3; // FNV-1a of 64 bits

// Sites of code become identifiers, which are below 2^53: an address, of which the lower bits suffice, or a
// function's hash behind a bit that no such address has.
constexpr uint64_t kFunctionBit = uint64_t{1} << 52, kSiteMask = kFunctionBit - 1;

uint64_t hashOf(std::string_view text, uint64_t hash = kHashBasis) {
    for (const char c : text)
        hash = (hash ^ static_cast<uint8_t>(c)) * kHashPrime;
    return hash;
}

// The sum of figures; what the kernel does not tell adds nothing.
uint64_t sum(std::initializer_list<std::optional<uint64_t>> sizes) {
    uint64_t total = 0;
    for (const auto &size : sizes)
        total += size.value_or(0);
    return total;
}

uint64_t difference(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
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

// Whether `name` is a word of the list `names`.
bool isOneOf(std::string_view name, std::string_view names) {
    for (HXTextCursor cursor{names}; !cursor.rest.empty();)
        if (cursor.word() == name) return true;
    return false;
}

// Who asks vmalloc for the stacks of tasks: the allocator itself, or the functions that the compiler inlined
// it into and their callers (kernel/fork.c, from 4.9 on).
constexpr std::string_view kStackAllocators =
    "alloc_thread_stack_node dup_task_struct copy_process _do_fork do_fork kernel_clone fork_idle "
    "kernel_thread create_io_thread vhost_task_create user_mode_thread";

// Who asks it for the code and data of modules (kernel/module, mm/execmem.c, arch/*/kernel/module.c).
constexpr std::string_view kModuleAllocators =
    "load_module layout_and_allocate move_module module_alloc module_memory_alloc "
    "execmem_vmap execmem_vmalloc execmem_alloc execmem_alloc_rw execmem_cache_add execmem_cache_alloc";

// Caches that the kernel makes with SLAB_RECLAIM_ACCOUNT, for machines whose sysfs does not say so; beside
// these, all whose names end as below.
constexpr std::string_view kReclaimableCaches =
    "dentry radix_tree_node buffer_head mb_cache_entry mbcache dquot dax_cache fscrypt_info "
    "fscrypt_inode_info "
    "extent_status ext4_extent_status ext4_allocation_context ext4_prealloc_space ext4_free_data ext4_io_end "
    "pending_reservation jbd2_journal_head jbd2_journal_handle jbd2_revoke_record_s jbd2_revoke_table_s "
    "jbd2_transaction_s xfs_inode xfs_ili xfs_buf btrfs_inode btrfs_extent_map btrfs_extent_buffer "
    "ovl_inode fuse_inode erofs_inode";
// Inode caches that are nevertheless not reclaimable: their memory lives as long as the files.
constexpr std::string_view kPinnedInodeCaches =
    "shmem_inode_cache mqueue_inode_cache hugetlbfs_inode_cache lsm_inode_cache";

bool isReclaimableByName(std::string_view name) {
    if (name.starts_with("kmalloc-rcl-") || isOneOf(name, kReclaimableCaches)) return true;
    return name.ends_with("inode_cache") && !isOneOf(name, kPinnedInodeCaches);
}

bool isKmallocCache(std::string_view name) {
    return name.starts_with("kmalloc-") || name.starts_with("dma-kmalloc-") || name.starts_with("size-");
}

// ---- Zones

struct Zone {
    std::string_view name;
    uint64_t size; // bytes, as all sizes here
    uint64_t activeObjects;
    uint64_t objectSize;
    bool isReclaimable;
    // Bytes that go with the other kind; only where the kind was guessed by name.
    uint64_t otherSize = 0;
};

struct Zones {
    std::vector<Zone> zones;
    bool areKindsGuessed = true;
    uint64_t kmallocSize = 0; // of the general-purpose caches

    void add(const HXSlabCache &cache, uint64_t pageSize);
    uint64_t sizeOfKind(bool isReclaimable) const;
    void shift(bool isReclaimable, uint64_t knownSize);
    void addRemainder(std::string_view name, uint64_t size, bool isReclaimable);
};

void Zones::add(const HXSlabCache &cache, uint64_t pageSize) {
    const uint64_t size = cache.slabs * cache.pagesPerSlab * pageSize;
    if (size == 0) return; // it holds no memory now
    zones.push_back({cache.name, size, cache.activeObjects, cache.objectSize,
                     cache.reclaimable.value_or(isReclaimableByName(cache.name))});
    areKindsGuessed &= !cache.reclaimable.has_value();
    if (isKmallocCache(cache.name)) kmallocSize += size;
}

uint64_t Zones::sizeOfKind(bool isReclaimable) const {
    uint64_t size = 0;
    for (const Zone &zone : zones)
        size += zone.isReclaimable == isReclaimable ? zone.size - zone.otherSize : zone.otherSize;
    return size;
}

// Takes what the zones of one kind hold beyond `knownSize` to be of the other kind, in proportion.
void Zones::shift(bool isReclaimable, uint64_t knownSize) {
    const auto kindSize = static_cast<double>(sizeOfKind(isReclaimable));
    const double share = (kindSize - static_cast<double>(knownSize)) / kindSize;
    for (Zone &zone : zones)
        if (zone.isReclaimable == isReclaimable)
            zone.otherSize =
                std::min(zone.size, static_cast<uint64_t>(static_cast<double>(zone.size) * share));
}

void Zones::addRemainder(std::string_view name, uint64_t size, bool isReclaimable) {
    if (size > 0) zones.push_back({name, size, 1, size, isReclaimable});
}

Zones zonesOf(const HXLinuxKernelReadings &readings) {
    const uint64_t reclaimableSize = *readings.meminfo.slabReclaimableSize;
    const uint64_t unreclaimableSize = *readings.meminfo.slabUnreclaimableSize;
    Zones zones;
    if (!readings.caches) {
        zones.addRemainder("slab", unreclaimableSize, false);
        zones.addRemainder("reclaimable slab", reclaimableSize, true);
        return zones;
    }
    for (const HXSlabCache &cache : *readings.caches)
        zones.add(cache, readings.pageSize);
    // Where no kind is known, names may mislead; the kernel's two sums then say how much of the zones is
    // what.
    if (zones.areKindsGuessed && zones.sizeOfKind(true) > reclaimableSize)
        zones.shift(true, reclaimableSize);
    else if (zones.areKindsGuessed && zones.sizeOfKind(false) > unreclaimableSize)
        zones.shift(false, unreclaimableSize);
    const uint64_t largeSize = difference(unreclaimableSize, zones.sizeOfKind(false));
    zones.addRemainder("kmalloc-large", largeSize, false);
    zones.kmallocSize += largeSize;
    return zones;
}

mach_zone_info infoOf(const Zone &zone) {
    mach_zone_info info{};
    info.mzi_cur_size = info.mzi_max_size = info.mzi_alloc_size = zone.size;
    info.mzi_elem_size = zone.objectSize;
    info.mzi_collectable = zone.isReclaimable || zone.otherSize > 0;
    if (!info.mzi_collectable) info.mzi_count = zone.activeObjects;
    if (zone.otherSize == 0) return info;
    // A mixed zone: what can't be taken back is given as elements of one byte.
    info.mzi_elem_size = 1;
    info.mzi_count = zone.isReclaimable ? zone.otherSize : zone.size - zone.otherSize;
    return info;
}

// ---- Sites

// An area's function, or its address where the kernel has no name for it.
struct Site {
    std::string_view function, module;
    uint64_t address = 0; // 0: named by its function
    uint64_t size = 0;

    uint64_t number() const {
        return address ? address & kSiteMask : HXKernelSiteForFunction(function, module);
    }
};

// The areas of vmalloc, summed up by what they are for.
struct Areas {
    std::vector<Site> sites; // all that are neither stacks nor modules, in order of appearance
    uint64_t size = 0, stackSize = 0, moduleSize = 0;
    uint64_t loadedSize = 0; // what the modules themselves tell
    // Whether the modules' areas were recognised. If those that were are fewer than the modules need, the
    // callers have other names in this kernel: then all are left among the other sites.
    bool knowModules = false;
};

std::string siteName(uint64_t address) {
    char name[32];
    std::snprintf(name, sizeof name, "site 0x%" PRIx64, address);
    return name;
}

Areas sumAreas(const HXLinuxKernelReadings &readings) {
    const auto isBy = [](const HXVmallocArea &area, std::string_view functions) {
        return area.module.empty() && isOneOf(plainFunction(area.function), functions);
    };
    Areas areas;
    for (const HXKernelModule &module : readings.modules)
        areas.loadedSize += module.size;
    for (const HXVmallocArea &area : readings.areas)
        if (isBy(area, kModuleAllocators)) areas.moduleSize += area.pages * readings.pageSize;
    areas.knowModules = areas.moduleSize >= areas.loadedSize;
    std::unordered_map<uint64_t, size_t> indexes;
    for (const HXVmallocArea &area : readings.areas) {
        const uint64_t size = area.pages * readings.pageSize;
        areas.size += size;
        if (isBy(area, kStackAllocators)) {
            areas.stackSize += size;
        } else if (!areas.knowModules || !isBy(area, kModuleAllocators)) {
            const Site site{area.function, area.module, area.callerAddress};
            const auto [index, isNew] = indexes.try_emplace(site.number(), areas.sites.size());
            if (isNew) areas.sites.push_back(site);
            areas.sites[index->second].size += size;
        }
    }
    return areas;
}

class SiteBuilder {
  public:
    SiteBuilder(const HXLinuxKernelReadings &readings, std::vector<mach_memory_info_record> *records)
        : _readings(readings), _meminfo(readings.meminfo), _areas(sumAreas(readings)), _records(*records) {}

    void build(uint64_t kmallocSize);

  private:
    void add(uint64_t flags, uint64_t site, std::optional<uint64_t> size, std::string_view name = {});
    void addStacks();
    void addTags();
    void addModules();
    void addAreas();
    void addCounters(uint64_t kmallocSize);

    const HXLinuxKernelReadings &_readings;
    const HXKernelMeminfo &_meminfo;
    const Areas _areas;
    const uint64_t _compressedSize = sum({_meminfo.zswapSize, _readings.zramSize});
    std::vector<mach_memory_info_record> &_records;
};

constexpr uint64_t kTag = VM_KERN_SITE_TAG | VM_KERN_SITE_WIRED;
constexpr uint64_t kCode = VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED;

// Nothing for a site without memory, or whose size this kernel does not tell.
void SiteBuilder::add(uint64_t flags, uint64_t site, std::optional<uint64_t> size, std::string_view name) {
    if (size.value_or(0) == 0) return;
    mach_memory_info_record record{};
    record.flags = name.empty() ? flags : flags | VM_KERN_SITE_NAMED;
    record.site = site;
    record.size = record.mapped = *size;
    if ((flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_TAG) record.tag = static_cast<uint16_t>(site);
    storeName(record.name, name);
    _records.push_back(record);
}

// Kernels with CONFIG_VMAP_STACK take all task stacks from vmalloc and keep some for the next task when one
// exits; KernelStack counts those in use. Other kernels take none from there.
void SiteBuilder::addStacks() {
    constexpr std::string_view freeStacks = "free kernel stacks";
    const uint64_t usedSize = *_meminfo.kernelStackSize;
    const bool inVmalloc = _areas.stackSize > 0;
    add(kTag, kTagStack, inVmalloc ? std::min(usedSize, _areas.stackSize) : usedSize);
    add(kCode, HXKernelSiteForFunction(freeStacks, {}), difference(_areas.stackSize, usedSize), freeStacks);
}

void SiteBuilder::addTags() {
    add(kTag, kTagCpu, _meminfo.perCpuSize);
    add(kTag, kTagCompressor, _compressedSize);
    add(kTag | VM_KERN_SITE_HIDE, kTagPageTables, _meminfo.pageTableSize);
    add(kTag | VM_KERN_SITE_HIDE, kTagPmap, _meminfo.secondaryPageTableSize);
    add(kTag, kTagLockedUserMemory, _meminfo.mlockedSize);
}

// Modules lie in vmalloc space. Where their areas can't be told from others, they are shown hidden,
// uncharged.
void SiteBuilder::addModules() {
    constexpr std::string_view rest = "module memory";
    const uint64_t hidden = _areas.knowModules ? 0 : VM_KERN_SITE_HIDE;
    for (const HXKernelModule &module : _readings.modules)
        add(VM_KERN_SITE_KMOD | VM_KERN_SITE_WIRED | hidden, HXKernelLoadTagForModule(module.name),
            module.size);
    if (_areas.knowModules)
        add(kCode, HXKernelSiteForFunction(rest, {}), _areas.moduleSize - _areas.loadedSize, rest);
}

void SiteBuilder::addAreas() {
    for (const Site &site : _areas.sites) {
        std::string name;
        if (site.address != 0)
            name = siteName(site.address);
        else
            name = site.function.empty() ? "vmalloc" : site.function;
        if (!name.empty() && !site.module.empty()) name.append(" [").append(site.module).append("]");
        add(kCode, site.number(), site.size, name);
    }
}

void SiteBuilder::addCounters(uint64_t kmallocSize) {
    const uint64_t totalSize = *_meminfo.totalSize;
    const uint64_t slabSize = *_meminfo.slabReclaimableSize + *_meminfo.slabUnreclaimableSize;
    const bool inVmalloc = _areas.stackSize > 0;
    const uint64_t stackSize = inVmalloc ? 0 : *_meminfo.kernelStackSize;
    const uint64_t vmallocSize = std::max(_meminfo.vmallocUsedSize.value_or(0), _areas.size);
    const struct {
        uint64_t counter;
        uint64_t size;
    } counters[] = {
        {kCounterManaged, totalSize},
        {kCounterReserved, difference(_readings.zonePages.present * _readings.pageSize, totalSize)},
        {kCounterWired,
         sum({_meminfo.slabUnreclaimableSize, _areas.size, stackSize, _meminfo.perCpuSize, _compressedSize,
              _meminfo.pageTableSize, _meminfo.secondaryPageTableSize, _meminfo.mlockedSize})},
        {kCounterStolen, sum({_meminfo.hardwareCorruptedSize, _meminfo.balloonSize})},
        {kCounterMapKernel, vmallocSize},
        {kCounterMapZone, slabSize},
        {kCounterMapKalloc, kmallocSize},
    };
    for (const auto &entry : counters)
        add(VM_KERN_SITE_COUNTER, entry.counter, entry.size);
    const uint64_t otherVmallocSize = difference(vmallocSize, inVmalloc ? *_meminfo.kernelStackSize : 0);
    for (const HXMachineFigure &figure : HXMachineFigures(_readings, otherVmallocSize))
        add(VM_KERN_SITE_COUNTER, HXKernelSiteForFunction(figure.name, {}), figure.size, figure.name);
}

void SiteBuilder::build(uint64_t kmallocSize) {
    addStacks();
    addTags();
    addModules();
    addAreas();
    addCounters(kmallocSize);
}

} // namespace

HXLinuxKernelAccount HXAccountForKernelMemory(const HXLinuxKernelReadings &readings) {
    HXLinuxKernelAccount account;
    const Zones zones = zonesOf(readings);
    for (const Zone &zone : zones.zones) {
        storeName(account.zoneNames.emplace_back().mzn_name, zone.name);
        account.zones.push_back(infoOf(zone));
    }
    SiteBuilder(readings, &account.records).build(zones.kmallocSize);
    return account;
}

uint64_t HXKernelSiteForFunction(std::string_view function, std::string_view module) {
    const uint64_t hash = hashOf(module, hashOf(function) * kHashPrime);
    return (hash & kSiteMask) | kFunctionBit; // above every number that a tag or load tag has
}

uint64_t HXKernelLoadTagForModule(std::string_view name) {
    const uint64_t hash = hashOf(name);
    const uint64_t tag = (hash ^ hash >> 32) & 0xFFFFFFFF;
    return tag ? tag : 1;
}
