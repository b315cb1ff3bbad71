// What the memory model knows of a process.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

// The owner of regions: one analysed process, whatever its source. Owners compare and hash by pid.
class HXRegionOwner {
  public:
    HXRegionOwner() = default;
    virtual ~HXRegionOwner() = default;
    HXRegionOwner(const HXRegionOwner &) = delete;
    HXRegionOwner &operator=(const HXRegionOwner &) = delete;

    int32_t pid() const { return _pid; }
    void setPid(int32_t pid) { _pid = pid; }
    // Bytes in a page of the process, a power of two.
    uint32_t pageSize() const { return _pageSize; }
    void setPageSize(uint32_t size) { _pageSize = size; }
    // Whether dirty sizes of this process's regions are the kernel's charge.
    virtual bool breakDownPhysHeft() const = 0;
    // How reports name the process: "NAME [PID]".
    const std::string &displayString() const { return _displayString; }
    void setDisplayString(std::string_view text) { _displayString = text; }

    uint64_t hash() const { return static_cast<uint64_t>(static_cast<int64_t>(_pid)); }
    bool isEqual(const HXRegionOwner &other) const { return _pid == other._pid; }
    // The pid, as the key in maps of processes.
    int32_t asNumber() const { return _pid; }
    // "HXProcess[PID]".
    std::string description() const { return "HXProcess[" + std::to_string(_pid) + "]"; }

  protected:
    std::string _displayString;

  private:
    int32_t _pid = 0;
    uint32_t _pageSize = 0;
};
