// Who shares what: the exact set of processes behind every object.
#include "analysis/HXHeft.h"

#include <algorithm>
#include <map>
#include <unordered_set>

namespace {

// The sets of processes met so far, as paths in a tree: a set's last member and the set without it. Processes
// are added in target order, so one set has one path (but see `unified`), and adding a process to a set costs
// one lookup however large the set is.
class MemberSets {
  public:
    static constexpr uint32_t kEmpty = 0;

    explicit MemberSets(const HXHeft::ProcessList &processes) {
        std::unordered_set<int32_t> seen;
        for (const auto &process : processes)
            if (!seen.insert(process->pid()).second) _repeatedPids.insert(process->pid());
    }

    // The set `set` with the process.
    uint32_t adding(const HXProcess &process, uint32_t set) {
        const int32_t pid = process.pid();
        if (holds(set, pid)) return set;
        const uint64_t key = uint64_t{set} << 32 | static_cast<uint32_t>(pid);
        const auto [next, isNew] = _next.try_emplace(key, static_cast<uint32_t>(_sets.size()));
        if (isNew) _sets.push_back({&process, set});
        return next->second;
    }

    // The members in the order in which they came.
    HXProcessGroup::Processes members(uint32_t set) const {
        HXProcessGroup::Processes members;
        for (; set != kEmpty; set = _sets[set].without)
            members.push_back(_sets[set].last);
        std::reverse(members.begin(), members.end());
        return members;
    }

    size_t size() const { return _sets.size(); }

    // The first of all paths asked for that have the members of `set`: where several records have one pid, it
    // can follow in one path what it goes before in another.
    uint32_t unified(uint32_t set) {
        if (_repeatedPids.empty()) return set;
        std::vector<int32_t> members;
        for (uint32_t rest = set; rest != kEmpty; rest = _sets[rest].without)
            members.push_back(_sets[rest].last->pid());
        std::sort(members.begin(), members.end());
        return _byMembers.try_emplace(std::move(members), set).first->second;
    }

  private:
    struct Set {
        const HXProcess *last;
        uint32_t without;
    };

    bool holds(uint32_t set, int32_t pid) const {
        if (set == kEmpty) return false;
        if (_sets[set].last->pid() == pid) return true;
        // Only several records of one pid can have put it further down.
        if (_repeatedPids.empty() || !_repeatedPids.contains(pid)) return false;
        for (; set != kEmpty; set = _sets[set].without)
            if (_sets[set].last->pid() == pid) return true;
        return false;
    }

    std::vector<Set> _sets = {{nullptr, kEmpty}};
    std::unordered_map<uint64_t, uint32_t> _next;
    std::unordered_set<int32_t> _repeatedPids;
    std::map<std::vector<int32_t>, uint32_t> _byMembers; // only where pids repeat
};

// Whether an object counts for a process that is gathered only to find memory owned by the shown ones in it.
bool countsForHidden(const HXMemoryObject &object, const std::unordered_set<int32_t> &shownPids) {
    return object.ownerPid() != HXMemoryObject::kNoOwner && shownPids.contains(object.ownerPid()) &&
           object.containsFakeRegion();
}

// Objects in the order in which they were first met, and the set of processes of each (by object index).
struct GroupedObjects {
    std::vector<const HXMemoryObject *> order;
    std::vector<uint32_t> setOf;
};

GroupedObjects groupObjects(const HXHeft &heft, MemberSets &sets) {
    std::unordered_set<int32_t> shownPids;
    for (const HXProcess *process : heft._notHiddenProcesses())
        shownPids.insert(process->pid());
    GroupedObjects grouped;
    grouped.setOf.resize(heft.memoryObjects().size(), MemberSets::kEmpty);
    grouped.order.reserve(heft.memoryObjects().size());
    for (const auto &process : heft.processes()) {
        for (const HXMemoryRegion &region : process->memoryRegions()) {
            const HXMemoryObject *object = region.memoryObject();
            if (process->hiddenFromDisplay() && !countsForHidden(*object, shownPids)) continue;
            uint32_t &set = grouped.setOf[object->index()];
            if (set == MemberSets::kEmpty) grouped.order.push_back(object);
            set = sets.adding(*process, set);
        }
    }
    return grouped;
}

void indexGroupByProcess(const HXProcessGroup &group, HXHeftSharingData &sharing) {
    for (const HXRegionOwner *process : group.processes()) {
        HXHeftSharingData::Groups &groups = sharing.processToProcessGroups[process->pid()];
        if (group.isPrivate())
            groups.insert(groups.begin(), &group);
        else
            groups.push_back(&group);
    }
}

} // namespace

HXHeftSharingData HXHeft::_sharingData() const {
    MemberSets sets(_processes);
    const GroupedObjects grouped = groupObjects(*this, sets);
    HXHeftSharingData sharing;
    std::vector<std::pair<const HXProcessGroup *, HXHeftSharingData::Objects *>> bySet(sets.size());
    std::vector<uint32_t> counts(sets.size());
    for (const uint32_t set : grouped.setOf)
        counts[set]++;
    for (const HXMemoryObject *object : grouped.order) {
        const uint32_t set = sets.unified(grouped.setOf[object->index()]);
        auto &[group, objects] = bySet[set];
        if (!group) {
            group = &sharing.groups.emplace_back(sets.members(set));
            indexGroupByProcess(*group, sharing);
            objects = &sharing.processGroupToObjects[group];
            objects->reserve(counts[set]);
        }
        objects->push_back(object);
    }
    return sharing;
}
