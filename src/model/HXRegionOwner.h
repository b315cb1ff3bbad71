// What the memory model knows of a process.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

// The owner of regions: one analysed process, whatever its source. Owners of one pid are equal.
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

    bool isEqual(const HXRegionOwner &other) const { return _pid == other._pid; }

  protected:
    std::string _displayString;

  private:
    int32_t _pid = 0;
    uint32_t _pageSize = 0;
};
