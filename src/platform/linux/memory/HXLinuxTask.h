// One process that has been opened for examination.
#pragma once

#include "platform/linux/memory/HXAddressSpaceReader.h"
#include "platform/linux/memory/HXPageReader.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcText.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <unordered_map>

// Everything is read through the process's directory in /proc, held open: once the process is gone those
// reads fail, whoever has its pid then. Used by one thread at a time.
class HXLinuxTask {
  public:
    // `number`: HXObjectIdentifiers::numberOfProcess.
    HXLinuxTask(int32_t pid, uint32_t number, HXDescriptor directory)
        : _pid(pid), _number(number), _directory(std::move(directory)) {}
    HXLinuxTask(const HXLinuxTask &) = delete;
    HXLinuxTask &operator=(const HXLinuxTask &) = delete;

    int32_t pid() const { return _pid; }
    uint32_t number() const { return _number; }
    const HXDescriptor &directory() const { return _directory; }

    // The address space as it was when this was first asked for; read again when dirty file pages are wanted
    // of one that was read without them.
    const HXAddressSpace &addressSpace(const HXReaderSetting &setting, bool needsDirtyPages);
    // The index in the address space, once read, of the first mapping that ends above `address`. A walk in
    // ascending order costs no search.
    size_t find(uint64_t address);
    // Of the address space, once read.
    HXPageReader &pages() { return *_pages; }

    // The process's status; none with errno set. `usage` and `ledger` share one reading when they are asked
    // for one after the other; a second one of either kind reads anew.
    enum class StatusUse { usage, ledger };
    std::optional<HXStatusRecord> status(StatusUse use);

  private:
    const int32_t _pid;
    const uint32_t _number;
    const HXDescriptor _directory;
    const std::chrono::steady_clock::time_point _opened = std::chrono::steady_clock::now();
    std::unique_ptr<HXAddressSpace> _addressSpace;
    size_t _cursor = 0;
    std::optional<HXPageReader> _pages;
    std::optional<HXStatusRecord> _status;
    bool _used[2] = {};
};

// The open tasks by port and by pid. Any thread.
class HXTaskTable {
  public:
    // The port of a new task, which lives until `remove`; no port is given twice.
    uint32_t add(std::unique_ptr<HXLinuxTask> task);
    void remove(uint32_t port);
    // Null for a port that is none.
    HXLinuxTask *find(uint32_t port) const;
    // The task of `pid` that was opened last and is open still; null when there is none.
    HXLinuxTask *findByPid(int32_t pid) const;

  private:
    mutable std::shared_mutex _mutex;
    std::unordered_map<uint32_t, std::unique_ptr<HXLinuxTask>> _tasks;
    std::unordered_map<int32_t, uint32_t> _portsByPid;
    uint32_t _nextPort = 0x100; // lower ones are the host's
};
