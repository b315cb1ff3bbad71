// One virtual-memory region of one process.
#pragma once

#include "model/HXRangeList.h"
#include "model/HXSizes.h"
#include "model/HXString.h"
#include "platform/HXHostRecords.h"
#include "platform/HXInternalError.h"

#include <cstddef>
#include <cstdint>
#include <iterator>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

class HXMemoryObject;

// Which kind of image segment a region belongs to.
enum HXSegment : uint8_t {
    HXSegmentUnset = 0,
    HXSegmentNoImage = 1, // the walk found no image that covers the region
    HXSegmentText = 2,    // a name that begins with "__TEXT"
    HXSegmentData = 3,    // any other name that begins with "__"
    HXSegmentLinkedit = 4 // a name that begins with "__LINKEDIT"
};

// The start of regions that stand for memory without an address.
inline constexpr uint64_t kNoAddress = UINT64_MAX;

// Where a region lies, which VM object backs it at which offset, how its bytes divide, and what it is called.
// Filled once by its process's source on one thread, read-only afterwards. All sizes in bytes.
class HXMemoryRegion {
  public:
    HXMemoryRegion() = default;
    HXMemoryRegion(const HXMemoryRegion &) = delete;
    HXMemoryRegion &operator=(const HXMemoryRegion &) = delete;
    HXMemoryRegion(HXMemoryRegion &&) = default;
    HXMemoryRegion &operator=(HXMemoryRegion &&) = default;

    // The pages are wired.
    bool wired() const { return _wired; }
    void setWired(bool wired) { _wired = wired; }
    // The region lies in the shared cache of the host's libraries.
    bool inSharedCache() const { return _inSharedCache; }
    void setInSharedCache(bool inside) { _inSharedCache = inside; }
    // A part of the shared cache that no image of the process uses.
    bool unusedSharedCacheRegion() const { return _unusedSharedCacheRegion; }
    void setUnusedSharedCacheRegion(bool unused) { _unusedSharedCacheRegion = unused; }
    // Memory that the process owns, whoever else maps it.
    bool ownedExclusivelyByParentProcess() const { return _ownedExclusivelyByParentProcess; }
    void setOwnedExclusivelyByParentProcess(bool owned) { _ownedExclusivelyByParentProcess = owned; }

    HXSegment segment() const { return _segment; }
    void setSegment(HXSegment segment) { _segment = segment; }
    // The kernel's share mode (SM_…).
    uint8_t share_mode() const { return _share_mode; }
    void setShare_mode(uint8_t mode) { _share_mode = mode; }
    uint32_t user_tag() const { return _user_tag; }
    void setUser_tag(uint32_t tag) { _user_tag = tag; }

    // The object that the region was merged into; not owned, null before the merge.
    HXMemoryObject *memoryObject() const { return _memoryObject; }
    void setMemoryObject(HXMemoryObject *object) { _memoryObject = object; }

    HXString name() const { return _name; }
    void setName(HXString name) { _name = name; }
    void setName(std::string_view name) { _name = HXString::intern(name); }
    // Further detail, for an image region the image's path; may be none.
    HXString detailedName() const { return _detailedName; }
    void setDetailedName(HXString name) { _detailedName = name; }
    void setDetailedName(std::string_view name) { _detailedName = HXString::intern(name); }
    // The name, and after a blank the detail where there is one.
    std::string fullName() const;

    // Offset of the first byte in the VM object.
    uint64_t offset() const { return _offset; }
    void setOffset(uint64_t offset) { _offset = offset; }
    uint64_t start() const { return _start; }
    void setStart(uint64_t start) { _start = start; }
    uint64_t size() const { return _size; }
    void setSize(uint64_t size) { _size = size; }
    // start + size; a region without an address has no end either.
    uint64_t end() const { return _start == kNoAddress ? kNoAddress : _start + _size; }
    void setEnd(uint64_t end) {
        HXRequire(end >= _start, "HXMemoryRegion setEnd", "end >= self.start");
        _size = end - _start;
    }

    uint64_t dirtySize() const { return _dirtySize; }
    void setDirtySize(uint64_t size) { _dirtySize = size; }
    uint64_t reclaimableSize() const { return _rest ? _rest->reclaimableSize : 0; }
    void setReclaimableSize(uint64_t size) {
        if (_rest || size != 0) rest().reclaimableSize = size;
    }
    uint64_t swappedSize() const { return _swappedSize; }
    void setSwappedSize(uint64_t size) { _swappedSize = size; }
    // Clean resident bytes that were not brought in speculatively.
    uint64_t cleanNonSpecSize() const { return _cleanNonSpecSize; }
    void setCleanNonSpecSize(uint64_t size) { _cleanNonSpecSize = size; }
    uint64_t wiredSize() const { return _wired ? _size : 0; }
    HXSizes sizes() const {
        return {_dirtySize, _swappedSize, _cleanNonSpecSize, reclaimableSize(), wiredSize()};
    }

    // The region stands for pages of a mapping that one set of processes shares (`takePart`): an entry of
    // their object, not of the listing, where they stay with the mapping.
    bool isPart() const { return _isPart; }
    // Takes dirty and swapped bytes out of what `sizes` tells, at most as much as there is, and makes a part
    // of them in the object `id`. Of the part `counted` bytes count for all who share the object.
    HXMemoryRegion takePart(uint64_t id, const HXSizes &part, const HXSizes &counted);
    // All of a mapping's bytes, its parts included.
    HXSizes listedSizes() const;
    // Of a part: see `takePart`.
    HXSizes countedSizes() const { return sharedSizes(); }

    // Identifier of the VM object; 0 when there is none.
    uint64_t object_id() const { return _object_id; }
    void setObject_id(uint64_t id) { _object_id = id; }

    // The region's page runs, where page queries split it; null otherwise. Exists only until the merge.
    const HXRangeList *subrangeList() const { return _rest ? _rest->subrangeList.get() : nullptr; }
    // Adds a run, located by its offset in the VM object.
    void addSubrange(HXRange range, const HXSizes &sizes, uint32_t pageSize);
    void freeSubrangeList() { takeSubrangeList(); }
    // Hands the page runs over; the region has none afterwards.
    std::unique_ptr<HXRangeList> takeSubrangeList() {
        return _rest ? std::move(_rest->subrangeList) : nullptr;
    }

    // Stands for owned memory that no mapping shows.
    bool isFake() const { return _user_tag == kFakeRegionTag; }
    // Whether one process's view of the region's object may differ from the whole object.
    bool eligibleForProcessView() const;
    // Whether splitting the region into page runs can tell anything new.
    bool eligibleForSubrangesUsingPageSize(uint32_t pageSize) const;

    // What memory of a user tag is called. Never none. Any thread.
    static HXString categoryNameForTag(uint32_t tag);

  private:
    // What few regions have.
    struct Rest {
        uint64_t reclaimableSize = 0;
        // In parts; of a part, the bytes that count.
        uint64_t sharedDirtySize = 0;
        uint64_t sharedSwappedSize = 0;
        std::unique_ptr<HXRangeList> subrangeList;
    };
    HXSizes sharedSizes() const {
        return _rest ? HXSizes{_rest->sharedDirtySize, _rest->sharedSwappedSize} : HXSizes{};
    }
    Rest &rest() {
        if (!_rest) _rest = std::make_unique<Rest>();
        return *_rest;
    }

    bool _wired : 1 = false;
    bool _inSharedCache : 1 = false;
    bool _unusedSharedCacheRegion : 1 = false;
    bool _ownedExclusivelyByParentProcess : 1 = false;
    bool _isPart : 1 = false;
    HXSegment _segment = HXSegmentUnset;
    uint8_t _share_mode = 0;
    uint32_t _user_tag = 0;
    HXMemoryObject *_memoryObject = nullptr;
    HXString _name;
    HXString _detailedName;
    std::unique_ptr<Rest> _rest;
    uint64_t _offset = 0;
    uint64_t _start = 0;
    uint64_t _size = 0;
    uint64_t _dirtySize = 0;
    uint64_t _swappedSize = 0;
    uint64_t _cleanNonSpecSize = 0;
    uint64_t _object_id = 0;
};

// A process's regions: their addresses stay as the list grows at its end.
class HXMemoryRegionList {
    template <typename List, typename Region>
    class Iterator {
      public:
        using iterator_category = std::forward_iterator_tag;
        using value_type = HXMemoryRegion;
        using difference_type = std::ptrdiff_t;
        using pointer = Region *;
        using reference = Region &;

        Iterator() = default;
        Iterator(List &list, size_t index) : _list(&list), _index(index) {}
        Region &operator*() const { return (*_list)[_index]; }
        Region *operator->() const { return &**this; }
        Iterator &operator++() {
            _index++;
            return *this;
        }
        Iterator operator++(int) { return {*_list, _index++}; }
        bool operator==(const Iterator &) const = default;

      private:
        List *_list = nullptr;
        size_t _index = 0;
    };

  public:
    using value_type = HXMemoryRegion;
    using iterator = Iterator<HXMemoryRegionList, HXMemoryRegion>;
    using const_iterator = Iterator<const HXMemoryRegionList, const HXMemoryRegion>;

    HXMemoryRegion &emplace_back() { return lastChunk().emplace_back(); }
    HXMemoryRegion &emplace_back(HXMemoryRegion region) {
        return lastChunk().emplace_back(std::move(region));
    }
    void push_back(HXMemoryRegion region) { emplace_back(std::move(region)); }
    void pop_back() {
        _chunks.back().pop_back();
        if (_chunks.back().empty()) _chunks.pop_back();
    }
    size_t size() const {
        return _chunks.empty() ? 0 : (_chunks.size() - 1) * kChunkSize + _chunks.back().size();
    }
    bool empty() const { return _chunks.empty(); }
    HXMemoryRegion &operator[](size_t index) { return _chunks[index / kChunkSize][index % kChunkSize]; }
    const HXMemoryRegion &operator[](size_t index) const {
        return _chunks[index / kChunkSize][index % kChunkSize];
    }
    iterator begin() { return {*this, 0}; }
    iterator end() { return {*this, size()}; }
    const_iterator begin() const { return {*this, 0}; }
    const_iterator end() const { return {*this, size()}; }

  private:
    static constexpr size_t kChunkSize = 32; // about as many as a small process has

    // With room for one more.
    std::vector<HXMemoryRegion> &lastChunk() {
        if (_chunks.empty() || _chunks.back().size() == kChunkSize)
            _chunks.emplace_back().reserve(kChunkSize);
        return _chunks.back();
    }

    std::vector<std::vector<HXMemoryRegion>> _chunks; // none of them empty; a chunk stays where it is
};
