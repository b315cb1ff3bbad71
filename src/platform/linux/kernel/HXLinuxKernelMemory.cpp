#include "platform/linux/kernel/HXLinuxKernelMemory.h"

#include "platform/HXSafeText.h"
#include "platform/linux/kernel/HXLinuxKernelAccount.h"
#include "platform/linux/kernel/HXLinuxKernelSymbols.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>

// What the readings are views of; none for files that there are not.
struct HXLinuxKernelMemory::Texts {
    std::optional<std::string> slabinfo, vmallocinfo, meminfo, zoneinfo, modules;
};

kern_return_t HXLinuxKernelMemory::readTexts(Texts *texts) const {
    const HXDescriptor proc = HXOpenAt(AT_FDCWD, _procPath.c_str(), O_DIRECTORY);
    bool isDenied = false;
    const auto read = [&](const char *name) {
        auto text = HXReadText(proc, name);
        if (!text && (errno == EACCES || errno == EPERM)) isDenied = true;
        return text;
    };
    // One after the other without pause: the figures of these three are set against each other.
    texts->slabinfo = read("slabinfo");
    texts->vmallocinfo = read("vmallocinfo");
    texts->meminfo = HXReadText(proc, "meminfo");
    if (isDenied) return KERN_NO_ACCESS;
    texts->zoneinfo = HXReadText(proc, "zoneinfo");
    texts->modules = HXReadText(proc, "modules");
    return KERN_SUCCESS;
}

// /sys/kernel/slab has a directory for every cache, and links to it for caches that were merged into it.
void HXLinuxKernelMemory::readCacheKinds(std::vector<HXSlabCache> &caches) const {
    const HXDescriptor directory = HXOpenAt(AT_FDCWD, (_sysPath + "/kernel/slab").c_str(), O_DIRECTORY);
    if (!directory) return;
    for (HXSlabCache &cache : caches) {
        if (cache.slabs == 0 || cache.name.find('/') != std::string_view::npos || cache.name.front() == '.')
            continue;
        char buffer[4]; // "0\n" or "1\n"
        const auto kind =
            HXReadOnce(directory, (std::string(cache.name) + "/reclaim_account").c_str(), buffer);
        if (kind && !kind->empty()) cache.reclaimable = kind->front() != '0';
    }
}

uint64_t HXLinuxKernelMemory::readZramSize() const {
    const HXDescriptor directory = HXOpenAt(AT_FDCWD, (_sysPath + "/block").c_str(), O_DIRECTORY);
    uint64_t size = 0;
    HXForEachEntry(directory, [&](const char *name) {
        char buffer[512]; // nine numbers
        const bool isZram = std::string_view(name).starts_with("zram");
        const auto text =
            isZram ? HXReadOnce(directory, (std::string(name) + "/mm_stat").c_str(), buffer) : std::nullopt;
        if (text) size += HXParseZramUsedSize(*text).value_or(0);
        return true;
    });
    return size;
}

// A directory "hugepages-SIZEkB" for each size of huge pages, with numbers of pages in its files.
HXHugePagePools HXLinuxKernelMemory::readHugePages() const {
    const HXDescriptor directory =
        HXOpenAt(AT_FDCWD, (_sysPath + "/kernel/mm/hugepages").c_str(), O_DIRECTORY);
    HXHugePagePools pools;
    HXForEachEntry(directory, [&](const char *name) {
        HXTextCursor text{name};
        uint64_t kibibytes = 0;
        if (!text.skip("hugepages-") || !text.number(&kibibytes)) return true;
        const auto sizeIn = [&](const char *file) {
            char buffer[32]; // one number
            const auto figure = HXReadOnce(directory, (std::string(name) + file).c_str(), buffer);
            uint64_t pages = 0;
            return figure && HXTextCursor{*figure}.number(&pages) ? pages * kibibytes * 1024 : 0;
        };
        pools.freeSize += sizeIn("/free_hugepages");
        pools.reservedSize += sizeIn("/resv_hugepages");
        return true;
    });
    return pools;
}

template <typename Record>
void HXLinuxKernelMemory::handOut(const std::vector<Record> &from, Record **records, uint32_t *count) {
    *count = static_cast<uint32_t>(from.size());
    *records = nullptr;
    if (from.empty()) return;
    const uint64_t size = from.size() * sizeof(Record);
    auto bytes = std::make_unique<std::byte[]>(size);
    std::memcpy(bytes.get(), from.data(), size);
    *records = reinterpret_cast<Record *>(bytes.get());
    const std::lock_guard lock(_mutex);
    _handedOut[*records] = {std::move(bytes), size};
}

kern_return_t HXLinuxKernelMemory::mach_memory_info(mach_port_t, mach_zone_name **names, uint32_t *nameCount,
                                                    mach_zone_info **zones, uint32_t *zoneCount,
                                                    mach_memory_info_record **records,
                                                    uint32_t *recordCount) {
    Texts texts;
    if (const kern_return_t error = readTexts(&texts); error != KERN_SUCCESS) return error;
    const auto meminfo = texts.meminfo ? HXParseKernelMeminfo(*texts.meminfo) : std::nullopt;
    if (!meminfo) return KERN_FAILURE;

    HXLinuxKernelReadings readings;
    readings.pageSize = _pageSize;
    readings.meminfo = *meminfo;
    if (texts.slabinfo) {
        readings.caches = HXParseSlabinfo(*texts.slabinfo);
        readCacheKinds(*readings.caches);
    }
    if (texts.vmallocinfo) readings.areas = HXParseVmallocinfo(*texts.vmallocinfo);
    if (texts.modules) readings.modules = HXParseModules(*texts.modules);
    if (texts.zoneinfo) readings.zonePages = HXParseZoneinfo(*texts.zoneinfo);
    readings.zramSize = readZramSize();
    readings.hugePages = readHugePages();

    const HXLinuxKernelAccount account = HXAccountForKernelMemory(readings);
    handOut(account.zoneNames, names, nameCount);
    handOut(account.zones, zones, zoneCount);
    handOut(account.records, records, recordCount);
    return KERN_SUCCESS;
}

kern_return_t HXLinuxKernelMemory::vm_deallocate(mach_port_t, const void *address, uint64_t bytes) {
    if (!address || bytes == 0) return KERN_SUCCESS;
    const std::lock_guard lock(_mutex);
    const auto entry = _handedOut.find(address);
    if (entry == _handedOut.end()) return KERN_INVALID_ADDRESS;
    if (entry->second.size != bytes) return KERN_INVALID_ARGUMENT;
    _handedOut.erase(entry);
    return KERN_SUCCESS;
}

std::vector<OSKextInfo> HXLinuxKernelMemory::OSKextCopyLoadedKextInfo() {
    const std::string text = HXReadText(AT_FDCWD, (_procPath + "/modules").c_str()).value_or("");
    std::vector<OSKextInfo> modules;
    for (const HXKernelModule &module : HXParseModules(text))
        modules.push_back({HXKernelLoadTagForModule(module.name), HXSafeName(module.name)});
    return modules;
}

RVSymbolicator *HXLinuxKernelMemory::RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t,
                                                                                            const void *) {
    return new HXLinuxKernelSymbolicator(_procPath);
}

RVSymbol HXLinuxKernelMemory::RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                       uint64_t address, uint64_t) {
    auto *kernel = dynamic_cast<HXLinuxKernelSymbolicator *>(symbolicator);
    return kernel ? kernel->symbolAt(address) : RVSymbol{nullptr};
}

RVSourceInfo HXLinuxKernelMemory::RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                               uint64_t address, uint64_t) {
    auto *kernel = dynamic_cast<HXLinuxKernelSymbolicator *>(symbolicator);
    return kernel ? kernel->sourceAt(address) : RVSourceInfo{nullptr, 0, true};
}

void HXLinuxKernelMemory::RVRelease(RVSymbolicator *symbolicator) {
    delete symbolicator;
}
