#include "platform/capture/HXMachineReader.h"

#include "platform/HXSafeText.h"
#include "platform/capture/HXFixedText.h"
#include "platform/capture/HXMachineFormat.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

using namespace HXMachineFormat;

namespace {

constexpr size_t kCommBytes = sizeof proc_bsdinfo::pbi_comm;
constexpr size_t kNameBytes = sizeof proc_bsdinfo::pbi_name;
constexpr size_t kPathBytes = 1024;

} // namespace

const HXMachineReader::Handler HXMachineReader::handlers[] = {
    &HXMachineReader::readRegion,  &HXMachineReader::readTop,   &HXMachineReader::readPages,
    &HXMachineReader::readProcess, &HXMachineReader::readImage, &HXMachineReader::readSegment,
    &HXMachineReader::readOwned,   &HXMachineReader::readFault, &HXMachineReader::readZone,
    &HXMachineReader::readSite,    &HXMachineReader::readKext,  &HXMachineReader::readSymbol,
    &HXMachineReader::readTag,     &HXMachineReader::readHost,
};

std::unique_ptr<HXMachine> HXMachine::load(HXServices &files, const std::string &path, std::string *reason) {
    std::FILE *const stream = files.fopen(path, "r");
    if (stream == nullptr) {
        *reason = std::strerror(errno);
        return nullptr;
    }
    auto machine = std::make_unique<HXMachine>();
    HXCaptureReader reader(format, stream);
    const bool whole = HXMachineReader(reader, *machine).read();
    std::fclose(stream);
    if (whole) return machine;
    *reason = reader.reason();
    return nullptr;
}

std::unique_ptr<HXMachine> HXMachine::loadText(std::string_view text, std::string *reason) {
    auto machine = std::make_unique<HXMachine>();
    HXCaptureReader reader(format, text);
    if (HXMachineReader(reader, *machine).read()) return machine;
    *reason = reader.reason();
    return nullptr;
}

bool HXMachineReader::read() {
    _machine.regionExtras.emplace_back();
    while (_reader.next()) {
        if (!(this->*handlers[_reader.kind()])()) return false;
        _hasRecords = true;
    }
    return !_reader.failed();
}

std::string HXMachineReader::safeText(size_t field, size_t bytes) const {
    const std::string safe = HXSafeText(_reader.text(field));
    return std::string(HXCutText(safe, bytes));
}

std::string HXMachineReader::safeName(size_t field, size_t bytes) const {
    const std::string safe = HXSafeName(_reader.text(field));
    return std::string(HXCutText(safe, bytes));
}

uint32_t HXMachineReader::internText(size_t field, size_t bytes) {
    return _reader.has(field) ? _machine.strings.add(safeText(field, bytes)) : kNoString;
}

uint32_t HXMachineReader::internName(size_t field, size_t bytes) {
    return _reader.has(field) ? _machine.strings.add(safeName(field, bytes)) : kNoString;
}

// Makes the process that the record's pid names the current one. The pid is the first field of every record
// that has one.
bool HXMachineReader::findProcess() {
    constexpr size_t pidField = 0;
    const int32_t pid = signed32(pidField);
    if (_process != nullptr && _process->pid == pid) return true;
    const auto found = _machine.processIndices.find(pid);
    if (found == _machine.processIndices.end())
        return _reader.fail("no process record before this one for pid " + std::to_string(pid));
    _process = &_machine.processes[found->second];
    return true;
}

bool HXMachineReader::checkMapping(uint64_t address, uint64_t size, uint64_t previousEnd) {
    if (!_reader.checkPlace(address, size)) return false;
    if ((address | size) % _machine.host.pageSize != 0)
        return _reader.fail("address or size is no multiple of the page size");
    if (address < previousEnd) return _reader.fail("it overlaps the mapping before it or does not ascend");
    return true;
}

uint32_t HXMachineReader::traitsOfRecord() {
    HXMachineRegionTraits traits;
    traits.prot = signed32(Region::prot);
    traits.maxProt = signed32(Region::maxProt);
    traits.inheritance = number32(Region::inheritance);
    traits.tag = number32(Region::tag);
    traits.refs = number32(Region::refs);
    traits.behavior = signed32(Region::behavior);
    traits.hasPurge = _reader.has(Region::purge);
    traits.purge = signed32(Region::purge);
    traits.shadowDepth = static_cast<uint16_t>(_reader.number(Region::shadowDepth));
    traits.wired = static_cast<uint16_t>(_reader.number(Region::wired));
    traits.pager = static_cast<uint8_t>(_reader.number(Region::pager));
    traits.shareMode = static_cast<uint8_t>(_reader.number(Region::shareMode));
    traits.shortRecord = _reader.number(Region::shortRecord) != 0;
    traits.heftOnly = _reader.number(Region::heftOnly) != 0;
    const auto [entry, isNew] = _traits.try_emplace(traits, static_cast<uint32_t>(_traits.size()));
    if (isNew) _machine.regionTraits.push_back(traits);
    return entry->second;
}

bool HXMachineReader::readRegion() {
    if (!findProcess()) return false;
    HXMachineRegion region{};
    region.address = _reader.number(Region::address);
    region.size = _reader.number(Region::size);
    auto &regions = _process->regions;
    if (!checkMapping(region.address, region.size, regions ? regions->back().end() : 0)) return false;
    region.offset = _reader.number(Region::offset);
    region.objectID = number32(Region::objectID);
    region.fullObjectID =
        _reader.number(_reader.has(Region::fullObjectID) ? Region::fullObjectID : Region::objectID);
    region.traits = traitsOfRecord();
    region.path = internText(Region::path, kPathBytes);
    region.residentPages = number32(Region::resident);
    region.swappedPages = number32(Region::swapped);
    region.dirtiedPages = number32(Region::dirtied);
    region.dirtiedObjectPages =
        number32(_reader.has(Region::dirtiedObject) ? Region::dirtiedObject : Region::dirtied);
    if (!addExtra(region)) return false;
    if (!regions) regions = std::make_unique<std::deque<HXMachineRegion>>();
    regions->push_back(region);
    return true;
}

bool HXMachineReader::addExtra(HXMachineRegion &region) {
    HXMachineRegionExtra extra;
    extra.sharedNowPrivatePages = number32(Region::sharedNowPrivate);
    extra.reusablePages = number32(Region::reusable);
    const bool hasPages = _reader.has(Region::pages);
    if (extra.sharedNowPrivatePages == 0 && extra.reusablePages == 0 && !hasPages) return true;
    region.extra = static_cast<uint32_t>(_machine.regionExtras.size());
    _machine.regionExtras.push_back(extra);
    return !hasPages || addPageRuns(region, _reader.text(Region::pages));
}

// Adds `text`, runs like "3*9,1*0x10", to the runs of the region that was given an extra last.
bool HXMachineReader::addPageRuns(HXMachineRegion &region, std::string_view text) {
    if (region.size > kMaxPagesRegionSize) return _reader.fail("pages on a region of more than 2^36 bytes");
    HXMachineRegionExtra &extra = _machine.regionExtras[region.extra];
    if (!extra.hasPageRuns) extra.firstPageRun = _machine.pageRuns.size();
    extra.hasPageRuns = true;
    const uint64_t pageCount = region.size / _machine.host.pageSize;
    uint64_t page = extra.pageRunCount == 0 ? 0 : _machine.pageRuns.back().endPage;
    while (!text.empty()) {
        const std::string_view run = text.substr(0, text.find(','));
        text.remove_prefix(run.size());
        const size_t star = run.find('*');
        uint64_t count = 0, disposition = 0;
        if (star == std::string_view::npos ||
            !HXParseNumber(run.substr(0, star), HXFieldKind::unsigned64, &count) ||
            !HXParseNumber(run.substr(star + 1), HXFieldKind::unsigned32, &disposition) || count == 0 ||
            text == ",")
            return _reader.fail("a bad run of pages:", run);
        if (count > pageCount - page) return _reader.fail("more pages than the region has");
        page += count;
        _machine.pageRuns.push_back({static_cast<uint32_t>(page), static_cast<int32_t>(disposition)});
        extra.pageRunCount++;
        if (!text.empty()) text.remove_prefix(1);
    }
    return true;
}

bool HXMachineReader::readPages() {
    if (!findProcess()) return false;
    if (!_process->regions) return _reader.fail("pages before a region of the process");
    HXMachineRegion &region = _process->regions->back();
    const HXMachineRegionExtra &extra = _machine.extra(region);
    const bool isLast = extra.firstPageRun + extra.pageRunCount == _machine.pageRuns.size();
    if (!extra.hasPageRuns || !isLast || _machine.pageRuns.empty())
        return _reader.fail("pages that do not continue those of the last region");
    return addPageRuns(region, _reader.text(Pages::pages));
}

bool HXMachineReader::readTop() {
    if (!findProcess()) return false;
    HXMachineTop top{};
    top.address = _reader.number(Top::address);
    top.size = _reader.number(Top::size);
    auto &tops = _process->tops;
    if (!checkMapping(top.address, top.size, tops.empty() ? 0 : tops.back().end())) return false;
    top.info.protection = signed32(Top::prot);
    top.info.max_protection = signed32(Top::maxProt);
    top.info.inheritance = number32(Top::inheritance);
    top.info.offset = _reader.number(Top::offset);
    top.info.behavior = signed32(Top::behavior);
    top.info.user_wired_count = static_cast<uint16_t>(_reader.number(Top::wired));
    tops.push_back(top);
    return true;
}

bool HXMachineReader::readProcess() {
    const int32_t pid = signed32(Process::pid);
    const auto index = static_cast<uint32_t>(_machine.processes.size());
    if (!_machine.processIndices.try_emplace(pid, index).second)
        return _reader.fail("a second process record of pid " + std::to_string(pid));
    _process = &_machine.processes.emplace_back();
    _process->pid = pid;
    _process->ppid = signed32(Process::ppid);
    _process->flags = number32(Process::flags);
    _process->status = number32(Process::status);
    _process->comm = internName(Process::comm, kCommBytes);
    _process->name = internName(Process::name, kNameBytes);
    _process->argsPath = internName(Process::argsPath);
    _process->argc = number32(Process::argc);
    _process->listed = _reader.number(Process::listed) != 0;
    _process->readable = _reader.number(Process::readable) != 0;
    _process->taskError = signed32(Process::taskError);
    if (_reader.has(Process::dirtyFlags)) _process->dirtyFlags = number32(Process::dirtyFlags);
    if (_reader.has(Process::heft)) _process->heft = _reader.number(Process::heft);
    _process->heftPeak = _reader.number(Process::heftPeak);
    if (_reader.has(Process::pageTable))
        _process->pageTable = static_cast<int64_t>(_reader.number(Process::pageTable));
    _process->ownedError = number32(Process::ownedError);
    _process->ownedNone = _reader.number(Process::ownedNone) != 0;
    return true;
}

bool HXMachineReader::readImage() {
    if (!findProcess()) return false;
    _process->images.push_back({_reader.number(Image::base), internText(Image::path),
                                static_cast<uint32_t>(_process->segments.size())});
    return true;
}

bool HXMachineReader::readSegment() {
    if (!findProcess()) return false;
    if (_process->images.empty()) return _reader.fail("a segment before an image of its process");
    const uint64_t start = _reader.number(Segment::start), size = _reader.number(Segment::size);
    if (!_reader.checkPlace(start, size)) return false;
    _process->segments.push_back({start, size, internText(Segment::name)});
    return true;
}

bool HXMachineReader::readOwned() {
    if (!findProcess()) return false;
    if (_process->ownedNone) return _reader.fail("an owned object of a process with owned_none=1");
    owned_vmobject object{};
    object.object_id = _reader.number(Owned::objectID);
    object.virtual_size = _reader.number(Owned::virtualSize);
    object.resident_size = _reader.number(Owned::resident);
    object.wired_size = _reader.number(Owned::wired);
    object.reusable_size = _reader.number(Owned::reusable);
    object.compressed_size = _reader.number(Owned::compressed);
    object.flags = _reader.number(Owned::flags);
    _process->owned.push_back(object);
    return true;
}

bool HXMachineReader::readFault() {
    static constexpr std::string_view calls[] = {"mach_vm_region", "mach_vm_region_recurse",
                                                 "mach_vm_page_range_query"};
    static constexpr std::string_view fates[] = {"alive", "gone", "zombie"};
    if (!findProcess()) return false;
    const auto call = std::find(std::begin(calls), std::end(calls), _reader.text(Fault::call));
    if (call == std::end(calls)) return _reader.fail("unknown call", _reader.text(Fault::call));
    const std::string_view fateName = _reader.has(Fault::becomes) ? _reader.text(Fault::becomes) : fates[0];
    const auto fate = std::find(std::begin(fates), std::end(fates), fateName);
    if (fate == std::end(fates)) return _reader.fail("unknown fate", fateName);
    HXMachineFault fault;
    fault.error = signed32(Fault::error);
    fault.from = number32(Fault::from);
    fault.becomes = static_cast<HXMachineFate>(fate - std::begin(fates));
    if (fault.error == 0) return _reader.fail("a fault with error 0");
    if (!_process->faults) _process->faults = std::make_unique<HXMachineFaults>();
    HXMachineFault &known = _process->faults->ofCall[call - std::begin(calls)];
    if (known.error == 0 || fault.from < known.from) known = fault;
    return true;
}

bool HXMachineReader::readZone() {
    mach_zone_name name{};
    HXFillText(name.mzn_name, safeName(Zone::name, sizeof name.mzn_name));
    mach_zone_info zone{};
    zone.mzi_count = _reader.number(Zone::count);
    zone.mzi_cur_size = _reader.number(Zone::curSize);
    zone.mzi_elem_size = _reader.number(Zone::elemSize);
    zone.mzi_collectable = _reader.number(Zone::collectable);
    _machine.zoneNames.push_back(name);
    _machine.zones.push_back(zone);
    return true;
}

bool HXMachineReader::readSite() {
    mach_memory_info_record site{};
    site.flags = _reader.number(Site::flags);
    site.site = _reader.number(Site::site);
    site.size = _reader.number(Site::size);
    site.mapped = _reader.number(Site::mapped);
    site.tag = static_cast<uint16_t>(_reader.number(Site::tag));
    site.zone = static_cast<uint16_t>(_reader.number(Site::zone));
    HXFillText(site.name, safeName(Site::name, sizeof site.name));
    _machine.sites.push_back(site);
    return true;
}

bool HXMachineReader::readKext() {
    OSKextInfo kext{_reader.number(Kext::loadTag), std::nullopt};
    if (_reader.has(Kext::bundleID)) kext.CFBundleIdentifier = safeName(Kext::bundleID);
    _machine.kexts.push_back(std::move(kext));
    return true;
}

bool HXMachineReader::readSymbol() {
    const uint64_t address = _reader.number(Symbol::address), size = _reader.number(Symbol::size);
    if (size == 0) return true; // it covers nothing
    const auto next = _machine.symbols.lower_bound(address);
    const bool runsIntoNext = next != _machine.symbols.end() && next->first - address < size;
    if (runsIntoNext || _machine.symbol(address) != nullptr)
        return _reader.fail("a symbol that overlaps another");
    _machine.symbols.emplace_hint(
        next, address,
        HXMachineSymbol{size, internName(Symbol::name), internText(Symbol::path), signed32(Symbol::line)});
    return true;
}

bool HXMachineReader::readTag() {
    const uint32_t tag = number32(Tag::tag);
    if (!_machine.tagNames.try_emplace(tag, safeText(Tag::name)).second)
        return _reader.fail("a second record of tag " + std::to_string(tag));
    return true;
}

bool HXMachineReader::readHost() {
    if (_hasHost) return _reader.fail("a second host record");
    if (_hasRecords) return _reader.fail("the host record comes after another record");
    _hasHost = true;
    HXMachineHost &host = _machine.host;
    host.pageSize = number32(Host::pageSize);
    if (!_reader.checkPageSize(host.pageSize)) return false;
    host.argMax = number32(Host::argMax);
    host.pid = signed32(Host::pid);
    host.euid = number32(Host::euid);
    if (_reader.has(Host::selfRegionHeft)) host.selfRegionHeft = signed32(Host::selfRegionHeft);
    host.sharedRegion = _reader.number(Host::sharedRegion) != 0;
    host.listPidsError = _reader.number(Host::listPidsError) != 0;
    host.memoryInfoError = signed32(Host::memoryInfoError);
    if (!_reader.has(Host::ledger)) return true;
    auto &ledger = host.ledger.emplace();
    const std::string names = safeText(Host::ledger);
    for (size_t start = 0; start <= names.size() && !names.empty();) {
        const size_t comma = std::min(names.find(',', start), names.size());
        ledger.push_back(names.substr(start, comma - start));
        start = comma + 1;
    }
    return true;
}
