#include "record/HXProcessRecorder.h"

#include "platform/capture/HXFixedText.h"
#include "platform/capture/HXMachineFormat.h"

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>

using namespace HXMachineFormat;

namespace {

constexpr uint64_t kChunkPages = 4096;
constexpr size_t kRunsTextBytes = kMaxCaptureRecordBytes / 2; // in one record, other fields beside them
constexpr int32_t kArgMaxName[] = {1, 8};
constexpr int32_t kProcArgs2 = 49;

// Run-length text of dispositions, in pieces that each fit a record. Zeros at the end are left out.
class RunsText {
  public:
    void add(int32_t disposition) {
        if (disposition != _disposition) flush();
        _disposition = disposition;
        _count++;
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

HXProcessRecorder::HXProcessRecorder(HXPlatform &host, HXRegionHeftSetting &setting, HXAnonymizer *anonymizer,
                                     std::optional<size_t> pageTableIndex, size_t ledgerCount)
    : _host(host), _setting(setting), _anonymizer(anonymizer), _pageTableIndex(pageTableIndex),
      _ledgerCount(ledgerCount), _pageSize(host.vm_kernel_page_size()), _dispositions(kChunkPages),
      _head(format), _body(format) {
    uint32_t argMax = 0;
    size_t bytes = sizeof argMax;
    if (_host.sysctl(kArgMaxName, 2, &argMax, &bytes) == 0) _argumentArea.resize(argMax);
}

bool HXProcessRecorder::fail(const std::string &problem) {
    _problem = problem;
    return false;
}

std::string HXProcessRecorder::pathName(std::string_view path) {
    return _anonymizer ? _anonymizer->path(path) : std::string(path);
}

std::string HXProcessRecorder::programName(std::string_view name) {
    return _anonymizer ? _anonymizer->programName(name) : std::string(name);
}

bool HXProcessRecorder::record(int32_t pid, bool listed) {
    _head.clear();
    _body.clear();
    return recordProcess(pid, listed);
}

// The process's facts. They make the first record, but its last fields come from its memory.
bool HXProcessRecorder::recordProcess(int32_t pid, bool listed) {
    proc_bsdinfo info{};
    proc_bsdshortinfo shortInfo{};
    const bool readable =
        _host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) == int32_t{sizeof info};
    const bool exists = _host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof shortInfo) ==
                        int32_t{sizeof shortInfo};
    if (!readable && !exists) return fail("no such process");
    const uint32_t flags = readable ? info.pbi_flags : shortInfo.pbsi_flags;
    const bool isKernel = (flags & PROC_FLAG_SYSTEM) != 0;
    const auto name = [&](std::string_view text) { return isKernel ? std::string(text) : programName(text); };
    _head.begin(processRecord);
    _head.signedNumber(Process::pid, pid);
    _head.signedNumber(Process::ppid, readable ? info.pbi_ppid : shortInfo.pbsi_ppid);
    _head.number(Process::flags, flags);
    _head.text(Process::comm,
               name(readable ? HXTextOfField(info.pbi_comm) : HXTextOfField(shortInfo.pbsi_comm)));
    _head.text(Process::name, name(HXTextOfField(info.pbi_name)));
    _head.number(Process::status, exists ? shortInfo.pbsi_status : info.pbi_status);
    _head.number(Process::listed, listed);
    _head.number(Process::readable, readable);
    recordArguments(pid);
    recordFigures(pid);

    kern_return_t taskError = KERN_FAILURE;
    if (!isKernel) taskError = _host.task_for_pid(_host.mach_task_self(), pid, &_task);
    if (taskError == KERN_SUCCESS) {
        const bool whole = recordMemory(pid);
        _host.mach_port_deallocate(_host.mach_task_self(), _task);
        if (!whole) return false;
    } else {
        const int32_t got = _host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &shortInfo, sizeof shortInfo);
        if (got == 0 && errno == ESRCH) return fail("it exited meanwhile");
        _head.signedNumber(Process::taskError, isKernel ? 0 : taskError);
    }
    _head.end();
    return true;
}

void HXProcessRecorder::recordArguments(int32_t pid) {
    const int32_t name[] = {kArgMaxName[0], kProcArgs2, pid};
    size_t bytes = _argumentArea.size();
    uint32_t argc = 0;
    if (bytes == 0 || _host.sysctl(name, 3, _argumentArea.data(), &bytes) != 0 || bytes < sizeof argc) return;
    std::memcpy(&argc, _argumentArea.data(), sizeof argc);
    const std::string_view area(_argumentArea.data(), bytes);
    const size_t end = std::min(area.find('\0', sizeof argc), area.size());
    _head.text(Process::argsPath, pathName(area.substr(sizeof argc, end - sizeof argc)));
    _head.number(Process::argc, argc);
}

void HXProcessRecorder::recordFigures(int32_t pid) {
    uint32_t dirtyFlags = 0;
    if (_host.proc_get_dirty(pid, &dirtyFlags) == 0) _head.number(Process::dirtyFlags, dirtyFlags);
    rusage_info_v4 usage{};
    if (_host.proc_pid_rusage(pid, RUSAGE_INFO_V4, &usage) == 0) {
        _head.number(Process::heft, usage.ri_phys_heft);
        _head.number(Process::heftPeak, usage.ri_lifetime_max_phys_heft);
    }
    if (!_pageTableIndex) return;
    std::vector<ledger_entry_info> entries(_ledgerCount);
    int64_t count = static_cast<int64_t>(_ledgerCount);
    if (_host.ledger(LEDGER_ENTRY_INFO, pid, entries.data(), &count) >= 0 &&
        count > static_cast<int64_t>(*_pageTableIndex))
        _head.signedNumber(Process::pageTable, entries[*_pageTableIndex].lei_balance);
}

// Lets the host read what both values of the setting need before the first region is recorded: it may read a
// process anew for the other value, and regions of two readings do not fit together.
void HXProcessRecorder::readAtOnce() {
    if (!_setting.found()) return;
    _setting.set(0);
    vm_region_submap_info_64 info{};
    uint64_t address = 0, size = 0;
    uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
    (void)_host.mach_vm_region_recurse(_task, &address, &size, &depth, &info, &words);
}

bool HXProcessRecorder::recordMemory(int32_t pid) {
    readAtOnce();
    _setting.set(1);
    recordOwned(pid);
    recordImages(pid);
    if (_host.hasSharedRegion()) recordTops(pid);
    if (!recordRegions(pid)) return false;
    if (_ownedError != 0) _head.number(Process::ownedError, static_cast<uint64_t>(_ownedError));
    _head.number(Process::ownedNone, _ownedNone);
    return true;
}

bool HXProcessRecorder::recordRegions(int32_t pid) {
    for (uint64_t address = 0, size = 0;; address += size) {
        vm_region_submap_info_64 info{};
        uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
        const uint64_t asked = address;
        _setting.set(1);
        const kern_return_t error =
            _host.mach_vm_region_recurse(_task, &address, &size, &depth, &info, &words);
        if (error == KERN_INVALID_ADDRESS) return true;
        if (error != KERN_SUCCESS) {
            proc_bsdshortinfo gone;
            const bool exists = _host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &gone, sizeof gone) != 0;
            return fail(exists ? _host.mach_error_string(error) : "it exited meanwhile");
        }
        if (size == 0 || address > UINT64_MAX - size || address + size <= asked) return true;
        recordRegion(pid, address, size, info, words);
    }
}

void HXProcessRecorder::recordRegion(int32_t pid, uint64_t address, uint64_t size,
                                     const vm_region_submap_info_64 &info, uint32_t words) {
    const bool isShort = words <= VM_REGION_SUBMAP_INFO_V1_COUNT_64;
    _tags.insert(info.user_tag);
    _body.begin(regionRecord);
    _body.signedNumber(Region::pid, pid);
    _body.hex(Region::address, address);
    _body.hex(Region::size, size);
    _body.signedNumber(Region::prot, info.protection);
    _body.signedNumber(Region::maxProt, info.max_protection);
    _body.number(Region::inheritance, info.inheritance);
    _body.hex(Region::offset, info.offset);
    _body.number(Region::tag, info.user_tag);
    _body.number(Region::resident, info.pages_resident);
    _body.number(Region::sharedNowPrivate, info.pages_shared_now_private);
    _body.number(Region::swapped, info.pages_swapped_out);
    _body.number(Region::dirtied, info.pages_dirtied);
    _body.number(Region::reusable, info.pages_reusable);
    _body.number(Region::refs, info.ref_count);
    _body.number(Region::shadowDepth, info.shadow_depth);
    _body.number(Region::pager, info.external_pager);
    _body.number(Region::shareMode, info.share_mode);
    _body.signedNumber(Region::behavior, info.behavior);
    _body.hex(Region::objectID, info.object_id);
    if (!isShort && info.object_id_full != info.object_id)
        _body.hex(Region::fullObjectID, info.object_id_full);
    _body.number(Region::shortRecord, isShort);
    _body.number(Region::wired, info.user_wired_count);

    int32_t purge = 0;
    if (_host.mach_vm_purgable_control(_task, address, VM_PURGABLE_GET_STATE, &purge) == KERN_SUCCESS)
        _body.signedNumber(Region::purge, purge);
    char path[1024];
    const int32_t pathBytes =
        info.external_pager == 0 ? 0 : _host.proc_regionfilename(pid, address, path, sizeof path);
    if (pathBytes > 0)
        _body.text(Region::path, pathName(std::string_view(path, static_cast<size_t>(pathBytes))));
    recordRegionObject(address, size, info);

    std::optional<std::vector<std::string>> runs;
    if (isPageQueried(size, info)) {
        if (size <= kMaxPagesRegionSize)
            runs = pageRuns(address, size);
        else
            std::fprintf(stderr, "heft-record: %d: the pages from 0x%" PRIx64 " on are too many to record\n",
                         pid, address);
    }
    for (size_t i = 0; runs && i < runs->size(); i++) {
        if (i > 0) {
            _body.end();
            _body.begin(pagesRecord);
            _body.signedNumber(Pages::pid, pid);
        }
        _body.text(i == 0 ? size_t{Region::pages} : size_t{Pages::pages}, (*runs)[i]);
    }
    _body.end();
}

// What the region looks like while the kernel counts what the memory objects see.
void HXProcessRecorder::recordRegionObject(uint64_t address, uint64_t size,
                                           const vm_region_submap_info_64 &info) {
    if (!_setting.found()) return;
    _setting.set(0);
    vm_region_submap_info_64 object{};
    uint64_t start = address, length = 0;
    uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
    const kern_return_t error = _host.mach_vm_region_recurse(_task, &start, &length, &depth, &object, &words);
    if (error == KERN_SUCCESS && start == address && length == size) {
        if (object.pages_dirtied != info.pages_dirtied)
            _body.number(Region::dirtiedObject, object.pages_dirtied);
    } else if (error == KERN_INVALID_ADDRESS || (error == KERN_SUCCESS && start >= address + size)) {
        _body.number(Region::heftOnly, 1);
    }
    _setting.set(1);
}

// Whether an analysis would ask for the dispositions of the region's pages.
bool HXProcessRecorder::isPageQueried(uint64_t size, const vm_region_submap_info_64 &info) const {
    // Pieces of a shared region are measured by their pages alone.
    if (_host.hasSharedRegion() && (info.max_protection & VM_PROT_WRITE) != 0) return true;
    const bool isPrivate =
        info.share_mode == SM_PRIVATE || info.share_mode == SM_EMPTY || info.share_mode == SM_PRIVATE_ALIASED;
    const bool isEmpty =
        (info.pages_resident | info.pages_swapped_out | info.pages_dirtied | info.pages_reusable) == 0;
    return !isPrivate && !isEmpty && size > _pageSize;
}

// The runs of the region's pages in pieces of text; none when they cannot be queried.
std::optional<std::vector<std::string>> HXProcessRecorder::pageRuns(uint64_t address, uint64_t size) {
    RunsText runs;
    const uint64_t pages = size / _pageSize;
    for (uint64_t page = 0; page < pages; page += kChunkPages) {
        uint64_t count = std::min(kChunkPages, pages - page);
        if (_host.mach_vm_page_range_query(_task, address + page * _pageSize, count * _pageSize,
                                           _dispositions.data(), &count) != KERN_SUCCESS)
            return std::nullopt;
        for (uint64_t i = 0; i < count; i++)
            runs.add(_dispositions[i]);
    }
    return runs.take();
}

// Whether any top-level mapping is another than the leaf mapping at its start.
bool HXProcessRecorder::topsDiffer() {
    for (uint64_t address = 0, size = 0;; address += size) {
        vm_region_basic_info_64 top{};
        vm_region_submap_info_64 leaf{};
        uint32_t words = VM_REGION_BASIC_INFO_COUNT_64, leafWords = VM_REGION_SUBMAP_INFO_COUNT_64;
        uint32_t depth = UINT32_MAX;
        uint64_t leafAddress = address, leafSize = 0;
        const kern_return_t topError =
            _host.mach_vm_region(_task, &address, &size, VM_REGION_BASIC_INFO_64, &top, &words);
        const kern_return_t leafError =
            _host.mach_vm_region_recurse(_task, &leafAddress, &leafSize, &depth, &leaf, &leafWords);
        if (topError != leafError) return true;
        if (topError != KERN_SUCCESS || size == 0) return false;
        if (address != leafAddress || size != leafSize || top.protection != leaf.protection ||
            top.max_protection != leaf.max_protection || top.inheritance != leaf.inheritance ||
            top.offset != leaf.offset || top.behavior != leaf.behavior ||
            top.user_wired_count != leaf.user_wired_count)
            return true;
    }
}

void HXProcessRecorder::recordTops(int32_t pid) {
    if (!topsDiffer()) return;
    for (uint64_t address = 0, size = 0;; address += size) {
        vm_region_basic_info_64 top{};
        uint32_t words = VM_REGION_BASIC_INFO_COUNT_64;
        if (_host.mach_vm_region(_task, &address, &size, VM_REGION_BASIC_INFO_64, &top, &words) !=
                KERN_SUCCESS ||
            size == 0)
            return;
        _body.begin(topRecord);
        _body.signedNumber(Top::pid, pid);
        _body.hex(Top::address, address);
        _body.hex(Top::size, size);
        _body.signedNumber(Top::prot, top.protection);
        _body.signedNumber(Top::maxProt, top.max_protection);
        _body.number(Top::inheritance, top.inheritance);
        _body.hex(Top::offset, top.offset);
        _body.signedNumber(Top::behavior, top.behavior);
        _body.number(Top::wired, top.user_wired_count);
        _body.end();
    }
}

void HXProcessRecorder::recordImages(int32_t pid) {
    RVSymbolicator *const symbolicator = _host.RVSymbolicatorCreateWithTaskFlagsAndNotification(
        _task, _host.RVSymbolicatorGetFlagsForNoSymbolOrSourceInfoData(), nullptr);
    if (symbolicator == nullptr) return;
    _host.RVSymbolicatorForeachSymbolOwnerAtTime(symbolicator, kRVNow, [&](const RVSymbolOwner &image) {
        _body.begin(imageRecord);
        _body.signedNumber(Image::pid, pid);
        _body.text(Image::path, pathName(_host.stringByResolvingSymlinksInPath(image.path)));
        _body.hex(Image::base, image.baseAddress);
        _body.end();
        for (size_t i = 0; i < image.segmentCount; i++) {
            const RVRegion &segment = image.segments[i];
            if (segment.length == 0 || segment.start > UINT64_MAX - segment.length) continue;
            _body.begin(segmentRecord);
            _body.signedNumber(Segment::pid, pid);
            _body.text(Segment::name, segment.name);
            _body.hex(Segment::start, segment.start);
            _body.hex(Segment::size, segment.length);
            _body.end();
        }
    });
    _host.RVRelease(symbolicator);
}

void HXProcessRecorder::recordOwned(int32_t pid) {
    constexpr char setting[] = "vm.get_owned_vmobjects";
    constexpr size_t spare = 16 * sizeof(owned_vmobject);
    std::vector<char> reply;
    size_t bytes = 0;
    _ownedNone = false;
    int32_t result = _host.sysctlbyname(setting, nullptr, &bytes, &_task, sizeof _task);
    while (result == 0) {
        reply.resize(bytes + spare);
        bytes = reply.size();
        result = _host.sysctlbyname(setting, reply.data(), &bytes, &_task, sizeof _task);
        if (bytes < reply.size()) break; // else it may have been cut
    }
    _ownedError = result == 0 ? 0 : errno;
    if (result != 0) return;
    uint64_t count = 0;
    if (bytes >= sizeof count) std::memcpy(&count, reply.data(), sizeof count);
    count =
        std::min<uint64_t>(count, bytes < sizeof count ? 0 : (bytes - sizeof count) / sizeof(owned_vmobject));
    _ownedNone = count == 0;
    for (uint64_t i = 0; i < count; i++) {
        owned_vmobject object;
        std::memcpy(&object, reply.data() + sizeof count + i * sizeof object, sizeof object);
        _body.begin(ownedRecord);
        _body.signedNumber(Owned::pid, pid);
        _body.hex(Owned::objectID, object.object_id);
        _body.number(Owned::virtualSize, object.virtual_size);
        _body.number(Owned::resident, object.resident_size);
        _body.number(Owned::wired, object.wired_size);
        _body.number(Owned::reusable, object.reusable_size);
        _body.number(Owned::compressed, object.compressed_size);
        _body.hex(Owned::flags, object.flags);
        _body.end();
    }
}
