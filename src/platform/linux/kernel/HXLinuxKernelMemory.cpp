#include "platform/linux/kernel/HXLinuxKernelMemory.h"

#include "platform/HXSafeText.h"
#include "platform/linux/kernel/HXLinuxKernelAccount.h"
#include "platform/linux/kernel/HXLinuxKernelFile.h"
#include "platform/linux/kernel/HXLinuxKernelSymbols.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

// What the readings are views of.
struct HXLinuxKernelMemory::Texts {
    std::string meminfo, zoneinfo, slabinfo, vmallocinfo, modules;
    bool hasSlabinfo = false;
};

kern_return_t HXLinuxKernelMemory::readTexts(Texts *texts) const {
    const auto isDenied = [](int error) { return error == EACCES || error == EPERM; };
    int slabError = 0, vmallocError = 0;
    // One after the other without pause: the figures of these three are set against each other.
    auto slabinfo = HXReadKernelFile(_procPath + "/slabinfo", &slabError);
    auto vmallocinfo = HXReadKernelFile(_procPath + "/vmallocinfo", &vmallocError);
    texts->meminfo = HXReadKernelFile(_procPath + "/meminfo");
    if (isDenied(slabError) || isDenied(vmallocError)) return KERN_NO_ACCESS;
    texts->hasSlabinfo = slabinfo.has_value();
    texts->slabinfo = std::move(slabinfo).value_or(std::string());
    texts->vmallocinfo = std::move(vmallocinfo).value_or(std::string());
    texts->zoneinfo = HXReadKernelFile(_procPath + "/zoneinfo");
    texts->modules = HXReadKernelFile(_procPath + "/modules");
    return KERN_SUCCESS;
}

// /sys/kernel/slab has a directory for every cache, and links to it for caches that were merged into it.
void HXLinuxKernelMemory::readCacheKinds(HXLinuxKernelReadings *readings) const {
    const int directory = open((_sysPath + "/kernel/slab").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (directory < 0) return;
    for (HXSlabCache &cache : *readings->caches) {
        if (cache.slabs == 0 || cache.name.find('/') != std::string_view::npos || cache.name.front() == '.')
            continue;
        const std::string path = std::string(cache.name) + "/reclaim_account";
        const int file = openat(directory, path.c_str(), O_RDONLY | O_CLOEXEC);
        if (file < 0) continue;
        char kind = 0;
        if (read(file, &kind, 1) == 1) cache.reclaimable = kind != '0';
        close(file);
    }
    close(directory);
}

uint64_t HXLinuxKernelMemory::readZramSize() const {
    const std::string path = _sysPath + "/block";
    DIR *directory = opendir(path.c_str());
    if (!directory) return 0;
    uint64_t size = 0;
    while (const dirent *entry = readdir(directory))
        if (std::strncmp(entry->d_name, "zram", 4) == 0)
            size += HXParseZramUsedSize(HXReadKernelFile(path + "/" + entry->d_name + "/mm_stat"));
    closedir(directory);
    return size;
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
    const auto meminfo = HXParseKernelMeminfo(texts.meminfo);
    if (!meminfo) return KERN_FAILURE;

    HXLinuxKernelReadings readings;
    readings.pageSize = _pageSize;
    readings.meminfo = *meminfo;
    if (texts.hasSlabinfo) {
        readings.caches = HXParseSlabinfo(texts.slabinfo);
        readCacheKinds(&readings);
    }
    readings.areas = HXParseVmallocinfo(texts.vmallocinfo);
    readings.modules = HXParseModules(texts.modules);
    readings.presentPages = HXParseZoneinfoPresentPages(texts.zoneinfo);
    readings.zramSize = readZramSize();

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
    const std::string text = HXReadKernelFile(_procPath + "/modules");
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
