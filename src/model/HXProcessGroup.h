// An exact set of processes that map some memory.
#pragma once

#include "model/HXRegionOwner.h"

#include <utility>
#include <vector>

// Members are not owned, and no two have one pid. Groups are compared by identity: an analysis makes one for
// each set of processes.
class HXProcessGroup {
  public:
    using Processes = std::vector<const HXRegionOwner *>;

    explicit HXProcessGroup(Processes processes) : _processes(std::move(processes)) {}
    HXProcessGroup(const HXProcessGroup &) = delete;
    HXProcessGroup &operator=(const HXProcessGroup &) = delete;

    // The members, in target order.
    const Processes &processes() const { return _processes; }
    // Whether the memory is one process's alone.
    bool isPrivate() const { return _processes.size() == 1; }

  private:
    Processes _processes;
};
