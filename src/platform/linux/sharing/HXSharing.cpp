#include "platform/linux/sharing/HXSharing.h"

#include "platform/linux/memory/HXMappingClass.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTextNumber.h"
#include "platform/linux/sharing/HXFamilyColumns.h"
#include "platform/linux/sharing/HXFamilyShares.h"

#include <fcntl.h>
#include <sys/resource.h>

#include <algorithm>
#include <atomic>
#include <iterator>

namespace {

// How many page tables may be open at once: a quarter of the descriptors.
size_t mostOpenMembers() {
    constexpr rlim_t share = 4, enough = 1 << 16;
    rlimit limit;
    return ::getrlimit(RLIMIT_NOFILE, &limit) != 0 ? 0 : std::min(limit.rlim_cur / share, enough);
}

bool holdsPages(const HXMapping &mapping) {
    return (mapping.anonymousPages | mapping.swappedPages | mapping.hugePages) != 0;
}

// Without a page map where the task cannot be compared with others.
HXFamilyMember memberOf(const HXLinuxTask &task, uint32_t pageShift) {
    HXFamilyMember member;
    const HXAddressSpace &addressSpace = task.addressSpace();
    if (addressSpace.endError != KERN_INVALID_ADDRESS || addressSpace.count() == 0) return member;
    member.pagemap = HXOpenAt(task.directory(), "pagemap");
    for (size_t i = 0; i < addressSpace.count(); i++) {
        const HXMapping &mapping = addressSpace[i];
        if (!HXMayShareAfterFork(mapping)) continue;
        if (!addressSpace.lacksPrivatePages && !holdsPages(mapping)) continue;
        member.ranges.push_back({mapping.start >> pageShift, mapping.end >> pageShift,
                                 static_cast<uint32_t>(i), mapping.isFile()});
    }
    return member;
}

} // namespace

// A family while it is read. Readers that are given up keep what they touch alive.
struct HXSharing::Work {
    struct Slot {
        std::unique_ptr<HXFamilyPages> pages;
        std::atomic<uint32_t> reading = 0; // the member
    };

    std::vector<HXFamilyTask> tasks;
    std::shared_ptr<HXFamily> family;
    std::vector<HXPageStretch> stretches;
    std::shared_ptr<std::vector<Slot>> slots;
    std::atomic<size_t> unread = 0; // stretches
    std::shared_ptr<HXSeenKeys> repeated;
    std::optional<HXFamilyPages> pages;
    bool hasFailed = false;
};

std::set<int32_t> HXSharing::examine(const std::vector<HXLinuxTask *> &tasks) {
    std::vector<Tasks> families = findFamilies(tasks);
    if (families.empty()) return {};
    _entries = std::make_shared<HXPageEntries>(_setting.reader->pageShift);
    if (!_entries->tellFrames()) {
        measureNotTold(families);
        return _unanswering;
    }
    _findsLazilyFreed =
        _setting.reader->machine->hasFreedLazily(std::chrono::steady_clock::now()) && HXFrameFlags::areTold();
    // As many families at once as there are descriptors for.
    const size_t most = mostOpenMembers();
    for (size_t first = 0; first < families.size();) {
        std::vector<Tasks> batch;
        size_t members = 0;
        for (; first < families.size() && (batch.empty() || members + families[first].size() <= most);
             first++) {
            members += families[first].size();
            batch.push_back(std::move(families[first]));
        }
        if (members <= most)
            readFamilies(std::move(batch));
        else
            measureNotTold(batch);
    }
    return _unanswering;
}

// What the kernel counts for each process beyond its share of it.
void HXSharing::measureNotTold(const std::vector<Tasks> &families) {
    Tasks all;
    for (const Tasks &family : families)
        all.insert(all.end(), family.begin(), family.end());
    const auto size = std::make_shared<std::atomic<uint64_t>>(0);
    const auto givenUp = _setting.services->dispatch_apply(all.size(), newQueue(), [all, size](size_t i) {
        char text[4096]; // of some 25 lines
        const auto rollup = HXReadOnce(all[i]->directory(), "smaps_rollup", text);
        if (!rollup) return;
        const auto whole = HXParseLabelled(*rollup, "Anonymous:"),
                   share = HXParseLabelled(*rollup, "Pss_Anon:");
        if (whole && share && *whole > *share) *size += (*whole - *share) * 1024;
    });
    for (const size_t i : givenUp)
        _unanswering.insert(all[i]->pid());
    _sizeNotTold = _sizeNotTold.value_or(0) + *size;
}

HXDispatchQueue HXSharing::newQueue() const {
    return _setting.services->dispatch_queue_create("org.heft.sharing", QOS_CLASS_UTILITY);
}

// Processes that were forked from each other and executed nothing since have their stacks at one place, which
// is drawn anew by every execve(2). Where it is not, strangers are one family: that takes longer and changes
// nothing.
std::vector<HXSharing::Tasks> HXSharing::findFamilies(const Tasks &tasks) {
    const Tasks merged = findMerged(tasks); // ascending by pid, like the rest
    std::map<uint64_t, Tasks> byStack;
    for (HXLinuxTask *task : tasks)
        if (task->startStack() != 0) byStack[task->startStack()].push_back(task);
    std::vector<Tasks> families;
    Tasks united;
    for (auto &[start, family] : byStack) {
        const bool isMerged = std::any_of(family.begin(), family.end(), [&](const HXLinuxTask *task) {
            return std::find(merged.begin(), merged.end(), task) != merged.end();
        });
        if (isMerged)
            united.insert(united.end(), family.begin(), family.end());
        else if (family.size() > 1)
            families.push_back(std::move(family));
    }
    std::sort(united.begin(), united.end(),
              [](const HXLinuxTask *a, const HXLinuxTask *b) { return a->pid() < b->pid(); });
    if (!united.empty()) families.push_back(std::move(united)); // of one, too: it may hold a page twice
    return families;
}

// The tasks that say that the kernel has merged equal pages of theirs with others
// (Documentation/admin-guide/mm/ksm.rst). Their children need not say so.
HXSharing::Tasks HXSharing::findMerged(const Tasks &tasks) {
    char buffer[64];
    const auto shared =
        HXReadOnce(AT_FDCWD, (_setting.sysPath + "/kernel/mm/ksm/pages_shared").c_str(), buffer);
    uint64_t pages = 0;
    if (!shared || !HXTextCursor{*shared}.number(&pages) || pages == 0) return {};
    const auto isMerged = std::make_shared<std::vector<std::atomic<bool>>>(tasks.size());
    (void)_setting.services->dispatch_apply(tasks.size(), newQueue(), [tasks, isMerged](size_t i) {
        char text[512];
        const auto figures = HXReadOnce(tasks[i]->directory(), "ksm_stat", text);
        // A kernel that does not tell (before 6.1) may have merged any.
        (*isMerged)[i] = !figures || HXParseLabelled(*figures, "ksm_merging_pages ").value_or(1) != 0;
    });
    Tasks merged;
    for (size_t i = 0; i < tasks.size(); i++)
        if ((*isMerged)[i]) merged.push_back(tasks[i]);
    return merged;
}

void HXSharing::readFamilies(std::vector<Tasks> families) {
    Members members = readAddressSpaces(families);
    std::vector<std::shared_ptr<Work>> works;
    for (const Tasks &family : families)
        if (auto work = open(family, members)) works.push_back(std::move(work));
    readPages(works, false);
    std::vector<std::shared_ptr<Work>> repeating;
    for (const auto &work : works) {
        if (work->hasFailed || work->pages->metAgain.empty()) continue;
        work->repeated = std::make_shared<HXSeenKeys>();
        HXSeenKeys::Cursor repeated(*work->repeated);
        for (const HXPageKey key : work->pages->metAgain)
            repeated.add(key);
        repeating.push_back(work);
    }
    readPages(repeating, true);
    HXDispatchQueue queue = newQueue();
    queue.isOwnWork = true;
    (void)_setting.services->dispatch_apply(works.size(), queue,
                                            [this, works](size_t i) { give(*works[i]); });
}

// Those that answer; the others are no longer in their families.
HXSharing::Members HXSharing::readAddressSpaces(std::vector<Tasks> &families) {
    Tasks all;
    for (const Tasks &family : families)
        all.insert(all.end(), family.begin(), family.end());
    const auto found = std::make_shared<std::vector<HXFamilyMember>>(all.size());
    const auto read = [all, found, reader = _setting.reader, needsDirtyPages = _setting.needsDirtyPages,
                       findsLazilyFreed = _findsLazilyFreed](size_t i) {
        all[i]->withDescriptors([&] {
            all[i]->readForSharing(*reader, needsDirtyPages, findsLazilyFreed);
            (*found)[i] = memberOf(*all[i], reader->pageShift);
        });
    };
    HXDispatchQueue queue = newQueue();
    queue.activity = "reading processes";
    queue.processOf = [&all](size_t i) { return std::to_string(all[i]->pid()); };
    for (const size_t i : _setting.services->dispatch_apply(all.size(), queue, read)) {
        _unanswering.insert(all[i]->pid());
        for (Tasks &family : families)
            std::erase(family, all[i]);
    }
    Members members;
    for (size_t i = 0; i < all.size(); i++)
        if (!_unanswering.contains(all[i]->pid())) members[all[i]] = std::move((*found)[i]);
    return members;
}

// Null where nothing is shared, or what is cannot be read: every page is its task's own then.
std::shared_ptr<HXSharing::Work> HXSharing::open(const Tasks &tasks, Members &members) {
    auto work = std::make_shared<Work>();
    work->family = std::make_shared<HXFamily>();
    work->family->entries = _entries;
    work->family->seen = std::make_shared<HXSeenKeys>();
    for (HXLinuxTask *task : tasks) {
        const HXAddressSpace *const addressSpace = task->addressSpaceRead();
        if (addressSpace == nullptr) continue;
        HXFamilyMember member = std::move(members[task]);
        if (!member.pagemap || addressSpace->endError != KERN_INVALID_ADDRESS) {
            task->forget();
            continue;
        }
        work->tasks.push_back({task, addressSpace});
        work->family->members.push_back(std::move(member));
    }
    if (work->tasks.empty()) return nullptr;
    work->stretches = HXStretchesOfFamily(*work->family);
    return work;
}

void HXSharing::readPages(std::vector<std::shared_ptr<Work>> &families, bool isSecond) {
    std::vector<std::pair<std::shared_ptr<Work>, size_t>> items;
    for (const auto &work : families) {
        work->slots = std::make_shared<std::vector<Work::Slot>>(work->stretches.size());
        work->unread = work->stretches.size();
        for (size_t i = 0; i < work->stretches.size(); i++)
            items.emplace_back(work, i);
    }
    const auto isCancelled = _setting.isCancelled;
    const auto pidOf = [&items](size_t i) {
        const auto &[work, stretch] = items[i];
        return work->tasks[(*work->slots)[stretch].reading].task->pid();
    };
    const auto read = [items, isSecond, isCancelled, findsLazilyFreed = _findsLazilyFreed,
                       pageShift = _setting.reader->pageShift](size_t i) {
        const auto &[work, stretch] = items[i];
        const auto slots = work->slots;
        if (isCancelled()) return;
        Work::Slot &slot = (*slots)[stretch];
        slot.pages = HXReadColumns({work->family, work->stretches[stretch], pageShift,
                                    isSecond ? work->repeated : nullptr, findsLazilyFreed},
                                   &slot.reading);
        // The next family then takes the same memory.
        if (--work->unread == 0) work->family->seen->clear();
    };
    const auto costOf = [&items](size_t i) {
        const auto &[work, stretch] = items[i];
        return HXCostOfStretch(*work->family, work->stretches[stretch]);
    };
    HXDispatchQueue queue = newQueue();
    queue.activity = "comparing pages";
    queue.processOf = [&](size_t i) { return std::to_string(pidOf(i)); };
    queue.costOf = costOf;
    for (const size_t i : _setting.services->dispatch_apply(items.size(), queue, read)) {
        items[i].first->hasFailed = true;
        _unanswering.insert(pidOf(i));
    }
    constexpr size_t mostSets = size_t{1} << 17;
    for (const auto &work : families) {
        if (work->hasFailed) continue;
        work->pages.emplace(work->tasks.size(), mostSets);
        for (Work::Slot &slot : *work->slots) {
            work->hasFailed |= !slot.pages;
            if (slot.pages) work->pages->add(*slot.pages);
            slot.pages.reset();
        }
    }
}

// On any thread, each once.
void HXSharing::give(Work &work) const {
    std::vector<HXSharedPages> told;
    if (!work.hasFailed)
        told = HXSharesOfFamily(work.tasks, std::move(*work.pages), _setting.reader->pageShift,
                                *_setting.identifiers);
    for (size_t i = 0; i < work.tasks.size(); i++) {
        HXLinuxTask &task = *work.tasks[i].task;
        if (_unanswering.contains(task.pid())) continue; // somebody may be reading it
        if (work.hasFailed)
            task.forget();
        else
            task.takeShared(std::move(told[i]));
    }
    if (!work.hasFailed) work.family->members.clear(); // and its descriptors
}
