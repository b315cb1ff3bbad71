// An exact set of processes that map some memory.
#pragma once

#include "model/HXRegionOwner.h"

#include <cstdint>
#include <string>
#include <unordered_set>
#include <vector>

// Open while members are added, then frozen. Two records with one pid are the same member. Members are not
// owned.
class HXProcessGroup {
  public:
    HXProcessGroup() = default;
    HXProcessGroup(const HXProcessGroup &) = delete;
    HXProcessGroup &operator=(const HXProcessGroup &) = delete;

    bool immutable() const { return _immutable; }
    // The members, in the order in which they were added.
    const std::vector<const HXRegionOwner *> &processes() const { return _processes; }
    // Running hash of the members' pids: it depends on the order in which they were added.
    uint32_t hashValue() const { return _hashValue; }
    uint32_t hash() const { return _hashValue; }

    // Not after freezing.
    void addProcess(const HXRegionOwner &process);
    void freeze() { _immutable = true; }
    // A frozen group equals only itself among frozen ones; with an open one members are compared. An open
    // group is never asked about a frozen one.
    bool isEqual(const HXProcessGroup &other) const;
    bool holds(int32_t pid) const { return _pids.contains(pid); }
    // "HXProcessGroup" and the members' descriptions.
    std::string description() const;

  private:
    bool _immutable = false;
    std::vector<const HXRegionOwner *> _processes;
    std::unordered_set<int32_t> _pids;
    uint32_t _hashValue = 19;
};
