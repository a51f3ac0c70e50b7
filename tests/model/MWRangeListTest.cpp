#include "model/MWRangeList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <random>
#include <set>
#include <vector>

#include "support/FakeProcessSource.h"

namespace {

constexpr auto kKinds = {&MWCategoryTotals::dirty, &MWCategoryTotals::swapped, &MWCategoryTotals::clean,
                         &MWCategoryTotals::reclaimable, &MWCategoryTotals::wired};

struct Span {
    uint64_t start;
    uint64_t length;
    MWCategoryTotals counts = {};

    uint64_t end() const { return start + length; }
    bool operator==(const Span&) const = default;
};

std::vector<Span> spansOf(const MWRangeList& list) {
    std::vector<Span> spans;
    for (const MWRangeListNode* node = list.head(); node != nullptr; node = node->next) {
        spans.push_back({node->start,
                         node->length,
                         {node->dirty, node->swapped, node->clean, node->reclaimable, node->wired}});
    }
    return spans;
}

void add(MWRangeList& list, const Span& span, uint64_t pageSize) {
    list.addRange({.start = span.start, .length = span.length}, pageSize, span.counts);
}

uint64_t roundedDown(uint64_t offset, uint64_t pageSize) {
    return offset / pageSize * pageSize;
}
uint64_t roundedUp(uint64_t offset, uint64_t pageSize) {
    return roundedDown(offset + pageSize - 1, pageSize);
}

/// The same merging over an array, in signed bytes and without hints or page numbers; small offsets only.
class Model {
public:
    void add(Span span, uint64_t pageSize) {
        const uint64_t lo = roundedDown(span.start, pageSize);
        const uint64_t hi = roundedUp(span.end(), pageSize);
        std::erase_if(_spans, [&](const Span& node) {
            const uint64_t nodeLo = roundedDown(node.start, pageSize);
            const uint64_t nodeHi = roundedUp(node.end(), pageSize);
            if (nodeHi < lo || nodeLo > hi) {
                return false;
            }
            const int64_t overlap = signedBytes(std::min(hi, nodeHi)) - signedBytes(std::max(lo, nodeLo));
            span = merged(span, node, std::max<int64_t>(overlap, 0));
            return true;
        });
        _spans.push_back(span);
        std::ranges::sort(_spans, {}, &Span::start);
    }

    const std::vector<Span>& spans() const { return _spans; }

private:
    static int64_t signedBytes(uint64_t bytes) { return static_cast<int64_t>(bytes); }

    static Span merged(const Span& a, const Span& b, int64_t overlap) {
        const uint64_t start = std::min(a.start, b.start);
        Span both = {start, std::max(a.end(), b.end()) - start, a.counts};
        for (const auto kind : kKinds) {
            const int64_t once = signedBytes(a.counts.*kind) + signedBytes(b.counts.*kind) - overlap;
            const auto floored = static_cast<uint64_t>(std::max<int64_t>(once, 0));
            both.counts.*kind = std::max({floored, a.counts.*kind, b.counts.*kind});
        }
        return both;
    }

    std::vector<Span> _spans;
};

/// Spans of up to three pages, some of them empty or not on page boundaries, over `pages` pages of 4096, in
/// runs of ascending starts.
std::vector<Span> randomSpans(std::mt19937_64& random, uint64_t pages, ptrdiff_t run) {
    const auto below = [&random](uint64_t bound) { return random() % bound; };
    std::vector<Span> spans(200);
    for (Span& span : spans) {
        span = {below(pages) * 4096 + (below(3) == 0 ? below(4096) : 0),
                below(3) == 0 ? below(12288) : below(4) * 4096};
        for (const auto kind : kKinds) {
            span.counts.*kind = below(2) == 0 ? 0 : below(span.length + 1);
        }
    }
    for (auto begin = spans.begin(); begin != spans.end(); begin += run) {
        std::ranges::sort(begin, begin + run, {}, &Span::start);
    }
    return spans;
}

TEST(MWRangeList, MergesAsTheModelDoesWhateverTheOrderAndThePageSize) {
    std::mt19937_64 random(20250101);
    const std::vector<std::vector<uint64_t>> pageSizes = {{4096}, {16384}, {4096, 16384}, {1, 3000, 4096}};
    for (const auto& sizes : pageSizes) {
        for (const ptrdiff_t run : {1, 50, 200}) {
            for (const uint64_t pages : {60, 800, 8000}) {  // from one crowded node to mostly lone ones
                MWRangeList list;
                Model model;
                for (const Span& span : randomSpans(random, pages, run)) {
                    const uint64_t pageSize = sizes[random() % sizes.size()];
                    add(list, span, pageSize);
                    model.add(span, pageSize);
                    const auto spans = spansOf(list);
                    ASSERT_EQ(spans, model.spans());
                    for (size_t i = 1; i < spans.size(); ++i) {
                        ASSERT_LT(spans[i - 1].start, spans[i].start);
                        ASSERT_LE(spans[i - 1].end(), spans[i].start);
                    }
                }
            }
        }
    }
}

TEST(MWRangeList, CountsEachFullyDirtyPageOnce) {
    std::mt19937_64 random(20250102);
    for (const uint64_t pageSize : {4096, 16384}) {
        MWRangeList list;
        std::set<uint64_t> pages;
        for (int i = 0; i < 500; ++i) {
            const uint64_t first = random() % 3000;
            const uint64_t count = 1 + random() % 9;
            add(list, {first * pageSize, count * pageSize, {.dirty = count * pageSize}}, pageSize);
            for (uint64_t page = first; page < first + count; ++page) {
                pages.insert(page);
            }
            ASSERT_EQ(list.sum(), (MWCategoryTotals{.dirty = pages.size() * pageSize}));
        }
    }
}

TEST(MWRangeList, AbsorbsSeveralNodesAndLeavesTheOthersAlone) {
    constexpr uint64_t P = 4096;
    MWRangeList list;
    for (const uint64_t page : {0, 10, 12, 14, 20}) {
        add(list, {page * P, P, {.dirty = P, .wired = 1}}, P);
    }
    add(list, {11 * P, 3 * P, {.dirty = 0, .swapped = P}}, P);
    // Pages 10 and 14 are only touched and add up; page 12 is overlapped, and its dirty page may be the one
    // that the merged node already has.
    EXPECT_EQ(spansOf(list), (std::vector<Span>{{0, P, {.dirty = P, .wired = 1}},
                                                {10 * P, 5 * P, {.dirty = 2 * P, .swapped = P, .wired = 2}},
                                                {20 * P, P, {.dirty = P, .wired = 1}}}));

    // Both take up part of the page at 16384, which counts once although they share no byte.
    MWRangeList sharedPage;
    add(sharedPage, {0, 20480, {.dirty = 20480}}, 16384);
    add(sharedPage, {20480, 20480, {.dirty = 20480}}, 16384);
    EXPECT_EQ(spansOf(sharedPage), (std::vector<Span>{{0, 40960, {.dirty = 40960 - 16384}}}));
}

TEST(MWRangeList, StaysExactAtTheEndOfTheAddressSpace) {
    constexpr uint64_t lastPage = UINT64_MAX - 4095;
    MWRangeList list;
    add(list, {lastPage, 4096, {.dirty = 4096}}, 4096);
    add(list, {lastPage, 4096, {.dirty = 4096}}, 4096);
    EXPECT_EQ(spansOf(list), (std::vector<Span>{{lastPage, 4096, {.dirty = 4096}}}));

    add(list, {0, 4096, {.clean = 1}}, 4096);
    add(list, {lastPage - 4096, UINT64_MAX, {.dirty = 8192}}, 4096);  // runs past the end: cut there
    EXPECT_EQ(spansOf(list),
              (std::vector<Span>{{0, 4096, {.clean = 1}}, {lastPage - 4096, 8192, {.dirty = 8192}}}));

    add(list, {0, UINT64_MAX, {}}, 4096);
    EXPECT_EQ(list.sum(), (MWCategoryTotals{.dirty = 8192, .clean = 1}));
    EXPECT_EQ(spansOf(list).size(), 1U);
}

TEST(MWRangeList, TakesManySpansInAnyOrder) {
    // Walking from the head each time, or freeing the nodes by recursion, would not come to an end here.
    constexpr uint64_t count = 300'000;
    const auto ascending = [](uint64_t i) { return i; };
    const auto fromBothEnds = [](uint64_t i) { return i % 2 == 0 ? i / 2 : count - 1 - i / 2; };
    const auto scattered = [](uint64_t i) { return i * 618'031 % count; };
    for (const auto& place :
         std::vector<std::function<uint64_t(uint64_t)>>{ascending, fromBothEnds, scattered}) {
        MWRangeList list;
        for (uint64_t i = 0; i < count; ++i) {
            add(list, {place(i) * 8192 * 2, 4096, {.dirty = 4096}}, 4096);
        }
        EXPECT_EQ(list.sum().dirty, count * 4096);
    }
}

TEST(MWRangeList, AddsARegionByItsSubrangesOrByItsSpanOfTheObject) {
    const auto region = makeRegion({.dirty = 0x1000,
                                    .swapped = 0x800,
                                    .clean = 0x400,
                                    .reclaimable = 0x200,
                                    .size = 0x4000,
                                    .start = 0x7000'0000,
                                    .offset = 0x3000,
                                    .wired = true});
    MWRangeList list;
    EXPECT_EQ(list.sum(), MWCategoryTotals{});
    list.addRegion(*region, 4096);
    EXPECT_EQ(spansOf(list), (std::vector<Span>{{0x3000, 0x4000, {0x1000, 0x800, 0x400, 0x200, 0x4000}}}));

    const std::vector<Span> pieces = {{0x3000, 0x1000, {.dirty = 0x1000}},
                                      {0x5000, 0x1000, {.clean = 0x1000, .wired = 0x1000}}};
    for (const Span& piece : pieces) {
        region->addSubrange({.start = piece.start, .length = piece.length}, piece.counts, 4096);
    }
    MWRangeList exact;
    exact.addRegion(*region, 4096);
    EXPECT_EQ(spansOf(exact), pieces);
}

}  // namespace
