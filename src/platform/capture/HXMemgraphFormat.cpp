#include "platform/capture/HXMemgraphFormat.h"

#include <iterator>

namespace {

using F = HXFieldForm;
using K = HXFieldKind;

constexpr F regionFields[] = {
    F::required("address", K::unsigned64),
    F::required("length", K::unsigned64),
    F::required("type", K::text),
    F::optional("path", K::text),
    F::defaulted("prot", K::signed32),
    F::defaulted("max_prot", K::signed32),
    F::defaulted("offset", K::unsigned64),
    F::defaulted("user_tag", K::unsigned32),
    F::defaulted("resident", K::unsigned64),
    F::defaulted("shared_now_private", K::unsigned64),
    F::defaulted("swapped", K::unsigned64),
    F::defaulted("dirty", K::unsigned64),
    F::defaulted("reusable", K::unsigned64),
    F::defaulted("ref_count", K::unsigned32, 1),
    F::defaulted("external_pager", K::unsigned8),
    F::defaulted("share_mode", K::unsigned8, 2),
    F::defaulted("is_submap", K::unsigned32),
    F::defaulted("object_id", K::unsigned32),
    F::defaulted("purgeable", K::signed32, 3),
};
constexpr F processFields[] = {
    F::required("pid", K::signed32),
    F::required("name", K::text),
    F::required("description", K::text),
    F::defaulted("is64bit", K::boolean, 1),
    F::required("page_size", K::unsigned32),
    F::defaulted("phys_heft", K::unsigned64),
    F::defaulted("phys_heft_peak", K::unsigned64),
    F::defaulted("shows_phys_heft", K::boolean, 1),
    F::defaulted("shared_region", K::boolean, 1),
};

constexpr HXRecordForm records[] = {{"region", regionFields}, {"process", processFields}};

static_assert(std::size(regionFields) == HXMemgraphFormat::Region::purgeable + 1);
static_assert(std::size(processFields) == HXMemgraphFormat::Process::sharedRegion + 1);

} // namespace

const HXCaptureFormat HXMemgraphFormat::format = {"heft-memgraph 1", "not a memory graph", records};
