#include <gtest/gtest.h>

#include <algorithm>
#include <tuple>
#include <vector>

#include "process/InspectedProcess.h"
#include "support/FaultyHost.h"

namespace {

constexpr int32_t kReusable = kPresent | VM_PAGE_QUERY_PAGE_REUSABLE;

using Queries = std::vector<std::pair<uint64_t, uint64_t>>;  // start, pages
using Sizes = std::vector<std::pair<uint64_t, uint64_t>>;    // dirty, swapped

std::shared_ptr<MWMemoryRegion> region(uint64_t start, uint64_t end, bool gap = false) {
    auto result = std::make_shared<MWMemoryRegion>();
    result->setStart(start);
    result->setEnd(end);
    result->setUnusedSharedCacheRegion(gap);
    return result;
}

/// Dirty and swapped bytes of neighbouring shared-cache regions after each was measured in turn.
Sizes measure(InspectedProcess& process, const std::vector<std::shared_ptr<MWMemoryRegion>>& regions) {
    for (const auto& one : regions) {
        EXPECT_TRUE(process._populateMemoryRegionWithPageQueries(one, {}));
    }
    Sizes sizes;
    for (const auto& one : regions) {
        sizes.emplace_back(one->dirtySize(), one->swappedSize());
    }
    return sizes;
}

/// A host with 16 KiB pages and one process, 7, whose pages from 0x40000 on are these.
struct World {
    FakeHost host;

    explicit World(std::vector<int32_t> pages, uint64_t pageSize = 16384) {
        host.pageSize = pageSize;
        const uint64_t size = pages.size() * pageSize;
        host.processes[7] = {.comm = "victim",
                             .regions = {{.start = 0x40000, .size = size, .pages = std::move(pages)}}};
    }
};

TEST(MWUserProcessPagesTest, SplitsBytesOfPageBetweenNeighbours) {
    const World world({kPresent, kDirty, kSwapped});
    EXPECT_EQ(measure(*InspectedProcess::of(7), {region(0x41000, 0x45000), region(0x45000, 0x49000)}),
              (Sizes{{0x3000 + 0x1000, 0}, {0x3000, 0x1000}}));
    EXPECT_EQ(world.host.pageQueries, (Queries{{0x40000, 2}, {0x48000, 1}})) << "the page between once";

    const World within({kDirty, kClean});
    EXPECT_EQ(measure(*InspectedProcess::of(7),
                      {region(0x41000, 0x42000), region(0x42000, 0x42800), region(0x42800, 0x48000)}),
              (Sizes{{0x1000, 0}, {0x800, 0}, {0x1800, 0}}));
    EXPECT_EQ(within.host.pageQueries, (Queries{{0x40000, 1}, {0x44000, 1}}));
}

TEST(MWUserProcessPagesTest, GapIsCreditedWhenItsLastPageIsQueriedForTheNextRegion) {
    const World world({kDirty, kDirty, kSwapped, kDirty});
    const auto process = InspectedProcess::of(7);
    // The gap has 0x3000 bytes of the first page, which the region before it brought into the cache, and
    // 0x1000 of the third. Its page in between belongs to nobody and is never asked for.
    EXPECT_EQ(measure(*process,
                      {region(0x40000, 0x41000), region(0x41000, 0x49000, true), region(0x49000, 0x4C000)}),
              (Sizes{{0x1000, 0}, {0x3000, 0x1000}, {0, 0x3000}}));
    EXPECT_EQ(world.host.pageQueries, (Queries{{0x40000, 1}, {0x48000, 1}}));
    EXPECT_EQ(measure(*process, {region(0x46000, 0x49000, true), region(0x49000, 0x4C000)}),
              (Sizes{{0, 0}, {0, 0x3000}}))
        << "a gap that begins within an unknown page is credited nothing";
}

TEST(MWUserProcessPagesTest, AsksForAtMost4096PagesAtOnce) {
    const World world(std::vector<int32_t>(5000, kDirty), 4096);
    const auto process = InspectedProcess::of(7);
    EXPECT_EQ(measure(*process, {region(0x40000, 0x40000 + 5000 * 4096)}), (Sizes{{5000 * 4096, 0}}));
    EXPECT_EQ(world.host.pageQueries, (Queries{{0x40000, 4096}, {0x40000 + 4096 * 4096, 904}}));
}

TEST(MWUserProcessPagesTest, FailedQueryIsFiledAndFailsTheMeasurement) {
    World world({kDirty});
    const auto process = InspectedProcess::of(7);
    world.host.processes[7].pageQueryFailure = KERN_INVALID_ARGUMENT;
    world.host.processes[7].gone = true;
    EXPECT_FALSE(process->_populateMemoryRegionWithPageQueries(region(0x40000, 0x44000), {}));
    EXPECT_EQ(process->warnings(), Lines{"victim [7]: code 4 (process exited)"});
    EXPECT_EQ(world.host.machErrors, Lines{"mach_vm_page_range_query: 4"});
}

using PageRun = std::tuple<uint64_t, uint64_t, MWCategoryTotals>;

std::vector<PageRun> runsOf(const MWMemoryRegion& one) {
    std::vector<PageRun> runs;
    for (const auto* node = one.subrangeList() ? one.subrangeList()->head() : nullptr; node != nullptr;
         node = node->next) {
        runs.emplace_back(node->start, node->length,
                          MWCategoryTotals{.dirty = node->dirty,
                                           .swapped = node->swapped,
                                           .clean = node->clean,
                                           .reclaimable = node->reclaimable,
                                           .wired = node->wired});
    }
    return runs;
}

TEST(MWUserProcessPagesTest, SubrangesAreRunsOfOneKindWithinTheObject) {
    struct Case {
        std::vector<int32_t> pages;
        int32_t purgeState;
        std::vector<PageRun> runs;
    };
    // Absent pages stand between the runs: touching ones become a single node.
    const std::vector<Case> cases = {
        {{kDirty, kDirty, 0, kClean},
         VM_PURGABLE_DENY,
         {{0, 8192, {.dirty = 8192}}, {12288, 4096, {.clean = 4096}}}},
        {{kReusable, 0, kDirty | kSwapped},
         VM_PURGABLE_DENY,
         {{0, 4096, {.reclaimable = 4096}}, {8192, 4096, {.swapped = 4096}}}},
        {{kPresent, 0, 0, kDirty},
         VM_PURGABLE_VOLATILE,
         {{0, 4096, {.reclaimable = 4096}}, {12288, 4096, {.dirty = 4096}}}},
        {{kDirty, kSwapped, kClean},
         VM_PURGABLE_DENY,
         {{0, 12288, {.dirty = 4096, .swapped = 4096, .clean = 4096}}}},
        {{0, 0}, VM_PURGABLE_DENY, {}},
    };
    constexpr uint64_t kOffset = 0x100000;
    for (const Case& c : cases) {
        for (const bool wired : {false, true}) {
            const World world(c.pages, 4096);
            const auto one = region(0x40000, 0x40000 + c.pages.size() * 4096);
            one->setOffset(kOffset);
            one->setWired(wired);
            InspectedProcess::of(7)->_addSubrangesForRegion(*one, c.purgeState);
            std::vector<PageRun> expected = c.runs;
            for (auto& [start, length, totals] : expected) {
                start += kOffset;
                totals.wired = wired ? length : 0;
            }
            EXPECT_EQ(runsOf(*one), expected);
        }
    }
}

TEST(MWUserProcessPagesTest, SubrangesNeverWrapAroundTheObject) {
    const World world({kDirty, 0, kDirty}, 4096);
    const auto one = region(0x40000, 0x43000);
    one->setOffset(UINT64_MAX - 0x2000);
    InspectedProcess::of(7)->_addSubrangesForRegion(*one, VM_PURGABLE_DENY);
    EXPECT_EQ(one->subrangeList(), nullptr);
}

TEST(MWUserProcessPagesTest, PagesOfWhichNothingIsToldAreAbsentAndMoveNoOthers) {
    // More than one query's pages, of which all are dirty; the first answer is cut in half.
    constexpr uint64_t kPage = 4096;
    constexpr uint64_t kPagesPerQuery = 4096;
    World world(std::vector<int32_t>(kPagesPerQuery + 8, kDirty), kPage);
    FaultyHost host(world.host, HostFault{{"mach_vm_page_range_query", 7}, FaultKind::isHalf});
    const auto process = InspectedProcess::of(7);
    std::vector<uint64_t> told;
    EXPECT_TRUE(process->_enumerateDispositionChunksWithStartAddr(
        0x40000, {.pagesToQuery = kPagesPerQuery + 8, .block = [&](const MWDispositionChunk& chunk) {
                      told.push_back(chunk.words.size());
                      told.push_back(static_cast<uint64_t>(std::ranges::count(chunk.words, kDirty)));
                  }}));
    EXPECT_EQ(told, (std::vector<uint64_t>{kPagesPerQuery, kPagesPerQuery / 2, 8, 8}));
}

}  // namespace
