#include "model/MWMemoryObject.h"

#include <gtest/gtest.h>

#include "model/MWMemoryCategory.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "support/FakeHost.h"

namespace {

constexpr uint64_t P = 4096;

class Holder : public MWRegionHolder {
public:
    explicit Holder(int32_t pid, bool breakDown = false) : _pid(pid), _breakDown(breakDown) {}
    int32_t pid() const override { return _pid; }
    uint64_t pageSize() const override { return P; }
    bool breakDownPhysMemweight() const override { return _breakDown; }

private:
    int32_t _pid;
    bool _breakDown;
};

using Region = std::shared_ptr<MWMemoryRegion>;

/// Pages [first, first + pages) of a shared object, so many bytes of them dirty.
Region shared(uint64_t first, uint64_t pages, uint64_t dirty) {
    auto region = std::make_shared<MWMemoryRegion>();
    region->setShare_mode(SM_SHARED);
    region->setObject_id(77);
    region->setOffset(first * P);
    region->setSize(pages * P);
    region->setDirtySize(dirty);
    region->setName("shared memory");
    return region;
}

Region named(Region region, const std::string& name) {
    region->setName(name);
    region->setDetailedName("detail of " + name);
    return region;
}

Region fake(const std::string& name) {
    Region region = named(shared(0, 1, 0), name);
    region->setUser_tag(MWFakeRegionTag);
    return region;
}

std::shared_ptr<MWMemoryObject> object(const std::vector<Region>& regions, int32_t ownerPid = -1) {
    auto made = std::make_shared<MWMemoryObject>();
    made->setOwnerPid(ownerPid);
    for (const Region& region : regions) {
        made->addRegion(region, P);
    }
    return made;
}

MWCategoryTotals sizes(const MWMemoryObject& object) {
    return {.dirty = object.totalDirtySize(),
            .swapped = object.totalSwappedSize(),
            .clean = object.totalCleanSize(),
            .reclaimable = object.totalReclaimableSize(),
            .wired = object.totalWiredSize()};
}

class MWMemoryObjectTest : public testing::Test {
protected:
    FakeHost host;  ///< its break-down switch is off unless a test turns it on
    Holder one = Holder(1);
    Holder two = Holder(2);
    Holder other = Holder(9);
    std::shared_ptr<MWMemoryObject> subject = std::make_shared<MWMemoryObject>();
};

TEST_F(MWMemoryObjectTest, CountsNothingOfRegionsWithoutAnObject) {
    const Region region = shared(0, 2, P);
    region->setObject_id(0);
    region->addSubrange({.start = 0, .length = P}, {.dirty = P}, P);
    subject->addRegion(region, &one);
    subject->addRegion(region, &two);
    EXPECT_EQ(subject->rangeList(), nullptr);
    EXPECT_FALSE(subject->processMemoryRegions());
    subject->finalize();
    EXPECT_EQ(sizes(*subject), MWCategoryTotals{});
    EXPECT_EQ(subject->memoryRegions().size(), 2U);
    EXPECT_EQ(subject->viewForProcess(one), subject);
}

TEST_F(MWMemoryObjectTest, MergesSubrangesAndDropsThem) {
    const Region region = shared(0, 4, P);
    region->addSubrange({.start = 0, .length = P}, {.dirty = P}, P);
    region->addSubrange({.start = 3 * P, .length = P}, {.clean = P}, P);
    subject->addRegion(region, &one);
    EXPECT_EQ(region->subrangeList(), nullptr);
    EXPECT_NE(subject->rangeList()->head()->next, nullptr);
    subject->finalize();
    EXPECT_EQ(sizes(*subject), (MWCategoryTotals{.dirty = P, .clean = P}));
    EXPECT_EQ(subject->rangeList(), nullptr);
    EXPECT_FALSE(subject->processMemoryRegions());  // a single process sees what there is
}

TEST_F(MWMemoryObjectTest, DropsTheProcessMapWhenEveryoneSeesTheWhole) {
    for (const Holder* process : {&one, &two}) {
        const Region region = shared(0, 2, 2 * P);
        region->setWired(true);
        subject->addRegion(region, process);
    }
    EXPECT_TRUE(subject->couldHaveProcessView());
    subject->finalize();
    EXPECT_EQ(sizes(*subject), (MWCategoryTotals{.dirty = 2 * P, .wired = 2 * P}));
    EXPECT_FALSE(subject->processMemoryRegions());
    EXPECT_FALSE(subject->couldHaveProcessView());
    EXPECT_EQ(subject->viewForProcess(one), subject);
    EXPECT_EQ(subject->viewForProcess(two), subject);
}

TEST_F(MWMemoryObjectTest, KeepsTheProcessMapForAnyDifference) {
    using Change = void (*)(MWMemoryRegion&);
    const std::vector<Change> changes = {
        [](auto& r) { r.setDirtySize(P); },        [](auto& r) { r.setSwappedSize(P); },
        [](auto& r) { r.setCleanNonSpecSize(P); }, [](auto& r) { r.setReclaimableSize(P); },
        [](auto& r) { r.setWired(true); },
    };
    for (const Change change : changes) {
        auto differing = std::make_shared<MWMemoryObject>();
        const Region more = shared(0, 1, 0);
        change(*more);
        differing->addRegion(shared(0, 1, 0), &one);
        differing->addRegion(more, &two);
        differing->finalize();
        EXPECT_TRUE(differing->processMemoryRegions());
    }
    // Two regions of one process, though together they are the whole.
    subject->addRegion(shared(0, 1, P), &one);
    subject->addRegion(shared(0, 1, P), &one);
    subject->addRegion(shared(0, 1, P), &two);
    subject->finalize();
    EXPECT_TRUE(subject->processMemoryRegions());
}

TEST_F(MWMemoryObjectTest, ShowsEachProcessItsOwnPages) {
    subject->addRegion(shared(0, 2, 2 * P), &one);
    subject->addRegion(shared(1, 4, 4 * P), &two);
    subject->addRegion(shared(1, 4, 4 * P), &two);
    subject->finalize();
    EXPECT_EQ(subject->totalDirtySize(), 5 * P);

    const auto ofOne = subject->viewForProcess(one);
    EXPECT_NE(ofOne, subject);
    EXPECT_TRUE(ofOne->accurateSizes());
    EXPECT_EQ(sizes(*ofOne), (MWCategoryTotals{.dirty = 2 * P}));
    EXPECT_EQ(subject->viewForProcess(two)->totalDirtySize(), 4 * P);
    EXPECT_EQ(subject->viewForProcess(two)->memoryRegions().size(), 2U);
    // Charged by regions, the pages that two maps twice count twice.
    EXPECT_EQ(subject->viewForProcess(Holder(2, true))->totalDirtySize(), 8 * P);
    EXPECT_EQ(subject->viewForProcess(other), subject);
}

TEST_F(MWMemoryObjectTest, RecordsEveryRegionFromTheFirstEligibleOneOn) {
    const Region before = shared(0, 1, P);
    const Region after = shared(2, 1, P);
    before->setShare_mode(SM_PRIVATE);
    after->setShare_mode(SM_PRIVATE);
    subject->addRegion(before, &one);
    EXPECT_FALSE(subject->processMemoryRegions());
    const Region eligible = shared(1, 1, P);
    subject->addRegion(eligible, &one);
    subject->addRegion(after, &two);
    subject->addRegion(shared(5, 1, P), P);  // of no process
    EXPECT_EQ(*subject->processMemoryRegions(), (MWProcessMemoryRegions{{1, {eligible}}, {2, {after}}}));
}

TEST_F(MWMemoryObjectTest, HoldsAtLeastWhatOneProcessIsChargedWhenBrokenDown) {
    const auto totalsWithSwitch = [this](bool on) {
        MWPhysMemweightSwitch::set(on);
        // One page, which each process maps twice.
        const Region swapped = shared(0, 1, 0);
        swapped->setSwappedSize(P);
        auto made = std::make_shared<MWMemoryObject>();
        made->addRegion(shared(0, 1, P), &one);
        made->addRegion(shared(0, 1, P), &one);
        made->addRegion(shared(0, 1, P), &two);
        made->addRegion(swapped, &two);
        made->addRegion(swapped, &two);
        made->finalize();
        return sizes(*made);
    };
    EXPECT_EQ(totalsWithSwitch(false), (MWCategoryTotals{.dirty = P, .swapped = P}));
    EXPECT_EQ(totalsWithSwitch(true), (MWCategoryTotals{.dirty = 2 * P, .swapped = 2 * P}));
}

TEST_F(MWMemoryObjectTest, ChargesDirtyPagesToTheOwnerAlone) {
    const auto make = [] {
        Region region = shared(0, 8, 2 * P);
        region->setSwappedSize(P);
        region->setCleanNonSpecSize(3 * P);
        region->setReclaimableSize(P);
        region->setWired(true);
        return region;
    };
    const MWCategoryTotals whole = {
        .dirty = 2 * P, .swapped = P, .clean = 3 * P, .reclaimable = P, .wired = 8 * P};
    const auto unmapped = object({make()}, 1);
    unmapped->finalize();
    EXPECT_TRUE(unmapped->couldHaveProcessView());
    EXPECT_EQ(unmapped->viewForProcess(one), unmapped);
    const auto ofTwo = unmapped->viewForProcess(two);
    EXPECT_EQ(sizes(*ofTwo), (MWCategoryTotals{.clean = 6 * P, .wired = 8 * P}));
    EXPECT_EQ(sizes(*unmapped), whole);
    EXPECT_EQ(&ofTwo->memoryRegions(), &unmapped->memoryRegions());
    EXPECT_EQ(ofTwo->ownerPid(), 1);

    // With views of their own: the owner's dirty pages become clean on top of what the other one sees.
    subject->addRegion(make(), &one);
    subject->addRegion(shared(20, 1, P / 2), &two);
    subject->setOwnerPid(1);
    subject->finalize();
    EXPECT_EQ(sizes(*subject->viewForProcess(one)), whole);
    EXPECT_NE(subject->viewForProcess(one), subject);
    EXPECT_EQ(subject->viewForProcess(one)->ownerPid(), 1);
    // The whole object holds 2 pages and a half dirty and one swapped; two's own view is not clean at all.
    EXPECT_EQ(sizes(*subject->viewForProcess(two)), (MWCategoryTotals{.clean = 3 * P + P / 2}));
    EXPECT_EQ(subject->viewForProcess(other), subject);
}

TEST_F(MWMemoryObjectTest, TakesItsNamesFromTheCanonicalRegion) {
    const auto cached = [](const std::string& name, bool unused) {
        Region region = named(shared(0, 1, 0), name);
        region->setInSharedCache(true);
        region->setUnusedSharedCacheRegion(unused);
        return region;
    };
    EXPECT_EQ(object({cached("gap", true), cached("used", false), cached("late", false)})->name(), "used");
    EXPECT_EQ(object({cached("gap", true), cached("hole", true)}, 1)->name(), "gap");
    const Region mapped = named(shared(0, 1, 0), "mapped");
    EXPECT_EQ(object({fake("owned"), mapped})->name(), "owned");
    EXPECT_EQ(object({fake("owned"), mapped}, 1)->fullName(), "mapped detail of mapped");
    EXPECT_EQ(object({fake("owned"), fake("more")}, 1)->detailedName(), "detail of owned");

    const Region reserved = shared(0, 1, 0);
    reserved->setVerbose(true);
    EXPECT_FALSE(object({mapped, reserved})->verbose());
    EXPECT_TRUE(object({reserved, mapped})->verbose());
}

TEST_F(MWMemoryObjectTest, NamesFakeRegionsAfterARealMapping) {
    const auto namesAfter = [](const std::vector<Region>& regions, int32_t ownerPid) {
        const auto made = object(regions, ownerPid);
        made->finalize();
        std::vector<std::string> names;
        for (const Region& region : made->memoryRegions()) {
            names.push_back(region->fullName());
        }
        return names;
    };
    using Names = std::vector<std::string>;
    const auto real = [] { return named(shared(0, 1, 0), "real"); };
    EXPECT_EQ(namesAfter({fake("owned"), real(), fake("more")}, 1),
              (Names{"real detail of real", "real detail of real", "real detail of real"}));
    EXPECT_EQ(namesAfter({real(), fake("owned")}, -1), (Names{"real detail of real", "real detail of real"}));
    // Without an owner a fake first region is canonical and everyone keeps its name, as when all are fake.
    EXPECT_EQ(namesAfter({fake("owned"), real(), fake("more")}, -1),
              (Names{"owned detail of owned", "real detail of real", "more detail of more"}));
    EXPECT_EQ(namesAfter({fake("owned"), fake("more")}, 1),
              (Names{"owned detail of owned", "more detail of more"}));
}

TEST_F(MWMemoryObjectTest, StopsTheProgramWhenUsedOutOfOrder) {
    const MWRegionHolder* nobody = nullptr;
    EXPECT_DEATH(subject->addRegion(shared(0, 1, 0), nobody), "for a process, and there is none");
    EXPECT_DEATH(subject->copyWithZone(), "Only a finalized memory object is copied");
    subject->finalize();
    EXPECT_DEATH(subject->addRegion(shared(0, 1, 0), &one), "takes no more regions");
    EXPECT_DEATH(subject->addRegion(shared(0, 1, 0), P), "takes no more regions");
    EXPECT_DEATH(subject->finalizeUsingRegionDirtySize(true), "finalized only once");
}

TEST_F(MWMemoryObjectTest, CategoriesSumObjectsUnderTheNameOfTheFirst) {
    const Region region = named(shared(0, 4, P), "first");
    region->setSwappedSize(2 * P);
    region->setCleanNonSpecSize(3 * P);
    region->setReclaimableSize(4 * P);
    region->setWired(true);
    const auto first = object({region});
    const auto second = object({shared(0, 1, P), shared(1, 1, P), shared(2, 1, P)});
    first->finalize();
    second->finalize();
    for (const bool isSummary : {false, true}) {
        MWMemoryCategory category(isSummary);
        category.addMemoryObject(first);
        category.addMemoryObject(second);
        category.addMemoryObject(second);  // counted as often as it is added
        EXPECT_EQ(category.totalDirtySize(), 7 * P);
        EXPECT_EQ(category.totalSwappedSize(), 2 * P);
        EXPECT_EQ(category.totalCleanSize(), 3 * P);
        EXPECT_EQ(category.totalReclaimableSize(), 4 * P);
        EXPECT_EQ(category.totalWiredSize(), 4 * P);
        EXPECT_EQ(category.totalRegions(), 7);
        EXPECT_EQ(category.name(), "first");
        EXPECT_EQ(category.detailedName(), isSummary ? std::nullopt : std::optional("detail of first"));
        EXPECT_EQ(category.fullName(), isSummary ? "first" : "first detail of first");
    }
}

}  // namespace
