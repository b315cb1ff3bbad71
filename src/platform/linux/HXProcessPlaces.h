// Whose a process is and where it runs: its user, its systemd unit and its container, for reports that add
// processes up. Live processes only.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

// A control group that has a name of its own, as its path in a hierarchy tells.
struct HXNamedGroup {
    std::string name; // empty: there is none
    std::string path; // the group's, in its hierarchy
};
// The last unit (*.service, *.scope) and the first container that are on a path of control groups. A unit in
// a container is named with it. Made safe.
struct HXGroupNames {
    HXNamedGroup unit;
    HXNamedGroup container; // "docker:0123456789ab", "lxc:NAME", …; an identifier is cut to twelve digits
};
HXGroupNames HXNamesOnPath(std::string_view path);

// /proc/PID/cgroup (cgroups(7)): the path in the unified hierarchy, that of systemd's own where there are
// version 1 hierarchies, and that of the memory controller of version 1. Empty: no such line.
struct HXGroupPaths {
    std::string unified;
    std::string systemd;
    std::string memory;
};
HXGroupPaths HXParseGroups(std::string_view text);
// The effective user in /proc/PID/status (proc(5)), as ps(1) shows it; none when there is no such line.
std::optional<uint32_t> HXParseUser(std::string_view status);

// One thread. Asks anew each time, but for the names of users.
class HXProcessPlaces {
  public:
    struct Place {
        std::string user; // a number where it has no name
        HXGroupNames groups;
        HXGroupNames memoryGroups; // in the hierarchy of version 1's memory controller
    };

    explicit HXProcessPlaces(std::string procPath = "/proc", std::string groupPath = "/sys/fs/cgroup")
        : _procPath(std::move(procPath)), _groupPath(std::move(groupPath)) {}

    // None when the process has ended or may not be looked at.
    std::optional<Place> placeOf(int32_t pid);
    // Bytes that the kernel has charged to a control group, page cache and kernel memory included
    // (memory.current of cgroup-v2, memory.usage_in_bytes of version 1); none where it does not count. The
    // paths of the unified hierarchy and of version 1's memory controller; either may be empty.
    std::optional<uint64_t> memoryOf(const std::string &unified, const std::string &memory) const;

  private:
    const std::string &nameOfUser(uint32_t user);

    std::string _procPath;
    std::string _groupPath;
    std::unordered_map<uint32_t, std::string> _users;
};
