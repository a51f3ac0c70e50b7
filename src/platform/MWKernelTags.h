#pragma once

#include <array>
#include <cstdint>

// What the kernel's memory is for, where neither a function nor a module stands for it. Hosts fill records
// with these numbers, each as far as its system tells; the kernel pseudo-process names them.

enum MWKernelTag : uint8_t {
    MWKernelTagNone = 0,
    MWKernelTagPageTables = 1,           ///< of processes
    MWKernelTagSecondaryPageTables = 2,  ///< of virtual machines and of address translation for devices
    MWKernelTagStack = 3,                ///< of threads, while they run in the kernel
    MWKernelTagShadowCallStack = 4,      ///< return addresses of these alone
    MWKernelTagPerCpu = 5,
    MWKernelTagVmalloc = 6,      ///< of contiguous kernel addresses, where the callers are not told
    MWKernelTagReclaimable = 7,  ///< given back on demand, outside of the slab caches
    MWKernelTagZswap = 8,        ///< pages compressed before they would reach a swap device
    MWKernelTagZsmalloc = 9,     ///< pages compressed in a device that is nothing but memory
    MWKernelTagBounce = 10,      ///< copies within reach of devices that do not reach all memory
    MWKernelTagBalloon = 11,     ///< lent back to the hypervisor
    MWKernelTagHardwareCorrupted = 12,
    MWKernelTagWriteback = 13,  ///< copies of pages that a file system in user space writes back
    MWKernelTagPageMap = 14,    ///< descriptions of page frames
    MWKernelTagSlab = 15,
    MWKernelTagModule = 16,
    MWKernelTagBpf = 17,
    MWKernelTagPipe = 18,
    MWKernelTagSocket = 19,
    MWKernelTagTrace = 20,
    MWKernelTagDma = 21,
    MWKernelTagGraphics = 22,
    MWKernelTagFirmware = 23,
    MWKernelTagUserWired = 24,  ///< memory of processes that mlock keeps resident
    MWKernelTagCrashKernel = 25,
    MWKernelTagHugetlb = 26,
    MWKernelTagSwapMap = 27,
    MWKernelTagFileSystem = 28,
    MWKernelTagDriver = 30,
    MWKernelTagAny = 255,
};

struct MWKernelTagName {
    MWKernelTag tag;
    const char* name;
};
inline constexpr MWKernelTagName MWKernelTagNames[] = {
    {MWKernelTagNone, "VM_KERN_MEMORY_NONE"},
    {MWKernelTagPageTables, "VM_KERN_MEMORY_PAGE_TABLES"},
    {MWKernelTagSecondaryPageTables, "VM_KERN_MEMORY_SECONDARY_PAGE_TABLES"},
    {MWKernelTagStack, "VM_KERN_MEMORY_STACK"},
    {MWKernelTagShadowCallStack, "VM_KERN_MEMORY_SHADOW_CALL_STACK"},
    {MWKernelTagPerCpu, "VM_KERN_MEMORY_PERCPU"},
    {MWKernelTagVmalloc, "VM_KERN_MEMORY_VMALLOC"},
    {MWKernelTagReclaimable, "VM_KERN_MEMORY_RECLAIMABLE"},
    {MWKernelTagZswap, "VM_KERN_MEMORY_ZSWAP"},
    {MWKernelTagZsmalloc, "VM_KERN_MEMORY_ZSMALLOC"},
    {MWKernelTagBounce, "VM_KERN_MEMORY_BOUNCE"},
    {MWKernelTagBalloon, "VM_KERN_MEMORY_BALLOON"},
    {MWKernelTagHardwareCorrupted, "VM_KERN_MEMORY_HARDWARE_CORRUPTED"},
    {MWKernelTagWriteback, "VM_KERN_MEMORY_WRITEBACK"},
    {MWKernelTagPageMap, "VM_KERN_MEMORY_PAGE_MAP"},
    {MWKernelTagSlab, "VM_KERN_MEMORY_SLAB"},
    {MWKernelTagModule, "VM_KERN_MEMORY_MODULE"},
    {MWKernelTagBpf, "VM_KERN_MEMORY_BPF"},
    {MWKernelTagPipe, "VM_KERN_MEMORY_PIPE"},
    {MWKernelTagSocket, "VM_KERN_MEMORY_SOCKET"},
    {MWKernelTagTrace, "VM_KERN_MEMORY_TRACE"},
    {MWKernelTagDma, "VM_KERN_MEMORY_DMA"},
    {MWKernelTagGraphics, "VM_KERN_MEMORY_GRAPHICS"},
    {MWKernelTagFirmware, "VM_KERN_MEMORY_FIRMWARE"},
    {MWKernelTagUserWired, "VM_KERN_MEMORY_MLOCK"},
    {MWKernelTagCrashKernel, "VM_KERN_MEMORY_CRASH_KERNEL"},
    {MWKernelTagHugetlb, "VM_KERN_MEMORY_HUGETLB"},
    {MWKernelTagSwapMap, "VM_KERN_MEMORY_SWAP_MAP"},
    {MWKernelTagFileSystem, "VM_KERN_MEMORY_FILE_SYSTEM"},
    {MWKernelTagDriver, "VM_KERN_MEMORY_DRIVER"},
    {MWKernelTagAny, "VM_KERN_MEMORY_ANY"},
};

/// Figures of the kernel's that are not memory of a site, in bytes.
enum MWKernelCounter : uint8_t {
    MWKernelCounterManaged = 0,  ///< all memory that the kernel hands out
    MWKernelCounterFree = 1,
    MWKernelCounterPerCpuFree = 2,  ///< free, in lists of single processors; not in the figure before
    MWKernelCounterAvailable = 3,   ///< what new programs could get without swapping, as the kernel estimates
    MWKernelCounterUser = 4,        ///< of processes and files
    MWKernelCounterUnaccounted = 5,  ///< handed out to the kernel and told by no record
    MWKernelCounterSlab = 6,
    MWKernelCounterVmalloc = 7,
    MWKernelCounterCommitted = 8,  ///< promised to processes, resident or not
    MWKernelCounterDirty = 9,      ///< of files, waiting to be written back
    MWKernelCounterHugetlb = 10,   ///< set aside for huge pages, in use or not
    MWKernelCounterPageMap = 11,   ///< descriptions of page frames, taken at boot from unmanaged memory
};

inline constexpr std::array MWKernelCounterNames = {
    "VM_KERN_COUNT_MANAGED",   "VM_KERN_COUNT_FREE",    "VM_KERN_COUNT_PER_CPU_FREE",
    "VM_KERN_COUNT_AVAILABLE", "VM_KERN_COUNT_USER",    "VM_KERN_COUNT_UNACCOUNTED",
    "VM_KERN_COUNT_SLAB",      "VM_KERN_COUNT_VMALLOC", "VM_KERN_COUNT_COMMITTED",
    "VM_KERN_COUNT_DIRTY",     "VM_KERN_COUNT_HUGETLB", "VM_KERN_COUNT_PAGE_MAP",
};
static_assert(MWKernelCounterNames.size() == 12);
