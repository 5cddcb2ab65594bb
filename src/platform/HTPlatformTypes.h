#pragma once

// Records and constants of the kernel interface heft is written against.
// Each backend fills them from what its own kernel exposes.

#include <cstddef>
#include <cstdint>

using kern_return_t = int32_t;

inline constexpr kern_return_t KERN_SUCCESS = 0;
inline constexpr kern_return_t KERN_INVALID_ADDRESS = 1;
inline constexpr kern_return_t KERN_INVALID_ARGUMENT = 4;
inline constexpr kern_return_t KERN_FAILURE = 5;
inline constexpr kern_return_t MACH_SEND_INVALID_DEST = 0x10000003;
// A failure the backend met as an errno: the code carries the errno in its
// low 16 bits so that the error text can name it.
inline constexpr kern_return_t HT_KERN_ERRNO_BASE = 0x0e000000;

// proc_pidinfo flavors.
inline constexpr int PROC_PIDTBSDINFO = 3;
inline constexpr int PROC_PIDT_SHORTBSDINFO = 13;

// pbi_flags bits.
inline constexpr uint32_t PROC_FLAG_SYSTEM = 0x1;
// Exiting: the process is on its way out and its memory is being freed.
inline constexpr uint32_t PROC_FLAG_INEXIT = 0x4;
inline constexpr uint32_t PROC_FLAG_LP64 = 0x10;
inline constexpr uint32_t PROC_FLAG_CONTROLT = 0x80;
inline constexpr uint32_t PROC_FLAG_THCWD = 0x100;
inline constexpr uint32_t PROC_FLAG_PSUGID = 0x2000;
inline constexpr uint32_t PROC_FLAG_EXEC = 0x4000;

// The kernel's own process flags, which a process held at its exit is
// described by.
inline constexpr uint32_t P_CONTROLT = 0x2;      // has a controlling terminal
inline constexpr uint32_t P_LP64 = 0x4;          // 64-bit
inline constexpr uint32_t P_SUGID = 0x100;       // changed its user or group id
inline constexpr uint32_t P_SYSTEM = 0x200;      // a system process
inline constexpr uint32_t P_EXEC = 0x4000;       // has run a program since it began
inline constexpr uint32_t P_THCWD = 0x01000000;  // a thread has a working directory of its own

// pbi_status / pbsi_status values.
inline constexpr uint32_t SIDL = 1;
inline constexpr uint32_t SRUN = 2;
inline constexpr uint32_t SSLEEP = 3;
inline constexpr uint32_t SSTOP = 4;
inline constexpr uint32_t SZOMB = 5;

// proc_get_dirty flags.
inline constexpr uint32_t PROC_DIRTY_TRACKED = 0x1;
inline constexpr uint32_t PROC_DIRTY_ALLOWS_IDLE_EXIT = 0x2;
inline constexpr uint32_t PROC_DIRTY_IS_DIRTY = 0x4;

// sysctl names.
inline constexpr int CTL_KERN = 1;
inline constexpr int KERN_ARGMAX = 8;
inline constexpr int KERN_PROCARGS2 = 49;

inline constexpr int MAXCOMLEN = 16;

// VM tags (user_tag) of the regions the Linux backend reports.
inline constexpr uint32_t HT_VM_TAG_UNTAGGED = 0;
inline constexpr uint32_t HT_VM_TAG_HEAP = 5;
inline constexpr uint32_t HT_VM_TAG_STACK = 30;
inline constexpr uint32_t HT_VM_TAG_GUARD = 31;
// Kinds of mapping that have no tag of their own among the others.
inline constexpr uint32_t HT_VM_TAG_SHARED_MEMORY = 100;
inline constexpr uint32_t HT_VM_TAG_KERNEL_PROVIDED = 101;
inline constexpr uint32_t HT_VM_TAG_NAMED_ANONYMOUS = 102;

// Share modes of a mapping.
inline constexpr uint8_t SM_COW = 1;
inline constexpr uint8_t SM_PRIVATE = 2;
inline constexpr uint8_t SM_EMPTY = 3;
inline constexpr uint8_t SM_SHARED = 4;
inline constexpr uint8_t SM_TRUESHARED = 5;
inline constexpr uint8_t SM_PRIVATE_ALIASED = 6;
inline constexpr uint8_t SM_SHARED_ALIASED = 7;
inline constexpr uint8_t SM_LARGE_PAGE = 8;

// Protection bits.
inline constexpr uint32_t VM_PROT_READ = 0x1;
inline constexpr uint32_t VM_PROT_WRITE = 0x2;
inline constexpr uint32_t VM_PROT_EXECUTE = 0x4;

// Inheritance.
inline constexpr uint32_t VM_INHERIT_SHARE = 0;
inline constexpr uint32_t VM_INHERIT_COPY = 1;
inline constexpr uint32_t VM_INHERIT_NONE = 2;

// Purgeable states and the control that reads one.
inline constexpr int VM_PURGABLE_GET_STATE = 1;
inline constexpr int32_t VM_PURGABLE_NONVOLATILE = 0;
inline constexpr int32_t VM_PURGABLE_VOLATILE = 1;
inline constexpr int32_t VM_PURGABLE_EMPTY = 2;
inline constexpr int32_t VM_PURGABLE_DENY = 3;

// Page dispositions.
inline constexpr int32_t VM_PAGE_QUERY_PAGE_PRESENT = 0x1;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_DIRTY = 0x8;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_PAGED_OUT = 0x10;
// A page of a private file mapping that is the mapping's own copy, not the
// file's page.
inline constexpr int32_t VM_PAGE_QUERY_PAGE_COPIED = 0x20;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_EXTERNAL = 0x80;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_REUSABLE = 0x800;

// Every shared page identity is below this: the bits above are free for
// whoever stores one beside a few bits of its own.
inline constexpr uint64_t HTMaxPageIdentity = uint64_t{1} << 58;

// Platform codes of the shared region; 5 is Linux, whose shared region is
// empty.
inline constexpr int HTPlatformLinux = 5;

// A run [start, end) of pages that may hold something. `disposition` is
// the page-query disposition of every page of the run when the backend
// knows it without asking page by page, and 0 when the pages must be
// queried.
struct HTPageRun {
    uint64_t start;
    uint64_t end;
    int32_t disposition;
};

// A region as the address-space walk reports it. The count of a reply is
// in 32-bit words: a kernel that answers with fewer than the full count
// leaves out object_id_full.
inline constexpr uint32_t VM_REGION_SUBMAP_INFO_COUNT_64 = 19;
struct vm_region_submap_info_64 {
    uint32_t protection;
    uint32_t max_protection;
    uint32_t inheritance;
    uint64_t offset;
    uint32_t user_tag;
    uint32_t pages_resident;
    uint32_t pages_shared_now_private;
    uint32_t pages_swapped_out;
    uint32_t pages_dirtied;
    uint32_t ref_count;
    uint16_t shadow_depth;
    uint8_t external_pager;
    uint8_t share_mode;
    uint32_t is_submap;
    int32_t behavior;
    uint32_t object_id;
    uint16_t user_wired_count;
    uint32_t pages_reusable;
    uint64_t object_id_full;
};

// A top-level region, without descending into submaps.
inline constexpr uint32_t VM_REGION_BASIC_INFO_64 = 9;
inline constexpr uint32_t VM_REGION_BASIC_INFO_COUNT_64 = 9;
struct vm_region_basic_info_64 {
    uint32_t protection;
    uint32_t max_protection;
    uint32_t inheritance;
    uint32_t shared;
    uint32_t reserved;
    uint64_t offset;
    int32_t behavior;
    uint16_t user_wired_count;
};

// The resource-usage figures heft reads: the physical heft of a process
// and its lifetime maximum, in bytes.
inline constexpr int RUSAGE_INFO_V4 = 4;
struct rusage_info_v4 {
    uint64_t ri_phys_heft;
    uint64_t ri_lifetime_max_phys_heft;
};

// Ledger records: a template entry names an entry; an entry holds its
// balance.
inline constexpr int LEDGER_ENTRY_INFO = 1;
inline constexpr int LEDGER_TEMPLATE_INFO = 2;
struct ledger_template_info {
    char lti_name[32];
    char lti_group[32];
    char lti_units[32];
};
struct ledger_entry_info {
    int64_t lei_balance;
    int64_t lei_credit;
    int64_t lei_debit;
    int64_t lei_limit;
    int64_t lei_refill_period;
    int64_t lei_last_refill;
};

// One VM object a task owns, as "vm.get_owned_vmobjects" lists it after a
// 64-bit count: seven 64-bit words.
struct vm_owned_object {
    uint64_t object_id = 0;
    uint64_t virtual_size = 0;
    uint64_t resident_size = 0;
    uint64_t wired_size = 0;
    uint64_t reusable_size = 0;
    uint64_t compressed_size = 0;
    // Bit 0: not counted in the owner's heft; bits 4-5: purgeable state.
    uint64_t flags = 0;
};
static_assert(sizeof(vm_owned_object) == 56, "an owned-object record is seven 64-bit words");

// The process information record (136 bytes).
struct proc_bsdinfo {
    uint32_t pbi_flags;
    uint32_t pbi_status;
    uint32_t pbi_xstatus;
    uint32_t pbi_pid;
    uint32_t pbi_ppid;
    uint32_t pbi_uid;
    uint32_t pbi_gid;
    uint32_t pbi_ruid;
    uint32_t pbi_rgid;
    uint32_t pbi_svuid;
    uint32_t pbi_svgid;
    uint32_t rfu_1;
    char pbi_comm[MAXCOMLEN];
    char pbi_name[2 * MAXCOMLEN];
    uint32_t pbi_nfiles;
    uint32_t pbi_pgid;
    uint32_t pbi_pjobc;
    uint32_t e_tdev;
    uint32_t e_tpgid;
    int32_t pbi_nice;
    uint64_t pbi_start_tvsec;
    uint64_t pbi_start_tvusec;
};
static_assert(sizeof(proc_bsdinfo) == 136, "proc_bsdinfo is 136 bytes");

// The short process information record (64 bytes).
struct proc_bsdshortinfo {
    uint32_t pbsi_pid;
    uint32_t pbsi_ppid;
    uint32_t pbsi_pgid;
    uint32_t pbsi_status;
    char pbsi_comm[MAXCOMLEN];
    uint32_t pbsi_flags;
    uint32_t pbsi_uid;
    uint32_t pbsi_gid;
    uint32_t pbsi_ruid;
    uint32_t pbsi_rgid;
    uint32_t pbsi_svuid;
    uint32_t pbsi_svgid;
    uint32_t pbsi_rfu;
};
static_assert(sizeof(proc_bsdshortinfo) == 64, "proc_bsdshortinfo is 64 bytes");

// --- the kernel's memory ----------------------------------------------------

// The length of a zone's name and of a memory-info record's own name.
inline constexpr size_t MACH_ZONE_NAME_MAX_LEN = 80;

// A zone's name: 80 bytes of text, not necessarily NUL-terminated.
struct mach_zone_name_t {
    char mzn_name[MACH_ZONE_NAME_MAX_LEN];
};
static_assert(sizeof(mach_zone_name_t) == 80, "a zone name is 80 bytes");

// A zone's figures; zone info i belongs to zone name i.
struct mach_zone_info_t {
    uint64_t mzi_count;     // elements in use
    uint64_t mzi_cur_size;  // bytes held now
    uint64_t mzi_max_size;
    uint64_t mzi_elem_size;  // bytes an element
    uint64_t mzi_alloc_size;
    uint64_t mzi_sum_size;
    uint64_t mzi_exhaustible;
    uint64_t mzi_collectable;  // non-zero: free elements can be given back
};
static_assert(sizeof(mach_zone_info_t) == 64, "a zone info is 64 bytes");

// One site of the kernel's memory accounting: a tag, a module, a piece of
// kernel code, or a counter.
struct mach_memory_info_t {
    uint64_t flags;
    uint64_t site;
    uint64_t size;
    uint64_t free;
    uint64_t largest;
    uint64_t collectable_bytes;
    uint64_t mapped;
    uint64_t peak;
    uint16_t tag;
    uint16_t zone;
    uint16_t _resv[2];
    uint64_t _resv2[3];
    char name[MACH_ZONE_NAME_MAX_LEN];  // NUL-terminated
};
static_assert(sizeof(mach_memory_info_t) == 176, "a memory-info record is 176 bytes");

// mach_memory_info_t flags: the site's type in the low byte, then bits.
inline constexpr uint64_t VM_KERN_SITE_TYPE = 0xff;
inline constexpr uint64_t VM_KERN_SITE_TAG = 0;      // `site` is a VM_KERN_MEMORY tag
inline constexpr uint64_t VM_KERN_SITE_KMOD = 1;     // `site` is a module's load tag
inline constexpr uint64_t VM_KERN_SITE_KERNEL = 2;   // `site` is a code address
inline constexpr uint64_t VM_KERN_SITE_COUNTER = 3;  // `site` is a VM_KERN_COUNT index
inline constexpr uint64_t VM_KERN_SITE_WIRED = 0x100;
inline constexpr uint64_t VM_KERN_SITE_HIDE = 0x200;
inline constexpr uint64_t VM_KERN_SITE_NAMED = 0x400;  // the record carries its own name
inline constexpr uint64_t VM_KERN_SITE_ZONE = 0x800;   // `zone` indexes the zone names
// Memory the kernel holds for no process that is neither wired nor free to
// drop, but may be swapped (shared memory whose holders are gone): `size`
// bytes in memory and swap, `mapped` of them in swap.
inline constexpr uint64_t HT_KERN_SITE_SWAPPABLE = 0x1000;

// Tags the kernel's own accounting gives special meaning.
inline constexpr uint64_t VM_KERN_MEMORY_KALLOC = 13;
inline constexpr uint64_t VM_KERN_MEMORY_MLOCK = 24;  // memory user processes wired
