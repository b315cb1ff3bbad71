#include "platform/capture/HXMachineFormat.h"

#include <iterator>

namespace {

using F = HXFieldForm;
using K = HXFieldKind;

constexpr auto regionFields = HXWithRegionFields<&HXRegionField::machine>(
    std::array{F::required("pid", K::signed32), F::required("address", K::unsigned64).inHexadecimal(),
               F::required("size", K::unsigned64).inHexadecimal()},
    std::array{
        F::optional("full_object_id", K::unsigned64).inHexadecimal(),
        F::optional("dirtied_object", K::unsigned32),
        F::optional("purge", K::signed32),
        F::optional("path", K::text),
        F::optional("pages", K::text),
        F::defaulted("short_record", HX_MEMBER(HXMachineRegionTraits, shortRecord)),
        F::defaulted("heft_only", HX_MEMBER(HXMachineRegionTraits, heftOnly)),
    });
constexpr auto topFields = HXWithRegionFields<&HXRegionField::topForm>(
    std::array{F::required("pid", K::signed32), F::required("address", K::unsigned64).inHexadecimal(),
               F::required("size", K::unsigned64).inHexadecimal()});
constexpr F pagesFields[] = {F::required("pid", K::signed32), F::required("pages", K::text)};
#define SHARE(member) HX_MEMBER(vm_region_share, member)
constexpr F shareFields[] = {
    F::required("pid", K::signed32),
    F::required("object_id", SHARE(object_id)).inHexadecimal(),
    F::defaulted("resident", SHARE(pages_resident)),
    F::defaulted("swapped", SHARE(pages_swapped_out)),
    F::defaulted("resident_counted", SHARE(pages_resident_counted)),
    F::defaulted("swapped_counted", SHARE(pages_swapped_out_counted)),
};
#define PROCESS(member) HX_MEMBER(HXMachineProcess, member)
constexpr F processFields[] = {
    F::required("pid", K::signed32),
    F::defaulted("comm", K::text),
    F::defaulted("name", K::text),
    F::optional("args_path", K::text),
    F::optional("dirty_flags", K::unsigned32),
    F::optional("heft", K::unsigned64),
    F::optional("page_table", K::signed64),
    F::optional("page_table_object", K::unsigned64).inHexadecimal(),
    F::defaulted("ppid", PROCESS(ppid), 1),
    F::defaulted("flags", PROCESS(flags), PROC_FLAG_LP64),
    F::defaulted("status", PROCESS(status), 2),
    F::defaulted("listed", PROCESS(listed), 1),
    F::defaulted("readable", PROCESS(readable), 1),
    F::defaulted("argc", PROCESS(argc), 1),
    F::defaulted("task_error", PROCESS(taskError)),
    F::defaulted("heft_peak", PROCESS(heftPeak)),
    F::defaulted("owned_error", PROCESS(ownedError), 2),
    F::defaulted("owned_none", PROCESS(ownedNone)),
};
constexpr F imageFields[] = {
    F::required("pid", K::signed32),
    F::required("path", K::text),
    F::required("base", K::unsigned64).inHexadecimal(),
};
constexpr F segmentFields[] = {
    F::required("pid", K::signed32),
    F::required("name", K::text),
    F::required("start", K::unsigned64).inHexadecimal(),
    F::required("size", K::unsigned64).inHexadecimal(),
};
#define OWNED(member) HX_MEMBER(owned_vmobject, member)
constexpr F ownedFields[] = {
    F::required("pid", K::signed32),
    F::required("object_id", OWNED(object_id)).inHexadecimal(),
    F::defaulted("virtual", OWNED(virtual_size)),
    F::defaulted("resident", OWNED(resident_size)),
    F::defaulted("wired", OWNED(wired_size)),
    F::defaulted("reusable", OWNED(reusable_size)),
    F::defaulted("compressed", OWNED(compressed_size)),
    F::defaulted("flags", OWNED(flags)).inHexadecimal(),
};
#define HELD(member) HX_MEMBER(task_held_object, member)
constexpr F heldFields[] = {
    F::required("pid", K::signed32),
    F::defaulted("name", K::text),
    F::defaulted("detail", K::text),
    F::required("object_id", HELD(object_id)).inHexadecimal(),
    F::defaulted("container_id", HELD(container_id)).inHexadecimal(),
    F::defaulted("resident", HELD(resident_size)),
    F::defaulted("swapped", HELD(swapped_size)),
    F::defaulted("flags", HELD(flags)).inHexadecimal(),
};
constexpr F faultFields[] = {
    F::required("pid", K::signed32),        F::required("call", K::text),
    F::defaulted("from", K::unsigned32, 1), F::required("error", K::signed32),
    F::optional("becomes", K::text),
};
#define ZONE(member) HX_MEMBER(mach_zone_info, member)
constexpr F zoneFields[] = {
    F::required("name", K::text),
    F::defaulted("count", ZONE(mzi_count)),
    F::defaulted("cur_size", ZONE(mzi_cur_size)),
    F::defaulted("elem_size", ZONE(mzi_elem_size)),
    F::defaulted("collectable", ZONE(mzi_collectable)),
};
#define SITE(member) HX_MEMBER(mach_memory_info_record, member)
constexpr F siteFields[] = {
    F::defaulted("name", K::text),
    F::defaulted("flags", SITE(flags)).inHexadecimal(),
    F::defaulted("site", SITE(site)).inHexadecimal(),
    F::defaulted("size", SITE(size)),
    F::defaulted("mapped", SITE(mapped)),
    F::defaulted("tag", SITE(tag)),
    F::defaulted("zone", SITE(zone)),
};
constexpr F kextFields[] = {F::required("load_tag", K::unsigned64), F::optional("bundle_id", K::text)};
constexpr F symbolFields[] = {
    F::required("address", K::unsigned64).inHexadecimal(),
    F::required("size", K::unsigned64),
    F::optional("name", K::text),
    F::optional("path", K::text),
    F::defaulted("line", K::unsigned32),
};
constexpr F tagFields[] = {F::required("tag", K::unsigned32), F::required("name", K::text)};
#define HOST(member) HX_MEMBER(HXMachineHost, member)
constexpr F hostFields[] = {
    F::optional("self_region_heft", K::boolean),
    F::optional("ledger", K::text),
    F::defaulted("page_size", HOST(pageSize), 16384),
    F::defaulted("arg_max", HOST(argMax), 1048576),
    F::defaulted("pid", HOST(pid), 1),
    F::defaulted("euid", HOST(euid)),
    F::defaulted("shared_region", HOST(sharedRegion), 1),
    F::defaulted("list_pids_error", HOST(listPidsError)),
    F::defaulted("memory_info_error", HOST(memoryInfoError)),
};

constexpr HXRecordForm records[] = {
    {"region", regionFields}, {"top", topFields},         {"pages", pagesFields}, {"share", shareFields},
    {"image", imageFields},   {"segment", segmentFields}, {"owned", ownedFields}, {"held", heldFields},
    {"fault", faultFields},   {"process", processFields}, {"zone", zoneFields},   {"site", siteFields},
    {"kext", kextFields},     {"symbol", symbolFields},   {"tag", tagFields},     {"host", hostFields},
};

static_assert(std::size(regionFields) <= kMaxCaptureFields);
static_assert(regionFields[HXMachineFormat::Region::fullObjectID].name == "full_object_id");
static_assert(regionFields[HXMachineFormat::Region::heftOnly].name == "heft_only");
static_assert(processFields[HXMachineFormat::Process::pageTableObject].name == "page_table_object");
static_assert(offsetof(HXMachineRegionTraits, info) == 0, "both are filled by the places in one form");
static_assert(std::size(records) == HXMachineFormat::hostRecord + 1);

} // namespace

const HXCaptureFormat HXMachineFormat::format = {"heft-machine 1", "not a machine file", records};
