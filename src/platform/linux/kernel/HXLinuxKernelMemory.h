// The kernel's own memory on a live Linux machine: what the kernel operations of HXPlatform answer there,
// under the same names.
#pragma once

#include "platform/HXHostRecords.h"

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

struct HXHugePagePools;
struct HXSlabCache;

// Reads /proc and /sys anew for every call. May be called from any thread.
class HXLinuxKernelMemory {
  public:
    // The paths at which procfs and sysfs are mounted, or those of trees made to look like them. `pageSize`:
    // bytes in a page of the machine.
    HXLinuxKernelMemory(std::string procPath, std::string sysPath, uint32_t pageSize)
        : _procPath(std::move(procPath)), _sysPath(std::move(sysPath)), _pageSize(pageSize) {}

    // As HXPlatform says. KERN_NO_ACCESS when slabinfo or vmallocinfo may not be read (both are root's),
    // KERN_FAILURE when meminfo can't be, or lacks a needed figure.
    kern_return_t mach_memory_info(mach_port_t host, mach_zone_name **names, uint32_t *nameCount,
                                   mach_zone_info **zones, uint32_t *zoneCount,
                                   mach_memory_info_record **records, uint32_t *recordCount);

    // Gives back an array of `mach_memory_info`. An empty array (null or 0 bytes) is always taken back;
    // KERN_INVALID_ADDRESS for what was not handed out, KERN_INVALID_ARGUMENT when it has another length.
    kern_return_t vm_deallocate(mach_port_t task, const void *address, uint64_t bytes);

    // The loaded modules; their load tags are those of the sites of `mach_memory_info`.
    std::vector<OSKextInfo> OSKextCopyLoadedKextInfo();

    // Never null. Costs nothing until it is asked for an address.
    RVSymbolicator *RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t flags,
                                                                           const void *notification);
    // Answer nothing for a symbolicator that is not the kernel's.
    RVSymbol RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                      uint64_t time);
    RVSourceInfo RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                              uint64_t time);
    // Destroys any symbolicator.
    void RVRelease(RVSymbolicator *symbolicator);

  private:
    struct Texts;
    kern_return_t readTexts(Texts *texts) const;
    void readCacheKinds(std::vector<HXSlabCache> &caches) const;
    uint64_t readZramSize() const;
    HXHugePagePools readHugePages() const;
    template <typename Record>
    void handOut(const std::vector<Record> &from, Record **records, uint32_t *count);

    const std::string _procPath, _sysPath;
    const uint32_t _pageSize;
    struct Buffer {
        std::unique_ptr<std::byte[]> bytes;
        uint64_t size = 0;
    };
    std::mutex _mutex;
    std::map<const void *, Buffer> _handedOut;
};
