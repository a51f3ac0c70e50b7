#include "platform/linux/KernelMemory.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <map>
#include <span>
#include <string>
#include <string_view>
#include <utility>

#include "platform/MWKernelTags.h"
#include "platform/linux/KernelTexts.h"
#include "platform/linux/Procfs.h"

namespace {

using procfs::AllocationSite;
using procfs::Figures;
using procfs::VmallocCaller;

using Functions = std::span<const std::string_view>;

constexpr size_t kLongestText = 256U << 20U;

uint64_t lessAtMost(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
}

template <size_t N>
void copyText(std::array<char, N>& to, std::string_view from) {
    std::copy_n(from.begin(), std::min(from.size(), N), to.begin());
}

std::string readText(int directory, const char* name) {
    std::string text;
    procfs::readFile(directory, name, text, kLongestText);
    return text;
}

// Each processor keeps some counts to itself; this has them added to the totals. Root alone may.
void refreshStatistics(int procDirectory) {
    const procfs::Descriptor file(::openat(procDirectory, "sys/vm/stat_refresh", O_WRONLY | O_CLOEXEC));
    if (file) {
        [[maybe_unused]] const ssize_t written = ::write(file.get(), "1", 1);
    }
}

/// The number of the site `index`, counted from 1: all but the one that stands for memory of processes.
uint64_t siteNumber(uint64_t index) {
    return index < MWKernelTagUserWired ? index : index + 1;
}

mach_memory_info_t recordOf(MWSiteType type, uint64_t site, uint64_t bytes) {
    mach_memory_info_t record = {};
    record.flags = uint64_t{type} | MWSiteWired;
    record.site = site;
    record.size = bytes;
    return record;
}

bool isReclaimable(int sysDirectory, const std::string& cache) {
    std::string text;
    if (cache.find('/') == std::string::npos &&
        procfs::readFile(sysDirectory, ("kernel/slab/" + cache + "/reclaim_account").c_str(), text)) {
        return text.starts_with('1');
    }
    return cache.starts_with("dentry") || cache.ends_with("inode_cache") || cache == "radix_tree_node" ||
           cache.starts_with("kmalloc-rcl-");
}

/// Memory of contiguous kernel addresses by caller, out of which parts are taken that go by other names.
class VmallocMemory {
public:
    VmallocMemory(std::string_view vmallocinfo, uint64_t total, uint64_t pageSize)
        : _isKnown(!vmallocinfo.empty()) {
        for (const auto& [caller, pages] : procfs::parseVmallocinfo(vmallocinfo)) {
            _bytes[caller] = pages * pageSize;
        }
        if (!_isKnown) {
            _bytes[VmallocCaller()] = total;
        }
    }

    const std::map<VmallocCaller, uint64_t>& bytes() const { return _bytes; }

    /// Whether some of it was got through these functions; true where the callers are not told.
    bool isUsedBy(Functions functions) const {
        return std::ranges::any_of(_bytes,
                                   [&](const auto& entry) { return _isOneOf(entry.first, functions); });
    }

    /// Takes as much of `bytes` as there is; how much that was.
    uint64_t take(Functions functions, uint64_t bytes) {
        uint64_t taken = 0;
        for (auto& [caller, left] : _bytes) {
            if (_isOneOf(caller, functions)) {
                const uint64_t part = std::min(left, bytes - taken);
                left -= part;
                taken += part;
            }
        }
        return taken;
    }

private:
    bool _isOneOf(const VmallocCaller& caller, Functions functions) const {
        return !_isKnown || std::ranges::find(functions, caller.function()) != functions.end();
    }

    bool _isKnown;
    std::map<VmallocCaller, uint64_t> _bytes;
};

// Inlining decides which of these is the caller.
constexpr std::string_view kStackMakers[] = {"kernel_clone",
                                             "_do_fork",
                                             "copy_process",
                                             "dup_task_struct",
                                             "fork_idle",
                                             "create_io_thread",
                                             "alloc_thread_stack_node",
                                             "vhost_task_create"};
constexpr std::string_view kModuleLoaders[] = {"move_module",          "load_module",
                                               "layout_and_allocate",  "module_alloc",
                                               "module_memory_alloc",  "execmem_alloc",
                                               "execmem_alloc_rw",     "execmem_vmalloc",
                                               "execmem_cache_alloc",  "execmem_cache_populate",
                                               "init_module_from_file"};

enum class Allocation : uint8_t { kernel, ofProcess, leftOut };

// Allocators that get their memory from another one appear twice, with what they got and with what they gave:
// their own lines are left out. So are pages of processes and files.
Allocation kindOf(const AllocationSite& site) {
    constexpr std::string_view kLeftOut[] = {
        "mm/slub.c",       "mm/percpu-vm.c", "mm/percpu-km.c",   "mm/memory.c",     "mm/filemap.c",
        "mm/readahead.c",  "mm/shmem.c",     "mm/huge_memory.c", "mm/hugetlb.c",    "mm/mempolicy.c",
        "mm/swap_state.c", "mm/migrate.c",   "mm/khugepaged.c",  "mm/compaction.c", "mm/userfaultfd.c"};
    if (std::ranges::find(kLeftOut, site.file) != std::end(kLeftOut)) {
        return Allocation::leftOut;
    }
    return site.file.ends_with("/pgalloc.h") || site.file.ends_with("mm/pgtable.c") ? Allocation::ofProcess
                                                                                    : Allocation::kernel;
}

class KernelMemoryReading {
public:
    explicit KernelMemoryReading(const KernelMemorySources& sources) : _sources(sources) {}

    std::optional<KernelMemory> read() {
        refreshStatistics(_sources.procDirectory);
        _meminfo = procfs::parseMeminfo(_text("meminfo"));
        _vmstat = procfs::parseVmstat(_text("vmstat"));
        _perCpuFree = procfs::pagesInPerCpuLists(_text("zoneinfo")) * _sources.pageSize;
        if (!_addAllocations()) {
            _addSlabCaches();
            _addVmalloc();
            _addTags();
        }
        if (_memory.zones.empty() && _memory.records.empty() && _meminfo.empty()) {
            return std::nullopt;
        }
        _addCounters();
        _addTag(MWKernelTagUserWired, _meminfo["Mlocked"]);
        return std::move(_memory);
    }

private:
    std::string _text(const char* name) const { return readText(_sources.procDirectory, name); }

    // False without allocation profiling, also where the kernel has it and it is switched off.
    bool _addAllocations() {
        auto locations = std::make_shared<KernelSourceLocations>();
        uint64_t index = 0;
        for (const AllocationSite& site : procfs::parseAllocinfo(_text("allocinfo"))) {
            const uint64_t number = siteNumber(++index);
            const Allocation kind = kindOf(site);
            if (site.bytes == 0 || kind == Allocation::leftOut) {
                continue;
            }
            mach_memory_info_t record = recordOf(MWSiteKernel, number, site.bytes);
            record.flags |= kind == Allocation::ofProcess ? MWSiteHidden : 0;
            _name(record, site.module.empty() ? site.function : site.function + " [" + site.module + "]");
            _add(record);
            locations->insert({number, {.path = site.file, .line = site.line}});
        }
        if (_memory.records.empty()) {
            return false;
        }
        _memory.locations = std::move(locations);
        return true;
    }

    // Allocations too large for any cache are in no row, so what is missing of the total is theirs.
    void _addSlabCaches() {
        const auto caches = procfs::parseSlabinfo(_text("slabinfo"));
        if (caches.empty()) {
            _addZone("SReclaimable", {.mzi_cur_size = _meminfo["SReclaimable"]});
            _addZone("SUnreclaim", {.mzi_cur_size = _meminfo["SUnreclaim"]});
            return;
        }
        uint64_t sum = 0;
        for (const procfs::SlabCache& cache : caches) {
            const uint64_t slabSize = cache.pagesPerSlab * _sources.pageSize;
            const uint64_t bytes = cache.slabs * slabSize;
            sum += bytes;
            // Some of the active objects are only thought to be: never more than there is room for.
            const uint64_t room = cache.objectSize == 0 ? 0 : bytes / cache.objectSize;
            _addZone(cache.name,
                     {.mzi_count = std::min(cache.activeObjects, room),
                      .mzi_cur_size = bytes,
                      .mzi_elem_size = cache.objectSize,
                      .mzi_alloc_size = slabSize,
                      .mzi_collectable = isReclaimable(_sources.sysDirectory, cache.name) ? 1U : 0U});
        }
        _addZone("kmalloc-large", {.mzi_cur_size = lessAtMost(_meminfo["Slab"], sum)});
    }

    void _addZone(std::string_view name, const mach_zone_info_t& zone) {
        if (zone.mzi_cur_size == 0) {
            return;
        }
        copyText(_memory.zoneNames.emplace_back().mzn_name, name);
        _memory.zones.push_back(zone);
        _accounted += zone.mzi_cur_size;
    }

    void _addVmalloc() {
        VmallocMemory vmalloc(_text("vmallocinfo"), _meminfo["VmallocUsed"], _sources.pageSize);
        const uint64_t stacks = _meminfo["KernelStack"];
        // Kernels are built with stacks in this memory or outside of it.
        _addTag(MWKernelTagStack,
                vmalloc.isUsedBy(kStackMakers) ? vmalloc.take(kStackMakers, stacks) : stacks);
        uint64_t index = 0;
        for (const procfs::LoadedModule& module : procfs::parseModules(_text("modules"))) {
            const uint64_t number = siteNumber(++index);
            if (const uint64_t bytes = vmalloc.take(kModuleLoaders, module.bytes); bytes != 0) {
                _add(recordOf(MWSiteExtension, number, bytes));
            }
        }
        for (const auto& [caller, bytes] : vmalloc.bytes()) {
            if (caller.call.empty()) {
                _addTag(MWKernelTagVmalloc, bytes);
            } else if (bytes != 0) {
                mach_memory_info_t record = recordOf(MWSiteKernel, caller.address(), bytes);
                _name(record, caller.name());
                _add(record);
            }
        }
    }

    void _addTags() {
        // Processes are charged for their page tables.
        _addTag(MWKernelTagPageTables, _meminfo["PageTables"], MWSiteHidden);
        _addTag(MWKernelTagSecondaryPageTables, _meminfo["SecPageTables"]);
        _addTag(MWKernelTagShadowCallStack, _meminfo["ShadowCallStack"]);
        _addTag(MWKernelTagPerCpu, _meminfo["Percpu"]);
        _addTag(MWKernelTagReclaimable, lessAtMost(_meminfo["KReclaimable"], _meminfo["SReclaimable"]));
        _addTag(MWKernelTagZswap, _meminfo["Zswap"]);
        _addTag(MWKernelTagZsmalloc, lessAtMost(_pages("nr_zspages"), _meminfo["Zswap"]));
        _addTag(MWKernelTagBounce, _meminfo["Bounce"]);
        _addTag(MWKernelTagBalloon, _meminfo["Balloon"]);
        _addTag(MWKernelTagHardwareCorrupted, _meminfo["HardwareCorrupted"]);
        _addTag(MWKernelTagWriteback, _meminfo["WritebackTmp"]);
        _addTag(MWKernelTagPageMap, _pages("nr_memmap_pages"));
    }

    void _addTag(MWKernelTag tag, uint64_t bytes, uint64_t flags = 0) {
        if (bytes == 0) {
            return;
        }
        mach_memory_info_t record = recordOf(MWSiteTag, tag, bytes);
        record.tag = tag;
        record.flags |= flags;
        _add(record);
    }

    void _add(const mach_memory_info_t& record) {
        _memory.records.push_back(record);
        _accounted += record.size;
    }

    static void _name(mach_memory_info_t& record, std::string_view name) {
        copyText(record.name, name);
        record.flags |= name.empty() ? 0 : MWSiteNamed;
    }

    void _addCounters() {
        if (_meminfo.empty()) {
            return;
        }
        // Every page of a process or a file is in one of the lists from which pages are reclaimed, in one at
        // a time.
        const uint64_t user = _meminfo.sum({"Active", "Inactive", "Unevictable", "Hugetlb"});
        const uint64_t inUse = lessAtMost(_meminfo["MemTotal"], _meminfo["MemFree"]);
        _addCounter(MWKernelCounterManaged, _meminfo["MemTotal"]);
        _addCounter(MWKernelCounterFree, _meminfo["MemFree"]);
        _addCounter(MWKernelCounterPerCpuFree, _perCpuFree);
        _addCounter(MWKernelCounterAvailable, _meminfo["MemAvailable"]);
        _addCounter(MWKernelCounterUser, user);
        _addCounter(MWKernelCounterUnaccounted, lessAtMost(inUse, user + _perCpuFree + _accounted));
        _addCounter(MWKernelCounterSlab, _meminfo["Slab"]);
        _addCounter(MWKernelCounterVmalloc, _meminfo["VmallocUsed"]);
        _addCounter(MWKernelCounterCommitted, _meminfo["Committed_AS"]);
        _addCounter(MWKernelCounterDirty, _meminfo["Dirty"]);
        _addCounter(MWKernelCounterHugetlb, _meminfo["Hugetlb"]);
        _addCounter(MWKernelCounterPageMap, _pages("nr_memmap_boot_pages"));
    }

    void _addCounter(MWKernelCounter counter, uint64_t bytes) {
        mach_memory_info_t record = {};
        record.flags = MWSiteCounter;
        record.site = counter;
        record.mapped = bytes;
        _memory.records.push_back(record);
    }

    uint64_t _pages(std::string_view name) const { return _vmstat[name] * _sources.pageSize; }

    KernelMemorySources _sources;
    Figures _meminfo;
    Figures _vmstat;
    uint64_t _perCpuFree = 0;
    uint64_t _accounted = 0;
    KernelMemory _memory;
};

}  // namespace

std::optional<KernelMemory> readKernelMemory(const KernelMemorySources& sources) {
    return KernelMemoryReading(sources).read();
}

std::vector<MWKernelExtension> readKernelModules(int procDirectory) {
    std::vector<MWKernelExtension> modules;
    for (procfs::LoadedModule& module : procfs::parseModules(readText(procDirectory, "modules"))) {
        modules.push_back(
            {.OSBundleLoadTag = siteNumber(modules.size() + 1), .bundleIdentifier = std::move(module.name)});
    }
    return modules;
}
