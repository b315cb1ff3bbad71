#include "record/HXProcessRecorder.h"

#include "platform/capture/HXFixedText.h"
#include "platform/capture/HXMachineFormat.h"
#include "record/HXLedger.h"

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <span>

using namespace HXMachineFormat;

namespace {

constexpr size_t kRunsTextBytes = kMaxCaptureRecordBytes / 2; // in one record, other fields beside them

// Run-length text of dispositions, in pieces that each fit a record. Zeros at the end are left out.
class RunsText {
  public:
    void add(int32_t disposition, uint64_t count) {
        if (disposition != _disposition) flush();
        _disposition = disposition;
        _count += count;
    }
    std::vector<std::string> take() {
        if (_disposition != 0) flush();
        return std::move(_pieces);
    }

  private:
    void flush() {
        if (_count == 0) return;
        if (_pieces.back().size() > kRunsTextBytes) _pieces.emplace_back();
        std::string &piece = _pieces.back();
        if (!piece.empty()) piece += ',';
        piece += std::to_string(_count) + "*" + std::to_string(static_cast<uint32_t>(_disposition));
        _count = 0;
    }

    int32_t _disposition = 0;
    uint64_t _count = 0;
    std::vector<std::string> _pieces{1};
};

} // namespace

void HXRecordHeld(const task_held_object &object, int32_t pid, HXCaptureWriter *writer) {
    writer->begin(heldRecord, pid);
    writer->numbers(&object);
    writer->text(Held::name, object.name);
    writer->text(Held::detail, object.detail);
    writer->end();
}

HXProcessRecorder::HXProcessRecorder(HXPlatform &host, const HXMachineHost &facts,
                                     HXRegionHeftSetting &setting, HXAnonymizer *anonymizer)
    : _host(host), _facts(facts), _task(host), _setting(setting), _hasSetting(setting.found()),
      _anonymizer(anonymizer), _argumentArea(facts.argMax), _head(format), _body(format) {}

bool HXProcessRecorder::fail(const std::string &problem) {
    _problem = problem;
    return false;
}

std::string HXProcessRecorder::pathName(std::string_view path) {
    if (_isAbandoned) return {};
    return _anonymizer ? _anonymizer->path(path) : std::string(path);
}

std::string HXProcessRecorder::programName(std::string_view name) {
    if (_isAbandoned) return {};
    return _anonymizer ? _anonymizer->programName(name) : std::string(name);
}

void HXProcessRecorder::setSetting(int32_t value) {
    if (!_isAbandoned) _setting.set(value);
}

bool HXProcessRecorder::record(int32_t pid, bool listed, HXTaskPort task, kern_return_t taskError) {
    _head.clear();
    _body.clear();
    _task = std::move(task);
    _taskError = taskError;
    const bool whole = recordProcess(pid, listed);
    _task.close();
    return whole;
}

// The process's facts. They make the first record, but the last of them come from its memory.
bool HXProcessRecorder::recordProcess(int32_t pid, bool listed) {
    proc_bsdinfo info{};
    proc_bsdshortinfo shortInfo{};
    _process = {};
    _process.listed = listed;
    _process.readable =
        _host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) == int32_t{sizeof info};
    const bool exists = _host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof shortInfo) ==
                        int32_t{sizeof shortInfo};
    if (!_process.readable && !exists) return fail("no such process");
    _process.ppid = _process.readable ? info.pbi_ppid : shortInfo.pbsi_ppid;
    _process.flags = _process.readable ? info.pbi_flags : shortInfo.pbsi_flags;
    _process.status = exists ? shortInfo.pbsi_status : info.pbi_status;
    const bool isKernel = (_process.flags & PROC_FLAG_SYSTEM) != 0;
    const auto name = [&](std::string_view text) { return isKernel ? std::string(text) : programName(text); };
    _head.begin(processRecord, pid);
    _head.text(Process::comm, name(HXTextOfField(_process.readable ? info.pbi_comm : shortInfo.pbsi_comm)));
    _head.text(Process::name, name(HXTextOfField(info.pbi_name)));
    recordArguments(pid);
    recordFigures(pid);
    if (isKernel)
        _task.close();
    else
        _process.taskError = _taskError;
    if (_process.taskError != KERN_SUCCESS && !this->exists(pid)) return fail("it exited meanwhile");
    if (_task.get() != 0 && !recordMemory(pid)) return false;
    _head.numbers(&_process);
    _head.end();
    return true;
}

bool HXProcessRecorder::exists(int32_t pid) {
    proc_bsdshortinfo info;
    return _host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof info) != 0 || errno != ESRCH;
}

void HXProcessRecorder::recordArguments(int32_t pid) {
    const int32_t name[] = {CTL_KERN, KERN_PROCARGS2, pid};
    size_t bytes = _argumentArea.size();
    uint32_t argc = 0;
    if (bytes == 0 || _host.sysctl(name, 3, _argumentArea.data(), &bytes) != 0 || bytes < sizeof argc) return;
    std::memcpy(&argc, _argumentArea.data(), sizeof argc);
    const std::string_view area(_argumentArea.data(), bytes);
    const size_t end = std::min(area.find('\0', sizeof argc), area.size());
    _head.text(Process::argsPath, pathName(area.substr(sizeof argc, end - sizeof argc)));
    _process.argc = argc;
}

void HXProcessRecorder::recordFigures(int32_t pid) {
    uint32_t dirtyFlags = 0;
    if (_host.proc_get_dirty(pid, &dirtyFlags) == 0) _head.number(Process::dirtyFlags, dirtyFlags);
    rusage_info_v4 usage{};
    if (_host.proc_pid_rusage(pid, RUSAGE_INFO_V4, &usage) == 0) {
        _head.number(Process::heft, usage.ri_phys_heft);
        _process.heftPeak = usage.ri_lifetime_max_phys_heft;
    }
    if (_facts.ledger) _head.number(Process::pageTable, HXPageTableBalance(_host, *_facts.ledger, pid));
    const uint64_t pageTables = _host.pageTableObject(_task.get());
    if (pageTables != UINT64_MAX) _head.number(Process::pageTableObject, pageTables);
}

// Lets the host read what both values of the setting need before the first region is recorded: it may read a
// process anew for the other value, and regions of two readings do not fit together.
void HXProcessRecorder::readAtOnce() {
    if (!_hasSetting) return;
    setSetting(0);
    vm_region_submap_info_64 info{};
    uint64_t address = 0, size = 0;
    uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
    (void)_host.mach_vm_region_recurse(_task.get(), &address, &size, &depth, &info, &words);
}

bool HXProcessRecorder::recordMemory(int32_t pid) {
    readAtOnce();
    setSetting(1);
    recordOwned(pid);
    recordImages(pid);
    if (_facts.sharedRegion) recordTops(pid);
    if (!recordRegions(pid)) return false;
    for (const auto &held : {_host.task_held_objects(_task.get()), _host.proc_held_objects(pid)})
        for (const task_held_object &object : held)
            HXRecordHeld(object, pid, &_body);
    return true;
}

bool HXProcessRecorder::recordRegions(int32_t pid) {
    for (uint64_t address = 0, size = 0;; address += size) {
        vm_region_submap_info_64 info{};
        uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
        const uint64_t asked = address;
        setSetting(1);
        const kern_return_t error =
            _host.mach_vm_region_recurse(_task.get(), &address, &size, &depth, &info, &words);
        if (error == KERN_INVALID_ADDRESS) return true;
        if (error != KERN_SUCCESS) {
            return fail(exists(pid) ? _host.mach_error_string(error) : "it exited meanwhile");
        }
        if (size == 0 || address > UINT64_MAX - size || address + size <= asked) return true;
        recordRegion(pid, address, size, info, words);
    }
}

void HXProcessRecorder::recordRegion(int32_t pid, uint64_t address, uint64_t size,
                                     const vm_region_submap_info_64 &info, uint32_t words) {
    HXMachineRegionTraits traits;
    traits.info = info;
    traits.shortRecord = words <= VM_REGION_SUBMAP_INFO_V1_COUNT_64;
    const std::optional<uint32_t> dirtiedObject = pagesDirtiedOfObject(address, size, &traits);
    _tags.insert(info.user_tag);
    _body.begin(regionRecord, pid);
    _body.number(Region::address, address);
    _body.number(Region::size, size);
    _body.numbers(&traits);
    if (!traits.shortRecord && info.object_id_full != info.object_id)
        _body.number(Region::fullObjectID, uint64_t{info.object_id_full});
    if (dirtiedObject != info.pages_dirtied) _body.number(Region::dirtiedObject, dirtiedObject);
    int32_t purge = 0;
    if (_host.mach_vm_purgable_control(_task.get(), address, VM_PURGABLE_GET_STATE, &purge) == KERN_SUCCESS)
        _body.number(Region::purge, purge);
    char path[kMaxPathBytes];
    const int32_t pathBytes =
        info.external_pager == 0 ? 0 : _host.proc_regionfilename(pid, address, path, sizeof path);
    if (pathBytes > 0)
        _body.text(Region::path, pathName(std::string_view(path, static_cast<size_t>(pathBytes))));
    if (isPageQueried(size, info)) recordPages(pid, address, size);
    _body.end();
    recordShares(pid, address);
}

void HXProcessRecorder::recordShares(int32_t pid, uint64_t address) {
    for (const vm_region_share &share : _host.mach_vm_region_shares(_task.get(), address)) {
        _body.begin(shareRecord, pid);
        _body.numbers(&share);
        _body.end();
    }
}

// Ends the region's record with the dispositions of its pages; records that go on with them come after it.
void HXProcessRecorder::recordPages(int32_t pid, uint64_t address, uint64_t size) {
    if (size > kMaxPagesRegionSize) {
        std::fprintf(stderr, "heft-record: %d: the pages from 0x%" PRIx64 " on are too many to record\n", pid,
                     address);
        return;
    }
    const auto runs = pageRuns(address, size);
    for (size_t i = 0; runs && i < runs->size(); i++) {
        if (i > 0) {
            _body.end();
            _body.begin(pagesRecord, pid);
        }
        _body.text(i == 0 ? size_t{Region::pages} : size_t{Pages::pages}, (*runs)[i]);
    }
}

// What the region looks like while the kernel counts what the memory objects see: its dirtied pages, or none
// with `heftOnly` set where it is not there.
std::optional<uint32_t> HXProcessRecorder::pagesDirtiedOfObject(uint64_t address, uint64_t size,
                                                                HXMachineRegionTraits *traits) {
    if (!_hasSetting) return std::nullopt;
    setSetting(0);
    vm_region_submap_info_64 object{};
    uint64_t start = address, length = 0;
    uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
    const kern_return_t error =
        _host.mach_vm_region_recurse(_task.get(), &start, &length, &depth, &object, &words);
    setSetting(1);
    if (error == KERN_SUCCESS && start == address && length == size) return object.pages_dirtied;
    traits->heftOnly = error == KERN_INVALID_ADDRESS || (error == KERN_SUCCESS && start >= address + size);
    return std::nullopt;
}

// Whether an analysis would ask for the dispositions of the region's pages.
bool HXProcessRecorder::isPageQueried(uint64_t size, const vm_region_submap_info_64 &info) const {
    // Pieces of a shared region are measured by their pages alone.
    if (_facts.sharedRegion && (info.max_protection & VM_PROT_WRITE) != 0) return true;
    const bool isPrivate =
        info.share_mode == SM_PRIVATE || info.share_mode == SM_EMPTY || info.share_mode == SM_PRIVATE_ALIASED;
    const bool isEmpty =
        (info.pages_resident | info.pages_swapped_out | info.pages_dirtied | info.pages_reusable) == 0;
    return !isPrivate && !isEmpty && size > _facts.pageSize;
}

// The runs of the region's pages in pieces of text; none when they cannot be queried.
std::optional<std::vector<std::string>> HXProcessRecorder::pageRuns(uint64_t address, uint64_t size) {
    RunsText text;
    std::vector<vm_page_run> runs;
    const uint64_t pages = size / _facts.pageSize;
    for (uint64_t done = 0, told = 0; done < pages; done += told) {
        const uint64_t start = address + done * _facts.pageSize;
        if (_host.mach_vm_page_range_query(_task.get(), start, (pages - done) * _facts.pageSize, &runs,
                                           &told) != KERN_SUCCESS ||
            told == 0)
            return std::nullopt;
        uint64_t next = 0; // page from `start` on
        for (const vm_page_run &run : runs) {
            const uint64_t first = (run.address - start) / _facts.pageSize;
            if (first > next) text.add(0, first - next);
            text.add(run.disposition, run.pages);
            next = first + run.pages;
        }
        if (told > next) text.add(0, told - next);
    }
    return text.take();
}

// The first top-level mapping that ends above *address; false when there is none.
bool HXProcessRecorder::nextTop(uint64_t *address, uint64_t *size, vm_region_basic_info_64 *top) {
    uint32_t words = VM_REGION_BASIC_INFO_COUNT_64;
    return _host.mach_vm_region(_task.get(), address, size, VM_REGION_BASIC_INFO_64, top, &words) ==
               KERN_SUCCESS &&
           *size != 0;
}

// Whether any top-level mapping is another than the leaf mapping at its start.
bool HXProcessRecorder::topsDiffer() {
    for (uint64_t address = 0, size = 0;; address += size) {
        vm_region_basic_info_64 top{};
        vm_region_submap_info_64 leaf{};
        uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
        uint64_t leafAddress = address, leafSize = 0;
        const bool hasTop = nextTop(&address, &size, &top);
        const bool hasLeaf = _host.mach_vm_region_recurse(_task.get(), &leafAddress, &leafSize, &depth, &leaf,
                                                          &words) == KERN_SUCCESS;
        if (hasTop != hasLeaf) return true;
        if (!hasTop) return false;
        if (address != leafAddress || size != leafSize) return true;
        for (const HXRegionField &field : kRegionFields)
            if (field.top.exists() && field.top.of(&top) != field.machine.member.of(&leaf)) return true;
    }
}

void HXProcessRecorder::recordTops(int32_t pid) {
    if (!topsDiffer()) return;
    vm_region_basic_info_64 top{};
    for (uint64_t address = 0, size = 0; nextTop(&address, &size, &top); address += size) {
        _body.begin(topRecord, pid);
        _body.number(Top::address, address);
        _body.number(Top::size, size);
        _body.numbers(&top);
        _body.end();
    }
}

void HXProcessRecorder::recordImages(int32_t pid) {
    const HXSymbolicatorGuard symbolicator =
        HXSymbolicatorOfTask(_host, _task.get(), _host.RVSymbolicatorGetFlagsForNoSymbolOrSourceInfoData());
    if (symbolicator == nullptr) return;
    _host.RVSymbolicatorForeachSymbolOwnerAtTime(symbolicator.get(), kRVNow, [&](const RVSymbolOwner &image) {
        _body.begin(imageRecord, pid);
        _body.text(Image::path, pathName(_host.stringByResolvingSymlinksInPath(image.path)));
        _body.number(Image::base, image.baseAddress);
        _body.end();
        for (const RVRegion &segment : std::span(image.segments, image.segmentCount)) {
            if (segment.length == 0 || segment.start > UINT64_MAX - segment.length) continue;
            _body.begin(segmentRecord, pid);
            _body.text(Segment::name, segment.name);
            _body.number(Segment::start, segment.start);
            _body.number(Segment::size, segment.length);
            _body.end();
        }
    });
}

// Whatever the host answers to kOwnedObjectsSetting; none with errno set when it fails.
std::optional<std::vector<char>> HXProcessRecorder::ownedReply() {
    constexpr size_t spare = 16 * sizeof(owned_vmobject);
    const mach_port_t task = _task.get();
    std::vector<char> reply;
    size_t bytes = 0;
    if (_host.sysctlbyname(kOwnedObjectsSetting, nullptr, &bytes, &task, sizeof task) != 0)
        return std::nullopt;
    do { // until it was not cut
        reply.resize(bytes + spare);
        bytes = reply.size();
        if (_host.sysctlbyname(kOwnedObjectsSetting, reply.data(), &bytes, &task, sizeof task) != 0)
            return std::nullopt;
    } while (bytes >= reply.size());
    reply.resize(bytes);
    return reply;
}

void HXProcessRecorder::recordOwned(int32_t pid) {
    const auto reply = ownedReply();
    if (!reply) {
        _process.ownedError = static_cast<uint32_t>(errno);
        return;
    }
    uint64_t count = 0;
    if (reply->size() >= sizeof count) {
        std::memcpy(&count, reply->data(), sizeof count);
        count = std::min<uint64_t>(count, (reply->size() - sizeof count) / sizeof(owned_vmobject));
    }
    _process.ownedNone = count == 0;
    for (uint64_t i = 0; i < count; i++) {
        owned_vmobject object;
        std::memcpy(&object, reply->data() + sizeof count + i * sizeof object, sizeof object);
        _body.begin(ownedRecord, pid);
        _body.numbers(&object);
        _body.end();
    }
}
