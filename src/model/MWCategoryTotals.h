#pragma once

#include <cstdint>

/// The byte counts by kind that go with every category table and every range-list sum. `dirty` excludes
/// `swapped`; whoever shows a dirty figure shows their sum.
struct MWCategoryTotals {
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;
    uint32_t regions = 0;

    bool operator==(const MWCategoryTotals&) const = default;
};
