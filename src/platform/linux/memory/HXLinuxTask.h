// One process that has been opened for examination.
#pragma once

#include "platform/linux/memory/HXAddressSpaceReader.h"
#include "platform/linux/memory/HXPageReader.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcText.h"

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <unordered_map>

// Everything is read through the process's directory in /proc, held open: once the process is gone those
// reads fail, whoever has its pid then. Used by one thread at a time.
class HXLinuxTask {
  public:
    HXLinuxTask(int32_t pid, HXDescriptor directory, uint32_t pageShift)
        : _pid(pid), _directory(std::move(directory)), _pages(_directory.get(), pageShift) {}
    HXLinuxTask(const HXLinuxTask &) = delete;
    HXLinuxTask &operator=(const HXLinuxTask &) = delete;

    int32_t pid() const { return _pid; }
    int directory() const { return _directory.get(); }

    // The address space as it was when this was first asked for; read again when dirty file pages are wanted
    // of one that was read without them.
    const HXAddressSpace &addressSpace(const HXReaderSetting &setting, bool needsDirtyPages);
    // The index in the address space, once read, of the first mapping that ends above `address`. A walk in
    // ascending order costs no search.
    size_t find(uint64_t address);
    HXPageReader &pages() { return _pages; }

    // The process's status; none with errno set. `usage` and `ledger` share one reading when they are asked
    // for one after the other; a second one of either kind reads anew.
    enum class StatusUse { usage, ledger };
    std::optional<HXStatusRecord> status(StatusUse use);

  private:
    const int32_t _pid;
    const HXDescriptor _directory;
    const std::chrono::steady_clock::time_point _opened = std::chrono::steady_clock::now();
    std::unique_ptr<HXAddressSpace> _addressSpace;
    size_t _cursor = 0;
    HXPageReader _pages;
    std::optional<HXStatusRecord> _status;
    bool _used[2] = {};
};

// The open tasks by port and by pid. Any thread; looking up a port takes no lock.
class HXTaskTable {
  public:
    static constexpr uint32_t firstPort = 0x100;

    HXTaskTable() = default;
    HXTaskTable(const HXTaskTable &) = delete;
    HXTaskTable &operator=(const HXTaskTable &) = delete;
    ~HXTaskTable();

    // The port of a new task, which lives until `remove`; 0 when there are too many.
    uint32_t add(std::unique_ptr<HXLinuxTask> task);
    void remove(uint32_t port);
    // Null for a port that is none.
    HXLinuxTask *find(uint32_t port) const;
    // The task of `pid` that was opened last and is open still; null when there is none.
    HXLinuxTask *findByPid(int32_t pid) const;

  private:
    static constexpr uint32_t chunkLength = 1024, chunkCount = 8192;
    using Chunk = std::array<std::atomic<HXLinuxTask *>, chunkLength>; // owns its tasks

    mutable std::mutex _mutex;
    std::unordered_map<int32_t, uint32_t> _portsByPid;
    uint32_t _count = 0;
    std::array<std::atomic<Chunk *>, chunkCount> _chunks{};
};
