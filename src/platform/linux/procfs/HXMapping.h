// One mapping of a process as its maps and smaps tell it, small enough to keep a million of them.
#pragma once

#include <cstdint>

// What the path column of maps says.
enum class HXPathKind : uint8_t {
    none,
    file,
    deletedFile,     // FILE (deleted)
    heap,            // [heap]
    stack,           // [stack]
    vdso,            // [vdso]
    special,         // other names in brackets
    namedAnonymous,  // [anon:NAME]
    namedShared,     // [anon_shmem:NAME]
    sharedAnonymous, // /dev/zero (deleted)
    systemV,         // /SYSVKEY (deleted)
    memfd,           // /memfd:NAME (deleted)
    anonymousHuge,   // /anon_hugepage (deleted)
};

enum HXMappingFlag : uint16_t {
    HXMappingReadable = 1 << 0,
    HXMappingWritable = 1 << 1,
    HXMappingExecutable = 1 << 2,
    HXMappingShared = 1 << 3,
    // From smaps' VmFlags (mr mw me lo ht dc); the first three are set for a kernel that does not print them.
    HXMappingMayRead = 1 << 4,
    HXMappingMayWrite = 1 << 5,
    HXMappingMayExecute = 1 << 6,
    HXMappingLocked = 1 << 7,
    HXMappingHugePages = 1 << 8, // of the huge-page pool
    HXMappingNotInherited = 1 << 9,
    // Found out by classification (HXMappingClass.h).
    HXMappingSwapBacked = 1 << 10, // shared memory of the kernel or of a tmpfs
    HXMappingHasPager = 1 << 11,
};

struct HXMapping {
    uint64_t start = 0;
    uint64_t end = 0;
    uint64_t offset = 0; // bytes into the file
    uint64_t inode = 0;
    uint32_t device = 0; // HXDeviceNumber
    uint32_t path = 0;   // index into the address space's paths; 0: none
    // Figures of smaps, in pages.
    uint32_t residentPages = 0; // without huge pages of the pool
    uint32_t anonymousPages = 0;
    uint32_t lazyFreePages = 0;
    uint32_t swappedPages = 0;
    uint32_t dirtyPages = 0; // Shared_Dirty and Private_Dirty
    uint32_t hugePages = 0;  // Shared_Hugetlb and Private_Hugetlb, in base pages
    // Of these, pages of the object that a mapping at a lower address shows, too (HXRepeatedPages.h).
    uint32_t repeatedPages = 0;
    uint32_t repeatedSwappedPages = 0;
    uint16_t flags = 0; // HXMappingFlag
    HXPathKind kind = HXPathKind::none;
    uint8_t tag = 0; // user tag

    // Of a file or a shared object. An inode number may be 0: System V memory's is its identifier.
    bool isFile() const { return device != 0 || inode != 0; }
    bool has(uint16_t wanted) const { return (flags & wanted) != 0; }
    bool contains(uint64_t address) const { return address >= start && address < end; }
};
static_assert(sizeof(HXMapping) == 80);
