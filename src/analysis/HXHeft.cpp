// Gathering and merging.
#include "analysis/HXHeft.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <span>
#include <utility>

namespace {

constexpr char kQueueLabel[] = "org.heft.gatherdata";

} // namespace

HXHeft::HXHeft(ProcessList processes)
    : _processes(std::move(processes)), _maps(std::make_unique<ObjectMaps>()) {}

HXHeft::~HXHeft() = default;

std::unique_ptr<HXDispatchSource> HXHeft::installCancelHandler(std::function<void()> callback) {
    HXServices &services = HXPlatform::current().services();
    if (services.isatty(1)) return nullptr;
    auto source = services.dispatch_source_create(HX_SIGINT);
    if (!source) return nullptr;
    services.dispatch_source_set_event_handler(*source, std::move(callback));
    services.signal(HX_SIGINT, HXSignalDisposition::ignored);
    services.dispatch_resume(*source);
    return source;
}

// Has the host find out what the processes share.
void HXHeft::examineTogether() {
    constexpr uint64_t least = 1 << 20; // bytes worth a warning
    HXPlatform &platform = HXPlatform::current();
    const auto unanswering = platform.examineTogether(
        [isCancelled = _isCancelled] { return isCancelled->load(std::memory_order_relaxed); });
    for (const int32_t pid : unanswering)
        for (const auto &process : _processes)
            if (process->pid() == pid && process->_isAlive()) setAside(*process);
    const uint64_t notTold = platform.sharedSizeNotTold().value_or(0);
    if (notTold > least)
        _warnings.push_back("Memory shared since fork(2) is counted for each process that has it, "
                            "which adds at most " +
                            std::to_string(notTold) + " bytes (try as root?)");
}

void HXHeft::gatherProcesses() {
    HXServices &services = HXPlatform::current().services();
    const std::vector<HXProcess *> ordered = _processesBySortingPidDesc(_processes);
    HXDispatchQueue queue = services.dispatch_queue_create(kQueueLabel, QOS_CLASS_UTILITY);
    queue.activity = "examining processes";
    queue.processOf = [&ordered](size_t i) { return ordered[i]->displayString(); };
    queue.costOf = [&ordered](size_t i) { return HXPlatform::current().expectedCost(ordered[i]->pid()); };
    const auto givenUp =
        services.dispatch_apply(ordered.size(), queue, [ordered, isCancelled = _isCancelled](size_t i) {
            if (!isCancelled->load(std::memory_order_relaxed)) ordered[i]->gatherData();
        });
    for (const size_t i : givenUp)
        setAside(*ordered[i]);
}

// What a worker may still be writing lives as long as the program; a record that tells why it is missing
// takes its place.
void HXHeft::setAside(const HXProcess &unanswering) {
    static ProcessList kept;
    for (auto &process : _processes) {
        if (process.get() != &unanswering) continue;
        kept.push_back(std::exchange(process, HXProcess::unansweringProcess(unanswering)));
        std::fprintf(stderr, "%s\n", process->errors().front().c_str());
    }
}

void HXHeft::gatherData() {
    examineTogether();
    gatherProcesses();
    if (*_isCancelled)
        HXProcess::_addGlobalError("Heft exited early due to SIGINT and did not finish gathering all data");
    reserveMaps();
    for (const auto &process : _processes)
        _addProcess(*process);
    _maps.reset();
    finalizeObjects();
    // Without all regions what nobody maps is not known.
    if (!*_isCancelled) _addHeldObjects();
    _buildProcessToHeftMap();
}

// Growing a map step by step would move every entry several times.
void HXHeft::reserveMaps() {
    size_t regions = 0;
    for (const auto &process : _processes)
        regions += process->memoryRegions().size();
    _maps->_memoryObjects.reserve(regions);
    _maps->_sharedCache64MemoryObjects.reserve(512);
    _maps->_textMemoryObjects.reserve(2 * _processes.size());
    _maps->_linkeditMemoryObjects.reserve(2 * _processes.size());
}

HXObjectMap &HXHeft::mapForRegion(const HXMemoryRegion &region, const HXProcess &process) {
    if (region.inSharedCache())
        return process.is64bit() ? _maps->_sharedCache64MemoryObjects : _maps->_sharedCache32MemoryObjects;
    if (region.segment() == HXSegmentText) return _maps->_textMemoryObjects;
    if (region.segment() == HXSegmentLinkedit) return _maps->_linkeditMemoryObjects;
    return _maps->_memoryObjects;
}

HXHeft::Place HXHeft::placeOf(HXMemoryRegion &region, const HXProcess &process) {
    constexpr uint64_t noKey = UINT64_MAX;
    uint64_t key = region.inSharedCache() ? region.start() : region.object_id();
    if (key == noKey) return {&region};
    // What a process has copied on write is its own, whoever else maps the object.
    if (region.share_mode() == SM_COW && (region.dirtySize() != 0 || region.swappedSize() != 0))
        key ^= uint64_t{static_cast<uint32_t>(process.pid())} << 32;
    if (key == 0 || key == noKey) return {&region};
    HXObjectMap &map = mapForRegion(region, process);
    map.announce(key);
    return {&region, &map, key};
}

HXMemoryObject &HXHeft::objectAt(const Place &place) {
    if (!place.map) return _objects.add();
    HXMemoryObject *&object = (*place.map)[place.key];
    if (!object) object = &_objects.add();
    return *object;
}

void HXHeft::_addProcess(HXProcess &process) {
    const bool breakDown = breakDownPhysHeft();
    auto &regions = process.memoryRegions();
    std::array<Place, 32> places; // as many lookups as wait for memory together
    for (auto next = regions.begin(); next != regions.end();) {
        size_t count = 0;
        for (; count < places.size() && next != regions.end(); ++next)
            places[count++] = placeOf(*next, process);
        for (const Place &place : std::span(places).first(count)) {
            HXMemoryObject &object = objectAt(place);
            merge(*place.region, process, object);
            if (breakDown && place.region->ownedExclusivelyByParentProcess())
                object.setOwnerPid(process.pid());
        }
    }
}

void HXHeft::merge(HXMemoryRegion &region, const HXProcess &process, HXMemoryObject &object) {
    if (isSharingAnalysisDisabled())
        object.addRegion(region, process.pageSize());
    else
        object.addRegion(region, process);
    region.setMemoryObject(&object);
}

// Every object lives in exactly one of the maps or shares with nothing; together they are all objects.
void HXHeft::finalizeObjects() {
    constexpr size_t piece = 4096, leastObjects = 32768;
    forAll((_objects.size() + piece - 1) / piece, leastObjects, [this](size_t number) {
        const size_t end = std::min((number + 1) * piece, _objects.size());
        for (size_t i = number * piece; i < end; i++)
            _objects[i].finalize();
    });
}

void HXHeft::forAll(size_t count, size_t leastObjects, std::function<void(size_t)> work) const {
    if (_objects.size() < leastObjects) {
        for (size_t i = 0; i < count; i++)
            work(i);
        return;
    }
    HXServices &services = HXPlatform::current().services();
    HXDispatchQueue queue = services.dispatch_queue_create("org.heft.analyse", QOS_CLASS_UTILITY);
    queue.isOwnWork = true;
    services.dispatch_apply(count, queue, std::move(work));
}
