#include "analysis/MWProcessGroup.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <list>
#include <numeric>

#include "analysis/FastBatchEnumeration.h"
#include "support/FakeProcessSource.h"

TEST(MWProcessGroup, HoldsEachPidOnceWhateverTheOrder) {
    const FakeProcessSource a(3, "a");
    const FakeProcessSource b(-7, "b");
    const FakeProcessSource sameAsA(3, "again");
    MWProcessGroupMinimal group;
    group.addProcess(a);
    group.addProcess(b);
    group.addProcess(sameAsA);
    EXPECT_EQ(group.hashValue(), (19U * 37U ^ 3U) * 37U ^ static_cast<uint64_t>(int64_t{-7}));
    EXPECT_EQ(group.processes(), (MWProcessSet{&b, &a}));
    EXPECT_EQ(group.description(), "MWProcessGroup{MWProcess[-7], MWProcess[3]}");

    MWProcessGroupMinimal otherOrder;
    otherOrder.addProcess(b);
    EXPECT_FALSE(group.isEqual(otherOrder));
    otherOrder.addProcess(a);
    EXPECT_TRUE(group.isEqual(otherOrder));
}

TEST(MWProcessGroup, ImmutableCopiesAreEqualToMinimalGroupsAndToThemselvesAlone) {
    const FakeProcessSource a(1, "a");
    const FakeProcessSource b(2, "b");
    MWProcessGroupMinimal minimal;
    minimal.addProcess(a);
    const auto group = minimal.immutableCopy();
    EXPECT_EQ(group->hash(), minimal.hash());
    EXPECT_TRUE(group->isEqual(minimal));
    EXPECT_TRUE(minimal.isEqual(*group));
    EXPECT_FALSE(group->isEqual(*minimal.immutableCopy()));
    minimal.addProcess(b);
    EXPECT_EQ(group->processes(), MWProcessSet{&a}) << "must not grow with the group it was copied from";
    EXPECT_DEATH(group->addProcess(b), "Attempt to add process to immutable MWProcessGroup");
}

TEST(MWProcessGroup, CachedTableIsGoneAfterTheCountedConsumptions) {
    const auto table = std::make_shared<const MWCategoryTable>();
    MWProcessGroup group;
    EXPECT_EQ(group.consumeCachedCategories(), nullptr);
    group.attachCachedCategories(table, 2);
    EXPECT_EQ(group.consumeCachedCategories(), table);
    EXPECT_EQ(group.consumeCachedCategories(), table);
    EXPECT_EQ(group.consumeCachedCategories(), nullptr);
    EXPECT_DEATH(group.attachCachedCategories(table, 0), "");
}

TEST(FastBatchEnumeration, HandsOutEveryElementOnceInOrder) {
    const auto expectSlices = [](const auto& elements, size_t batchSize, const std::vector<size_t>& lengths) {
        std::vector<int> joined;
        std::vector<size_t> handedOut;
        mw_enumerateObjectsWithBatchSize(elements, batchSize, [&](const int* first, size_t count) {
            joined.insert(joined.end(), first, first + count);
            handedOut.push_back(count);
        });
        EXPECT_EQ(handedOut, lengths);
        EXPECT_TRUE(std::ranges::equal(joined, elements));
    };
    std::vector<int> array(600);
    std::iota(array.begin(), array.end(), 0);
    expectSlices(array, 256, {256, 256, 88});
    expectSlices(std::list<int>(array.begin(), array.end()), 256, {256, 256, 88});
    expectSlices(std::vector{7, 8}, 0, {1, 1});
    expectSlices(std::list{7, 8}, 0, {1, 1});
    expectSlices(std::vector<int>{}, 4, {});
}
