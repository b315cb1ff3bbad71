// One process that has been opened for examination.
#pragma once

#include "platform/HXAdaptiveMutex.h"
#include "platform/linux/pages/HXAddressSpaceReader.h"
#include "platform/linux/pages/HXPageReader.h"
#include "platform/linux/pages/HXWalkDifference.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXLinuxProcesses.h"
#include "platform/linux/procfs/HXProcText.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <unordered_map>
#include <vector>

// What was found out of a task's private pages by looking at those of others, too. By the index of the
// mapping in its address space, in pages.
struct HXSharedPages {
    struct Figures {
        uint32_t mapping;
        uint32_t resident, anonymous, swapped; // as HXMapping has them
    };
    std::vector<Figures> figures; // some mappings several times: to be added up
    struct Repeated {
        uint32_t mapping;
        uint32_t resident, swapped; // of which a lower mapping shows the same pages
    };
    std::vector<Repeated> repeated;
    struct Share {
        uint32_t mapping;
        vm_region_share share;
    };
    std::vector<Share> shares;     // ascending by mapping
    bool mayBeLazilyFreed = false; // some of the pages, which smaps tells
};

// Lets those who read processes take turns when there are few descriptors. Any thread.
class HXDescriptorTurns {
  public:
    // Runs `read`; if it runs out of descriptors once more, with no other thread reading. Whether they
    // sufficed in the end.
    bool run(const std::function<void()> &read);

  private:
    std::shared_timed_mutex _mutex;
};

// Everything is read through the process's directory in /proc, which is held open, from the beginning or from
// the first reading of the address space on: once the process is gone those reads fail, whoever has its pid
// then. When it is opened again, the process's start time must be the same. Used by one thread at a time.
class HXLinuxTask {
  public:
    // `number`: HXObjectIdentifiers::numberOfProcess. `maps`: the process's file of that name, open. Both it
    // and the directory are held open until they are needed, with `keepsOpen`. What else is given outlives
    // this.
    HXLinuxTask(int32_t pid, uint32_t number, HXOpenProcess process, HXDescriptor maps, bool keepsOpen,
                HXLinuxProcesses &processes, HXDescriptorTurns &turns);
    HXLinuxTask(const HXLinuxTask &) = delete;
    HXLinuxTask &operator=(const HXLinuxTask &) = delete;

    int32_t pid() const { return _pid; }
    // Where the stack began when the process was executed: the same after fork(2). 0 where it is not told.
    uint64_t startStack() const { return _startStack; }
    uint32_t number() const { return _number; }
    uint64_t residentSizeWhenOpened() const { return _residentSize; } // bytes; 0: not known
    const HXDescriptor &directory() const { return _directory; }

    // Runs `read` by turns; if descriptors do not suffice, the address space, once read, ends with that
    // error. Whether they do.
    bool withDescriptors(const std::function<void()> &read);

    // The address space as it was when this was first asked for; read again when dirty file pages are wanted
    // of one that was read without them, and once more when the first reading disagrees with the process's
    // own counters.
    const HXAddressSpace &addressSpace(const HXReaderSetting &setting, bool needsDirtyPages);
    // Reads the address space for somebody who looks at several tasks together, and may leave the private
    // pages to him (HXAddressSpace::lacksPrivatePages). Then `takeShared` or `forget`, before anything else
    // is asked.
    // `leavesLazyFree`: HXReadRequest's.
    void readForSharing(const HXReaderSetting &setting, bool needsDirtyPages, bool leavesLazyFree);
    const HXAddressSpace *addressSpaceRead() const { return _addressSpace.get(); } // null: not read
    void takeShared(HXSharedPages shared);
    void forget() { _addressSpace.reset(); }
    // HXPlatform::mach_vm_region_shares for a mapping by its index.
    std::vector<vm_region_share> sharesOf(size_t index) const;

    // The address space, once read, as it is.
    const HXAddressSpace &addressSpace() const { return *_addressSpace; }
    // The index in the address space, once read, of the first mapping that ends above `address`. A walk in
    // ascending order costs no search.
    size_t find(uint64_t address);
    // Of the address space, once read.
    HXPageReader &pages() { return *_pages; }
    // How the address space, once read, differs from the counters all the same; none when it does not.
    const std::optional<HXWalkDifference> &difference() const { return _difference; }

    // The process's status; none with errno set. `usage` and `ledger` share one reading when they are asked
    // for one after the other; a second one of either kind reads anew.
    enum class StatusUse { usage, ledger };
    std::optional<HXStatusRecord> status(StatusUse use);

  private:
    HXDescriptor reopen();
    void read(const HXReaderSetting &setting, bool needsDirtyPages);
    void readOnce(const HXReaderSetting &setting, bool needsDirtyPages);
    void settle(const HXReaderSetting &setting);
    bool readLazilyFreed(const HXReaderSetting &setting);
    void finishReading(const HXReaderSetting &setting);
    void compare(const HXReaderSetting &setting, bool isFirst);

    const int32_t _pid;
    const uint32_t _number;
    const uint64_t _startTime; // clock ticks since boot
    const uint64_t _startStack;
    HXLinuxProcesses &_processes;
    HXDescriptorTurns &_turns;
    HXDescriptor _directory;
    HXDescriptor _maps; // until the first reading
    const std::chrono::steady_clock::time_point _opened = std::chrono::steady_clock::now();
    std::unique_ptr<HXAddressSpace> _addressSpace;
    size_t _cursor = 0;
    std::optional<HXPageReader> _pages;
    std::optional<HXStatusRecord> _status;
    const uint64_t _residentSize;
    std::optional<HXWalkDifference> _difference;
    bool _awaitsSettling = false; // shared pages have been taken
    bool _mayBeLazilyFreed = false;
    std::vector<HXSharedPages::Share> _shares;
    bool _used[2] = {};
};

// The open tasks by port and by pid. Any thread.
class HXTaskTable {
  public:
    // The port of a new task, which lives until `remove`; no port is given twice.
    uint32_t add(std::unique_ptr<HXLinuxTask> task);
    void remove(uint32_t port);
    // Null for a port that was never given. Threads other than that which has removed one
    // must not ask for it.
    HXLinuxTask *find(uint32_t port) const;
    size_t count() const;
    // Of each process the task that was opened last, ascending by pid.
    std::vector<HXLinuxTask *> all() const;
    // The task of `pid` that was opened last and is open still; null when there is none.
    HXLinuxTask *findByPid(int32_t pid) const;

  private:
    inline static std::atomic<uint64_t> _tables = 0; // that there were
    const uint64_t _number = ++_tables;
    mutable HXAdaptiveMutex _mutex;
    std::unordered_map<uint32_t, std::unique_ptr<HXLinuxTask>> _tasks;
    std::unordered_map<int32_t, uint32_t> _portsByPid;
    uint32_t _nextPort = 0x100; // lower ones are the host's
};
