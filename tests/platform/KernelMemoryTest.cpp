#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
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
        bool isHidden = false;
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
            sites.isHidden = (record.flags & MWSiteHidden) != 0;
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
              "HugePages_Total:       3\nHugetlb:           6144 kB\n" +
                  more);
    }
    void writeSlabinfo(const std::string& rows) {
        write("slabinfo",
              "slabinfo - version: 2.1\n# name            <active_objs> <num_objs> <objsize> <objperslab> "
              "<pagesperslab> : tunables <limit> <batchcount> <sharedfactor> : slabdata <active_slabs> "
              "<num_slabs> <sharedavail>\n" +
                  rows);
    }
    const uint64_t _page = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
};

std::string tagSite(MWKernelTag tag) {
    return "0 " + std::to_string(tag);
}

TEST_F(KernelTexts, CachesAreZonesAndTheRestOfTheTotalIsTooLargeForAny) {
    writeMeminfo();
    writeSlabinfo(
        "ext4_inode_cache     100    110   1000   10    2 : tunables    0    0    0 : slabdata     11     11 "
        "  "
        "   0\n"
        "kmalloc-64          5000   6400     64   64    1 : tunables    0    0    0 : slabdata    100    100 "
        "  "
        "   0\n"
        "dentry               900   1000    192   21    1 : tunables    0    0    0 : slabdata     50     50 "
        "  "
        "   0\n"
        "a name of words        7      8    512    8    1 : tunables    0    0    0 : slabdata      1      1 "
        "  "
        "   0\n"
        "full               99999   1000   4096    8    8 : tunables    0    0    0 : slabdata      1      1 "
        "  "
        "   0\n"
        "empty                  0      0     64   64    1 : tunables    0    0    0 : slabdata      0      0 "
        "  "
        "   0\n");
    write("sysfs/kernel/slab/kmalloc-64/reclaim_account", "0\n");
    write("sysfs/kernel/slab/full/reclaim_account", "1\n");
    const Answer answer = ask();
    EXPECT_FALSE(answer.zones.contains("empty"));
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_cur_size, 22 * _page);
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_count, std::min<uint64_t>(100, 22 * _page / 1000));
    EXPECT_EQ(answer.zones.at("ext4_inode_cache").mzi_elem_size, 1000U);
    EXPECT_NE(answer.zones.at("ext4_inode_cache").mzi_collectable, 0U) << "known by its name";
    EXPECT_NE(answer.zones.at("dentry").mzi_collectable, 0U);
    EXPECT_EQ(answer.zones.at("kmalloc-64").mzi_collectable, 0U) << "as sysfs says";
    EXPECT_NE(answer.zones.at("full").mzi_collectable, 0U);
    EXPECT_EQ(answer.zones.at("full").mzi_count, 8 * _page / 4096) << "no more than there is room for";
    EXPECT_EQ(answer.zones.at("a name of words").mzi_count, 7U);
    uint64_t sum = 0;
    for (const auto& [name, zone] : answer.zones) {
        sum += zone.mzi_cur_size;
    }
    EXPECT_EQ(sum, 8000 * kKiB);
    EXPECT_EQ(answer.zones.at("kmalloc-large").mzi_collectable, 0U);
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
    writeMeminfo();
    // Pages on many nodes are told in all and by node.
    write(
        "vmallocinfo",
        "0x0000000000000000-0x0000000000000000   20480 irq_init_percpu_irqstack+0xca/0x100 vmap\n"
        "0x0000000000000000-0x0000000000000000    8192 acpi_os_map_iomem+0x1bc/0x1e0 phys=0x0000000000009000 "
        "ioremap\n"
        "0x0000000000000000-0x0000000000000000   20480 kernel_clone+0x94/0x3e0 pages=300 vmalloc N0=100 "
        "N1=100 N7=100\n"
        "0x0000000000000000-0x0000000000000000   20480 kernel_clone+0x94/0x3e0 pages=200 vmalloc N1=200\n"
        "0x0000000000000000-0x0000000000000000   20480 load_module+0x94/0x3e0 pages=20 vmalloc N1=20\n"
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
    const auto pages = [&](uint64_t count, int sites = 1) { return Sites{sites, count * _page, false}; };
    const std::map<std::string, Sites> expected = {
        {tagSite(MWKernelTagStack), {1, 1600 * kKiB, false}},
        {"kernel_clone", {1, 500 * _page - 1600 * kKiB, false}},
        {"1 1", pages(15)},
        {"1 2", {1, 4096, false}},
        {"1 3", {1, 5 * _page - 4096, false}},  // what is left of the loader's
        {"make_table [net]", pages(12, 2)},
        {"2 " + std::to_string(0xffffffff81234567), pages(3)},
        {tagSite(MWKernelTagVmalloc), pages(2)},
        {tagSite(MWKernelTagPageTables), {1, 2000 * kKiB, true}},
        {tagSite(MWKernelTagPerCpu), {1, 700 * kKiB, false}},
        {tagSite(MWKernelTagReclaimable), {1, 100 * kKiB, false}},
        {tagSite(MWKernelTagUserWired), {1, 900 * kKiB, false}},
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
    writeMeminfo("SecPageTables: 40 kB\nZswap: 80 kB\nBounce: 4 kB\n");
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
        {tagSite(MWKernelTagStack), {1, 1600 * kKiB, false}},
        {tagSite(MWKernelTagVmalloc), {1, (6000 - 1600) * kKiB - 8192, false}},
        {"1 1", {1, 8192, false}},
        {tagSite(MWKernelTagPageTables), {1, 2000 * kKiB, true}},
        {tagSite(MWKernelTagSecondaryPageTables), {1, 40 * kKiB, false}},
        {tagSite(MWKernelTagPerCpu), {1, 700 * kKiB, false}},
        {tagSite(MWKernelTagReclaimable), {1, 100 * kKiB, false}},
        {tagSite(MWKernelTagZswap), {1, 80 * kKiB, false}},
        {tagSite(MWKernelTagZsmalloc), {1, zsmalloc, false}},
        {tagSite(MWKernelTagBounce), {1, 4 * kKiB, false}},
        {tagSite(MWKernelTagPageMap), {1, 2 * _page, false}},
        {tagSite(MWKernelTagUserWired), {1, 900 * kKiB, false}},
    };
    EXPECT_EQ(answer.sites, expected);
    const std::map<uint64_t, uint64_t> counters = {
        {MWKernelCounterManaged, 100000 * kKiB},
        {MWKernelCounterFree, 40000 * kKiB},
        {MWKernelCounterPerCpuFree, 60 * _page},
        {MWKernelCounterAvailable, 70000 * kKiB},
        {MWKernelCounterUser, (20000 + 10000 + 1000 + 6144) * kKiB},
        {MWKernelCounterUnaccounted,
         (60000 - 37144 - 8000 - 6000 - 2000 - 40 - 700 - 100 - 80 - 4) * kKiB - zsmalloc - 62 * _page},
        {MWKernelCounterSlab, 8000 * kKiB},
        {MWKernelCounterVmalloc, 6000 * kKiB},
        {MWKernelCounterCommitted, 50000 * kKiB},
        {MWKernelCounterDirty, 0},
        {MWKernelCounterHugetlb, 6144 * kKiB},
        {MWKernelCounterPageMap, 3 * _page},
    };
    EXPECT_EQ(answer.counters, counters);
}

TEST_F(KernelTexts, PlacesInTheSourceReplaceEverythingCoarser) {
    writeMeminfo();
    writeSlabinfo("dentry 900 1000 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n");
    write("vmallocinfo", "0x0-0x0 20480 load_module+0x94/0x3e0 pages=100 vmalloc N0=100\n");
    const std::string header = "allocinfo - version: 1.0\n#     <size>  <calls> <tag info>\n";
    const std::string unused = "           0        0 init/main.c:1 func:start\n";
    write("allocinfo", header + unused);
    EXPECT_TRUE(ask().zones.contains("dentry")) << "profiling is there and switched off";

    std::string unusedLines;
    for (int line = 2; line <= 21; ++line) {
        unusedLines += unused;
    }
    write("allocinfo", header + unusedLines +
                           "       65536       16 drivers/net/foo/main.c:77 [foo] func:foo_ring_alloc\n"
                           "        4096        1 kernel/fork.c:12 func:dup\n"
                           "        8192        1 kernel/fork.c:20 func:dup\n"
                           "       16384        1 fs/dcache.c:1690 func:__d_alloc accurate:no\n"
                           "     9999999        1 mm/slub.c:3000 func:alloc_slab_page\n"
                           "     9999999        1 mm/memory.c:1061 func:folio_prealloc\n"
                           "       12288        3 ./include/asm-generic/pgalloc.h:63 func:__pte_alloc_one\n");
    const Answer answer = ask();
    EXPECT_TRUE(answer.zones.empty());
    const std::map<std::string, Sites> expected = {
        {"foo_ring_alloc [foo]", {1, 65536, false}},
        {"dup", {2, 12288, false}},
        {"__d_alloc", {1, 16384, false}},
        {"__pte_alloc_one", {1, 12288, true}},
        {tagSite(MWKernelTagUserWired), {1, 900 * kKiB, false}},
    };
    EXPECT_EQ(answer.sites, expected);
    EXPECT_EQ(answer.locations.at("foo_ring_alloc [foo]"), "drivers/net/foo/main.c:77");
    EXPECT_EQ(answer.locations.at("dup"), "kernel/fork.c:20");
    EXPECT_EQ(answer.locations.at("__d_alloc"), "fs/dcache.c:1690") << "its number is not the tag's";
    EXPECT_FALSE(answer.locations.contains(tagSite(MWKernelTagUserWired)));
    EXPECT_EQ(answer.counters.at(MWKernelCounterUnaccounted),
              (60000 - 37144) * kKiB - 65536 - 12288 - 16384 - 12288);
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

// Whoever looks: without privilege the total is told by halves.
TEST(LiveKernel, ZonesAreTheSlab) {
    MWLinuxHost host;
    MWKernelMemoryArrays arrays;
    ASSERT_EQ(host.mach_memory_info(arrays), KERN_SUCCESS);
    if (arrays.zones.empty()) {
        GTEST_SKIP() << "a kernel with allocation profiling";
    }
    double zones = 0;
    for (const mach_zone_info_t& zone : arrays.zones) {
        zones += static_cast<double>(zone.mzi_cur_size);
    }
    const auto slab = std::ranges::find_if(arrays.records, [](const mach_memory_info_t& record) {
        return record.flags == MWSiteCounter && record.site == MWKernelCounterSlab;
    });
    ASSERT_NE(slab, arrays.records.end());
    EXPECT_NEAR(zones, static_cast<double>(slab->mapped), 0.03 * static_cast<double>(slab->mapped));
}

TEST_F(KernelTexts, AnyTextIsRead) {
    const std::string texts[] = {
        "dentry 9 10 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n",
        "0x0-0x1 20480 load_module+0x94/0x3e0 [net] pages=100 vmalloc N0=100\n",
        "65536 16 drivers/net/foo/main.c:77 [foo] func:foo_ring_alloc\n",
        "Slab: 18446744073709551615 kB\nMemTotal: 99999999999999999999 kB\nMemFree:\n: 5 kB\n",
        "net 18446744073709551615 2 fs, Live 0x0\n",
    };
    std::mt19937 random(1);
    for (int round = 0; round < 4000; ++round) {
        std::string text = texts[random() % std::size(texts)] + texts[random() % std::size(texts)];
        for (int damage = 0; damage < 3; ++damage) {
            text[random() % text.size()] = static_cast<char>(random());
        }
        text.resize(random() % (text.size() + 1));
        EXPECT_LE(procfs::parseSlabinfo(text).size(), text.size());
        EXPECT_LE(procfs::parseAllocinfo(text).size(), text.size());
        EXPECT_LE(procfs::parseModules(text).size(), text.size());
        for (const auto& [caller, pages] : procfs::parseVmallocinfo(text)) {
            EXPECT_LE(caller.name().size(), caller.call.size());
        }
        EXPECT_EQ(procfs::parseMeminfo(text)["no such figure"], 0U);
        EXPECT_LE(KernelSymbols(text).nameForAddress(UINT64_MAX).value_or("").size(), text.size());
    }
}

}  // namespace
