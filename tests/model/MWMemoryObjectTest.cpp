#include "model/MWMemoryObject.h"

#include <gtest/gtest.h>

#include "model/MWMemoryCategory.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"

namespace {

constexpr uint64_t P = 4096;

using Region = std::shared_ptr<MWMemoryRegion>;

/// A region of the same shared object as all the others.
Region shared(RegionLine line) {
    line.object_id = 77;
    line.share_mode = SM_SHARED;
    return makeRegion(line);
}

Region named(const std::string& name, bool fake = false) {
    return shared({.name = name, .detailedName = "detail of " + name, .size = P, .fake = fake});
}

std::shared_ptr<MWMemoryObject> object(const std::vector<Region>& regions, int32_t ownerPid = -1) {
    auto made = std::make_shared<MWMemoryObject>();
    made->setOwnerPid(ownerPid);
    for (const Region& region : regions) {
        made->addRegion(region, P);
    }
    return made;
}

/// The sums of a memory object or of a category.
template <typename Sized>
MWCategoryTotals sizes(const Sized& sized) {
    return {sized.totalDirtySize(), sized.totalSwappedSize(), sized.totalCleanSize(),
            sized.totalReclaimableSize(), sized.totalWiredSize()};
}

class MWMemoryObjectTest : public testing::Test {
protected:
    FakeHost host;  ///< its break-down switch is off unless a test turns it on
    FakeProcessSource one{1, "one"};
    FakeProcessSource two{2, "two"};
    FakeProcessSource other{9, "other"};
    std::shared_ptr<MWMemoryObject> subject = std::make_shared<MWMemoryObject>();
};

TEST_F(MWMemoryObjectTest, CountsNothingOfRegionsWithoutAnObject) {
    const Region region = makeRegion({.dirty = P, .share_mode = SM_SHARED});
    subject->addRegion(region, &one);
    subject->addRegion(region, &two);
    subject->finalize();
    EXPECT_EQ(sizes(*subject), MWCategoryTotals{});
    EXPECT_EQ(subject->memoryRegions().size(), 2U);
    EXPECT_EQ(subject->viewForProcess(one), subject);
}

TEST_F(MWMemoryObjectTest, MergesSubrangesAndDropsThem) {
    const Region region = shared({.size = 4 * P});
    region->addSubrange({.start = 0, .length = P}, {.dirty = P}, P);
    region->addSubrange({.start = 3 * P, .length = P}, {.clean = P}, P);
    subject->addRegion(region, &one);
    EXPECT_EQ(region->subrangeList(), nullptr);
    EXPECT_NE(subject->rangeList()->head()->next, nullptr);
    subject->finalize();
    EXPECT_EQ(sizes(*subject), (MWCategoryTotals{.dirty = P, .clean = P}));
    EXPECT_FALSE(subject->processMemoryRegions());  // a single process sees what there is
}

TEST_F(MWMemoryObjectTest, KeepsTheProcessMapForAnyDifference) {
    const auto sharedBy = [this](const std::vector<RegionLine>& linesOfOne, const RegionLine& ofTwo) {
        auto made = std::make_shared<MWMemoryObject>();
        for (const RegionLine& line : linesOfOne) {
            made->addRegion(shared(line), &one);
        }
        made->addRegion(shared(ofTwo), &two);
        made->finalize();
        return made;
    };
    const RegionLine plain = {.size = P};
    for (const RegionLine& more : std::vector<RegionLine>{
             {.dirty = P}, {.swapped = P}, {.clean = P}, {.reclaimable = P}, {.size = P, .wired = true}}) {
        EXPECT_TRUE(sharedBy({plain}, more)->processMemoryRegions());
        EXPECT_TRUE(sharedBy({more, more}, more)->processMemoryRegions()) << "though together the whole";
        const auto same = sharedBy({more}, more);
        EXPECT_FALSE(same->couldHaveProcessView());
        EXPECT_EQ(same->viewForProcess(two), same);
    }
}

TEST_F(MWMemoryObjectTest, ShowsEachProcessItsOwnPages) {
    const auto ofTwo = [] { return shared({.dirty = 4 * P, .offset = P}); };
    subject->addRegion(shared({.dirty = 2 * P}), &one);
    subject->addRegion(ofTwo(), &two);
    subject->addRegion(ofTwo(), &two);
    subject->finalize();
    EXPECT_EQ(subject->totalDirtySize(), 5 * P);
    EXPECT_EQ(sizes(*subject->viewForProcess(one)), (MWCategoryTotals{.dirty = 2 * P}));
    EXPECT_EQ(subject->viewForProcess(two)->totalDirtySize(), 4 * P);
    EXPECT_EQ(subject->viewForProcess(two)->memoryRegions().size(), 2U);
    EXPECT_EQ(subject->viewForProcess(other), subject);
    MWPhysMemweightSwitch::set(true);
    EXPECT_EQ(subject->viewForProcess(two)->totalDirtySize(), 8 * P) << "each region is charged";
}

TEST_F(MWMemoryObjectTest, RecordsEveryRegionFromTheFirstEligibleOneOn) {
    const auto single = [] { return makeRegion({.object_id = 77, .dirty = P}); };
    const Region after = single();
    subject->addRegion(single(), &one);
    EXPECT_FALSE(subject->processMemoryRegions());
    const Region eligible = shared({.dirty = P, .offset = P});
    subject->addRegion(eligible, &one);
    subject->addRegion(after, &two);
    subject->addRegion(shared({.dirty = P}), P);  // of no process
    EXPECT_EQ(*subject->processMemoryRegions(), (MWProcessMemoryRegions{{1, {eligible}}, {2, {after}}}));
}

TEST_F(MWMemoryObjectTest, HoldsAtLeastWhatOneProcessIsChargedWhenBrokenDown) {
    for (const bool on : {false, true}) {
        MWPhysMemweightSwitch::set(on);
        // One page, which each process maps twice.
        const auto made = std::make_shared<MWMemoryObject>();
        for (int i = 0; i < 2; ++i) {
            made->addRegion(shared({.dirty = P}), &one);
            made->addRegion(shared({.swapped = P}), &two);
        }
        made->finalize();
        const uint64_t charged = on ? 2 * P : P;
        EXPECT_EQ(sizes(*made), (MWCategoryTotals{.dirty = charged, .swapped = charged}));
    }
}

TEST_F(MWMemoryObjectTest, ChargesDirtyPagesToTheOwnerAlone) {
    const RegionLine line = {
        .dirty = 2 * P, .swapped = P, .clean = 3 * P, .reclaimable = P, .size = 8 * P, .wired = true};
    const MWCategoryTotals whole = {
        .dirty = 2 * P, .swapped = P, .clean = 3 * P, .reclaimable = P, .wired = 8 * P};
    const auto unmapped = object({shared(line)}, 1);
    unmapped->finalize();
    EXPECT_EQ(unmapped->viewForProcess(one), unmapped);
    const auto ofTwo = unmapped->viewForProcess(two);
    EXPECT_EQ(sizes(*ofTwo), (MWCategoryTotals{.clean = 6 * P, .wired = 8 * P}));
    EXPECT_EQ(sizes(*unmapped), whole);
    EXPECT_EQ(ofTwo->memoryRegions(), unmapped->memoryRegions());
    EXPECT_EQ(ofTwo->ownerPid(), 1);

    // With views of their own: the owner's dirty pages become clean on top of what the other one sees.
    subject->addRegion(shared(line), &one);
    subject->addRegion(shared({.dirty = P / 2, .size = P, .offset = 20 * P}), &two);
    subject->setOwnerPid(1);
    subject->finalize();
    EXPECT_EQ(sizes(*subject->viewForProcess(one)), whole);
    EXPECT_EQ(subject->viewForProcess(one)->ownerPid(), 1);
    // The whole object holds 2 pages and a half dirty and one swapped; two's own view is not clean at all.
    EXPECT_EQ(sizes(*subject->viewForProcess(two)), (MWCategoryTotals{.clean = 3 * P + P / 2}));
    EXPECT_EQ(subject->viewForProcess(other), subject);
}

TEST_F(MWMemoryObjectTest, TakesItsNamesFromTheCanonicalRegion) {
    const auto cached = [](const std::string& name, bool unused) {
        Region region = named(name);
        region->setInSharedCache(true);
        region->setUnusedSharedCacheRegion(unused);
        return region;
    };
    EXPECT_EQ(object({cached("gap", true), cached("used", false), cached("late", false)})->name(), "used");
    EXPECT_EQ(object({cached("gap", true), cached("hole", true)}, 1)->name(), "gap");
    EXPECT_EQ(object({named("owned", true), named("mapped")})->name(), "owned");
    EXPECT_EQ(object({named("owned", true), named("mapped")}, 1)->fullName(), "mapped detail of mapped");
}

TEST_F(MWMemoryObjectTest, NamesFakeRegionsAfterARealMapping) {
    const auto namesAfter = [](const std::vector<Region>& regions, int32_t ownerPid) {
        const auto made = object(regions, ownerPid);
        made->finalize();
        std::string names;
        for (const Region& region : made->memoryRegions()) {
            names += region->fullName() + "; ";
        }
        return names;
    };
    const auto owned = [] { return named("owned", true); };
    EXPECT_EQ(namesAfter({owned(), named("real"), owned()}, 1),
              "real detail of real; real detail of real; real detail of real; ");
    EXPECT_EQ(namesAfter({named("real"), owned()}, -1), "real detail of real; real detail of real; ");
    // Without an owner a fake first region is canonical and everyone keeps its name, as when all are fake.
    EXPECT_EQ(namesAfter({owned(), named("real")}, -1), "owned detail of owned; real detail of real; ");
    EXPECT_EQ(namesAfter({owned(), named("more", true)}, 1), "owned detail of owned; more detail of more; ");
}

TEST_F(MWMemoryObjectTest, StopsTheProgramWhenUsedOutOfOrder) {
    const MWRegionHolder* nobody = nullptr;
    EXPECT_DEATH(subject->addRegion(shared({}), nobody), "for a process, and there is none");
    EXPECT_DEATH(subject->copyWithZone(), "Only a finalized memory object is copied");
    subject->finalize();
    EXPECT_DEATH(subject->addRegion(shared({}), P), "takes no more regions");
    EXPECT_DEATH(subject->finalize(), "finalized only once");
}

TEST_F(MWMemoryObjectTest, CategoriesSumObjectsUnderTheNameOfTheFirst) {
    const auto first = object({named("first")});
    const auto second =
        object({shared({.dirty = P, .swapped = 2 * P, .clean = 3 * P, .reclaimable = 4 * P, .wired = true}),
                shared({})});
    first->finalize();
    second->finalize();
    for (const bool isSummary : {false, true}) {
        MWMemoryCategory category(isSummary);
        category.addMemoryObject(first);
        category.addMemoryObject(second);
        category.addMemoryObject(second);  // counted as often as it is added
        EXPECT_EQ(sizes(category), (MWCategoryTotals{2 * P, 4 * P, 6 * P, 8 * P, 20 * P}));
        EXPECT_EQ(category.totalRegions(), 5);
        EXPECT_EQ(category.fullName(), isSummary ? "first" : "first detail of first");
    }
}

}  // namespace
