// A host answered from a machine file.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/capture/HXMachine.h"

#include <array>
#include <atomic>

// Every answer is the machine's; what counts calls (faults) or can be set ("vm.self_region_heft") is kept
// here, so that one machine can be replayed several times. The machine and `services` must outlive the
// platform.
class HXReplayPlatform : public HXPlatform {
  public:
    HXReplayPlatform(const HXMachine &machine, HXServices &services);
    ~HXReplayPlatform() override;

    mach_port_t mach_task_self() override;
    kern_return_t task_for_pid(mach_port_t self, int32_t pid, mach_port_t *task) override;
    void mach_port_deallocate(mach_port_t self, mach_port_t task) override;
    kern_return_t mach_vm_region(mach_port_t task, uint64_t *address, uint64_t *size, int32_t flavor,
                                 vm_region_basic_info_64 *info, uint32_t *infoCount) override;
    kern_return_t mach_vm_region_recurse(mach_port_t task, uint64_t *address, uint64_t *size,
                                         uint32_t *nestingDepth, vm_region_submap_info_64 *info,
                                         uint32_t *infoCount) override;
    kern_return_t mach_vm_page_range_query(mach_port_t task, uint64_t address, uint64_t size,
                                           std::vector<vm_page_run> *runs, uint64_t *pages) override;
    std::vector<vm_region_share> mach_vm_region_shares(mach_port_t task, uint64_t address) override;
    kern_return_t mach_vm_purgable_control(mach_port_t task, uint64_t address, int32_t control,
                                           int32_t *state) override;
    uint64_t pageTableObject(mach_port_t task) override;
    std::vector<task_held_object> task_held_objects(mach_port_t task) override;
    std::vector<task_held_object> proc_held_objects(int32_t pid) override;
    std::vector<task_held_object> host_held_objects(mach_port_t host) override;
    uint32_t vm_kernel_page_size() override { return _machine.host.pageSize; }
    bool hasSharedRegion() override { return _machine.host.sharedRegion; }

    int32_t proc_listallpids(int32_t *pids, uint32_t bufferBytes) override;
    int32_t proc_pidinfo(int32_t pid, int32_t flavor, uint64_t argument, void *buffer,
                         uint32_t bufferBytes) override;
    int32_t proc_pid_rusage(int32_t pid, int32_t flavor, rusage_info_v4 *info) override;
    int32_t proc_get_dirty(int32_t pid, uint32_t *flags) override;
    int32_t proc_regionfilename(int32_t pid, uint64_t address, char *buffer, uint32_t bufferBytes) override;
    int32_t getpid() override { return _machine.host.pid; }
    uint32_t geteuid() override { return _machine.host.euid; }
    int32_t sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) override;
    int32_t sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                         size_t newBytes) override;
    int32_t ledger(int32_t command, int32_t pid, void *buffer, int64_t *count) override;

    RVSymbolicator *RVSymbolicatorCreateWithTaskFlagsAndNotification(mach_port_t task, uint32_t flags,
                                                                     const void *notification) override;
    void
    RVSymbolicatorForeachSymbolOwnerAtTime(RVSymbolicator *symbolicator, uint64_t time,
                                           const std::function<void(const RVSymbolOwner &)> &each) override;
    std::string stringByResolvingSymlinksInPath(const std::string &path) override { return path; }
    RVSymbolicator *RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t flags,
                                                                           const void *notification) override;
    RVSymbol RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                      uint64_t time) override;
    RVSourceInfo RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                              uint64_t time) override;
    void RVRelease(RVSymbolicator *symbolicator) override;

    mach_port_t mach_host_self() override;
    kern_return_t mach_memory_info(mach_port_t host, mach_zone_name **names, uint32_t *nameCount,
                                   mach_zone_info **zones, uint32_t *zoneCount,
                                   mach_memory_info_record **records, uint32_t *recordCount) override;
    kern_return_t vm_deallocate(mach_port_t task, const void *address, uint64_t bytes) override;
    std::vector<OSKextInfo> OSKextCopyLoadedKextInfo() override { return _machine.kexts; }
    std::optional<std::string> GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t shareMode,
                                                                              int32_t protection,
                                                                              uint8_t pager) override;
    HXServices &services() override { return _services; }

  private:
    // What changes about a process while it is replayed.
    struct State {
        std::atomic<size_t> walkHint = 0; // the region that the last query found
        std::array<std::atomic<uint64_t>, kMachineCallCount> calls{};
        std::atomic<HXMachineFate> fate = HXMachineFate::alive;
    };

    // A process of the machine and what changes about it; null both for a port that is no task's.
    struct Task {
        const HXMachineProcess *process = nullptr;
        State *state = nullptr;
    };
    Task taskOf(mach_port_t task);
    State *stateOf(int32_t pid);
    static uint64_t callsBeforeFault(const HXMachineProcess &process, const State &state, HXMachineCall call);
    kern_return_t countCall(const HXMachineProcess &process, State &state, HXMachineCall call);
    bool countsHeft() const { return _selfRegionHeft.load(std::memory_order_relaxed) != 0; }
    bool exists(const HXMachineRegion &region) const;
    const HXMachineRegion *firstRegion(const HXMachineProcess &process, State &state, uint64_t address) const;
    const HXMachineRegion *regionAt(const HXMachineProcess &process, State &state, uint64_t address) const;
    vm_region_submap_info_64 info(const HXMachineRegion &region) const;
    uint64_t findRuns(const HXMachineProcess &process, State &state, uint64_t first, uint64_t pages,
                      std::vector<vm_page_run> *runs) const;
    void addRuns(const HXMachineRegion &region, uint64_t index, uint64_t endIndex,
                 std::vector<vm_page_run> *runs) const;
    uint32_t hostTag(const vm_region_submap_info_64 &info) const;
    std::string_view text(uint32_t string) const;
    int32_t argumentArea(int32_t pid, void *old, size_t *oldBytes) const;
    int32_t selfRegionHeft(void *old, size_t *oldBytes, const void *newValue, size_t newBytes);
    int32_t ownedObjects(void *old, size_t *oldBytes, const void *newValue, size_t newBytes);
    void mapNamedTags();

    const HXMachine &_machine;
    HXServices &_services;
    std::deque<State> _states; // by process index
    std::atomic<int32_t> _selfRegionHeft;
    std::map<uint32_t, uint32_t> _namedTags; // of the machine's named tags, those of this run
};
