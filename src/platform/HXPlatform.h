// The one interface to the host. Its operations bear the names of the host calls they stand for; every word
// that the program learns of the machine comes through them, so that a recorded or made-up machine can stand
// in for a live one.
//
// Names and paths handed up by any platform are safe text (HXSafeText.h).
//
// Unless an operation says otherwise it may be called from any thread.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/HXRegionTags.h"
#include "platform/HXServices.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// Answers of a host that hold for the whole run, kept by those who asked.
struct HXHostCache {
    // "vm.self_region_heft": 0 or 1; −1 while it must be asked for.
    std::atomic<int32_t> selfRegionHeft = -1;
    // Where "page_table" stands in every task's ledger (−1: nowhere), and of how many entries.
    std::once_flag ledgerTemplate;
    int64_t pageTableIndex = -1;
    int64_t ledgerEntryCount = 0;
};

// Bytes of anonymous, shared and huge pages and of private swapped ones, the lazily freed included.
struct HXWalkDifference {
    uint64_t regionsSize;
    uint64_t countersSize;
};

// Takes from `runs`, which ascend, the pages from the address `end` on.
void HXCutRuns(uint64_t end, uint64_t pageSize, std::vector<vm_page_run> *runs);

class HXPlatform {
  public:
    virtual ~HXPlatform() = default;

    // The platform of this run. `setCurrent` is called once in main, or by a test; the caller keeps ownership
    // and keeps the platform alive while it is current. `current` without one is an internal error.
    static HXPlatform &current();
    static void setCurrent(HXPlatform *platform);

    // Tasks and virtual memory.

    // The program's own task.
    virtual mach_port_t mach_task_self() = 0;

    // Opens the task of `pid` and stores a port to it, which stays bound to that very process even when its
    // pid is given to another one later. KERN_FAILURE (5) when the process is gone or is a zombie,
    // KERN_NO_ACCESS (8) when the caller may not examine it, KERN_RESOURCE_SHORTAGE (6) when the program has
    // no descriptor left for it.
    virtual kern_return_t task_for_pid(mach_port_t self, int32_t pid, mach_port_t *task) = 0;

    // Gives a task port back, and with it all that the platform holds for the task. The port must not be used
    // again.
    virtual void mach_port_deallocate(mach_port_t self, mach_port_t task) = 0;

    // The first top-level mapping whose end lies above *address: its start and length in bytes, and its basic
    // information. *infoCount: words there is room for, then words filled. KERN_INVALID_ADDRESS when there is
    // none, MACH_SEND_INVALID_DEST when the process is gone or the port is no task's, KERN_INVALID_ARGUMENT
    // for another flavor and without room for all of the record.
    virtual kern_return_t mach_vm_region(mach_port_t task, uint64_t *address, uint64_t *size, int32_t flavor,
                                         vm_region_basic_info_64 *info, uint32_t *infoCount) = 0;

    // The same for leaf mappings, however deep; *nestingDepth is the deepest submap level to descend to, then
    // that of the mapping. As many words are filled as there is room for: 18 at most by a kernel that fills
    // the older record. A task's walk is answered from one snapshot of its address space, so it neither skips
    // nor repeats a mapping; one thread walks a task.
    virtual kern_return_t mach_vm_region_recurse(mach_port_t task, uint64_t *address, uint64_t *size,
                                                 uint32_t *nestingDepth, vm_region_submap_info_64 *info,
                                                 uint32_t *infoCount) = 0;

    // The pages of [address, address + size) that have a disposition: stores their runs, ascending and apart,
    // in `runs` in place of what it holds. The cost follows the runs, however large the holes between them.
    // *pages: how many pages from that of `address` on have been told of, the holes included; fewer than were
    // asked for where the runs are many or a later page cannot be told of, and then a multiple of
    // kPageQueryPages, so that the caller goes on from there. Each kPageQueryPages begun count as one call.
    // KERN_INVALID_ADDRESS when one of the first of them lies in no mapping, KERN_INVALID_ARGUMENT when the
    // process is gone or the port is no task's.
    static constexpr uint64_t kPageQueryPages = 4096;
    virtual kern_return_t mach_vm_page_range_query(mach_port_t task, uint64_t address, uint64_t size,
                                                   std::vector<vm_page_run> *runs, uint64_t *pages) = 0;

    // With VM_PURGABLE_GET_STATE: the purgeable state (VM_PURGABLE_…) of the object mapped at `address`.
    // Fails for objects that are not purgeable.
    virtual kern_return_t mach_vm_purgable_control(mach_port_t task, uint64_t address, int32_t control,
                                                   int32_t *state) = 0;

    // After the walk of a task whose memory moved while it was read: what its regions and what its own
    // counters add up to, which differ by more than 1 % and 1 MiB even on a second reading. None where they
    // agree, and on hosts whose memory stands still.
    virtual std::optional<HXWalkDifference> walkDifference(mach_port_t) { return std::nullopt; }

    // Tells the host that the tasks open now are examined together: it finds out what they share, which is
    // told among them. For a task that is opened later, or whose memory was read before, every page is its
    // own. Takes as long as reading them; ends early once `isCancelled` answers true. The pids of tasks that
    // do not answer: they must not be asked again. Main thread only.
    virtual std::vector<int32_t> examineTogether(const std::function<bool()> &) { return {}; }

    // After `examineTogether` by somebody who may not know which pages tasks share: how many bytes at most
    // are told of several of them. None where it is known.
    virtual std::optional<uint64_t> sharedSizeNotTold() { return std::nullopt; }

    // What of the private memory of the mapping that begins at `address` other tasks share. A page that
    // several mappings of a task show is told once.
    virtual std::vector<vm_region_share> mach_vm_region_shares(mach_port_t, uint64_t) { return {}; }

    // Which object a task's page tables are, as a full object id. All bits set where the host does not tell.
    virtual uint64_t pageTableObject(mach_port_t) { return UINT64_MAX; }

    // The shared memory that a task maps, each object once.
    virtual std::vector<task_held_object> task_held_objects(mach_port_t) { return {}; }

    // The shared memory that a process has descriptors of, each object once; nothing for a process whose task
    // may not be had.
    virtual std::vector<task_held_object> proc_held_objects(int32_t) { return {}; }

    // What the kernel holds itself: shared memory with a name, and what nobody has attached, as far as it is
    // in reach of the tasks that were asked before. No task holds any of these objects.
    virtual std::vector<task_held_object> host_held_objects(mach_port_t) { return {}; }

    // Bytes in a page of the machine, a power of two.
    virtual uint32_t vm_kernel_page_size() = 0;

    // What the host is, its machine architecture named as memory graphs name it, like "Linux 6.1.0, X86-64".
    virtual std::string hostDescription();

    // Whether tasks of this host have a shared region at all. Without one its base and size are 0 for every
    // task.
    virtual bool hasSharedRegion() = 0;

    // Prints "LABEL: TEXT\n" to standard error.
    void mach_error(const char *label, kern_return_t error);
    // The kernel's text for an error; never null, lives for ever.
    const char *mach_error_string(kern_return_t error);

    // Processes. These answer −1 with errno set when they fail, unless they say otherwise: ESRCH when there
    // is no such process, EINVAL for a flavor or command that there is not.

    // Fills `pids` with the pids of all processes, as many as there is room for, and answers how many were
    // filled. With a null buffer: how many there are about; the next list may be of that moment. Kernel
    // threads are no processes; the kernel itself is pid 0.
    virtual int32_t proc_listallpids(int32_t *pids, uint32_t bufferBytes) = 0;

    // Why the host does not tell of processes, for a message; none when it does. `ofAll`: also why it does
    // not tell of all of them.
    virtual std::optional<std::string> processesNotTold(bool) { return std::nullopt; }

    // How long it takes to gather a process whose task is open, compared with others; 0 where the host cannot
    // tell or order matters.
    virtual uint64_t expectedCost(int32_t) { return 0; }

    // Fills `buffer` with the record of `flavor` (PROC_PIDTBSDINFO, PROC_PIDT_SHORTBSDINFO) and answers its
    // length in bytes; 0 with errno set when it cannot (ENOMEM: too little room). A zombie has no record of
    // flavor 3.
    virtual int32_t proc_pidinfo(int32_t pid, int32_t flavor, uint64_t argument, void *buffer,
                                 uint32_t bufferBytes) = 0;

    // Resource usage, flavor RUSAGE_INFO_V4. 0 on success.
    virtual int32_t proc_pid_rusage(int32_t pid, int32_t flavor, rusage_info_v4 *info) = 0;

    // Whether the process's argument area surely names it as its record does: then it need not be asked for.
    virtual bool isNamedByRecord(const proc_bsdinfo &) { return false; }

    // Whether the process may be called `name` by its argument area, as far as its record tells: only those
    // that may need be asked for it.
    virtual bool mayBeNamed(const proc_bsdinfo &, std::string_view) { return true; }

    // Idle-exit flags (0x1 tracked, 0x2 allows idle exit, 0x4 dirty). 0 on success.
    virtual int32_t proc_get_dirty(int32_t pid, uint32_t *flags) = 0;

    // Path of the file mapped at `address` by a process whose task is open, not terminated, cut to whole
    // characters in `bufferBytes`; answers its length, 0 when there is none.
    virtual int32_t proc_regionfilename(int32_t pid, uint64_t address, char *buffer,
                                        uint32_t bufferBytes) = 0;

    // The number of the running process among those of the host; one that no process has when it is none.
    virtual int32_t getpid() = 0;
    virtual uint32_t geteuid() = 0;

    // { CTL_KERN, KERN_ARGMAX }: the size of the largest argument area in bytes, 32 bits (ENOMEM: too little
    // room). { CTL_KERN, KERN_PROCARGS2, pid }: the argument area: a 32-bit argument count, the executed
    // file's path, at least one zero byte, then the arguments, each with a zero; cut to the room there is.
    // *oldBytes: room, then bytes filled; without a buffer the size needed. ENOENT for another name. 0 on
    // success.
    virtual int32_t sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) = 0;

    // "vm.self_region_heft": read (32 bits) or written. "vm.get_owned_vmobjects": the new value is a task
    // port, the old one a 64-bit count and that many `owned_vmobject`; without a buffer *oldBytes tells the
    // size needed. ENOENT when the kernel has no such setting. 0 on success.
    virtual int32_t sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                                 size_t newBytes) = 0;

    // LEDGER_TEMPLATE_INFO: `buffer` holds *count `ledger_template_info`, `pid` is ignored.
    // LEDGER_ENTRY_INFO: *count `ledger_entry_info` of `pid`, in template order. *count comes back as the
    // entries filled. 0 on success.
    virtual int32_t ledger(int32_t command, int32_t pid, void *buffer, int64_t *count) = 0;

    // Images and symbols.

    virtual uint32_t RVSymbolicatorGetFlagsForNoSymbolOrSourceInfoData() { return 0; }
    virtual uint32_t RVSymbolicatorGetFlagsForNListOnlyData() { return 0; }

    // A symbolicator for the images that the task has loaded now; null when they cannot be listed.
    virtual RVSymbolicator *RVSymbolicatorCreateWithTaskFlagsAndNotification(mach_port_t task, uint32_t flags,
                                                                             const void *notification) = 0;
    // Calls `each` for every loaded image. `time` is kRVNow.
    virtual void
    RVSymbolicatorForeachSymbolOwnerAtTime(RVSymbolicator *symbolicator, uint64_t time,
                                           const std::function<void(const RVSymbolOwner &)> &each) = 0;
    // The path with its symbolic links resolved, where the host that the task runs on can tell; else as
    // given.
    virtual std::string stringByResolvingSymlinksInPath(const std::string &path) = 0;

    // A symbolicator for the running kernel; null when there is none.
    virtual RVSymbolicator *
    RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t flags, const void *notification) = 0;
    virtual RVSymbol RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                              uint64_t time) = 0;
    virtual RVSourceInfo RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                      uint64_t address, uint64_t time) = 0;
    // Releases a symbolicator; null is allowed.
    virtual void RVRelease(RVSymbolicator *symbolicator) = 0;

    // The kernel's own memory.

    virtual mach_port_t mach_host_self() = 0;

    // The kernel's wired memory: names and facts of its zones (one count) and its allocation sites. The
    // arrays belong to the caller, who gives each back with `vm_deallocate`. KERN_NO_ACCESS without the right
    // to know.
    virtual kern_return_t mach_memory_info(mach_port_t host, mach_zone_name **names, uint32_t *nameCount,
                                           mach_zone_info **zones, uint32_t *zoneCount,
                                           mach_memory_info_record **records, uint32_t *recordCount) = 0;

    // Gives back memory that a kernel call handed out; `bytes` is its length.
    virtual kern_return_t vm_deallocate(mach_port_t task, const void *address, uint64_t bytes) = 0;

    // All loaded kernel extensions.
    virtual std::vector<OSKextInfo> OSKextCopyLoadedKextInfo() = 0;

    // Region types.

    // What the host calls memory of a user tag that the program has no name for; none when it has no name
    // either.
    virtual std::optional<std::string> GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag,
                                                                                      uint8_t shareMode,
                                                                                      int32_t protection,
                                                                                      uint8_t pager) = 0;

    // The names that programs gave their memory, on this host and in memory graphs read beside it.
    HXNamedTags &namedTags() { return _namedTags; }
    const HXNamedTags &namedTags() const { return _namedTags; }
    HXHostCache &cache() { return _cache; }

    // The real machine's, on every platform, a replayed one included. Lives as long as the platform.
    virtual HXServices &services() = 0;

  private:
    HXNamedTags _namedTags;
    HXHostCache _cache;
};
