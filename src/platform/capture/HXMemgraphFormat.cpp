#include "platform/capture/HXMemgraphFormat.h"

#include "platform/capture/HXRegionFields.h"

namespace {

using F = HXFieldForm;
using K = HXFieldKind;

constexpr auto regionFields = HXWithRegionFields<&HXRegionField::graph>(std::array{
    F::required("address", K::unsigned64).inHexadecimal(),
    F::required("length", K::unsigned64).inHexadecimal(),
    F::required("type", K::text),
    F::optional("path", K::text),
});
#define PROCESS(member) HX_MEMBER(GXProcessFacts, member)
constexpr F processFields[] = {
    F::required("pid", K::signed32),
    F::required("name", K::text),
    F::required("description", K::text),
    F::defaulted("is64bit", PROCESS(is64bit), 1),
    F::required("page_size", PROCESS(pageSize)),
    F::defaulted("phys_heft", PROCESS(physicalHeft)),
    F::defaulted("phys_heft_peak", PROCESS(physicalHeftPeak)),
    F::defaulted("shows_phys_heft", PROCESS(showsPhysHeft), 1),
    F::defaulted("shared_region", PROCESS(hasSharedRegion), 1),
};

constexpr HXRecordForm records[] = {{"region", regionFields}, {"process", processFields}};

static_assert(regionFields[HXMemgraphFormat::Region::path].name == "path");
static_assert(processFields[HXMemgraphFormat::Process::description].name == "description");

// Longer than any graph of a process: a file may have any length without taking any room.
constexpr uint64_t kLongestFile = uint64_t{4} << 30;

} // namespace

const HXCaptureFormat HXMemgraphFormat::format = {"heft-memgraph 1", "not a memory graph", records,
                                                  kLongestFile};
