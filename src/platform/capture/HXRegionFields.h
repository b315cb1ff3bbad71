// The numbers of a region, each once: what captures call it, how wide it is and what it is without its field,
// and where a host's answers, a machine and a memory graph keep it. The readers, the writers, the recorders
// and the replay all go by this table.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/capture/GXProcessObjectGraph.h"
#include "platform/capture/HXCaptureFormat.h"
#include "platform/capture/HXMachine.h"

#include <algorithm>
#include <array>
#include <functional>
#include <iterator>
#include <type_traits>
#include <utility>

// A form without a name: the kind of capture does not have the field, or has its own rules for it.
struct HXRegionField {
    HXFieldForm machine;    // of a `region` in a machine file, in vm_region_submap_info_64
    HXFieldForm graph = {}; // of a `region` in a memory graph, in GXVMRegion
    HXMember top = {};      // in vm_region_basic_info_64; what has a place there is also a field of `top`
    // Where a region of a machine has it on its own; without either it is among its traits.
    HXMember own = {};   // in HXMachineRegion
    HXMember extra = {}; // in HXMachineRegionExtra

    constexpr HXFieldForm topForm() const {
        HXFieldForm form = machine;
        form.member = top;
        return top.exists() ? form : HXFieldForm();
    }
    // Whether a memory graph has it in bytes where the host counts pages.
    constexpr bool isPages() const {
        return machine.kind() == HXFieldKind::unsigned32 && graph.kind() == HXFieldKind::unsigned64;
    }
};

#define INFO(member) HX_MEMBER(vm_region_submap_info_64, member)
#define GRAPH(member) HX_MEMBER(GXVMRegion, member)
#define TOP(member) HX_MEMBER(vm_region_basic_info_64, member)
#define OWN(member) HX_MEMBER(HXMachineRegion, member)
#define EXTRA(member) HX_MEMBER(HXMachineRegionExtra, member)
#define IN(name, ...) HXFieldForm::defaulted(name, __VA_ARGS__)
#define HEX(name, ...) HXFieldForm::defaulted(name, __VA_ARGS__).inHexadecimal()
// clang-format off
inline constexpr HXRegionField kRegionFields[] = {
    // machine file                         memory graph                                  top          own or extra
    {IN("prot", INFO(protection), 3),       IN("prot", GRAPH(prot)),                      TOP(protection)},
    {IN("max_prot", INFO(max_protection), 7), IN("max_prot", GRAPH(maxProt)),             TOP(max_protection)},
    {IN("inheritance", INFO(inheritance), 1), {},                                         TOP(inheritance)},
    {HEX("offset", INFO(offset)),           HEX("offset", GRAPH(offset)),                 TOP(offset), OWN(offset)},
    {IN("tag", INFO(user_tag)),             IN("user_tag", GRAPH(user_tag))},
    {IN("resident", INFO(pages_resident)),  IN("resident", GRAPH(resident_size)),         {}, OWN(residentPages)},
    {IN("shared_now_private", INFO(pages_shared_now_private)),
                                            IN("shared_now_private", GRAPH(shared_now_private_size)),
                                                                                          {}, {}, EXTRA(sharedNowPrivatePages)},
    {IN("swapped", INFO(pages_swapped_out)), IN("swapped", GRAPH(swapped_out_size)),      {}, OWN(swappedPages)},
    {IN("dirtied", INFO(pages_dirtied)),    IN("dirty", GRAPH(dirty_size)),               {}, OWN(dirtiedPages)},
    {IN("reusable", INFO(pages_reusable)),  IN("reusable", GRAPH(reusable_size)),         {}, {}, EXTRA(reusablePages)},
    {IN("refs", INFO(ref_count), 1),        IN("ref_count", GRAPH(ref_count), 1)},
    {IN("shadow_depth", INFO(shadow_depth))},
    {IN("pager", INFO(external_pager)),     IN("external_pager", GRAPH(external_pager))},
    {IN("share_mode", INFO(share_mode), SM_PRIVATE), IN("share_mode", GRAPH(share_mode), SM_PRIVATE)},
    {IN("behavior", INFO(behavior)),        {},                                           TOP(behavior)},
    {{},                                    IN("is_submap", GRAPH(is_submap))},
    {HEX("object_id", INFO(object_id)),     HEX("object_id", GRAPH(object_id)),           {}, OWN(objectID)},
    {{{}, INFO(object_id_full)},            {},                                           {}, OWN(fullObjectID)},
    {IN("wired", INFO(user_wired_count)),   {},                                           TOP(user_wired_count)},
    {{},                                    IN("purgeable", GRAPH(purgeable), VM_PURGABLE_DENY)},
};
// clang-format on
#undef INFO
#undef GRAPH
#undef TOP
#undef OWN
#undef EXTRA
#undef IN
#undef HEX

// The fields of a record that holds a region's numbers: `first`, those forms of the table that have a name,
// `last`.
template <auto FormOf>
constexpr size_t HXRegionFieldCount() {
    return static_cast<size_t>(
        std::count_if(std::begin(kRegionFields), std::end(kRegionFields),
                      [](const HXRegionField &field) { return !std::invoke(FormOf, field).name.empty(); }));
}
template <auto FormOf, size_t First, size_t Last = 0>
constexpr auto HXWithRegionFields(const std::array<HXFieldForm, First> &first,
                                  const std::array<HXFieldForm, Last> &last = {}) {
    std::array<HXFieldForm, First + HXRegionFieldCount<FormOf>() + Last> all;
    auto end = std::copy(first.begin(), first.end(), all.begin());
    for (const HXRegionField &field : kRegionFields)
        if (const HXFieldForm form = std::invoke(FormOf, field); !form.name.empty()) *end++ = form;
    std::copy(last.begin(), last.end(), end);
    return all;
}

// Calls `work` with each field's index as a constant, so that what is done for every region costs no
// more than if its fields were written out.
template <class Work>
void HXForEachRegionField(Work work) {
    [&]<size_t... I>(std::index_sequence<I...>) {
        (work(std::integral_constant<size_t, I>()), ...);
    }
    (std::make_index_sequence<std::size(kRegionFields)>());
}

// What a memory graph tells of the mapping.
inline GXVMRegion HXGraphRegion(const vm_region_submap_info_64 &info, uint32_t pageSize) {
    GXVMRegion region{};
    for (const HXRegionField &field : kRegionFields)
        if (field.graph.member.exists() && field.machine.member.exists())
            field.graph.member.set(&region,
                                   field.machine.member.of(&info) * (field.isPages() ? pageSize : 1));
    return region;
}

// The other way round; with a page size of 1 the counts of pages come in bytes.
inline vm_region_submap_info_64 HXInfoOfGraphRegion(const GXVMRegion &region, uint32_t pageSize) {
    vm_region_submap_info_64 info{};
    for (const HXRegionField &field : kRegionFields)
        if (field.graph.member.exists() && field.machine.member.exists())
            field.machine.member.set(&info,
                                     field.graph.member.of(&region) / (field.isPages() ? pageSize : 1));
    info.is_submap = static_cast<int32_t>(region.is_submap & 1);
    info.object_id_full = region.object_id;
    return info;
}

// What the top-level query tells of a mapping that the leaf query finds too.
inline vm_region_basic_info_64 HXBasicInfo(const vm_region_submap_info_64 &info) {
    vm_region_basic_info_64 basic{};
    for (const HXRegionField &field : kRegionFields)
        if (field.top.exists()) field.top.set(&basic, field.machine.member.of(&info));
    return basic;
}
