#include <fmt/core.h>
#include <gtest/gtest.h>

#include <vector>

#include "process/InspectedProcess.h"

namespace {

/// "START+SIZE object ID purge STATE PATH" of every region that the walk of process 7 delivers.
struct Walk {
    Lines regions;
    std::string standardError;
    std::shared_ptr<InspectedProcess> process = InspectedProcess::of(7);

    explicit Walk(size_t stopAfter = SIZE_MAX) {
        testing::internal::CaptureStderr();
        process->enumerateRegions([&](const MWWalkedRegion& region) {
            regions.push_back(fmt::format("{:x}+{:x} object {} purge {} {}", region.address, region.size,
                                          region.info.object_id_full, region.purgeState,
                                          region.path.value_or("-")));
            return regions.size() >= stopAfter;
        });
        standardError = testing::internal::GetCapturedStderr();
    }
};

const vm_region_submap_info_64 kFake = {.user_tag = MWFakeRegionTag};
const vm_region_submap_info_64 kFile = {.external_pager = 1};
const std::string kBailingOut = "bailing out for process victim [7]; data may be incomplete!\n";

FakeProcess victim(std::vector<FakeRegion> regions) {
    return {.comm = "victim", .regions = std::move(regions)};
}

TEST(MWUserProcessWalkTest, DeliversEachRegionWithItsDetails) {
    FakeHost host;
    host.processes[7] = victim({
        {.start = 0x1000, .size = 0x2000, .info = {.object_id = 3, .object_id_full = 5}, .purgeState = 1},
        {.start = 0x3000, .size = 0x1000, .info = {.object_id = 3}, .purgeQueryFails = true, .words = 17},
        {.start = 0x4000, .size = 0x1000, .info = {.is_submap = 1}},
        {.start = 0x8000, .size = 0x1000, .info = kFile, .path = "/lib/x", .purgeState = 0},
        {.start = 0x9000, .size = 0x1000, .path = "/not/asked/for"},
        {.start = 0xA000, .size = 0x1000, .info = kFake},
        {.start = 0xB000, .size = 0x1000, .info = kFake},
        {.start = 0xC000, .size = 0x1000},  // an ordinary region behind the fake ones ends the walk
        {.start = 0xD000, .size = 0x1000, .info = kFake},
    });
    const Lines expected = {
        "1000+2000 object 5 purge 1 -", "3000+1000 object 3 purge 3 -", "8000+1000 object 0 purge 0 /lib/x",
        "9000+1000 object 0 purge 3 -", "a000+1000 object 0 purge 3 -", "b000+1000 object 0 purge 3 -",
    };
    EXPECT_EQ(Walk().regions, expected);
    EXPECT_EQ(Walk(2).regions, Lines(expected.begin(), expected.begin() + 2));
    const auto process = InspectedProcess::of(7);
    host.processes[7].gone = true;
    process->enumerateRegions([](const MWWalkedRegion& region) {
        EXPECT_FALSE(region.path.has_value()) << "of a process that has exited";
        return false;
    });
}

TEST(MWUserProcessWalkTest, FilesFailureByWhatBecameOfProcess) {
    enum Fate { alive, zombie, exited };
    struct Case {
        kern_return_t failure;
        Fate fate;
        Lines errors;
        Lines warnings;
    };
    const std::vector<Case> cases = {
        {KERN_INVALID_ADDRESS, alive, {}, {}},
        {KERN_FAILURE, exited, {"victim [7]: code 5"}, {}},
        {MACH_SEND_INVALID_DEST, alive, {"victim [7]: code 268435459"}, {}},
        {MACH_SEND_INVALID_DEST, zombie, {}, {"victim [7]: code 268435459 (zombie)"}},
        {MACH_SEND_INVALID_DEST, exited, {}, {"victim [7]: code 268435459 (process exited)"}},
    };
    for (const Case& c : cases) {
        FakeHost host;
        host.processes[7] = victim({{.start = 0x1000, .size = 0x1000}, {.start = 0x2000, .size = 0x1000}});
        host.processes[7].walkFailure = c.failure;
        host.processes[7].regionsBeforeFailure = 1;
        const auto process = InspectedProcess::of(7);
        host.processes[7].gone = c.fate == exited;
        host.processes[7].status = c.fate == zombie ? SZOMB : 2;
        testing::internal::CaptureStderr();
        process->gatherData();
        const bool ordinaryEnd = c.failure == KERN_INVALID_ADDRESS;
        EXPECT_EQ(testing::internal::GetCapturedStderr(), ordinaryEnd ? "" : kBailingOut);
        EXPECT_EQ(host.machErrors.size(), ordinaryEnd ? 0 : 1);
        EXPECT_EQ(process->errors(), c.errors);
        EXPECT_EQ(process->warnings(), c.warnings);
        ASSERT_TRUE(process->memoryRegions());
        EXPECT_EQ(process->memoryRegions()->size(), 1) << "what was gathered before is kept";
    }
}

TEST(MWUserProcessWalkTest, MalformedRegionEndsWalkWithAnError) {
    const std::vector<std::pair<FakeRegion, std::string>> cases = {
        {{.start = 0x3000, .size = 0}, "victim [7]: malformed region at 0x3000 of 0x0 bytes"},
        {{.start = 0x2000, .size = UINT64_MAX - 0xFFF},
         "victim [7]: malformed region at 0x2000 of 0xfffffffffffff000 bytes"},
    };
    for (const auto& [region, error] : cases) {
        FakeHost host;
        host.processes[7] = victim({{.start = 0x1000, .size = 0x1000}, region});
        const Walk walk;
        EXPECT_EQ(walk.regions, Lines{"1000+1000 object 0 purge 3 -"});
        EXPECT_EQ(walk.standardError, kBailingOut);
        EXPECT_EQ(walk.process->errors(), Lines{error});
    }
}

// A 64-bit process keeps the cache at 0x180000000 to 0x280000000.
TEST(MWUserProcessWalkTest, ReportsSharedCacheMappingsWhole) {
    const FakeRegion below = {.start = 0x17F000000, .size = 0x1000, .info = {.object_id_full = 9}};
    const FakeRegion cache = {.start = 0x180000000,
                              .size = 0x4000,
                              .info = {.offset = 0x100, .user_wired_count = 2, .object_id_full = 77},
                              .path = "/cache",
                              .purgeState = 0};
    const FakeRegion behind = {.start = 0x280000000, .size = 0x1000, .info = {.object_id_full = 8}};
    FakeHost host;
    host.sharedCache = true;
    host.processes[7] = victim({{.start = 0x1000, .size = 0x1000}, below, cache, behind});
    EXPECT_EQ(Walk().regions,
              (Lines{"1000+1000 object 0 purge 3 -", "17f000000+1000 object 9 purge 3 -",
                     "180000000+4000 object 1 purge 3 -", "280000000+1000 object 8 purge 3 -"}));
    // The region that marks the boundary is found by the fast query but is no part of the cache, and so is
    // the one behind the cache: 0x1000, the boundary itself, the last one and the end.
    EXPECT_EQ(host.asked("mach_vm_region_recurse"), 4);
    InspectedProcess::of(7)->enumerateRegions([](const MWWalkedRegion& region) {
        if (region.address == 0x180000000) {
            const auto& info = region.info;
            EXPECT_TRUE(info.share_mode == SM_COW && info.external_pager == 1);
            EXPECT_TRUE(info.user_wired_count == 2 && info.offset == 0x100);
        }
        return false;
    });

    host.processes[7].mappingFailureFrom = 0x17F000001;
    const Walk failing;
    EXPECT_EQ(failing.regions.size(), 2);
    EXPECT_EQ(failing.standardError, kBailingOut);
    EXPECT_EQ(host.machErrors, Lines{"mach_vm_region: 5"});

    host.processes[7] = victim({cache, behind});
    EXPECT_EQ(Walk().regions,
              (Lines{"180000000+4000 object 77 purge 0 -", "280000000+1000 object 8 purge 3 -"}))
        << "without a region below the cache there is no boundary, and every query goes into submaps";
}

TEST(MWUserProcessWalkTest, SharedCacheCountsOnlyWhereThereIsOne) {
    FakeHost host;
    host.processes[7] = victim({{.start = 0x1000, .size = 0x1000}, {.start = 0x180000000, .size = 0x1000}});
    const auto plain = InspectedProcess::of(7);
    plain->gatherData();
    EXPECT_FALSE(plain->memoryRegions()->back()->inSharedCache());
    EXPECT_EQ(host.asked("mach_vm_region"), 0);

    host.sharedCache = true;
    for (const bool isHidden : {false, true}) {
        const auto process = InspectedProcess::of(7);
        process->setHiddenFromDisplay(isHidden);
        process->gatherData();
        EXPECT_EQ(process->memoryRegions()->size(), isHidden ? 1 : 2);
        EXPECT_EQ(process->memoryRegions()->back()->inSharedCache(), !isHidden);
    }
    testing::internal::CaptureStderr();
    EXPECT_FALSE(plain->_setSharedRegionFromPlatform(MWPlatformUnknown));
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "Unable to determine platform architecture of target\n");
}

}  // namespace
