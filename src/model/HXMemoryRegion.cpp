#include "model/HXMemoryRegion.h"

#include "platform/HXPlatform.h"

#include <algorithm>
#include <array>

namespace {

struct TagName {
    uint32_t tag;
    const char *name;
};

constexpr TagName kTagNames[] = {
    {0, "untagged (\"VM_ALLOCATE\")"},
    {1, "malloc metadata"},
    {2, "MALLOC_SMALL"},
    {3, "MALLOC_LARGE"},
    {4, "MALLOC_HUGE"},
    {5, "sbrk"},
    {6, "realloc"},
    {7, "MALLOC_TINY"},
    {8, "MALLOC_LARGE_REUSABLE"},
    {9, "MALLOC_LARGE_REUSED"},
    {10, "performance tool data"},
    {11, "MALLOC_NANO"},
    {18, "system/kernel diagnostics"},
    {20, "Mach message"},
    {30, "stack"},
    {31, "guard"},
    {32, "shared pmap"},
    {33, "dylib"},
    {35, "unshared pmap"},
    {44, "Java"},
    {60, "dyld private memory"},
    {61, "dyld malloc memory"},
    {62, "SQLite page cache"},
    {63, "WebAssembly"},
    {64, "JS JIT generated code"},
    {65, "JS VM register file"},
    {66, "OpenGL Shading Language"},
    {67, "OpenCL"},
    {73, "os_alloc_once"},
    {78, "Activity Tracing"},
    {80, "corpse info"},
    {90, "audio"},
    {91, "video bitstream"},
};

constexpr uint32_t kFirstAppTag = HXHostTagLastNamed + 1;
constexpr uint32_t kLastAppTag = 255;

using NameTable = std::array<HXString, 256>;

NameTable makeNameTable() {
    NameTable table;
    for (const TagName &entry : kTagNames)
        table[entry.tag] = HXString::intern(entry.name);
    for (uint32_t tag = kFirstAppTag; tag <= kLastAppTag; tag++)
        table[tag] = HXString::intern("app-specific tag " + std::to_string(tag - kFirstAppTag + 1));
    return table;
}

} // namespace

std::string HXMemoryRegion::fullName() const {
    if (_detailedName.isEmpty()) return _name.str();
    return _name.str() + " " + _detailedName.str();
}

void HXMemoryRegion::addSubrange(HXRange range, const HXSizes &sizes, uint32_t pageSize) {
    auto &list = rest().subrangeList;
    if (!list) list = std::make_unique<HXRangeList>();
    list->addRange(range, pageSize, sizes);
}

HXMemoryRegion HXMemoryRegion::takePart(uint64_t id, const HXSizes &part, const HXSizes &counted) {
    const auto take = [this](uint64_t *own, uint64_t Rest::*shared, uint64_t wanted) {
        const uint64_t taken = std::min(*own, wanted);
        *own -= taken;
        if (taken != 0) rest().*shared += taken;
        return taken;
    };
    HXMemoryRegion taken;
    taken._isPart = true;
    taken._segment = HXSegmentNoImage;
    taken._share_mode = SM_SHARED;
    taken._user_tag = _user_tag;
    taken._name = _name;
    taken._detailedName = _detailedName;
    taken._start = _start;
    taken._object_id = id;
    taken._dirtySize = take(&_dirtySize, &Rest::sharedDirtySize, part.dirty);
    taken._swappedSize = take(&_swappedSize, &Rest::sharedSwappedSize, part.swapped);
    taken._size = taken.sizes().heft();
    const uint64_t dirty = std::min(counted.dirty, taken._dirtySize);
    const uint64_t swapped = std::min(counted.swapped, taken._swappedSize);
    if ((dirty | swapped) != 0) {
        taken.rest().sharedDirtySize = dirty;
        taken.rest().sharedSwappedSize = swapped;
    }
    return taken;
}

HXSizes HXMemoryRegion::listedSizes() const {
    HXSizes listed = sizes();
    listed += sharedSizes();
    return listed;
}

bool HXMemoryRegion::eligibleForProcessView() const {
    if (isFake() || _inSharedCache) return false;
    if (_share_mode == SM_PRIVATE || _share_mode == SM_EMPTY || _share_mode == SM_PRIVATE_ALIASED)
        return false;
    return _segment != HXSegmentText && _segment != HXSegmentData && _segment != HXSegmentLinkedit;
}

bool HXMemoryRegion::eligibleForSubrangesUsingPageSize(uint32_t pageSize) const {
    if (!eligibleForProcessView() || _size <= pageSize || _ownedExclusivelyByParentProcess) return false;
    if (sharedSizes() != HXSizes{}) return false; // the runs have what is in parts, too
    bool anyNonZero = false;
    for (const uint64_t part : {_dirtySize, _swappedSize, _cleanNonSpecSize, reclaimableSize()}) {
        if (part == _size) return false; // wholly in one state: nothing to split
        anyNonZero = anyNonZero || part != 0;
    }
    return anyNonZero;
}

HXString HXMemoryRegion::categoryNameForTag(uint32_t tag) {
    static const NameTable table = makeNameTable();
    if (tag < table.size() && table[tag]) return table[tag];
    if (tag < kFirstAppTag) {
        const auto described =
            HXPlatform::current().GXRegionTypeDescriptionForTagShareProtAndPager(tag, 0, 0, 0);
        if (described && !described->starts_with("Memory Tag")) return HXString::intern(*described);
    }
    if (tag == kFakeRegionTag) return HXString::intern("Owned physical heft (unmapped)");
    return HXString::intern("tag " + std::to_string(static_cast<int32_t>(tag)));
}
