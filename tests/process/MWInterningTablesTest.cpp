#include "process/MWInterningTables.h"

#include <gtest/gtest.h>

#include <set>
#include <thread>
#include <vector>

namespace {

TEST(MWInterningTableTest, LooksAtBoundedNumberOfSlotsAroundTheEnd) {
    MWInterningTable table(5, 3);
    const auto a = table.intern("a", 4);
    const auto b = table.intern("b", 4);  // slot 0
    const auto c = table.intern("c", 4);  // slot 1
    EXPECT_EQ(*a + *b + *c, "abc");
    EXPECT_EQ(table.intern("a", 4), a);
    EXPECT_EQ(table.intern("b", 0), b);
    EXPECT_EQ(table.intern("c", 4), c);

    const auto copy = table.intern("d", 4);
    EXPECT_EQ(*copy, "d");
    EXPECT_NE(table.intern("d", 4), copy) << "not among the slots looked at, so not stored";
    const auto stored = table.intern("d", 1);  // slot 2
    EXPECT_EQ(table.intern("d", 2), stored);
    EXPECT_NE(table.intern("d", 4), stored) << "slot 2 is the fourth from slot 4";
    const auto twice = table.intern("a", 1);  // slot 3: what lies before the first slot is not seen
    EXPECT_NE(twice, a);
    EXPECT_EQ(*twice, "a");
}

TEST(MWInterningTableTest, ThreadsAgreeOnOneCopyOfEachText) {
    constexpr size_t kThreads = 8;
    constexpr size_t kTexts = 600;
    MWInterningTable table(1024, 18);
    std::vector<std::vector<MWSharedText>> seen(kThreads);
    std::vector<std::thread> threads;
    for (auto& texts : seen) {
        threads.emplace_back([&] {
            for (size_t text = 0; text < kTexts; ++text) {
                // Four texts to a slot, so that they also race for the slots behind it.
                texts.push_back(table.intern("text " + std::to_string(text), text / 4 * 4));
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    std::set<MWSharedText> copies;
    for (size_t text = 0; text < kTexts; ++text) {
        for (const auto& texts : seen) {
            EXPECT_EQ(*texts[text], "text " + std::to_string(text));
            EXPECT_EQ(texts[text], seen.front()[text]);
        }
        copies.insert(seen.front()[text]);
    }
    EXPECT_EQ(copies.size(), kTexts);
}

}  // namespace
