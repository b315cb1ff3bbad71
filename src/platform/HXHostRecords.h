// The records that the host's calls fill, as plain data under their published field names and widths.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

using kern_return_t = int32_t;
using mach_port_t = uint32_t;

// Kernel results that the program tells apart; every other value is only printed.
inline constexpr kern_return_t KERN_SUCCESS = 0;
inline constexpr kern_return_t KERN_INVALID_ADDRESS = 1;
inline constexpr kern_return_t KERN_PROTECTION_FAILURE = 2;
inline constexpr kern_return_t KERN_NO_SPACE = 3;
inline constexpr kern_return_t KERN_INVALID_ARGUMENT = 4;
inline constexpr kern_return_t KERN_FAILURE = 5;
inline constexpr kern_return_t KERN_RESOURCE_SHORTAGE = 6;
inline constexpr kern_return_t KERN_NO_ACCESS = 8;
inline constexpr kern_return_t KERN_OPERATION_TIMED_OUT = 49;
inline constexpr kern_return_t MACH_SEND_INVALID_DEST = 0x10000003;

inline constexpr int32_t VM_PROT_READ = 1;
inline constexpr int32_t VM_PROT_WRITE = 2;
inline constexpr int32_t VM_PROT_EXECUTE = 4;

inline constexpr uint8_t SM_COW = 1;
inline constexpr uint8_t SM_PRIVATE = 2;
inline constexpr uint8_t SM_EMPTY = 3;
inline constexpr uint8_t SM_SHARED = 4;
inline constexpr uint8_t SM_TRUESHARED = 5;
inline constexpr uint8_t SM_PRIVATE_ALIASED = 6;
inline constexpr uint8_t SM_SHARED_ALIASED = 7;
inline constexpr uint8_t SM_LARGE_PAGE = 8;

inline constexpr int32_t VM_PURGABLE_GET_STATE = 1;
inline constexpr int32_t VM_PURGABLE_NONVOLATILE = 0;
inline constexpr int32_t VM_PURGABLE_VOLATILE = 1;
inline constexpr int32_t VM_PURGABLE_EMPTY = 2;
inline constexpr int32_t VM_PURGABLE_DENY = 3;

// Bits of a page disposition (`mach_vm_page_range_query`).
inline constexpr int32_t VM_PAGE_QUERY_PAGE_PRESENT = 0x1;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_DIRTY = 0x8;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_PAGED_OUT = 0x10;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_EXTERNAL = 0x80;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_REUSABLE = 0x800;

// Consecutive pages of one disposition.
struct vm_page_run {
    uint64_t address; // of the first page
    uint64_t pages;
    int32_t disposition; // VM_PAGE_QUERY_… bits

    // The address behind the last page, of pages of `pageSize` bytes.
    uint64_t end(uint64_t pageSize) const { return address + pages * pageSize; }
};

// The longest path of a mapped file that is asked for; longer ones are cut.
inline constexpr size_t kMaxPathBytes = 1024;

// The user tag of the region with which the kernel closes a walk, and of regions without an address.
inline constexpr uint32_t kFakeRegionTag = 0xFFFFFFFF;

#pragma pack(push, 4)

// What `mach_vm_region` (flavor basic-info-64) tells of a top-level mapping: 9 words.
struct vm_region_basic_info_64 {
    int32_t protection;
    int32_t max_protection;
    uint32_t inheritance;
    uint32_t shared;
    uint32_t reserved;
    uint64_t offset; // bytes into the VM object
    int32_t behavior;
    uint16_t user_wired_count;
};
inline constexpr uint32_t VM_REGION_BASIC_INFO_COUNT_64 = 9;
inline constexpr int32_t VM_REGION_BASIC_INFO_64 = 9;

// What `mach_vm_region_recurse` tells of a leaf mapping: 19 words. Page counts are in pages of the task's
// size.
struct vm_region_submap_info_64 {
    int32_t protection;
    int32_t max_protection;
    uint32_t inheritance;
    uint64_t offset; // bytes into the VM object
    uint32_t user_tag;
    uint32_t pages_resident;
    uint32_t pages_shared_now_private;
    uint32_t pages_swapped_out;
    uint32_t pages_dirtied;
    uint32_t ref_count;
    uint16_t shadow_depth;
    uint8_t external_pager;
    uint8_t share_mode;
    int32_t is_submap;
    int32_t behavior;
    uint32_t object_id;
    uint16_t user_wired_count;
    uint16_t padding;
    uint32_t pages_reusable;
    uint64_t object_id_full;
};
inline constexpr uint32_t VM_REGION_SUBMAP_INFO_COUNT_64 = 19;
// An older kernel fills at most this many words: the full object id is then not whole.
inline constexpr uint32_t VM_REGION_SUBMAP_INFO_V1_COUNT_64 = 18;

#pragma pack(pop)
static_assert(sizeof(vm_region_submap_info_64) == VM_REGION_SUBMAP_INFO_COUNT_64 * sizeof(uint32_t));

inline constexpr int32_t PROC_PIDTBSDINFO = 3;
inline constexpr int32_t PROC_PIDT_SHORTBSDINFO = 13;
inline constexpr uint32_t PROC_FLAG_SYSTEM = 0x1;
inline constexpr uint32_t PROC_FLAG_LP64 = 0x10;
inline constexpr uint32_t SZOMB = 5; // process status: waiting to be collected by its parent

// `proc_pidinfo` flavor 3. The names need no terminating zero.
struct proc_bsdinfo {
    uint32_t pbi_flags;
    uint32_t pbi_status;
    uint32_t pbi_xstatus;
    int32_t pbi_pid;
    int32_t pbi_ppid;
    uint32_t pbi_uid;
    uint32_t pbi_gid;
    uint32_t pbi_ruid;
    uint32_t pbi_rgid;
    uint32_t pbi_svuid;
    uint32_t pbi_svgid;
    uint32_t rfu_1;
    char pbi_comm[16];
    char pbi_name[32];
    uint32_t pbi_nfiles;
    uint32_t pbi_pgid;
    uint32_t pbi_pjobc;
    uint32_t e_tdev;
    uint32_t e_tpgid;
    int32_t pbi_nice;
    uint64_t pbi_start_tvsec;
    uint64_t pbi_start_tvusec;
};
static_assert(sizeof(proc_bsdinfo) == 136);

// `proc_pidinfo` flavor 13.
struct proc_bsdshortinfo {
    int32_t pbsi_pid;
    int32_t pbsi_ppid;
    uint32_t pbsi_pgid;
    uint32_t pbsi_status;
    char pbsi_comm[16];
    uint32_t pbsi_flags;
    uint32_t pbsi_uid;
    uint32_t pbsi_gid;
    uint32_t pbsi_ruid;
    uint32_t pbsi_rgid;
    uint32_t pbsi_svuid;
    uint32_t pbsi_svgid;
    uint32_t pbsi_rfu;
};
static_assert(sizeof(proc_bsdshortinfo) == 64);

// Names for `sysctl`.
inline constexpr int32_t CTL_KERN = 1;
inline constexpr int32_t KERN_ARGMAX = 8;
inline constexpr int32_t KERN_PROCARGS2 = 49;

// Names for `sysctlbyname`.
inline constexpr char kSelfRegionHeftSetting[] = "vm.self_region_heft";
inline constexpr char kOwnedObjectsSetting[] = "vm.get_owned_vmobjects";

inline constexpr int32_t RUSAGE_INFO_V4 = 4;

// `proc_pid_rusage` flavor 4; only the heft figures (bytes) are read.
struct rusage_info_v4 {
    uint8_t ri_uuid[16];
    uint64_t ri_before_phys_heft[7];
    uint64_t ri_phys_heft;
    uint64_t ri_between[20];
    uint64_t ri_lifetime_max_phys_heft;
    uint64_t ri_after[6];
};
static_assert(offsetof(rusage_info_v4, ri_phys_heft) == 72);
static_assert(offsetof(rusage_info_v4, ri_lifetime_max_phys_heft) == 240);

inline constexpr int32_t LEDGER_ENTRY_INFO = 1;
inline constexpr int32_t LEDGER_TEMPLATE_INFO = 2;
// The entry that counts a task's page tables, in bytes.
inline constexpr std::string_view kPageTableEntry = "page_table";

struct ledger_template_info {
    char lti_name[32]; // zero-terminated
    char lti_group[32];
    char lti_units[32];
};
static_assert(sizeof(ledger_template_info) == 96);

struct ledger_entry_info {
    int64_t lei_balance;
    int64_t lei_credit;
    int64_t lei_debit;
    uint64_t lei_limit;
    uint64_t lei_refill_period;
    uint64_t lei_last_refill;
};
static_assert(sizeof(ledger_entry_info) == 48);

// One VM object that a task owns, in the reply of "vm.get_owned_vmobjects" (a 64-bit count goes before them).
struct owned_vmobject {
    uint64_t object_id; // the full object id of regions that map it
    uint64_t virtual_size;
    uint64_t resident_size;
    uint64_t wired_size;
    uint64_t reusable_size;
    uint64_t compressed_size;
    uint64_t flags; // bit 0: not charged to the owner; bits 4 and 5: purgeable state
};
static_assert(sizeof(owned_vmobject) == 56);

// Pages of a private mapping that other tasks hold, too (`mach_vm_region_shares`).
struct vm_region_share {
    // Of the pages that one set of tasks shares: the same for all of them, and below 2^53.
    uint64_t object_id;
    uint64_t pages_resident; // of the mapping's, in pages of the task's size
    uint64_t pages_swapped_out;
    // Where tasks share an object each in its own part: the pages of this mapping that count for all of them,
    // so that each page of the object counts once. 0 where all hold the same pages.
    uint64_t pages_resident_counted;
    uint64_t pages_swapped_out_counted;
};

// Shared memory that a task or the kernel holds, mapped or not (`task_held_objects`, `host_held_objects`).
struct task_held_object {
    uint64_t object_id = 0; // the full object id of regions that map it
    uint64_t container_id =
        0; // of the kernel's held object that it is a part of, as of a file system; 0: none
    // Bytes of all of it, whoever maps how much. Both 0 where only its container is known.
    uint64_t resident_size = 0;
    uint64_t swapped_size = 0;
    uint64_t flags = 0; // TASK_HELD_…
    // What is called so is what of it no region shows. Empty: that is its container's.
    std::string name;
    std::string detail; // more of the name; may be empty
};
// Known by an open descriptor alone.
inline constexpr uint64_t TASK_HELD_OPEN = 0x1;
// The container of all that the machine has of the kind: what is left of it means something only to those who
// know all holders.
inline constexpr uint64_t TASK_HELD_WHOLE = 0x2;

// `mach_memory_info`.
struct mach_zone_name {
    char mzn_name[80]; // need not end in a zero
};
static_assert(sizeof(mach_zone_name) == 80);

struct mach_zone_info {
    uint64_t mzi_count;      // elements in use
    uint64_t mzi_cur_size;   // bytes
    uint64_t mzi_max_size;   // bytes
    uint64_t mzi_elem_size;  // bytes
    uint64_t mzi_alloc_size; // bytes
    uint64_t mzi_sum_size;
    uint64_t mzi_exhaustible;
    uint64_t mzi_collectable; // non-zero: free elements can be taken back
};
static_assert(sizeof(mach_zone_info) == 64);

struct mach_memory_info_record {
    uint64_t flags; // VM_KERN_SITE_… below
    uint64_t site;  // tag, load tag, kernel address or counter number, by type
    uint64_t size;  // bytes
    uint64_t free;
    uint64_t largest;
    uint64_t collectable_bytes;
    uint64_t mapped; // bytes; the amount of a counter
    uint64_t peak;
    uint16_t tag;
    uint16_t zone; // index among the zones when VM_KERN_SITE_ZONE is set
    uint16_t _reserved1[2];
    uint64_t _reserved2[3];
    char name[80]; // when VM_KERN_SITE_NAMED is set
};
static_assert(sizeof(mach_memory_info_record) == 176);

inline constexpr uint64_t VM_KERN_SITE_TYPE = 0xFF;
inline constexpr uint64_t VM_KERN_SITE_TAG = 0;
inline constexpr uint64_t VM_KERN_SITE_KMOD = 1;
inline constexpr uint64_t VM_KERN_SITE_KERNEL = 2;
inline constexpr uint64_t VM_KERN_SITE_COUNTER = 3;
inline constexpr uint64_t VM_KERN_SITE_WIRED = 0x100;
inline constexpr uint64_t VM_KERN_SITE_HIDE = 0x200;
inline constexpr uint64_t VM_KERN_SITE_NAMED = 0x400;
inline constexpr uint64_t VM_KERN_SITE_ZONE = 0x800;

// One loaded kernel extension's information dictionary, as far as it is read.
struct OSKextInfo {
    uint64_t OSBundleLoadTag;
    std::optional<std::string> CFBundleIdentifier;
};

// A loaded image and its segments, as the symbol-lookup library lists them.
struct RVRegion {
    const char *name; // zero-terminated; may carry more words after a blank
    uint64_t start;
    uint64_t length; // bytes
};
struct RVSymbolOwner {
    const char *path; // zero-terminated
    uint64_t baseAddress;
    const RVRegion *segments;
    size_t segmentCount;
};
// A kernel symbol; `name` is null when the address has none.
struct RVSymbol {
    const char *name;
};
// The source position of a kernel address; `path` is null when it is not known.
struct RVSourceInfo {
    const char *path;
    int32_t lineNumber;
    bool isNull;
};
inline constexpr uint64_t kRVNow = 0x8000000000000000;

// An open symbolicator of a task or of the kernel. Owned by the platform; given back with `RVRelease`.
// Everything that its lookups hand out lives until then.
class RVSymbolicator {
  public:
    virtual ~RVSymbolicator() = default;
};
