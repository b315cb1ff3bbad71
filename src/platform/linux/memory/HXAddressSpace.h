// The mappings of one process as they were read: a snapshot, ascending and without overlaps.
#pragma once

#include "platform/HXRegionTags.h"
#include "platform/linux/memory/HXMappingClass.h"
#include "platform/linux/procfs/HXMapping.h"

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory_resource>
#include <string_view>
#include <unordered_map>
#include <vector>

// A path that mappings name; `text` is safe, and lives as long as the address space.
struct HXMappedPath {
    std::string_view text;
    HXPathKind kind = HXPathKind::none;
    uint8_t namedTag = 0; // of the name that the program gave the memory
};

// Addresses [start, end).
struct HXAddressRange {
    uint64_t start;
    uint64_t end;
};

class HXAddressSpace {
  public:
    HXAddressSpace();

    // What a query past the last mapping answers: KERN_INVALID_ADDRESS when all mappings were read, else why
    // not: MACH_SEND_INVALID_DEST for a process that died or executed another program meanwhile.
    kern_return_t endError = KERN_INVALID_ADDRESS;
    bool knowsDirtyPages = false;
    // Figures of mappings that HXMayShareAfterFork are still to come (HXReadRequest::leavesPrivatePages).
    bool lacksPrivatePages = false;
    uint64_t ipcNamespace = 0; // read when there is System V memory
    // Where mappings show pages of their object that a mapping at a lower address shows, too; ascending.
    std::vector<HXAddressRange> repeated;

    size_t count() const { return _mappings.size(); }
    HXMapping &operator[](size_t index) { return _mappings[index]; }
    const HXMapping &operator[](size_t index) const { return _mappings[index]; }

    // The index of the first mapping that ends above `address`; `count()` when there is none. `hint`: where
    // it is likely to be.
    size_t find(uint64_t address, size_t hint = 0) const;

    // Appends a mapping. What overlaps its predecessor is cut off: while the text is read piece by piece the
    // process may have joined a mapping with one that has been read already.
    void append(HXMapping mapping);
    // The index of `path` (as the kernel wrote it), for HXMapping::path. A name that a program gave its
    // memory gets its tag from `tags`.
    uint32_t intern(std::string_view path, HXNamedTags &tags);
    const HXMappedPath &path(uint32_t index) const { return _paths[index]; }

  private:
    std::string_view kept(std::string_view text);
    HXMappedPath mappedPath(std::string_view raw, HXNamedTags &tags);

    // Of all that follows. Freed piece by piece it would make threads wait for one another.
    std::pmr::monotonic_buffer_resource _memory{4096};
    // A million may come, which nobody should copy as they grow.
    std::pmr::deque<HXMapping> _mappings{&_memory};
    std::pmr::deque<HXMappedPath> _paths{&_memory}; // the first one is empty
    std::pmr::unordered_map<std::string_view, uint32_t> _pathIndexes{&_memory};
    std::string_view _lastPath; // mappings of one file mostly follow each other
    uint32_t _lastPathIndex = 0;
};
