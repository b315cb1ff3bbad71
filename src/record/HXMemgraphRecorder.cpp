#include "record/HXMemgraphRecorder.h"

#include "platform/HXRegionTags.h"
#include "platform/capture/HXMemgraphFormat.h"
#include "platform/capture/HXRegionFields.h"
#include "record/HXAnswer.h"
#include "record/HXLedger.h"
#include "record/HXRegionHeftSetting.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <span>

using namespace HXMemgraphFormat;

namespace {

// No process maps memory from here to the small area at the end of the address space: the page tables, which
// have no address, are put into the first gap.
constexpr uint64_t kPageTablePlace = uint64_t{1} << 63;
constexpr char kPageTableType[] = "page table";
constexpr uint32_t kPageTableObjectID = 0xFFFFFFFE;

// The page tables are told as memory that is named by its user, under the last tag for such memory: readers
// go by the name.
constexpr uint32_t kPageTableTag = HXHostTagLastNamed;

} // namespace

HXMemgraphRecorder::HXMemgraphRecorder(HXPlatform &host, CategoryName categoryName)
    : _host(host), _task(host), _categoryName(std::move(categoryName)), _pageSize(host.vm_kernel_page_size()),
      _writer(format) {}

bool HXMemgraphRecorder::record(HXPlatform &host, std::FILE *out, CategoryName categoryName,
                                const Subject &subject, std::string *reason) {
    const auto recorder = std::make_shared<HXMemgraphRecorder>(host, std::move(categoryName));
    const bool isAnswered = HXIsAnswered(host.services(), [recorder, subject] { recorder->gather(subject); });
    *reason = isAnswered ? recorder->_reason : kNotAnswering;
    if (!reason->empty()) return false;
    const std::string &text = recorder->_writer.written();
    if (std::fwrite(text.data(), 1, text.size(), out) == text.size() && std::fflush(out) == 0) return true;
    *reason = std::strerror(errno);
    return false;
}

// Fills the writer, or says why it cannot.
void HXMemgraphRecorder::gather(const Subject &subject) {
    const int32_t pid = subject.pid;
    proc_bsdinfo info{};
    if (_host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) != int32_t{sizeof info}) {
        _reason = std::strerror(errno);
        return;
    }
    if ((info.pbi_flags & PROC_FLAG_SYSTEM) != 0) {
        _reason = "the kernel has no memory graph";
        return;
    }
    if (const kern_return_t error = _task.open(pid); error != KERN_SUCCESS) {
        _reason = _host.mach_error_string(error);
        return;
    }
    HXRegionHeftSetting setting(_host);
    setting.set(subject.breakDownPhysHeft ? 1 : 0);
    const auto ledger = subject.breakDownPhysHeft ? HXLedgerNames(_host) : std::nullopt;
    const int64_t balance = ledger ? HXPageTableBalance(_host, *ledger, pid).value_or(0) : 0;
    recordProcess(subject, info);
    gatherImages();
    recordRegions(pid, static_cast<uint64_t>(std::max<int64_t>(balance, 0)));
    _task.close();
}

void HXMemgraphRecorder::recordProcess(const Subject &subject, const proc_bsdinfo &info) {
    rusage_info_v4 usage{};
    if (_host.proc_pid_rusage(subject.pid, RUSAGE_INFO_V4, &usage) != 0) usage = {};
    // Leaf mappings are written, also where a shared region lies: nothing is left to be cut.
    const GXProcessFacts facts{.pageSize = _pageSize,
                               .physicalHeft = usage.ri_phys_heft,
                               .physicalHeftPeak = usage.ri_lifetime_max_phys_heft,
                               .is64bit = (info.pbi_flags & PROC_FLAG_LP64) != 0,
                               .showsPhysHeft = subject.breakDownPhysHeft,
                               .hasSharedRegion = false};
    _writer.header();
    _writer.begin(processRecord, subject.pid);
    _writer.text(Process::name, subject.name);
    _writer.text(Process::description, _host.hostDescription());
    _writer.numbers(&facts);
    _writer.end();
}

void HXMemgraphRecorder::gatherImages() {
    const HXSymbolicatorGuard symbolicator =
        HXSymbolicatorOfTask(_host, _task.get(), _host.RVSymbolicatorGetFlagsForNoSymbolOrSourceInfoData());
    if (symbolicator == nullptr) return;
    _host.RVSymbolicatorForeachSymbolOwnerAtTime(symbolicator.get(), kRVNow, [&](const RVSymbolOwner &image) {
        const std::string path = _host.stringByResolvingSymlinksInPath(image.path);
        for (const RVRegion &segment : std::span(image.segments, image.segmentCount)) {
            const std::string_view raw = segment.name;
            const std::string_view name = raw == "MACH_HEADER" ? "__TEXT" : raw.substr(0, raw.find(' '));
            _segments.push_back({segment.start, segment.start + segment.length, std::string(name), path});
        }
    });
    std::stable_sort(_segments.begin(), _segments.end(),
                     [](const Segment &a, const Segment &b) { return a.start < b.start; });
}

// The segment that overlaps [start, end), or null; ranges are asked for in ascending order. The choice among
// several is that of the walk over a live process.
const HXMemgraphRecorder::Segment *HXMemgraphRecorder::nextSegment(uint64_t start, uint64_t end) {
    for (; _segmentCursor < _segments.size(); _segmentCursor++) {
        const Segment &segment = _segments[_segmentCursor];
        const bool beginsWithin = start >= segment.start && start < segment.end;
        const bool endsWithin = segment.start < end && segment.end >= end;
        const bool holds = segment.end <= end && segment.start >= start;
        if (beginsWithin || endsWithin || holds) return &segment;
        if (segment.start >= start) return nullptr;
    }
    return nullptr;
}

void HXMemgraphRecorder::recordRegions(int32_t pid, uint64_t pageTableBytes) {
    bool needsPageTable = pageTableBytes > 0;
    // Puts the page tables between `from` and `to` if they are still to be put and fit.
    const auto putPageTable = [&](uint64_t from, uint64_t to) {
        const uint64_t place = std::max(from, kPageTablePlace);
        if (!needsPageTable || to < place || to - place < pageTableBytes) return;
        needsPageTable = false;
        recordPageTable(place, pageTableBytes);
    };
    for (uint64_t address = 0, size = 0;; address += size) {
        vm_region_submap_info_64 info{};
        uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
        const uint64_t asked = address;
        const kern_return_t error =
            _host.mach_vm_region_recurse(_task.get(), &address, &size, &depth, &info, &words);
        const bool isLast =
            error == KERN_SUCCESS && (size == 0 || address > UINT64_MAX - size || address + size <= asked);
        if (error == KERN_INVALID_ADDRESS || isLast) {
            putPageTable(asked, UINT64_MAX);
            return;
        }
        if (error != KERN_SUCCESS) {
            _reason = _host.mach_error_string(error);
            return;
        }
        if (words <= VM_REGION_SUBMAP_INFO_V1_COUNT_64) info.object_id_full = info.object_id;
        putPageTable(asked, address);
        recordRegion(pid, address, size, info);
    }
}

void HXMemgraphRecorder::recordRegion(int32_t pid, uint64_t address, uint64_t size,
                                      const vm_region_submap_info_64 &info) {
    GXVMRegion region = HXGraphRegion(info, _pageSize);
    region.address = address;
    region.length = size;
    region.object_id = graphObjectID(info.object_id_full, info.object_id);
    region.is_submap = 0; // leaves only
    region.purgeable = VM_PURGABLE_DENY;
    int32_t purge = 0;
    if (_host.mach_vm_purgable_control(_task.get(), address, VM_PURGABLE_GET_STATE, &purge) == KERN_SUCCESS)
        region.purgeable = purge;
    std::string category; // backs the type
    char path[kMaxPathBytes];
    if (const Segment *const segment = nextSegment(address, address + size)) {
        region.type = segment->name;
        region.path = segment->path;
    } else if (info.external_pager != 0) {
        const int32_t bytes = _host.proc_regionfilename(pid, address, path, sizeof path);
        region.type = "mapped file";
        if (bytes > 0) region.path = std::string_view(path, static_cast<size_t>(bytes));
    } else {
        region.type = category = _categoryName(info.user_tag);
    }
    writeRegion(region);
}

// Under an object id that no other region has, as memory that was copied on write: such memory is never
// merged with another process's.
void HXMemgraphRecorder::recordPageTable(uint64_t address, uint64_t size) {
    GXVMRegion region{};
    region.address = address;
    region.length = region.resident_size = region.dirty_size = size;
    region.type = kPageTableType;
    region.user_tag = kPageTableTag;
    region.ref_count = 1;
    region.object_id = freeObjectID(kPageTableObjectID);
    region.purgeable = VM_PURGABLE_DENY;
    region.share_mode = SM_COW;
    writeRegion(region);
}

void HXMemgraphRecorder::writeRegion(const GXVMRegion &region) {
    _writer.begin(regionRecord);
    _writer.number(Region::address, region.address);
    _writer.number(Region::length, region.length);
    _writer.text(Region::type, region.type);
    if (region.path) _writer.text(Region::path, *region.path);
    _writer.numbers(&region);
    _writer.end();
}

// An id of 32 bits for an object's full id: the host's own short id where no other object of the graph has
// it, so that graphs of one host agree; else the next that is free. Without a full id (0) there is none; all
// ones stand for an object of the region's own.
uint32_t HXMemgraphRecorder::graphObjectID(uint64_t fullID, uint32_t preferred) {
    if (fullID == 0) return 0;
    if (fullID == UINT64_MAX) return freeObjectID(preferred);
    const auto known = _objectIDs.find(fullID);
    if (known != _objectIDs.end()) return known->second;
    const uint32_t id = freeObjectID(preferred);
    _objectIDs.emplace(fullID, id);
    return id;
}

uint32_t HXMemgraphRecorder::freeObjectID(uint32_t preferred) {
    uint32_t id = preferred;
    while (id == 0 || id == UINT32_MAX || !_takenObjectIDs.insert(id).second)
        id++;
    return id;
}
