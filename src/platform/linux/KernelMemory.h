#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "platform/MWHostInterface.h"
#include "platform/linux/KernelSymbols.h"
#include "platform/linux/PageTables.h"

/// Where the kernel tells of its memory.
struct KernelMemorySources {
    int procDirectory;
    int sysDirectory;  ///< -1 when there is no sysfs
    uint64_t pageSize;
    const PageTables& pageTables;  ///< of processes that need not be asked again
};

/// The kernel's memory as records, no page in two of them.
struct KernelMemory {
    std::vector<mach_zone_name_t> zoneNames;
    std::vector<mach_zone_info_t> zones;
    std::vector<mach_memory_info_t> records;
    std::vector<MWKernelExtension> modules;
    std::shared_ptr<const KernelSourceLocations> locations;  ///< none unless the records are made from them
};

/// What can be read: with allocation profiling, the places in the source that allocated; else slab caches,
/// callers of vmalloc, modules and the figures of `meminfo`. Without privilege, `meminfo` alone. None when
/// nothing can be read.
std::optional<KernelMemory> readKernelMemory(const KernelMemorySources& sources);
