#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <fstream>
#include <iterator>
#include <map>
#include <random>
#include <string>
#include <utility>

#include "platform/MWKernelTags.h"
#include "platform/linux/KernelSymbols.h"
#include "platform/linux/KernelTexts.h"
#include "platform/linux/MWLinuxHost.h"
#include "support/RecordedTree.h"

// The kernel's memory as the host reports it, from texts of kernels of several kinds.

namespace {

constexpr uint64_t kKiB = 1024;

template <size_t N>
std::string textOf(const std::array<char, N>& text) {
    return {text.begin(), std::find(text.begin(), text.end(), '\0')};
}

class KernelTexts : public RecordedTree {
protected:
    /// All sites of one name.
    struct Sites {
        int count = 0;
        uint64_t bytes = 0;
        uint64_t hidden = 0;  ///< of these
        auto operator<=>(const Sites&) const = default;
    };
    struct Answer {
        kern_return_t result = KERN_SUCCESS;
        std::map<std::string, mach_zone_info_t> zones;
        std::map<std::string, Sites> sites;  ///< by name, or "TYPE NUMBER" where there is none
        std::map<uint64_t, uint64_t> counters;
        std::map<std::string, std::string> locations;  ///< "PATH:LINE" by name
        std::map<uint64_t, std::string> extensions;
    };

    Answer ask() {
        MWLinuxHost host(_top, _top + "/sysfs");
        return ask(host);
    }
    Answer ask(MWLinuxHost& host) {
        MWKernelMemoryArrays arrays;
        Answer answer;
        answer.result = host.mach_memory_info(arrays);
        if (answer.result != KERN_SUCCESS) {
            return answer;
        }
        const auto symbolicator = host.makeKernelSymbolicator();
        for (size_t index = 0; index < arrays.zones.size(); ++index) {
            answer.zones[textOf(arrays.zoneNames[index].mzn_name)] = arrays.zones[index];
        }
        for (const mach_memory_info_t& record : arrays.records) {
            const uint64_t type = record.flags & MWSiteTypeMask;
            if (type == MWSiteCounter) {
                answer.counters[record.site] = record.mapped;
                continue;
            }
            EXPECT_NE(record.flags & MWSiteWired, 0U);
            const std::string name = (record.flags & MWSiteNamed) != 0
                                         ? textOf(record.name)
                                         : std::to_string(type) + " " + std::to_string(record.site);
            Sites& sites = answer.sites[name];
            sites.count += 1;
            sites.bytes += record.size;
            sites.hidden += (record.flags & MWSiteHidden) != 0 ? record.size : 0;
            EXPECT_EQ(record.tag, type == MWSiteTag ? record.site : 0);
            if (const auto location = symbolicator->sourceLocationForAddress(record.site)) {
                answer.locations[name] = location->path + ":" + std::to_string(location->line);
            }
        }
        for (const MWKernelExtension& extension : host.loadedKernelExtensions()) {
            answer.extensions[extension.OSBundleLoadTag] = extension.bundleIdentifier;
        }
        EXPECT_EQ(host.vm_deallocate(arrays.zones.data(), arrays.zones.size_bytes()), KERN_SUCCESS);
        EXPECT_EQ(host.vm_deallocate(arrays.zoneNames.data(), arrays.zoneNames.size_bytes()), KERN_SUCCESS);
        EXPECT_EQ(host.vm_deallocate(arrays.records.data(), arrays.records.size_bytes()), KERN_SUCCESS);
        return answer;
    }

    void writeMeminfo(const std::string& more = "") {
        write("meminfo",
              "MemTotal:        100000 kB\nMemFree:          40000 kB\nMemAvailable:     70000 kB\n"
              "Buffers:            100 kB\nActive:           20000 kB\nInactive:         10000 kB\n"
              "Active(anon):     99999 kB\nUnevictable:       1000 kB\nMlocked:            900 kB\n"
              "Slab:              8000 kB\nSReclaimable:      3000 kB\nSUnreclaim:        5000 kB\n"
              "KReclaimable:      3100 kB\nKernelStack:       1600 kB\nPageTables:        2000 kB\n"
              "VmallocUsed:       6000 kB\nPercpu:             700 kB\nCommitted_AS:     50000 kB\n"
              "HugePages_Total:       3\nHugetlb:           6144 kB\nDirty:              30 kB\n" +
                  more);
    }
    void writeSlabinfo(const std::string& rows) {
        write("slabinfo",
              "slabinfo - version: 2.1\n# name            <active_objs> <num_objs> <objsize> <objperslab> "
              "<pagesperslab> : tunables <limit> <batchcount> <sharedfactor> : slabdata <active_slabs> "
              "<num_slabs> <sharedavail>\n" +
                  rows);
    }
    /// Processes that are charged for 1500 kB of page tables.
    void writeProcesses() {
        write("1/status", "Name:\tinit\nVmPTE:\t 1000 kB\n");
        write("70/status", "Name:\tother\nVmPTE:\t 500 kB\n");
        write("2/status", "Name:\tkthreadd\n");
        write("uptime/status", "VmPTE:\t 500 kB\n");
    }
    const uint64_t _page = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
};

std::string tagSite(MWKernelTag tag) {
    return "0 " + std::to_string(tag);
}

TEST_F(KernelTexts, CachesAreZonesAndTheRestOfTheTotalIsTooLargeForAny) {
    writeMeminfo();
    writeSlabinfo(
        "ext4_inode_cache  100 110 1000 10 2 : tunables 0 0 0 : slabdata 11 11 0\n"
        "kmalloc-64        5000 6400 64 64 1 : tunables 0 0 0 : slabdata 100 100 0\n"
        "dentry            900 1000 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n"
        "a name of words   7 8 512 8 1 : tunables 0 0 0 : slabdata 1 1 0\n"
        "full              99999 1000 4096 8 8 : tunables 0 0 0 : slabdata 1 1 0\n"
        "nothing           1 1 0 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"
        "radix_tree_node   1 1 64 64 1 : tunables 0 0 0 : slabdata 1 1 0\n"
        "kmalloc-rcl-64    1 1 64 64 1 : tunables 0 0 0 : slabdata 1 1 0\n"
        "endless           1 1 64 64 1 : tunables 0 0 0 : slabdata 1 18446744073709551615 0\n"
        "empty             0 0 64 64 1 : tunables 0 0 0 : slabdata 0 0 0\n");
    write("sysfs/kernel/slab/kmalloc-64/reclaim_account", "0\n");
    write("sysfs/kernel/slab/full/reclaim_account", "1\n");
    const Answer answer = ask();
    EXPECT_FALSE(answer.zones.contains("empty"));
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_cur_size, 22 * _page);
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_count, std::min<uint64_t>(100, 22 * _page / 1000));
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_elem_size, 1000U);
    EXPECT_NE(answer.zones.at("ext4_inode_cache").mzi_collectable, 0U) << "known by its name";
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_alloc_size, 2 * _page);
    for (const char* name : {"dentry", "radix_tree_node", "kmalloc-rcl-64"}) {
        EXPECT_NE(answer.zones.at(name).mzi_collectable, 0U) << name;
    }
    EXPECT_EQ(answer.zones.at("nothing").mzi_count, 0U) << "objects of no size";
    EXPECT_EQ(answer.zones.at("endless").mzi_cur_size, UINT64_MAX) << "no small and plausible figure";
    EXPECT_FALSE(answer.zones.contains("kmalloc-large"));
    EXPECT_EQ(answer.zones.at("kmalloc-64").mzi_collectable, 0U) << "as sysfs says";
    EXPECT_NE(answer.zones.at("full").mzi_collectable, 0U);
    EXPECT_EQ(answer.zones.at("full").mzi_count, 8 * _page / 4096) << "no more than there is room for";
    EXPECT_EQ(answer.zones.at("a name of words").mzi_count, 7U);
}

TEST_F(KernelTexts, WhatIsTooLargeForAnyCacheIsTheRestOfTheTotal) {
    writeMeminfo();
    writeSlabinfo("dentry 900 1000 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n");
    write("sys/vm/stat_refresh", "");
    const Answer answer = ask();
    EXPECT_EQ(answer.zones.at("kmalloc-large").mzi_cur_size, 8000 * kKiB - 50 * _page);
    EXPECT_EQ(answer.zones.at("kmalloc-large").mzi_collectable, 0U);
    std::ifstream refresh(place("sys/vm/stat_refresh"));
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(refresh), {}), "1")
        << "counts are brought up to date";
}

TEST_F(KernelTexts, ThousandsOfCaches) {
    std::string rows;
    for (int index = 0; index < 3000; ++index) {
        rows += "cache-" + std::to_string(index) + " 10 10 64 64 1 : tunables 0 0 0 : slabdata 1 1 0\n";
    }
    writeMeminfo();
    writeSlabinfo(rows);
    const Answer answer = ask();
    EXPECT_EQ(answer.zones.size(), 3000U) << "more than the total: none is left for large ones";
    EXPECT_EQ(answer.counters.at(MWKernelCounterUnaccounted),
              60000 * kKiB - (37144 + 100 + 700 + 2000 + 6000) * kKiB - 3000 * _page);
}

TEST_F(KernelTexts, CallersOfVmallocWithoutWhatHasItsOwnName) {
    writeMeminfo("ShadowCallStack: 360 kB\n");
    writeProcesses();
    // Pages on many nodes are told in all and by node.
    write(
        "vmallocinfo",
        "0x0000000000000000-0x0000000000000000   20480 irq_init_percpu_irqstack+0xca/0x100 vmap\n"
        "0x0000000000000000-0x0000000000000000    8192 acpi_os_map_iomem+0x1bc/0x1e0 phys=0x0000000000009000 "
        "ioremap\n"
        "0x0000000000000000-0x0000000000000000   20480 kernel_clone+0x94/0x3e0 pages=300 vmalloc N0=100 "
        "N1=100 N7=100\n"
        "0x0000000000000000-0x0000000000000000   20480 kernel_clone+0x94/0x3e0 pages=100 vmalloc N1=100\n"
        "0x0000000000000000-0x0000000000000000   20480 copy_process.isra.0+0x94/0x3e0 pages=100 vmalloc\n"
        "0x0000000000000000-0x0000000000000000   20480 load_module+0x94/0x3e0 pages=12 vmalloc N1=12\n"
        "0x0000000000000000-0x0000000000000000   20480 execmem_alloc.constprop.0+0x9/0x3e0 pages=8 vmalloc\n"
        "0x0000000000000000-0x0000000000000000   20480 scs_prepare+0x9/0x3e0 pages=100 vmalloc N1=100\n"
        "0x0000000000000000-0x0000000000000000   20480 make_table+0x10/0x20 [net] pages=5 vmalloc vpages "
        "N0=5\n"
        "0x0000000000000000-0x0000000000000000   20480 make_table+0x18/0x20 [net] pages=7 vmalloc user N0=7\n"
        "0x0000000000000000-0x0000000000000000   20480 0xffffffff81234567 pages=3 vmalloc N0=3\n"
        "0x0000000000000000-0x0000000000000000  524288 vm_map_ram\n"
        "0x0000000000000000-0x0000000000000000   24576 unpurged vm_area\n"
        "0x0000000000000000-0x0000000000000000   24576 pages=2 vmalloc N0=2\n");
    write("modules", "net " + std::to_string(15 * _page) +
                         " 2 fs,\tother, Live 0x0000000000000000 (OE)\nfs 4096 0 - Live 0x0\nlarge " +
                         std::to_string(400 * _page) + " 0 - Live 0x0\nlast 4096 0 - Live 0x0\n");
    const Answer answer = ask();
    const auto pages = [&](uint64_t count, int sites = 1) { return Sites{sites, count * _page}; };
    const std::map<std::string, Sites> expected = {
        {tagSite(MWKernelTagStack), {1, 1600 * kKiB}},
        {"kernel_clone", {1, 500 * _page - 1600 * kKiB}},  // the callers in the order of their names
        {tagSite(MWKernelTagShadowCallStack), {1, 360 * kKiB}},
        {"scs_prepare", {1, 100 * _page - 360 * kKiB}},
        {"1 1", pages(15)},
        {"1 2", {1, 4096}},
        {"1 3", {1, 5 * _page - 4096}},  // what is left of the loader's
        {"make_table [net]", pages(12, 2)},
        {"2 " + std::to_string(0xffffffff81234567), pages(3)},
        {tagSite(MWKernelTagVmalloc), pages(2)},
        {tagSite(MWKernelTagPageTables), {2, 2000 * kKiB, 1500 * kKiB}},
        {tagSite(MWKernelTagPerCpu), {1, 700 * kKiB}},
        {tagSite(MWKernelTagReclaimable), {1, 100 * kKiB}},
        {tagSite(MWKernelTagUserWired), {1, 900 * kKiB}},
    };
    EXPECT_EQ(answer.sites, expected);
    EXPECT_EQ(answer.extensions,
              (std::map<uint64_t, std::string>{{1, "net"}, {2, "fs"}, {3, "large"}, {4, "last"}}));
}

TEST_F(KernelTexts, StacksOutsideOfVmallocAndModulesBeyondTheTag) {
    writeMeminfo();
    write("vmallocinfo", "0x0-0x0 20480 load_module+0x94/0x3e0 pages=100 vmalloc N0=100\n");
    std::string modules;
    for (int index = 1; index <= 30; ++index) {
        modules += "m" + std::to_string(index) + " " + std::to_string(_page) + " 0 - Live 0x0\n";
    }
    write("modules", modules);
    const Answer answer = ask();
    EXPECT_EQ(answer.sites.at(tagSite(MWKernelTagStack)).bytes, 1600 * kKiB);
    EXPECT_EQ(answer.sites.at("load_module").bytes, 70 * _page);
    EXPECT_FALSE(answer.sites.contains("1 24")) << "the number of memory that processes have wired";
    EXPECT_EQ(answer.extensions.at(23), "m23");
    EXPECT_EQ(answer.extensions.at(25), "m24");
    EXPECT_TRUE(answer.sites.contains("1 31"));
}

TEST_F(KernelTexts, ClosedOrAbsentSourcesLeaveTheFigures) {
    EXPECT_EQ(ask().result, KERN_FAILURE);
    writeMeminfo(
        "SecPageTables: 40 kB\nZswap: 80 kB\nBounce: 4 kB\nBalloon: 999999 kB\nHardwareCorrupted: 8 kB\n"
        "WritebackTmp: 12 kB\nShadowCallStack: 360 kB\n");
    writeProcesses();
    write("vmstat", "nr_free_pages 7\nnr_zspages 30\nnr_memmap_boot_pages 3\nnr_memmap_pages 2\n");
    write("zoneinfo",
          "Node 0, zone DMA\n  pagesets\n    cpu: 0\n              count:    10\n              high:  5\n"
          "    cpu: 1\n              count: 20\nNode 7, zone Normal\n  pagesets\n    cpu: 0\n"
          "              count:    30\n");
    write("modules", "net 8192 0 - Live 0x0\n");
    const Answer answer = ask();
    EXPECT_EQ(answer.zones.size(), 2U);
    EXPECT_EQ(answer.zones.at("SReclaimable").mzi_cur_size, 3000 * kKiB);
    EXPECT_EQ(answer.zones.at("SUnreclaim").mzi_cur_size, 5000 * kKiB);
    const uint64_t zsmalloc = 30 * _page - 80 * kKiB;
    const std::map<std::string, Sites> expected = {
        {tagSite(MWKernelTagStack), {1, 1600 * kKiB}},
        {tagSite(MWKernelTagShadowCallStack), {1, 360 * kKiB}},
        {tagSite(MWKernelTagHardwareCorrupted), {1, 8 * kKiB}},
        {tagSite(MWKernelTagWriteback), {1, 12 * kKiB}},
        {tagSite(MWKernelTagBalloon), {1, 999999 * kKiB, 999999 * kKiB}},  // the host's by now
        {tagSite(MWKernelTagVmalloc), {1, (6000 - 1600 - 360) * kKiB - 8192}},
        {"1 1", {1, 8192}},
        {tagSite(MWKernelTagPageTables), {2, 2000 * kKiB, 1500 * kKiB}},
        {tagSite(MWKernelTagSecondaryPageTables), {1, 40 * kKiB}},
        {tagSite(MWKernelTagPerCpu), {1, 700 * kKiB}},
        {tagSite(MWKernelTagReclaimable), {1, 100 * kKiB}},
        {tagSite(MWKernelTagZswap), {1, 80 * kKiB}},
        {tagSite(MWKernelTagZsmalloc), {1, zsmalloc}},
        {tagSite(MWKernelTagBounce), {1, 4 * kKiB}},
        {tagSite(MWKernelTagPageMap), {1, 2 * _page}},
        {tagSite(MWKernelTagUserWired), {1, 900 * kKiB}},
    };
    EXPECT_EQ(answer.sites, expected);
    const std::map<uint64_t, uint64_t> counters = {
        {MWKernelCounterManaged, 100000 * kKiB},
        {MWKernelCounterFree, 40000 * kKiB},
        {MWKernelCounterPerCpuFree, 60 * _page},
        {MWKernelCounterAvailable, 70000 * kKiB},
        {MWKernelCounterUser, (20000 + 10000 + 1000 + 6144) * kKiB},
        {MWKernelCounterUnaccounted,
         (60000 - 37144 - 8000 - 6000 - 2000 - 40 - 700 - 100 - 80 - 4 - 8 - 12) * kKiB - zsmalloc -
             62 * _page},
        {MWKernelCounterSlab, 8000 * kKiB},
        {MWKernelCounterVmalloc, 6000 * kKiB},
        {MWKernelCounterCommitted, 50000 * kKiB},
        {MWKernelCounterDirty, 30 * kKiB},
        {MWKernelCounterHugetlb, 6144 * kKiB},
        {MWKernelCounterPageMap, 3 * _page},
    };
    EXPECT_EQ(answer.counters, counters);
}

class ProfiledKernel : public KernelTexts {
protected:
    void SetUp() override {
        KernelTexts::SetUp();
        writeMeminfo("SecPageTables: 40 kB\n");
        writeProcesses();
        writeSlabinfo("dentry 900 1000 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n");
        write("vmallocinfo", "0x0-0x0 20480 load_module+0x94/0x3e0 pages=100 vmalloc N0=100\n");
        write("sys/vm/mem_profiling", "1\n");
    }
    void writeAllocinfo(const std::string& lines) {
        write("allocinfo", "allocinfo - version: 1.0\n#     <size>  <calls> <tag info>\n" + lines);
    }
    bool isReportedCoarsely() { return ask().zones.contains("dentry"); }
};

TEST_F(ProfiledKernel, PlacesInTheSourceReplaceEverythingCoarser) {
    std::string unused;
    for (int line = 1; line <= 21; ++line) {
        unused += "           0        0 init/main.c:1 func:start\n";
    }
    writeAllocinfo(unused +
                   "       65536       16 drivers/net/foo/main.c:77 [foo] func:foo_ring_alloc\n"
                   "        4096        1 kernel/fork.c:12 func:dup\n"
                   "        8192        1 kernel/fork.c:20 func:dup\n"
                   "     8192000        1 fs/dcache.c:1690 func:__d_alloc accurate:no\n"
                   "    99999999        1 mm/slub.c:3000 func:alloc_slab_page\n"
                   "    99999999        1 mm/percpu-km.c:30 func:pcpu_create_chunk\n"
                   "    99999999        1 mm/memory.c:1061 func:folio_prealloc\n"
                   "    99999999        1 mm/filemap.c:9 func:__filemap_get_folio\n"
                   "    99999999        1 arch/arm64/mm/fault.c:9 func:vma_alloc_zeroed_movable_folio\n"
                   "    99999999        1 arch/x86/mm/pgtable.c:9 func:_pgd_alloc\n"
                   "    99999999        3 ./include/asm-generic/pgalloc.h:63 func:__pte_alloc_one\n");
    const Answer answer = ask();
    EXPECT_TRUE(answer.zones.empty());
    const std::map<std::string, Sites> expected = {
        {"foo_ring_alloc [foo]", {1, 65536}},
        {"dup", {2, 12288}},
        {"__d_alloc", {1, 8192000}},
        {tagSite(MWKernelTagPageTables), {2, 2000 * kKiB, 1500 * kKiB}},
        {tagSite(MWKernelTagUserWired), {1, 900 * kKiB}},
    };
    EXPECT_EQ(answer.sites, expected);
    EXPECT_EQ(answer.locations.at("foo_ring_alloc [foo]"), "drivers/net/foo/main.c:77");
    EXPECT_EQ(answer.locations.at("dup"), "kernel/fork.c:20");
    EXPECT_EQ(answer.locations.at("__d_alloc"), "fs/dcache.c:1690") << "its number is not the tag's";
    EXPECT_FALSE(answer.locations.contains(tagSite(MWKernelTagUserWired)));
    EXPECT_EQ(answer.counters.at(MWKernelCounterUnaccounted),
              (60000 - 37144 - 2000) * kKiB - 65536 - 12288 - 8192000);
}

TEST_F(ProfiledKernel, FiguresThatCannotBeRightAreNotUsed) {
    const std::string fitting = "8192000 1 fs/dcache.c:1690 func:__d_alloc\n";
    writeAllocinfo(fitting);
    EXPECT_FALSE(isReportedCoarsely());
    write("sys/vm/mem_profiling", "0\n");
    EXPECT_TRUE(isReportedCoarsely()) << "switched off, with what it knew before";
    write("sys/vm/mem_profiling", "1\n");
    writeAllocinfo("64 1 fs/dcache.c:1690 func:__d_alloc\n");
    EXPECT_TRUE(isReportedCoarsely()) << "switched on a moment ago";
    writeAllocinfo(fitting + "28000000 1 mm/newer.c:1 func:for_a_process\n");
    EXPECT_TRUE(isReportedCoarsely()) << "more than the kernel has";
    writeAllocinfo("");
    EXPECT_TRUE(isReportedCoarsely());
}

TEST_F(KernelTexts, SymbolsAreReadWhenAnAddressNeedsThem) {
    write("kallsyms",
          "ffffffff81000300 T last\nffffffff81000000 T first\nffffffff81000100 d data\n"
          "ffffffff81000200 t second\t[net]\nnonsense\n\nffffffff81000210 T\n");
    MWLinuxHost host(_top, _top + "/sysfs");
    const auto symbolicator = host.makeKernelSymbolicator();
    EXPECT_EQ(symbolicator->nameForAddress(0xffffffff80ffffff), std::nullopt);
    EXPECT_EQ(symbolicator->nameForAddress(0xffffffff81000000), "first");
    EXPECT_EQ(symbolicator->nameForAddress(0xffffffff810001ff), "first");
    EXPECT_EQ(symbolicator->nameForAddress(0xffffffff81000250), "second [net]");
    write("kallsyms", "");
    EXPECT_EQ(symbolicator->nameForAddress(UINT64_MAX), "last") << "read once";
    EXPECT_EQ(symbolicator->sourceLocationForAddress(0xffffffff81000000), std::nullopt);
    // Without privilege all addresses read as 0.
    write("kallsyms", "0000000000000000 T first\n0000000000000000 T last\n");
    EXPECT_EQ(host.makeKernelSymbolicator()->nameForAddress(5), std::nullopt);
}

TEST_F(KernelTexts, ArraysAreGivenBackOnceAndWhole) {
    writeMeminfo();
    MWLinuxHost host(_top, _top + "/sysfs");
    MWKernelMemoryArrays arrays;
    ASSERT_EQ(host.mach_memory_info(arrays), KERN_SUCCESS);
    const size_t size = arrays.zones.size_bytes();
    EXPECT_EQ(host.vm_deallocate(arrays.zones.data(), size - 64), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(host.vm_deallocate(arrays.zones.data(), size), KERN_SUCCESS);
    EXPECT_EQ(host.vm_deallocate(arrays.zones.data(), size), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(host.vm_deallocate(&host, 8), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(host.vm_deallocate(nullptr, 0), KERN_SUCCESS);
}

// Others come and go meanwhile: one look in three has to fit.
TEST(LiveKernel, RecordsAddUpToTheKernelsTotals) {
    MWLinuxHost host;
    const auto isNear = [](double a, double b) { return std::abs(a - b) <= 0.03 * b; };
    bool fits = false;
    for (int look = 0; look < 3 && !fits; ++look) {
        MWKernelMemoryArrays arrays;
        ASSERT_EQ(host.mach_memory_info(arrays), KERN_SUCCESS);
        if (arrays.zones.empty()) {
            GTEST_SKIP() << "a kernel with allocation profiling";
        }
        double slab = 0;
        for (const mach_zone_info_t& zone : arrays.zones) {
            slab += static_cast<double>(zone.mzi_cur_size);
        }
        double vmalloc = 0;
        std::map<uint64_t, double> counters;
        for (const mach_memory_info_t& record : arrays.records) {
            const uint64_t type = record.flags & MWSiteTypeMask;
            if (type == MWSiteCounter) {
                counters[record.site] = static_cast<double>(record.mapped);
            } else if (type != MWSiteTag || record.site == MWKernelTagStack ||
                       record.site == MWKernelTagVmalloc) {
                vmalloc += static_cast<double>(record.size);
            }
        }
        fits = isNear(slab, counters.at(MWKernelCounterSlab)) &&
               isNear(vmalloc, counters.at(MWKernelCounterVmalloc));
    }
    EXPECT_TRUE(fits);
}

// Whatever the texts say, figures stay within what they can be made of.
TEST_F(KernelTexts, DamagedTextsMakeNoMemory) {
    const std::pair<const char*, std::string> texts[] = {
        {"slabinfo",
         "dentry 9 10 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n"
         "huge 18446744073709551615 10 192 21 1 : tunables 0 0 0 : slabdata 50 18446744073709551615 0\n"},
        {"vmallocinfo",
         "0x0-0x1 20480 load_module+0x94/0x3e0 [net] pages=100 vmalloc N0=100\n"
         "0x0-0x1 20480 kernel_clone+0x94/0x3e0 pages=18446744073709551615 vmalloc\n"},
        {"modules", "net 18446744073709551615 2 fs, Live 0x0\nfs 99999999999999999999 0 - Live 0x0\n"},
        {"vmstat", "nr_zspages 18446744073709551615\nnr_memmap_pages 18446744073709551610\n"},
        {"allocinfo", "18446744073709551615 16 drivers/main.c:77 [foo] func:foo\n65536 1 a.c:1 func:b\n"},
        {"zoneinfo", "  count: 18446744073709551615\n  count: 5\n"},
        {"sys/vm/mem_profiling", "1"},
    };
    writeMeminfo();
    std::mt19937 random(1);
    for (int round = 0; round < 300; ++round) {
        for (const auto& [name, text] : texts) {
            std::string damaged = text;
            for (unsigned damage = random() % 4; damage != 0; --damage) {
                damaged[random() % damaged.size()] = static_cast<char>(random());
            }
            damaged.resize(random() % 2 == 0 ? damaged.size() : random() % damaged.size());
            write(name, damaged);
        }
        const Answer answer = ask();
        ASSERT_EQ(answer.result, KERN_SUCCESS);
        for (const auto& [name, zone] : answer.zones) {
            EXPECT_LE(zone.mzi_count, zone.mzi_elem_size == 0 ? 0 : zone.mzi_cur_size / zone.mzi_elem_size);
        }
        EXPECT_LE(answer.counters.at(MWKernelCounterUnaccounted), 60000 * kKiB);
        EXPECT_FALSE(answer.sites.contains(tagSite(MWKernelTagPageMap)) &&
                     answer.sites.at(tagSite(MWKernelTagPageMap)).bytes > 100000 * kKiB);
    }
}

// Or what a process gave back meanwhile would be the kernel's, beside the charge of the process.
TEST_F(KernelTexts, PageTablesOfAMeasuredProcessAreThoseOfItsCharge) {
    writeMeminfo();
    writeProcesses();
    write("1/stat", "1 (init) S 0 1 1 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 500 0 0 0 1 2 3 0 0\n");
    write("1/maps", "");
    MWLinuxHost host(_top, _top + "/sysfs");
    const auto hidden = [&] { return ask(host).sites.at(tagSite(MWKernelTagPageTables)).hidden; };
    task_t task = 0;
    ASSERT_EQ(host.task_read_for_pid(1, task), KERN_SUCCESS);
    rusage_info_v5 usage;
    ASSERT_EQ(host.proc_pid_rusage(1, usage), 0);
    EXPECT_EQ(usage.ri_phys_memweight, 1000 * kKiB);
    write("1/status", "Name:\tinit\nVmPTE:\t 400 kB\n");
    EXPECT_EQ(hidden(), 1500 * kKiB);
    host.task_release(task);
    EXPECT_EQ(hidden(), 900 * kKiB) << "its pid may be another's";
}

TEST_F(KernelTexts, AnyBytesAreSymbols) {
    const std::string whole = "ffffffff81000300 T last\nffffffff81000000 t first\t[net]\n";
    std::mt19937 random(1);
    for (int round = 0; round < 4000; ++round) {
        std::string text = whole;
        text[random() % text.size()] = static_cast<char>(random());
        text.resize(random() % (text.size() + 1));
        const auto name = KernelSymbols(text).nameForAddress(UINT64_MAX);
        EXPECT_TRUE(!name || (!name->empty() && name->size() < text.size())) << text;
    }
}

}  // namespace
