#include "analysis/MWProcessGroup.h"

#include <gtest/gtest.h>

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
    EXPECT_EQ(group.hashValue(), 19U * 37U ^ 3U);
    group.addProcess(b);
    const uint64_t hash = group.hashValue();
    EXPECT_EQ(hash, (19U * 37U ^ 3U) * 37U ^ static_cast<uint64_t>(int64_t{-7}));
    group.addProcess(sameAsA);
    EXPECT_EQ(group.hashValue(), hash);
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
    const auto twin = minimal.immutableCopy();
    EXPECT_EQ(group->hash(), minimal.hash());
    EXPECT_TRUE(group->isEqual(minimal));
    EXPECT_TRUE(minimal.isEqual(*group));
    EXPECT_TRUE(group->isEqual(*group));
    EXPECT_FALSE(group->isEqual(*twin));

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

namespace {

template <typename Elements>
std::vector<std::vector<int>> slicesOf(const Elements& elements, size_t batchSize) {
    std::vector<std::vector<int>> slices;
    mw_enumerateObjectsWithBatchSize(elements, batchSize, [&](const int* first, size_t count) {
        slices.emplace_back(first, first + count);
    });
    return slices;
}

}  // namespace

TEST(FastBatchEnumeration, HandsOutEveryElementOnceInOrder) {
    std::vector<int> list(600);
    std::iota(list.begin(), list.end(), 0);
    const std::list<int> sequence(list.begin(), list.end());
    for (const auto& slices : {slicesOf(list, 256), slicesOf(sequence, 256)}) {
        ASSERT_EQ(slices.size(), 3U);
        EXPECT_EQ(slices[0].size(), 256U);
        EXPECT_EQ(slices[1].size(), 256U);
        EXPECT_EQ(slices[2].size(), 88U);
        std::vector<int> joined;
        for (const auto& slice : slices) {
            joined.insert(joined.end(), slice.begin(), slice.end());
        }
        EXPECT_EQ(joined, list);
    }
    EXPECT_EQ(slicesOf(std::vector{7, 8}, 0), (std::vector<std::vector<int>>{{7}, {8}}));
    EXPECT_EQ(slicesOf(std::list{7, 8}, 0), (std::vector<std::vector<int>>{{7}, {8}}));
    EXPECT_TRUE(slicesOf(std::vector<int>{}, 4).empty());
}
