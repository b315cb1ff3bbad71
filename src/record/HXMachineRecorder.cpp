#include "record/HXMachineRecorder.h"

#include "platform/HXRegionTags.h"
#include "platform/capture/HXFixedText.h"
#include "platform/capture/HXMachineFormat.h"
#include "record/HXProcessRecorder.h"
#include "record/HXRegionHeftSetting.h"

#include <algorithm>

using namespace HXMachineFormat;

namespace {

constexpr int32_t kArgMaxName[] = {1, 8};
constexpr uint32_t kLastDescribedTag = 239; // from 240 on tags are the program's own

} // namespace

HXMachineRecorder::HXMachineRecorder(HXPlatform &host, std::FILE *out, bool anonymize)
    : _host(host), _out(out), _anonymize(anonymize), _writer(format) {}

bool HXMachineRecorder::write(const std::string &text) {
    return std::fwrite(text.data(), 1, text.size(), _out) == text.size();
}

bool HXMachineRecorder::record(const std::vector<int32_t> &pids) {
    HXRegionHeftSetting setting(_host);
    const bool withKernel = pids.empty() || std::find(pids.begin(), pids.end(), 0) != pids.end();
    readLedgerTemplate();
    _listed = listedPids();
    // The host's record comes first and says whether the kernel told of its memory.
    if (withKernel) recordKernel();
    const std::string kernel = _writer.written();
    _writer.clear();
    _writer.header();
    recordHost(setting.found());
    if (!write(_writer.written()) || !write(kernel)) return false;

    HXProcessRecorder process(_host, setting, _anonymize ? &_anonymizer : nullptr, _pageTableIndex,
                              _ledger ? _ledger->size() : 0);
    const int32_t self = _host.getpid();
    for (const int32_t pid : pids.empty() ? _listed.value_or(std::vector<int32_t>()) : pids) {
        if (pid == self) continue;
        const bool listed = !_listed || std::binary_search(_sorted.begin(), _sorted.end(), pid);
        if (!process.record(pid, listed)) {
            std::fprintf(stderr, "heft-record: %d is left out: %s\n", pid, process.problem().c_str());
            continue;
        }
        if (!write(process.head()) || !write(process.body())) return false;
        _processCount++;
    }
    _writer.clear();
    recordTags(process.tags());
    return write(_writer.written()) && std::fflush(_out) == 0;
}

// The pids in the host's order; also sorted, in _sorted.
std::optional<std::vector<int32_t>> HXMachineRecorder::listedPids() {
    constexpr size_t spare = 64; // processes that come meanwhile
    std::vector<int32_t> pids;
    int32_t count = _host.proc_listallpids(nullptr, 0);
    while (count >= 0 && static_cast<size_t>(count) >= pids.size()) {
        pids.resize(static_cast<size_t>(count) + spare);
        count = _host.proc_listallpids(pids.data(), static_cast<uint32_t>(pids.size() * sizeof(int32_t)));
    }
    if (count < 0) return std::nullopt;
    pids.resize(static_cast<size_t>(count));
    _sorted = pids;
    std::sort(_sorted.begin(), _sorted.end());
    return pids;
}

void HXMachineRecorder::readLedgerTemplate() {
    constexpr int64_t longest = 1 << 16;
    std::vector<ledger_template_info> entries;
    int64_t count = 0;
    for (int64_t room = 80; room <= longest; room *= 2) {
        entries.resize(static_cast<size_t>(room));
        count = room;
        if (_host.ledger(LEDGER_TEMPLATE_INFO, 0, entries.data(), &count) < 0) return;
        if (count < room) break;
    }
    _ledger.emplace();
    for (size_t i = 0; i < static_cast<size_t>(count); i++) {
        std::string name(HXTextOfField(entries[i].lti_name));
        std::replace(name.begin(), name.end(), ',', '?'); // the comma joins them
        if (!_pageTableIndex && name == "page_table") _pageTableIndex = i;
        _ledger->push_back(std::move(name));
    }
}

void HXMachineRecorder::recordHost(const std::optional<int32_t> &selfRegionHeft) {
    _writer.begin(hostRecord);
    _writer.number(Host::pageSize, _host.vm_kernel_page_size());
    uint32_t argMax = 0;
    size_t bytes = sizeof argMax;
    if (_host.sysctl(kArgMaxName, 2, &argMax, &bytes) == 0) _writer.number(Host::argMax, argMax);
    _writer.signedNumber(Host::pid, _host.getpid());
    _writer.number(Host::euid, _host.geteuid());
    if (selfRegionHeft) _writer.number(Host::selfRegionHeft, *selfRegionHeft != 0);
    _writer.number(Host::sharedRegion, _host.hasSharedRegion());
    _writer.number(Host::listPidsError, !_listed);
    if (_ledger) {
        std::string names;
        for (const std::string &name : *_ledger)
            names += (names.empty() ? "" : ",") + name;
        _writer.text(Host::ledger, names);
    }
    _writer.signedNumber(Host::memoryInfoError, _memoryInfoError);
    _writer.end();
}

void HXMachineRecorder::recordKernel() {
    mach_zone_name *names = nullptr;
    mach_zone_info *zones = nullptr;
    mach_memory_info_record *records = nullptr;
    uint32_t nameCount = 0, zoneCount = 0, recordCount = 0;
    _memoryInfoError = _host.mach_memory_info(_host.mach_host_self(), &names, &nameCount, &zones, &zoneCount,
                                              &records, &recordCount);
    if (_memoryInfoError != KERN_SUCCESS) return;
    for (uint32_t i = 0; i < std::min(nameCount, zoneCount); i++) {
        _writer.begin(zoneRecord);
        _writer.text(Zone::name, HXTextOfField(names[i].mzn_name));
        _writer.number(Zone::count, zones[i].mzi_count);
        _writer.number(Zone::curSize, zones[i].mzi_cur_size);
        _writer.number(Zone::elemSize, zones[i].mzi_elem_size);
        _writer.number(Zone::collectable, zones[i].mzi_collectable);
        _writer.end();
    }
    std::set<uint64_t> code;
    for (uint32_t i = 0; i < recordCount; i++) {
        const mach_memory_info_record &record = records[i];
        _writer.begin(siteRecord);
        _writer.hex(Site::flags, record.flags);
        _writer.hex(Site::site, record.site);
        _writer.number(Site::size, record.size);
        _writer.number(Site::mapped, record.mapped);
        _writer.number(Site::tag, record.tag);
        _writer.number(Site::zone, record.zone);
        _writer.text(Site::name, HXTextOfField(record.name));
        _writer.end();
        if ((record.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_KERNEL) code.insert(record.site);
    }
    _host.vm_deallocate(_host.mach_task_self(), names, nameCount * sizeof *names);
    _host.vm_deallocate(_host.mach_task_self(), zones, zoneCount * sizeof *zones);
    _host.vm_deallocate(_host.mach_task_self(), records, recordCount * sizeof *records);
    for (const OSKextInfo &kext : _host.OSKextCopyLoadedKextInfo()) {
        _writer.begin(kextRecord);
        _writer.number(Kext::loadTag, kext.OSBundleLoadTag);
        if (kext.CFBundleIdentifier) _writer.text(Kext::bundleID, *kext.CFBundleIdentifier);
        _writer.end();
    }
    recordSymbols(code);
}

// Of each symbol only the byte that is asked for is recorded: where it begins and ends the host does not say.
void HXMachineRecorder::recordSymbols(const std::set<uint64_t> &addresses) {
    RVSymbolicator *const symbolicator = _host.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(
        _host.RVSymbolicatorGetFlagsForNListOnlyData(), nullptr);
    if (symbolicator == nullptr) return;
    for (const uint64_t address : addresses) {
        const RVSymbol symbol = _host.RVSymbolicatorGetSymbolWithAddressAtTime(symbolicator, address, kRVNow);
        const RVSourceInfo source =
            _host.RVSymbolicatorGetSourceInfoWithAddressAtTime(symbolicator, address, kRVNow);
        const bool hasSource = !source.isNull && source.path != nullptr;
        if (symbol.name == nullptr && !hasSource) continue;
        _writer.begin(symbolRecord);
        _writer.hex(Symbol::address, address);
        _writer.number(Symbol::size, 1);
        if (symbol.name != nullptr) _writer.text(Symbol::name, symbol.name);
        if (hasSource) {
            _writer.text(Symbol::path, source.path);
            _writer.number(Symbol::line, static_cast<uint32_t>(source.lineNumber));
        }
        _writer.end();
    }
    _host.RVRelease(symbolicator);
}

void HXMachineRecorder::recordTags(const std::set<uint32_t> &tags) {
    for (const uint32_t tag : tags) {
        if (tag > kLastDescribedTag) break;
        const auto name = _host.GXRegionTypeDescriptionForTagShareProtAndPager(tag, 0, 0, 0);
        if (!name) continue;
        const bool fromProgram = tag >= HXHostTagFirstNamed && tag <= HXHostTagLastNamed;
        _writer.begin(tagRecord);
        _writer.number(Tag::tag, tag);
        _writer.text(Tag::name, _anonymize && fromProgram ? _anonymizer.memoryName(*name) : *name);
        _writer.end();
    }
}
