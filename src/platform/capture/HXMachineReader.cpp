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

} // namespace

const HXMachineReader::Handler HXMachineReader::handlers[] = {
    &HXMachineReader::readRegion,  &HXMachineReader::readTop,    &HXMachineReader::readPages,
    &HXMachineReader::readShare,   &HXMachineReader::readImage,  &HXMachineReader::readSegment,
    &HXMachineReader::readOwned,   &HXMachineReader::readHeld,   &HXMachineReader::readFault,
    &HXMachineReader::readProcess, &HXMachineReader::readZone,   &HXMachineReader::readSite,
    &HXMachineReader::readKext,    &HXMachineReader::readSymbol, &HXMachineReader::readTag,
    &HXMachineReader::readHost,
};

static std::unique_ptr<HXMachine> machineOf(HXCaptureReader &&reader, std::string *reason) {
    auto machine = std::make_unique<HXMachine>();
    if (HXMachineReader(reader, *machine).read()) return machine;
    *reason = reader.reason();
    return nullptr;
}

std::unique_ptr<HXMachine> HXMachine::load(HXServices &files, const std::string &path, std::string *reason) {
    const std::unique_ptr<std::FILE, int (*)(std::FILE *)> stream(files.openForReading(path), std::fclose);
    if (stream) return machineOf(HXCaptureReader(format, stream.get()), reason);
    *reason = std::strerror(errno);
    return nullptr;
}

std::unique_ptr<HXMachine> HXMachine::loadText(std::string_view text, std::string *reason) {
    return machineOf(HXCaptureReader(format, text), reason);
}

bool HXMachineReader::read() {
    _machine.regionExtras.emplace_back();
    for (; _reader.next(); _hasRecords = true)
        if ((_reader.kind() < processRecord && !findProcess()) || !(this->*handlers[_reader.kind()])())
            return false;
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

// Makes the process that the record's pid names the current one.
bool HXMachineReader::findProcess() {
    constexpr size_t pidField = 0; // of every record that has one
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

// Keeps the numbers of the current record where the table of region fields says: on the region's own, or
// among the traits and the extras that it is given.
void HXMachineReader::keepNumbers(HXMachineRegion &region) {
    HXMachineRegionTraits traits;
    HXMachineRegionExtra extra;
    bool hasExtra = _reader.has(Region::pages);
    size_t index = Region::firstNumber;
    HXForEachRegionField([&](auto each) {
        constexpr HXRegionField field = kRegionFields[each];
        if constexpr (!field.machine.name.empty()) {
            const uint64_t number = _reader.number(index++);
            if constexpr (field.own.exists()) {
                field.own.set(&region, number);
            } else if constexpr (field.extra.exists()) {
                field.extra.set(&extra, number);
                hasExtra |= number != 0;
            } else {
                field.machine.member.set(&traits.info, number);
            }
        }
    });
    traits.purge = _reader.optionalNumber<int32_t>(Region::purge);
    traits.shortRecord = _reader.number(Region::shortRecord) != 0;
    traits.heftOnly = _reader.number(Region::heftOnly) != 0;
    const auto [entry, isNew] = _traits.try_emplace(traits, static_cast<uint32_t>(_traits.size()));
    if (isNew) _machine.regionTraits.push_back(traits);
    region.traits = entry->second;
    if (!hasExtra) return;
    region.extra = static_cast<uint32_t>(_machine.regionExtras.size());
    _machine.regionExtras.push_back(extra);
}

bool HXMachineReader::readRegion() {
    HXMachineRegion region{};
    region.address = _reader.number(Region::address);
    region.size = _reader.number(Region::size);
    auto &regions = _process->regions;
    if (!checkMapping(region.address, region.size, regions ? regions->back().end() : 0)) return false;
    keepNumbers(region);
    region.fullObjectID = _reader.optionalNumber<uint64_t>(Region::fullObjectID).value_or(region.objectID);
    region.dirtiedObjectPages =
        _reader.optionalNumber<uint32_t>(Region::dirtiedObject).value_or(region.dirtiedPages);
    region.path = internText(Region::path, kMaxPathBytes);
    if (_reader.has(Region::pages) && !addPageRuns(region, _reader.text(Region::pages))) return false;
    if (!regions) regions = std::make_unique<std::deque<HXMachineRegion>>();
    regions->push_back(region);
    return true;
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
    if (!_process->regions) return _reader.fail("pages before a region of the process");
    HXMachineRegion &region = _process->regions->back();
    const HXMachineRegionExtra &extra = _machine.extra(region);
    const bool isLast = extra.firstPageRun + extra.pageRunCount == _machine.pageRuns.size();
    if (!extra.hasPageRuns || !isLast || _machine.pageRuns.empty())
        return _reader.fail("pages that do not continue those of the last region");
    return addPageRuns(region, _reader.text(Pages::pages));
}

bool HXMachineReader::readShare() {
    constexpr uint64_t mostPages = uint64_t{1} << 45; // whose bytes fit a record of sizes many times
    if (!_process->regions) return _reader.fail("a share before a region of the process");
    vm_region_share share{};
    _reader.fill(&share);
    if (share.object_id == 0 || share.object_id == UINT64_MAX) return _reader.fail("a share of no object");
    for (const uint64_t pages : {share.pages_resident, share.pages_swapped_out})
        if (pages > mostPages) return _reader.fail("a share of too many pages");
    HXMachineRegion &region = _process->regions->back();
    if (region.extra == 0) {
        region.extra = static_cast<uint32_t>(_machine.regionExtras.size());
        _machine.regionExtras.emplace_back();
    }
    HXMachineRegionExtra &extra = _machine.regionExtras[region.extra];
    if (extra.shareCount == 0) extra.firstShare = _machine.shares.size();
    if (extra.firstShare + extra.shareCount != _machine.shares.size())
        return _reader.fail("a share that does not continue those of the last region");
    extra.shareCount++;
    _machine.shares.push_back(share);
    return true;
}

bool HXMachineReader::readTop() {
    HXMachineTop top{};
    top.address = _reader.number(Top::address);
    top.size = _reader.number(Top::size);
    auto &tops = _process->tops;
    if (!checkMapping(top.address, top.size, tops.empty() ? 0 : tops.back().end())) return false;
    _reader.fill(&top.info);
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
    _reader.fill(_process);
    _process->comm = internName(Process::comm, kCommBytes);
    _process->name = internName(Process::name, kNameBytes);
    _process->argsPath = internName(Process::argsPath);
    _process->dirtyFlags = _reader.optionalNumber<uint32_t>(Process::dirtyFlags);
    _process->heft = _reader.optionalNumber<uint64_t>(Process::heft);
    _process->pageTable = _reader.optionalNumber<int64_t>(Process::pageTable);
    _process->pageTableObject =
        _reader.optionalNumber<uint64_t>(Process::pageTableObject).value_or(UINT64_MAX);
    if (_process->pageTableObject == 0) return _reader.fail("page tables of no object");
    return true;
}

bool HXMachineReader::readImage() {
    _process->images.push_back({_reader.number(Image::base), internText(Image::path),
                                static_cast<uint32_t>(_process->segments.size())});
    return true;
}

bool HXMachineReader::readSegment() {
    if (_process->images.empty()) return _reader.fail("a segment before an image of its process");
    const uint64_t start = _reader.number(Segment::start), size = _reader.number(Segment::size);
    if (!_reader.checkPlace(start, size)) return false;
    _process->segments.push_back({start, size, internText(Segment::name)});
    return true;
}

bool HXMachineReader::readOwned() {
    if (_process->ownedNone) return _reader.fail("an owned object of a process with owned_none=1");
    _reader.fill(&_process->owned.emplace_back());
    return true;
}

bool HXMachineReader::readHeld() {
    task_held_object &object = _process->held.emplace_back();
    _reader.fill(&object);
    object.name = safeText(Held::name);
    object.detail = safeText(Held::detail);
    return true;
}

bool HXMachineReader::readFault() {
    static constexpr std::string_view calls[] = {"mach_vm_region", "mach_vm_region_recurse",
                                                 "mach_vm_page_range_query"};
    static constexpr std::string_view fates[] = {"alive", "gone", "zombie"};
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
    HXFillText(_machine.zoneNames.emplace_back().mzn_name,
               safeName(ZoneOrSite::name, sizeof mach_zone_name::mzn_name));
    _reader.fill(&_machine.zones.emplace_back());
    return true;
}

bool HXMachineReader::readSite() {
    mach_memory_info_record &site = _machine.sites.emplace_back();
    HXFillText(site.name, safeName(ZoneOrSite::name, sizeof site.name));
    _reader.fill(&site);
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
    _reader.fill(&host);
    if (!_reader.checkPageSize(host.pageSize)) return false;
    host.selfRegionHeft = _reader.optionalNumber<int32_t>(Host::selfRegionHeft);
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
