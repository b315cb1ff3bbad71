#include "process/HXMemgraphProcess.h"

#include "platform/HXPlatform.h"
#include "platform/capture/HXRegionFields.h"

#include <cerrno>
#include <cstdio>
#include <system_error>

namespace {

// Codes of HXHeftErrorDomain.
constexpr int kInitializationFailed = 1, kUnknownPlatform = 2;

bool fail(HXError *error, const char *domain, int code, std::string description) {
    if (error) *error = HXError(domain, code, std::move(description));
    return false;
}

} // namespace

HXSharedRegionPlatform HXPlatformOfDescription(const std::string &description) {
    const auto contains = [&](const char *word) { return description.find(word) != std::string::npos; };
    if (contains("X86-64")) return HXPlatformIntel64;
    if (contains("X86")) return HXPlatformIntel32;
    const size_t arm64 = description.find("ARM64");
    if (arm64 != std::string::npos)
        return description.compare(arm64 + 5, 3, "-32") == 0 ? HXPlatformARM64_32 : HXPlatformARM64;
    return contains("ARM") ? HXPlatformARM32 : HXPlatformUnknown;
}

std::unique_ptr<HXMemgraphProcess> HXMemgraphProcess::processWithMemgraph(const std::string &path,
                                                                          HXError *error) {
    auto process = std::make_unique<HXMemgraphProcess>();
    return process->initWithMemgraph(path, error) ? std::move(process) : nullptr;
}

bool HXMemgraphProcess::initWithMemgraph(const std::string &path, HXError *error) {
    if (error) *error = HXError();
    const std::unique_ptr<std::FILE, int (*)(std::FILE *)> stream(
        HXPlatform::current().services().openRegularFile(path), std::fclose);
    if (!stream) {
        const std::error_code failure(errno, std::generic_category());
        return fail(error, HXPOSIXErrorDomain, failure.value(), failure.message());
    }
    std::string reason;
    _graph = GXProcessObjectGraph::directedGraphWithStream(stream.get(), HXPlatform::current().namedTags(),
                                                           &reason);
    if (!_graph)
        return fail(error, HXHeftErrorDomain, kInitializationFailed,
                    reason.empty() ? "memgraph initialization failed with unknown error" : reason);

    proc_bsdinfo info{};
    info.pbi_flags = _graph->is64bit() ? PROC_FLAG_LP64 : 0;
    info.pbi_pid = _graph->pid();
    if (!initWithBsdInfo(info, nullptr)) return false;
    setName(_graph->processName());
    setDisplayString(name() + " [" + std::to_string(pid()) + "] (memgraph)");
    if (!_setSharedRegionFromPlatform(HXPlatformOfDescription(_graph->processDescriptionString())))
        return fail(error, HXHeftErrorDomain, kUnknownPlatform,
                    "Unable to determine platform from memory graph process description");
    return true;
}

void HXMemgraphProcess::_gatherPhysHeft() {
    _phys_heft = _graph->physicalHeft();
    _phys_heft_peak = _graph->physicalHeftPeak();
}

vm_region_submap_info_64 HXMemgraphProcess::infoOfRegion(const GXVMRegion &region) const {
    const bool inSharedRegion = sharedRegion().contains(region.address);
    // Within the shared region the fields hold bytes; elsewhere pages, as a live walk delivers them.
    return HXInfoOfGraphRegion(region, inSharedRegion ? 1 : static_cast<uint32_t>(pageSize()));
}

// A region whose type names a segment completes the pending image; any other only names it.
void HXMemgraphProcess::takeImage(const GXVMRegion &region, HXImage &pending) {
    pending.setName(HXString::intern(region.type));
    if (pending.segment() == HXSegmentUnset) return;
    pending.setStart(region.address);
    pending.setSize(region.length);
    if (region.path) pending.setOwnerPath(HXString::intern(*region.path));
    _images.push_back(pending);
    pending = HXImage();
}

void HXMemgraphProcess::enumerateRegions(const HXRegionCallback &callback) {
    HXImage pending;
    _graph->enumerateRegionsWithBlock([&](const GXVMRegion &region, bool *stop) {
        const vm_region_submap_info_64 info = infoOfRegion(region);
        takeImage(region, pending);
        std::optional<std::string_view> path;
        if (region.external_pager && region.path) path = *region.path;
        *stop = callback(region.address, region.length, info, region.purgeable, path);
    });
}
