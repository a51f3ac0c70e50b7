#include "model/MWMemoryRegion.h"

#include <gtest/gtest.h>

#include <compare>
#include <map>
#include <set>
#include <vector>

#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"

namespace {

MWMemoryRegion regionAt(uint64_t start, uint64_t size) {
    MWMemoryRegion region;
    region.setStart(start);
    region.setSize(size);
    return region;
}

TEST(MWMemoryRegion, EndsWhereItsSizeSays) {
    MWMemoryRegion region = regionAt(0x1000, 0x4000);
    EXPECT_EQ(region.end(), 0x5000U);
    region.setEnd(0x2000);
    EXPECT_EQ(region.size(), 0x1000U);
    EXPECT_DEATH(region.setEnd(0xFFF), "end is never below its start");

    EXPECT_EQ(regionAt(MWNoAddress, 4096).end(), MWNoAddress);
    EXPECT_EQ(regionAt(UINT64_MAX - 4095, 4096).end(), UINT64_MAX);
}

TEST(MWMemoryRegion, OrdersEnclosingRegionsFirst) {
    const auto large = regionAt(0x1000, 0x4000);
    const auto small = regionAt(0x1000, 0x1000);
    const auto later = regionAt(0x2000, 0x8000);
    EXPECT_TRUE(std::is_lt(large.compare(small)));
    EXPECT_TRUE(std::is_gt(small.compare(large)));
    EXPECT_TRUE(std::is_lt(small.compare(later)));
    EXPECT_TRUE(std::is_lt(small.compare(regionAt(MWNoAddress, 1))));
}

TEST(MWMemoryRegion, JudgesWhetherProcessesCanSeeDifferentPages) {
    struct Case {
        void (*change)(MWMemoryRegion&);
        bool processView;
        bool subranges;
    };
    const std::vector<Case> cases = {
        {[](auto&) {}, true, true},
        {[](auto& r) { r.setShare_mode(SM_COW); }, true, true},
        {[](auto& r) { r.setSegment(SegmentNone); }, true, true},
        {[](auto& r) { r.setUser_tag(MWFakeRegionTag); }, false, false},
        {[](auto& r) { r.setInSharedCache(true); }, false, false},
        {[](auto& r) { r.setShare_mode(SM_PRIVATE); }, false, false},
        {[](auto& r) { r.setShare_mode(SM_PRIVATE_ALIASED); }, false, false},
        {[](auto& r) { r.setSegment(SegmentText); }, false, false},
        {[](auto& r) { r.setSegment(SegmentData); }, false, false},
        // The others only tell whether page-exact sub-ranges would tell more than the region itself.
        {[](auto& r) { r.setOwnedExclusivelyByParentProcess(true); }, true, false},
        {[](auto& r) { r.setDirtySize(r.size()); }, true, false},
        {[](auto& r) { r.setSwappedSize(r.size()); }, true, false},
        {[](auto& r) { r.setCleanNonSpecSize(r.size()); }, true, false},
        {[](auto& r) { r.setReclaimableSize(r.size()); }, true, false},
        {[](auto& r) { r.setDirtySize(0), r.setCleanNonSpecSize(0); }, true, false},
        {[](auto& r) { r.setSize(4096), r.setDirtySize(10), r.setCleanNonSpecSize(0); }, true, false},
        {[](auto& r) { r.setSize(4097), r.setDirtySize(10), r.setCleanNonSpecSize(0); }, true, true},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        const auto region =
            makeRegion({.dirty = 4096, .clean = 8192, .size = 16384, .share_mode = SM_SHARED});
        cases[i].change(*region);
        EXPECT_EQ(region->eligibleForProcessView(), cases[i].processView) << "case " << i;
        EXPECT_EQ(region->eligibleForSubrangesUsingPageSize(4096), cases[i].subranges) << "case " << i;
    }
}

TEST(MWMemoryRegion, NamesTagsByTheTableThenByTheSystemThenByNumber) {
    FakeHost host;
    host.tagDescriptions = {
        {1, "not asked"}, {100, "frame cache"}, {101, "Memory Tag 101"}, {240, "not asked"}};
    const std::map<uint32_t, std::string> expected = {
        {0, "untagged (\"VM_ALLOCATE\")"},
        {1, "malloc heap (brk)"},
        {98, "vvar (virtual clock)"},
        {100, "frame cache"},
        {101, "tag 101"},
        {239, "tag 239"},
        {240, "app-specific tag 1"},
        {255, "app-specific tag 16"},
        {256, "tag 256"},
        {0xFFFFFFFE, "tag -2"},
        {0xFFFFFFFF, "Owned physical memweight (unmapped)"},
    };
    for (const auto& [tag, name] : expected) {
        EXPECT_EQ(MWMemoryRegion::categoryNameForTag(tag), name);
    }
    std::set<std::string> names;
    for (uint32_t tag = 0; tag < 99; ++tag) {
        names.insert(MWMemoryRegion::categoryNameForTag(tag));
    }
    EXPECT_EQ(names.size(), 99U);  // no two tags share a name
}

TEST(MWMemoryRegion, NamesLedgers) {
    const std::vector<std::optional<std::string>> expected = {
        std::nullopt, std::nullopt, "network", "media", "graphics", "neural", "VM ledger tag 6"};
    for (uint64_t tag = 0; tag < expected.size(); ++tag) {
        EXPECT_EQ(MWMemoryRegion::vmLedgerNameForTag(tag), expected[tag]) << tag;
    }
}

}  // namespace
