#pragma once

#include <array>
#include <cstdint>

// The records, handles and codes in which MWHostInterface answers. Sizes are bytes, page counts are pages of
// the inspected process. Integers whose meaning the kernel defines keep the kernel's names and values.

using task_t = uint32_t;
using kern_return_t = int32_t;

inline constexpr kern_return_t KERN_SUCCESS = 0;
/// The end of the address space was reached.
inline constexpr kern_return_t KERN_INVALID_ADDRESS = 1;
inline constexpr kern_return_t KERN_INVALID_ARGUMENT = 4;
inline constexpr kern_return_t KERN_FAILURE = 5;
inline constexpr kern_return_t KERN_RESOURCE_SHORTAGE = 6;
/// The task is gone.
inline constexpr kern_return_t MACH_SEND_INVALID_DEST = 0x10000003;

/// Share modes, `share_mode` of a region record.
enum MWShareMode : uint8_t {
    SM_COW = 1,
    SM_PRIVATE = 2,
    SM_EMPTY = 3,
    SM_SHARED = 4,
    SM_PRIVATE_ALIASED = 6,
};

/// Purgeable states, as mach_vm_purgable_control answers them.
enum MWPurgeState : int32_t {
    VM_PURGABLE_NONVOLATILE = 0,
    VM_PURGABLE_VOLATILE = 1,
    VM_PURGABLE_EMPTY = 2,
    VM_PURGABLE_DENY = 3,
};
inline constexpr int32_t VM_PURGABLE_GET_STATE = 1;

/// Bits of a page disposition word.
inline constexpr int32_t VM_PAGE_QUERY_PAGE_PRESENT = 0x1;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_DIRTY = 0x8;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_PAGED_OUT = 0x10;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_EXTERNAL = 0x80;
inline constexpr int32_t VM_PAGE_QUERY_PAGE_REUSABLE = 0x800;

/// The tag of memory that a process owns without mapping it.
inline constexpr uint32_t MWFakeRegionTag = 0xFFFFFFFF;

/// 32-bit words of a filled region record; fewer words mean that `object_id_full` was not filled.
inline constexpr uint32_t VM_REGION_SUBMAP_INFO_COUNT_64 = 19;
struct vm_region_submap_info_64 {
    uint32_t protection = 0;
    uint32_t max_protection = 0;
    uint32_t inheritance = 0;
    uint64_t offset = 0;  ///< bytes, of the region's start within its object
    uint32_t user_tag = 0;
    uint32_t pages_resident = 0;
    uint32_t pages_shared_now_private = 0;
    uint32_t pages_swapped_out = 0;
    uint32_t pages_dirtied = 0;
    uint32_t ref_count = 0;
    uint16_t shadow_depth = 0;
    uint8_t external_pager = 0;  ///< non-zero for file-backed memory
    uint8_t share_mode = 0;
    uint32_t is_submap = 0;
    uint32_t behavior = 0;
    uint32_t object_id = 0;
    uint16_t user_wired_count = 0;
    uint32_t pages_reusable = 0;
    uint64_t object_id_full = 0;
};

inline constexpr uint32_t VM_REGION_BASIC_INFO_COUNT_64 = 9;
struct vm_region_basic_info_64 {
    uint32_t protection = 0;
    uint32_t max_protection = 0;
    uint32_t inheritance = 0;
    uint32_t shared = 0;
    uint32_t reserved = 0;  ///< non-zero for a submap
    uint64_t offset = 0;
    uint32_t behavior = 0;
    uint16_t user_wired_count = 0;
};

/// `pbi_flags` of the kernel itself, and of a 64-bit process.
inline constexpr uint32_t PROC_FLAG_SYSTEM = 0x1;
inline constexpr uint32_t PROC_FLAG_LP64 = 0x10;
/// Process status of a zombie.
inline constexpr uint32_t SZOMB = 5;

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
    std::array<char, 16> pbi_comm;  ///< not necessarily NUL-terminated
    std::array<char, 32> pbi_name;  ///< not necessarily NUL-terminated
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

struct proc_bsdshortinfo {
    uint32_t pbsi_pid;
    uint32_t pbsi_ppid;
    uint32_t pbsi_pgid;
    uint32_t pbsi_status;
    std::array<char, 16> pbsi_comm;
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

/// What the program reads of the resource-usage record, in bytes.
struct rusage_info_v5 {
    uint64_t ri_phys_memweight = 0;
    uint64_t ri_lifetime_max_phys_memweight = 0;
};

/// Dirty-tracking flags of proc_get_dirty.
inline constexpr uint32_t PROC_DIRTY_TRACKED = 0x1;
inline constexpr uint32_t PROC_DIRTY_ALLOWS_IDLE_EXIT = 0x2;
inline constexpr uint32_t PROC_DIRTY_IS_DIRTY = 0x4;

struct ledger_template_info {
    std::array<char, 32> lti_name;  ///< NUL-padded
    std::array<char, 32> lti_group;
    std::array<char, 32> lti_units;
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

/// The VM ledger that an owned object is charged to.
enum MWLedgerTag : uint64_t {
    MWLedgerDefault = 0,
    MWLedgerNetwork = 2,
    MWLedgerMedia = 3,
    MWLedgerGraphics = 4,
    MWLedgerNeural = 5,
};

/// One entry of the reply to "vm.get_owned_vmobjects": an 8-byte entry count, then this record for each
/// object.
struct OwnedObjectRecord {
    uint64_t object_id = 0;  ///< same space as `object_id_full`
    uint64_t virtual_size = 0;
    uint64_t resident = 0;
    uint64_t wired = 0;
    uint64_t reusable = 0;
    uint64_t compressed = 0;
    uint64_t flags = 0;

    /// The flags of a charged object.
    static uint64_t flagsFor(MWLedgerTag tag, MWPurgeState state) {
        return (static_cast<uint64_t>(tag) << 1U) | (static_cast<uint64_t>(state) << 4U);
    }
    bool notCharged() const { return (flags & 1) != 0; }
    uint64_t ledgerTag() const { return (flags >> 1) & 7; }
    int32_t purgeState() const { return static_cast<int32_t>((flags >> 4) & 3); }
};
static_assert(sizeof(OwnedObjectRecord) == 56);

/// One instant, read from three clocks as close together as the system allows.
struct MWClockReading {
    uint64_t absoluteTicks = 0;    ///< monotonic, stops while the system sleeps
    uint64_t continuousTicks = 0;  ///< monotonic, counts through sleep
    int64_t wallSeconds = 0;       ///< since 1970-01-01 00:00:00 UTC
    int64_t wallNanoseconds = 0;   ///< 0 to 999,999,999
};

/// Nanoseconds for each tick, as a fraction.
struct mach_timebase_info_t {
    uint32_t numer = 1;
    uint32_t denom = 1;
};

// What mach_memory_info tells of the kernel's own memory.

struct mach_zone_name_t {
    std::array<char, 80> mzn_name;  ///< not necessarily NUL-terminated
};
static_assert(sizeof(mach_zone_name_t) == 80);

/// A zone of the kernel's allocator: elements of one size in memory set aside for them.
struct mach_zone_info_t {
    uint64_t mzi_count = 0;     ///< elements in use
    uint64_t mzi_cur_size = 0;  ///< bytes that the zone holds now
    uint64_t mzi_max_size = 0;
    uint64_t mzi_elem_size = 0;   ///< bytes of an element
    uint64_t mzi_alloc_size = 0;  ///< bytes by which the zone grows
    uint64_t mzi_sum_size = 0;
    uint64_t mzi_exhaustible = 0;
    uint64_t mzi_collectable = 0;  ///< not 0: memory of free elements can be taken back
};
static_assert(sizeof(mach_zone_info_t) == 64);

/// Memory by who allocated it, or a figure of the kernel's.
struct mach_memory_info_t {
    uint64_t flags;  ///< the MWSite... values, the type in the low byte
    uint64_t site;   ///< a tag's number, an extension's load tag, a code address or a counter's number
    uint64_t size;
    uint64_t free;
    uint64_t largest;
    uint64_t collectable_bytes;
    uint64_t mapped;  ///< a counter's value
    uint64_t peak;
    uint16_t tag;
    uint16_t zone;  ///< index of the zone's name
    uint32_t reserved1;
    std::array<uint64_t, 3> reserved2;
    std::array<char, 80> name;  ///< UTF-8, not necessarily NUL-terminated
};
static_assert(sizeof(mach_memory_info_t) == 176);

/// What `site` of a memory-information record is.
enum MWSiteType : uint8_t {
    MWSiteTag = 0,
    MWSiteExtension = 1,
    MWSiteKernel = 2,
    MWSiteCounter = 3,
};
inline constexpr uint64_t MWSiteTypeMask = 0xFF;
inline constexpr uint64_t MWSiteWired = 0x100;
inline constexpr uint64_t MWSiteHidden = 0x200;
inline constexpr uint64_t MWSiteNamed = 0x400;
inline constexpr uint64_t MWSiteZone = 0x800;
