#include <fmt/core.h>
#include <gtest/gtest.h>

#include <vector>

#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWRegionTags.h"
#include "process/InspectedProcess.h"

namespace {

constexpr uint64_t kPage = 4096;
const std::string kUnmapped = "Owned physical memweight (unmapped)";

/// 16 pages: 10 resident, of which 2 reusable and 3 dirty, and 4 in swap.
const vm_region_submap_info_64 kMixed = {.user_tag = 300,
                                         .pages_resident = 10,
                                         .pages_swapped_out = 4,
                                         .pages_dirtied = 3,
                                         .share_mode = SM_PRIVATE,
                                         .pages_reusable = 2};

vm_region_submap_info_64 mixed(uint32_t tag, uint64_t object, uint8_t pager = 0) {
    vm_region_submap_info_64 info = kMixed;
    info.user_tag = tag;
    info.object_id_full = object;
    info.external_pager = pager;
    return info;
}

/// "NAME|DETAIL ADDRESS: DIRTY+SWAPPED CLEAN RECLAIMABLE FLAGS" of each region, sizes in pages.
Lines linesOf(MWProcess& process) {
    process.gatherData();
    Lines lines;
    for (const auto& region : *process.memoryRegions()) {
        lines.push_back(fmt::format("{}|{} {:x}: {}+{} {} {}{}{}{}", region->name(),
                                    region->detailedName().value_or("-"), region->start(),
                                    region->dirtySize() / kPage, region->swappedSize() / kPage,
                                    region->cleanNonSpecSize() / kPage, region->reclaimableSize() / kPage,
                                    region->ownedExclusivelyByParentProcess() ? " owned" : "",
                                    region->wired() ? " wired" : "", region->verbose() ? " verbose" : ""));
    }
    return lines;
}

/// A host with one process, 7, that has these regions of 16 pages at 0x10000, 0x20000 and so on.
struct World {
    FakeHost host;

    explicit World(std::vector<FakeRegion> regions, bool breakDown = false) {
        uint64_t start = 0x10000;
        for (FakeRegion& region : regions) {
            region.start = region.start != 0 ? region.start : start;
            region.size = region.size != 0 ? region.size : 16 * kPage;
            start += 0x10000;
        }
        host.processes[7] = {.comm = "victim", .regions = std::move(regions)};
        MWPhysMemweightSwitch::set(breakDown);
    }
};

TEST(MWUserProcessMemoryTest, ChargesPagesByPurgeStateAndMode) {
    struct Case {
        vm_region_submap_info_64 info;
        int32_t purgeState;
        std::string plain;
        std::string brokenDown;  ///< empty for the same
    };
    // Reusable and dirty pages together exceed the resident ones: the rest is not below nothing.
    const vm_region_submap_info_64 contradictory = {
        .user_tag = 300, .pages_resident = 1, .pages_dirtied = 3, .external_pager = 1, .pages_reusable = 2};
    const vm_region_submap_info_64 moreReusable = {.user_tag = 300, .pages_resident = 1, .pages_reusable = 2};
    const std::vector<Case> cases = {
        {kMixed, VM_PURGABLE_DENY, "tag 300|- 10000: 8+4 0 2", "tag 300|- 10000: 3+4 5 2"},
        {mixed(300, 0, 1), VM_PURGABLE_DENY, "mapped file|- 10000: 3+4 5 2", ""},
        {kMixed, VM_PURGABLE_NONVOLATILE, "tag 300|- 10000: 8+4 0 2", "tag 300|- 10000: 8+0 0 2 owned"},
        {kMixed, VM_PURGABLE_VOLATILE, "tag 300|- 10000: 0+0 0 10", "tag 300|- 10000: 0+0 0 10 owned"},
        {kMixed, VM_PURGABLE_EMPTY, "tag 300|- 10000: 0+0 0 16", "tag 300|- 10000: 0+0 0 16 owned"},
        {{.user_tag = 300, .pages_swapped_out = 4}, VM_PURGABLE_NONVOLATILE, "tag 300|- 10000: 0+4 0 0", ""},
        {mixed(MWTagLoader, 0), VM_PURGABLE_EMPTY, "dynamic loader|- 10000: 0+0 0 16", ""},
        {contradictory, VM_PURGABLE_DENY, "mapped file|- 10000: 3+0 0 2", ""},
        {moreReusable, VM_PURGABLE_DENY, "tag 300|- 10000: 0+0 0 2", ""},
    };
    for (const Case& c : cases) {
        for (const bool breakDown : {false, true}) {
            const World world({{.info = c.info, .purgeState = c.purgeState}}, breakDown);
            EXPECT_EQ(linesOf(*InspectedProcess::of(7)),
                      Lines{breakDown && !c.brokenDown.empty() ? c.brokenDown : c.plain});
        }
    }
}

TEST(MWUserProcessMemoryTest, NamesRegions) {
    vm_region_submap_info_64 wired = kMixed;
    wired.user_wired_count = 1;
    World world({
        {.info = mixed(300, 0, 1), .path = "/bin/tool"},
        {.info = mixed(300, 0, 1), .path = "/data"},
        {.info = wired},
        {.start = 0xFC0000000, .size = 0x40000000},
        {.start = 0x1000000000, .size = 0x6000000000},
        {.start = 0x7000000000, .size = 0x40000000},
    });
    const auto process = InspectedProcess::of(7);
    world.host.processes[7].images = {
        {.path = "/bin/tool (resolved)", .baseAddress = 0x1F000, .segments = {{"__TEXT", 0x1F000, 0x1000}}}};
    EXPECT_EQ(linesOf(*process),
              (Lines{"__TEXT|/bin/tool (resolved) 10000: 3+4 5 2", "mapped file|/data 20000: 3+4 5 2",
                     "tag 300|- 30000: 8+4 0 2 wired", "commpage (reserved)|- fc0000000: 0+0 0 0 verbose",
                     "GPU Carveout (reserved)|- 1000000000: 0+0 0 0 verbose",
                     "untagged (\"VM_ALLOCATE\")|- 7000000000: 0+0 0 0"}));
    EXPECT_EQ(process->memoryRegions()->at(0)->segment(), SegmentText);
    EXPECT_EQ(process->memoryRegions()->at(1)->segment(), SegmentNotImage);

    world.host.processes[7].regions.clear();
    process->gatherData();
    EXPECT_EQ(process->memoryRegions()->size(), 6) << "a process is gathered once";
}

TEST(MWUserProcessMemoryTest, MatchesOwnedObjectsWithRegionsAndListsTheRest) {
    enum : uint64_t { uncharged = 1, network = 2 << 1, tag9 = 7 << 1, isVolatile = 1 << 4, denied = 3 << 4 };
    const auto object = [](uint64_t identifier, uint64_t flags, uint64_t reusable = 1) {
        return std::pair(identifier, OwnedObjectRecord{.object_id = identifier,
                                                       .virtual_size = 32 * kPage,
                                                       .resident = 6 * kPage,
                                                       .wired = 2 * kPage,
                                                       .reusable = reusable * kPage,
                                                       .compressed = 3 * kPage,
                                                       .flags = flags});
    };
    World world({{.info = mixed(300, 0x50)},
                 {.info = mixed(300, 0x60)},
                 {.info = mixed(300, 0x70, 1)},  // named by its file, so not matched
                 {.info = mixed(MWFakeRegionTag, 0)}},
                true);
    const auto process = InspectedProcess::of(7);
    process->setPageTables(9 * kPage);
    process->ownedObjects =
        MWOwnedObjects{object(0x90, uncharged), object(0x80, network | isVolatile),
                       object(0x70, tag9 | denied), object(0x50, network), object(0x40, 0, 7)};
    EXPECT_EQ(linesOf(*process),
              (Lines{"tag 300 (network)|- 10000: 5+3 0 1 owned", "tag 300|- 20000: 3+4 5 2",
                     "mapped file|- 30000: 3+4 5 2",
                     kUnmapped + "|- ffffffffffffffff: 0+3 0 7 owned wired",  // 6 resident, 7 reusable
                     kUnmapped + " (VM ledger tag 7)|- ffffffffffffffff: 5+3 0 1 owned wired",
                     kUnmapped + " (network)|- ffffffffffffffff: 2+0 0 1 owned wired",
                     kUnmapped + "|- ffffffffffffffff: 0+0 0 1 owned wired",
                     "page table|- ffffffffffffffff: 9+0 0 0"}));

    const auto hidden = InspectedProcess::of(7);
    hidden->ownedObjects = process->ownedObjects;
    hidden->setHiddenFromDisplay(true);
    EXPECT_EQ(linesOf(*hidden).back(), kUnmapped + "|- ffffffffffffffff: 3+4 5 2")
        << "a hidden process is not asked for its objects, so the kernel's one figure stands";
}

TEST(MWUserProcessMemoryTest, TakesChargeOfMappedRegionsOutOfUnmappedCharge) {
    struct Case {
        uint32_t mappedPages;  ///< charge found in a mapped purgeable region
        Lines holder;
        Lines warnings;
    };
    const std::vector<Case> cases = {
        {2, {kUnmapped + "|- ffffffffffffffff: 1+4 0 0"}, {}},
        {5, {kUnmapped + "|- ffffffffffffffff: 0+2 0 0"}, {}},
        {7, {}, {}},
        {9,
         {},
         {"victim [7]: Memweight changed while analyzing – unmapped owned physical memweight may be "
          "over-counted by 8192 bytes"}},
    };
    for (const Case& c : cases) {
        const vm_region_submap_info_64 mapped = {.user_tag = 300, .pages_resident = c.mappedPages};
        const vm_region_submap_info_64 unmapped = {
            .user_tag = MWFakeRegionTag, .pages_swapped_out = 4, .pages_dirtied = 3, .object_id = 0x33};
        const World world({{.info = mapped, .purgeState = VM_PURGABLE_NONVOLATILE}, {.info = unmapped}},
                          true);
        const auto process = InspectedProcess::of(7);
        const Lines lines = linesOf(*process);
        EXPECT_EQ(Lines(lines.begin() + 1, lines.end()), c.holder);
        EXPECT_EQ(process->warnings(), c.warnings);
        if (!c.holder.empty()) {
            EXPECT_EQ(process->memoryRegions()->back()->object_id(), 0x33) << "the 32-bit identifier";
        }
    }
}

TEST(MWUserProcessMemoryTest, TakesSubrangesOfMixedSharedRegionsOnly) {
    vm_region_submap_info_64 shared = mixed(300, 0x50);
    shared.share_mode = SM_SHARED;
    const std::vector<int32_t> pages = {kPresent, 0, kSwapped};
    for (const auto& [breakDown, hidden] : {std::pair(true, false), {true, true}, {false, false}}) {
        const World world({{.info = kMixed, .pages = pages}, {.info = shared, .pages = pages}}, breakDown);
        const auto process = InspectedProcess::of(7);
        process->setHiddenFromDisplay(hidden);
        process->gatherData();
        const bool taken = breakDown && !hidden;
        EXPECT_EQ(process->memoryRegions()->front()->subrangeList(), nullptr) << "private memory";
        EXPECT_EQ(process->memoryRegions()->back()->subrangeList() != nullptr, taken);
        EXPECT_EQ(world.host.pageQueries.size(), taken ? 1 : 0);
    }
}

}  // namespace
