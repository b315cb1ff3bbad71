#include "platform/capture/HXMachineFormat.h"

#include <iterator>

namespace {

using F = HXFieldForm;
using K = HXFieldKind;

constexpr F regionFields[] = {
    F::required("pid", K::signed32),
    F::required("address", K::unsigned64),
    F::required("size", K::unsigned64),
    F::defaulted("prot", K::signed32, 3),
    F::defaulted("max_prot", K::signed32, 7),
    F::defaulted("inheritance", K::unsigned32, 1),
    F::defaulted("offset", K::unsigned64),
    F::defaulted("tag", K::unsigned32),
    F::defaulted("resident", K::unsigned32),
    F::defaulted("shared_now_private", K::unsigned32),
    F::defaulted("swapped", K::unsigned32),
    F::defaulted("dirtied", K::unsigned32),
    F::defaulted("reusable", K::unsigned32),
    F::optional("dirtied_object", K::unsigned32),
    F::defaulted("refs", K::unsigned32, 1),
    F::defaulted("shadow_depth", K::unsigned16),
    F::defaulted("pager", K::unsigned8),
    F::defaulted("share_mode", K::unsigned8, 2),
    F::defaulted("behavior", K::signed32),
    F::defaulted("object_id", K::unsigned32),
    F::optional("full_object_id", K::unsigned64),
    F::defaulted("short_record", K::boolean),
    F::defaulted("wired", K::unsigned16),
    F::optional("purge", K::signed32),
    F::optional("path", K::text),
    F::defaulted("heft_only", K::boolean),
    F::optional("pages", K::text),
};
constexpr F topFields[] = {
    F::required("pid", K::signed32),          F::required("address", K::unsigned64),
    F::required("size", K::unsigned64),       F::defaulted("prot", K::signed32, 3),
    F::defaulted("max_prot", K::signed32, 7), F::defaulted("inheritance", K::unsigned32, 1),
    F::defaulted("offset", K::unsigned64),    F::defaulted("behavior", K::signed32),
    F::defaulted("wired", K::unsigned16),
};
constexpr F pagesFields[] = {F::required("pid", K::signed32), F::required("pages", K::text)};
constexpr F processFields[] = {
    F::required("pid", K::signed32),
    F::defaulted("ppid", K::signed32, 1),
    F::defaulted("flags", K::unsigned32, 0x10),
    F::defaulted("comm", K::text),
    F::defaulted("name", K::text),
    F::defaulted("status", K::unsigned32, 2),
    F::defaulted("listed", K::boolean, 1),
    F::defaulted("readable", K::boolean, 1),
    F::optional("args_path", K::text),
    F::defaulted("argc", K::unsigned32, 1),
    F::defaulted("task_error", K::signed32),
    F::optional("dirty_flags", K::unsigned32),
    F::optional("heft", K::unsigned64),
    F::defaulted("heft_peak", K::unsigned64),
    F::optional("page_table", K::signed64),
    F::defaulted("owned_error", K::unsigned32, 2),
    F::defaulted("owned_none", K::boolean),
};
constexpr F imageFields[] = {
    F::required("pid", K::signed32),
    F::required("path", K::text),
    F::required("base", K::unsigned64),
};
constexpr F segmentFields[] = {
    F::required("pid", K::signed32),
    F::required("name", K::text),
    F::required("start", K::unsigned64),
    F::required("size", K::unsigned64),
};
constexpr F ownedFields[] = {
    F::required("pid", K::signed32),           F::required("object_id", K::unsigned64),
    F::defaulted("virtual", K::unsigned64),    F::defaulted("resident", K::unsigned64),
    F::defaulted("wired", K::unsigned64),      F::defaulted("reusable", K::unsigned64),
    F::defaulted("compressed", K::unsigned64), F::defaulted("flags", K::unsigned64),
};
constexpr F faultFields[] = {
    F::required("pid", K::signed32),        F::required("call", K::text),
    F::defaulted("from", K::unsigned32, 1), F::required("error", K::signed32),
    F::optional("becomes", K::text),
};
constexpr F zoneFields[] = {
    F::required("name", K::text),
    F::defaulted("count", K::unsigned64),
    F::defaulted("cur_size", K::unsigned64),
    F::defaulted("elem_size", K::unsigned64),
    F::defaulted("collectable", K::unsigned64),
};
constexpr F siteFields[] = {
    F::defaulted("flags", K::unsigned64), F::defaulted("site", K::unsigned64),
    F::defaulted("size", K::unsigned64),  F::defaulted("mapped", K::unsigned64),
    F::defaulted("tag", K::unsigned16),   F::defaulted("zone", K::unsigned16),
    F::defaulted("name", K::text),
};
constexpr F kextFields[] = {F::required("load_tag", K::unsigned64), F::optional("bundle_id", K::text)};
constexpr F symbolFields[] = {
    F::required("address", K::unsigned64), F::required("size", K::unsigned64),  F::optional("name", K::text),
    F::optional("path", K::text),          F::defaulted("line", K::unsigned32),
};
constexpr F tagFields[] = {F::required("tag", K::unsigned32), F::required("name", K::text)};
constexpr F hostFields[] = {
    F::defaulted("page_size", K::unsigned32, 16384),
    F::defaulted("arg_max", K::unsigned32, 1048576),
    F::defaulted("pid", K::signed32, 1),
    F::defaulted("euid", K::unsigned32),
    F::optional("self_region_heft", K::boolean),
    F::defaulted("shared_region", K::boolean, 1),
    F::defaulted("list_pids_error", K::boolean),
    F::optional("ledger", K::text),
    F::defaulted("memory_info_error", K::signed32),
};

constexpr HXRecordForm records[] = {
    {"region", regionFields}, {"top", topFields},         {"pages", pagesFields}, {"process", processFields},
    {"image", imageFields},   {"segment", segmentFields}, {"owned", ownedFields}, {"fault", faultFields},
    {"zone", zoneFields},     {"site", siteFields},       {"kext", kextFields},   {"symbol", symbolFields},
    {"tag", tagFields},       {"host", hostFields},
};

static_assert(std::size(regionFields) == HXMachineFormat::Region::pages + 1);
static_assert(std::size(regionFields) <= kMaxCaptureFields);
static_assert(std::size(processFields) == HXMachineFormat::Process::ownedNone + 1);
static_assert(std::size(hostFields) == HXMachineFormat::Host::memoryInfoError + 1);
static_assert(std::size(records) == HXMachineFormat::hostRecord + 1);

} // namespace

const HXCaptureFormat HXMachineFormat::format = {"heft-machine 1", "not a machine file", records};
