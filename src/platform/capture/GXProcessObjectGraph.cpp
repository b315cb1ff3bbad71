#include "platform/capture/GXProcessObjectGraph.h"

#include "platform/HXHostRecords.h"
#include "platform/HXRegionTags.h"
#include "platform/HXSafeText.h"
#include "platform/capture/HXCaptureReader.h"
#include "platform/capture/HXMemgraphFormat.h"

using namespace HXMemgraphFormat;

namespace {

// Tags that programs name mean the name that their region's type gives, whatever number the writer had for
// it. When no tag is free the name is lost, as on a live host.
uint32_t tagOfThisRun(const GXVMRegion &region, HXNamedTags &tags) {
    const bool named = region.user_tag >= HXHostTagFirstNamed && region.user_tag <= HXHostTagLastNamed;
    if (!named || region.external_pager != 0 || region.type.starts_with("__")) return region.user_tag;
    const uint32_t unnamed = region.share_mode == SM_SHARED ? HXHostTagSharedAnonymous : HXHostTagAnonymous;
    return tags.tagForName(region.type).value_or(unnamed);
}

} // namespace

std::unique_ptr<GXProcessObjectGraph> GXProcessObjectGraph::graphOf(HXCaptureReader &&reader,
                                                                    HXNamedTags &tags, std::string *reason) {
    auto graph = std::make_unique<GXProcessObjectGraph>();
    if (graph->read(reader, tags)) return graph;
    *reason = reader.reason();
    return nullptr;
}

std::unique_ptr<GXProcessObjectGraph>
GXProcessObjectGraph::directedGraphWithStream(std::FILE *stream, HXNamedTags &tags, std::string *reason) {
    return graphOf(HXCaptureReader(format, stream), tags, reason);
}

std::unique_ptr<GXProcessObjectGraph>
GXProcessObjectGraph::directedGraphWithData(std::string_view data, HXNamedTags &tags, std::string *reason) {
    return graphOf(HXCaptureReader(format, data), tags, reason);
}

void GXProcessObjectGraph::enumerateRegionsWithBlock(
    const std::function<void(const GXVMRegion &, bool *stop)> &each) const {
    bool stop = false;
    for (auto region = _regions.begin(); region != _regions.end() && !stop; ++region)
        each(*region, &stop);
}

bool GXProcessObjectGraph::read(HXCaptureReader &reader, HXNamedTags &tags) {
    while (reader.next())
        if (!(reader.kind() == processRecord ? readProcess(reader) : readRegion(reader, tags))) return false;
    if (!_hasProcess) reader.fail("no process record");
    return !reader.failed();
}

bool GXProcessObjectGraph::readProcess(HXCaptureReader &reader) {
    if (_hasProcess) return reader.fail("a second process record");
    _hasProcess = true;
    reader.fill(&_facts);
    _facts.pid = static_cast<int32_t>(reader.number(Process::pid));
    _processName = HXSafeName(reader.text(Process::name));
    _description = HXSafeText(reader.text(Process::description));
    return reader.checkPageSize(_facts.pageSize);
}

bool GXProcessObjectGraph::readRegion(HXCaptureReader &reader, HXNamedTags &tags) {
    if (!_hasProcess) return reader.fail("a region before the process record");
    GXVMRegion region{};
    reader.fill(&region);
    region.address = reader.number(Region::address);
    region.length = reader.number(Region::length);
    if (!reader.checkPlace(region.address, region.length)) return false;
    if (!_regions.empty() && region.address < _regions.back().address + _regions.back().length)
        return reader.fail("it overlaps the region before it or does not ascend");
    region.type = intern(reader.text(Region::type));
    if (reader.has(Region::path)) region.path = intern(reader.text(Region::path));
    region.user_tag = tagOfThisRun(region, tags);
    _regions.push_back(region);
    return true;
}

std::string_view GXProcessObjectGraph::intern(std::string_view text) {
    return _strings.text(_strings.add(HXSafeText(text)));
}
