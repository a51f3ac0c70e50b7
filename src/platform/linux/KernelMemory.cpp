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
#include "platform/MWSizeMath.h"
#include "platform/linux/KernelTexts.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace {

using procfs::AllocationSite;
using procfs::Figures;
using procfs::VmallocCaller;

using Functions = std::span<const std::string_view>;

constexpr size_t kLongestText = 256U << 20U;

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

uint64_t pageTablesOfProcesses(int procDirectory, const PageTables& known) {
    uint64_t sum = 0;
    std::string text;
    procfs::forEachEntry(procDirectory, ".", [&](int processes, const char* name) {
        std::string_view number = name;
        int32_t pid = 0;
        if (!procfs::takeNumber(number, pid)) {
            return true;
        }
        if (const auto bytes = known.of(pid)) {
            sum = MWSaturatingAdd(sum, *bytes);
        } else if (procfs::readRecord(processes, (std::string(name) + "/status").c_str(), text)) {
            sum = MWSaturatingAdd(sum, procfs::parseStatus(text).vmPte);
        }
        return true;
    });
    return sum;
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
            _bytes[caller] = MWSaturatingMultiply(pages, pageSize);
        }
        if (!_isKnown) {
            _bytes[VmallocCaller()] = total;
        }
    }

    const std::map<VmallocCaller, uint64_t>& bytes() const { return _bytes; }
    bool callersAreKnown() const { return _isKnown; }

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
        // Of a function that the compiler split or specialized the parts are told apart by a suffix.
        const std::string function = caller.function();
        const std::string_view plain = std::string_view(function).substr(0, function.find('.'));
        return !_isKnown || std::ranges::find(functions, plain) != functions.end();
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
constexpr std::string_view kShadowStackMakers[] = {"scs_alloc", "__scs_alloc", "scs_prepare"};
constexpr std::string_view kModuleLoaders[] = {"move_module",          "load_module",
                                               "layout_and_allocate",  "module_alloc",
                                               "module_memory_alloc",  "execmem_alloc",
                                               "execmem_alloc_rw",     "execmem_vmalloc",
                                               "execmem_cache_alloc",  "execmem_cache_populate",
                                               "init_module_from_file"};

// Allocators that get their memory from another one appear twice, with what they got and with what they gave:
// their own lines are left out. So are pages of processes and files, and page tables, which other figures
// tell.
bool isToldElsewhere(const AllocationSite& site) {
    constexpr std::string_view kFiles[] = {"mm/slub.c",
                                           "mm/percpu-vm.c",
                                           "mm/percpu-km.c",
                                           "mm/memory.c",
                                           "mm/filemap.c",
                                           "mm/readahead.c",
                                           "mm/shmem.c",
                                           "mm/huge_memory.c",
                                           "mm/hugetlb.c",
                                           "mm/mempolicy.c",
                                           "mm/swap_state.c",
                                           "mm/migrate.c",
                                           "mm/khugepaged.c",
                                           "mm/compaction.c",
                                           "mm/userfaultfd.c",
                                           "mm/ksm.c",
                                           "arch/arm64/mm/fault.c",
                                           "fs/btrfs/extent_io.c",
                                           "fs/btrfs/compression.c"};
    std::string_view file = site.file;
    procfs::takePrefix(file, "./");
    return std::ranges::find(kFiles, file) != std::end(kFiles) || file == "include/linux/highmem.h" ||
           file.ends_with("/pgalloc.h") || file.ends_with("mm/pgtable.c") || file == "mm/pgtable-generic.c";
}

class KernelMemoryReading {
public:
    explicit KernelMemoryReading(const KernelMemorySources& sources) : _sources(sources) {}

    std::optional<KernelMemory> read() {
        refreshStatistics(_sources.procDirectory);
        _meminfo = procfs::parseMeminfo(_text("meminfo"));
        _vmstat = procfs::parseVmstat(_text("vmstat"));
        _perCpuFree = _bytesOf(procfs::pagesInPerCpuLists(_text("zoneinfo")));
        if (!_addAllocations()) {
            _addSlabCaches();
            _addVmalloc();
            _addTags();
        }
        _addPageTables();
        if (_memory.zones.empty() && _memory.records.empty() && _meminfo.empty()) {
            return std::nullopt;
        }
        _addCounters();
        _addTag(MWKernelTagUserWired, _meminfo["Mlocked"]);
        _addTag(MWKernelTagBalloon, _meminfo["Balloon"], MWSiteHidden);
        return std::move(_memory);
    }

private:
    std::string _text(const char* name) const { return readText(_sources.procDirectory, name); }
    uint64_t _bytesOf(uint64_t pages) const { return MWSaturatingMultiply(pages, _sources.pageSize); }

    // Every page of a process or a file is on one of the lists from which pages are reclaimed, on one at a
    // time.
    uint64_t _userMemory() const { return _meminfo.sum({"Active", "Inactive", "Unevictable", "Hugetlb"}); }
    uint64_t _kernelMemory() const {
        const uint64_t inUse = MWSaturatingSubtract(_meminfo["MemTotal"], _meminfo["MemFree"]);
        return MWSaturatingSubtract(inUse, MWSaturatingAdd(_userMemory(), _perCpuFree));
    }

    // Profiling that was switched on late knows a part, and a newer kernel may have pages of processes in
    // lines that are not known for it: sums that cannot be right leave the coarser sources in force.
    bool _areCredible(const std::vector<AllocationSite>& sites) const {
        uint64_t sum = 0;
        for (const AllocationSite& site : sites) {
            sum = MWSaturatingAdd(sum, site.bytes);
        }
        const uint64_t atLeast = (_meminfo["Slab"] + _meminfo["VmallocUsed"]) / 2;
        const uint64_t atMost = _kernelMemory();
        return sum != 0 && sum >= atLeast && sum <= MWSaturatingAdd(atMost, atMost / 10);
    }

    // False without allocation profiling, also where the kernel has it and it is switched off.
    bool _addAllocations() {
        if (!_text("sys/vm/mem_profiling").starts_with('1')) {
            return false;
        }
        auto sites = procfs::parseAllocinfo(_text("allocinfo"));
        std::erase_if(sites, isToldElsewhere);
        if (!_areCredible(sites)) {
            return false;
        }
        auto locations = std::make_shared<KernelSourceLocations>();
        for (size_t index = 0; index < sites.size(); ++index) {
            const AllocationSite& site = sites[index];
            if (site.bytes == 0) {
                continue;
            }
            const uint64_t number = siteNumber(index + 1);
            mach_memory_info_t record = recordOf(MWSiteKernel, number, site.bytes);
            _name(record, site.module.empty() ? site.function : site.function + " [" + site.module + "]");
            _add(record);
            locations->insert({number, {.path = site.file, .line = site.line}});
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
            const uint64_t slabSize = _bytesOf(cache.pagesPerSlab);
            const uint64_t bytes = MWSaturatingMultiply(cache.slabs, slabSize);
            sum = MWSaturatingAdd(sum, bytes);
            // Some of the active objects are only thought to be: never more than there is room for.
            const uint64_t room = cache.objectSize == 0 ? 0 : bytes / cache.objectSize;
            _addZone(cache.name,
                     {.mzi_count = std::min(cache.activeObjects, room),
                      .mzi_cur_size = bytes,
                      .mzi_elem_size = cache.objectSize,
                      .mzi_alloc_size = slabSize,
                      .mzi_collectable =
                          bytes != 0 && isReclaimable(_sources.sysDirectory, cache.name) ? 1U : 0U});
        }
        _addZone("kmalloc-large", {.mzi_cur_size = MWSaturatingSubtract(_meminfo["Slab"], sum)});
    }

    void _addZone(std::string_view name, const mach_zone_info_t& zone) {
        if (zone.mzi_cur_size == 0) {
            return;
        }
        copyText(_memory.zoneNames.emplace_back().mzn_name, name);
        _memory.zones.push_back(zone);
        _accounted = MWSaturatingAdd(_accounted, zone.mzi_cur_size);
    }

    void _addVmalloc() {
        VmallocMemory vmalloc(_text("vmallocinfo"), _meminfo["VmallocUsed"], _sources.pageSize);
        // Kernels are built with stacks in this memory or outside of it.
        const uint64_t stacks = _meminfo["KernelStack"];
        const uint64_t stacksHere = vmalloc.take(kStackMakers, stacks);
        _addTag(MWKernelTagStack, vmalloc.callersAreKnown() && stacksHere != 0 ? stacksHere : stacks);
        _addTag(MWKernelTagShadowCallStack, vmalloc.take(kShadowStackMakers, _meminfo["ShadowCallStack"]));
        _addModules(vmalloc);
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

    // The load tag of a module is its place in the list.
    void _addModules(VmallocMemory& vmalloc) {
        for (procfs::LoadedModule& module : procfs::parseModules(_text("modules"))) {
            const uint64_t number = siteNumber(_memory.modules.size() + 1);
            if (const uint64_t bytes = vmalloc.take(kModuleLoaders, module.bytes); bytes != 0) {
                _add(recordOf(MWSiteExtension, number, bytes));
            }
            _memory.modules.push_back(
                {.OSBundleLoadTag = number, .bundleIdentifier = std::move(module.name)});
        }
    }

    // Processes are charged for their own, but not for the topmost level of each and not for the kernel's.
    void _addPageTables() {
        const uint64_t all = _meminfo["PageTables"];
        const uint64_t charged =
            all == 0 ? 0 : std::min(all, pageTablesOfProcesses(_sources.procDirectory, _sources.pageTables));
        _addTag(MWKernelTagPageTables, charged, MWSiteHidden);
        _addTag(MWKernelTagPageTables, all - charged);
    }

    void _addTags() {
        _addTag(MWKernelTagSecondaryPageTables, _meminfo["SecPageTables"]);
        _addTag(MWKernelTagPerCpu, _meminfo["Percpu"]);
        _addTag(MWKernelTagReclaimable,
                MWSaturatingSubtract(_meminfo["KReclaimable"], _meminfo["SReclaimable"]));
        _addTag(MWKernelTagZswap, _meminfo["Zswap"]);
        _addTag(MWKernelTagZsmalloc, MWSaturatingSubtract(_pages("nr_zspages"), _meminfo["Zswap"]));
        _addTag(MWKernelTagBounce, _meminfo["Bounce"]);
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
        _accounted = MWSaturatingAdd(_accounted, record.size);
    }

    static void _name(mach_memory_info_t& record, std::string_view name) {
        copyText(record.name, name);
        record.flags |= name.empty() ? 0 : MWSiteNamed;
    }

    void _addCounters() {
        if (_meminfo.empty()) {
            return;
        }
        _addCounter(MWKernelCounterManaged, _meminfo["MemTotal"]);
        _addCounter(MWKernelCounterFree, _meminfo["MemFree"]);
        _addCounter(MWKernelCounterPerCpuFree, _perCpuFree);
        _addCounter(MWKernelCounterAvailable, _meminfo["MemAvailable"]);
        _addCounter(MWKernelCounterUser, _userMemory());
        _addCounter(MWKernelCounterUnaccounted, MWSaturatingSubtract(_kernelMemory(), _accounted));
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

    /// What the kernel counts up and down at different processors can be told as less than nothing, which
    /// reads as a number beyond all memory.
    uint64_t _pages(std::string_view name) const {
        const uint64_t bytes = _bytesOf(_vmstat[name]);
        return bytes <= _meminfo["MemTotal"] ? bytes : 0;
    }

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
