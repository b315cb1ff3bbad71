// Shared memory that targets hold without mapping it, and what of the kernel's nobody maps.
#include "analysis/HXHeft.h"
#include "process/HXKernelProcess.h"

#include <algorithm>
#include <utility>

namespace {

using Answer = std::vector<task_held_object>;

// Asks for `count` answers, several at once. One that does not come is empty.
std::vector<Answer> askAll(size_t count, std::function<Answer(size_t)> ask) {
    HXServices &services = HXPlatform::current().services();
    const HXDispatchQueue queue = services.dispatch_queue_create("org.heft.held", QOS_CLASS_UTILITY);
    const auto answers = std::make_shared<std::vector<Answer>>(count); // whoever is given up writes here
    const auto givenUp = services.dispatch_apply(
        count, queue, [answers, ask = std::move(ask)](size_t i) { (*answers)[i] = ask(i); });
    std::vector<Answer> taken(count);
    for (size_t i = 0; i < count; i++)
        if (!std::binary_search(givenUp.begin(), givenUp.end(), i)) taken[i] = std::move((*answers)[i]);
    return taken;
}

// Bytes of `all` that are not among `part`: what one process maps and another has freed may be more.
uint64_t difference(uint64_t all, uint64_t part) {
    return all - std::min(all, part);
}

// An object that is held.
struct Held {
    task_held_object object;
    // Dirty (here: all that is resident) and swapped, as regions show it, or the objects that it contains.
    HXSizes known;
    bool isContainer = false;
    std::vector<size_t> holders; // by their places among the targets

    bool isWhole() const { return (object.flags & TASK_HELD_WHOLE) != 0; }
    // How much of the whole is swapped out the kernel does not say.
    uint64_t restSize() const {
        return isWhole() ? difference(object.resident_size, known.dirty)
                         : difference(object.resident_size + object.swapped_size, known.heft());
    }
    uint64_t swappedRestSize() const {
        return std::min(restSize(), difference(object.swapped_size, known.swapped));
    }
    // All of it. A file system tells only how much is resident and swapped out together.
    HXSizes sizes() const {
        HXSizes all = known;
        const uint64_t elsewhere = isContainer ? known.swapped : 0;
        all.dirty = std::max(known.dirty, difference(object.resident_size, elsewhere));
        all.swapped = std::max(known.swapped, object.swapped_size);
        return all;
    }
};

// All objects that are held, in the order in which they were first met.
class HeldObjects {
  public:
    void add(size_t holder, const Answer &answer) {
        for (const task_held_object &object : answer) {
            if (object.flags & TASK_HELD_WHOLE && !HXHeftSwitches::examinesWholeMachine()) continue;
            const auto [position, isNew] = _index.try_emplace(object.object_id, _all.size());
            Held &held = isNew ? _all.emplace_back(Held{object, {}, false, {}}) : _all[position->second];
            // It may have grown between two answers.
            held.object.resident_size = std::max(held.object.resident_size, object.resident_size);
            held.object.swapped_size = std::max(held.object.swapped_size, object.swapped_size);
            if (held.object.name.empty()) held.object.name = object.name;
            held.holders.push_back(holder);
        }
    }

    // Takes the regions as they are by now.
    explicit HeldObjects(const HXHeft &heft)
        : _objectCount(heft.memoryObjects().size()), _mapped(mappedObjects(heft)) {}

    // Works out what of each object is known otherwise, anew when more have been added.
    void count() {
        for (Held &held : _all)
            held.known = {};
        countRegions();
        countParts();
    }

    // Whether the whole has a rest beyond the error of the kernel's counters.
    bool leavesMuchOpen() {
        constexpr uint64_t leastRestSize = 1 << 20, leastShare = 200; // a mebibyte and 0.5 %
        const Held *whole = this->whole();
        return whole && whole->restSize() > leastRestSize &&
               whole->restSize() > whole->object.resident_size / leastShare;
    }

    std::vector<Held> &all() { return _all; }

  private:
    // An identifier, and an object with a region of that identifier.
    using Mapped = std::vector<std::pair<uint64_t, const HXMemoryObject *>>;

    // Of all regions that may be of what is held, in their order.
    static Mapped mappedObjects(const HXHeft &heft) {
        Mapped mapped;
        std::vector<bool> isThere(heft.memoryObjects().size()); // with its first region's identifier
        for (const auto &process : heft.processes()) {
            for (const HXMemoryRegion &region : process->memoryRegions()) {
                if (region.share_mode() == SM_PRIVATE) continue; // most of all
                const HXMemoryObject &object = *region.memoryObject();
                const uint64_t id = region.object_id();
                const bool isUsual = id == object.memoryRegions().front()->object_id();
                if (isUsual && isThere[object.index()]) continue;
                if (isUsual) isThere[object.index()] = true;
                mapped.emplace_back(id, &object);
            }
        }
        return mapped;
    }

    // Each merged object once: where several processes have copied the object's pages on write, each has one.
    void countRegions() {
        std::vector<bool> counted(_objectCount);
        for (const auto &[id, object] : _mapped) {
            Held *held = find(id);
            if (!held || counted[object->index()]) continue;
            counted[object->index()] = true;
            held->known += object->sizes();
        }
    }

    // Tells containers what they contain. Objects whose container is not known, and containers, are parts of
    // the whole.
    void countParts() {
        Held *const whole = this->whole();
        for (const Held &held : _all)
            if (Held *container = find(held.object.container_id)) container->isContainer = true;
        const auto addTo = [](Held *container, const Held &part) {
            if (container && container != &part) container->known += part.sizes();
        };
        for (const Held &held : _all) {
            if (held.isContainer) continue;
            Held *const container = find(held.object.container_id);
            addTo(container ? container : whole, held);
        }
        for (const Held &held : _all)
            if (held.isContainer) addTo(whole, held);
    }

    Held *find(uint64_t id) {
        const auto found = _index.find(id);
        return found == _index.end() ? nullptr : &_all[found->second];
    }
    Held *whole() {
        const auto found =
            std::find_if(_all.begin(), _all.end(), [](const Held &held) { return held.isWhole(); });
        return found == _all.end() ? nullptr : &*found;
    }

    const size_t _objectCount;
    const Mapped _mapped;
    std::vector<Held> _all;
    std::unordered_map<uint64_t, size_t> _index;
};

// Where the pages lie in the object nobody says: all holders have the same.
HXMemoryRegion regionOfRest(const Held &held) {
    HXMemoryRegion region;
    region.setStart(kNoAddress);
    region.setSize(held.restSize());
    region.setSwappedSize(held.swappedRestSize());
    region.setDirtySize(held.restSize() - held.swappedRestSize());
    region.setShare_mode(SM_SHARED);
    region.setSegment(HXSegmentNoImage);
    region.setObject_id(held.object.object_id);
    region.setName(held.object.name);
    region.setDetailedName(held.object.detail);
    return region;
}

Answer askKernel() {
    HXPlatform &platform = HXPlatform::current();
    return platform.host_held_objects(platform.mach_host_self());
}

} // namespace

void HXHeft::_addHeldObjects() {
    HeldObjects held(*this);
    for (size_t i = 0; i < _processes.size(); i++) {
        held.add(i, _processes[i]->heldObjects());
        if (dynamic_cast<const HXKernelProcess *>(_processes[i].get()))
            held.add(i, askAll(1, [](size_t) { return askKernel(); }).front());
    }
    held.count();
    if (held.leavesMuchOpen()) {
        std::vector<int32_t> pids;
        for (const auto &process : _processes)
            pids.push_back(process->pid());
        const auto answers = askAll(
            pids.size(), [pids](size_t i) { return HXPlatform::current().proc_held_objects(pids[i]); });
        for (size_t i = 0; i < answers.size(); i++)
            held.add(i, answers[i]);
        held.count();
    }
    for (Held &each : held.all()) {
        if (each.object.name.empty() || each.restSize() == 0) continue;
        if (each.isWhole() && !held.leavesMuchOpen()) continue;
        std::sort(each.holders.begin(), each.holders.end());
        HXMemoryObject &object = _objects.add();
        HXProcess *last = nullptr;
        for (const size_t holder : each.holders)
            if (std::exchange(last, _processes[holder].get()) != _processes[holder].get())
                merge(last->memoryRegions().emplace_back(regionOfRest(each)), *last, object);
        object.finalize();
    }
}
