#pragma once

#include <algorithm>
#include <cstddef>
#include <ranges>
#include <vector>

/// Calls `usingBlock(first, count)` with consecutive slices of the elements, in order, each of at most
/// `batchSize` elements (0 counts as 1), every element exactly once. Of a list every slice but the last is
/// full; temporaries that the block makes live no longer than its slice.
template <std::ranges::contiguous_range List, typename Block>
void mw_enumerateObjectsWithBatchSize(const List& list, size_t batchSize, Block&& usingBlock) {
    const size_t slice = std::max<size_t>(batchSize, 1);
    const size_t total = std::ranges::size(list);
    for (size_t first = 0; first < total; first += slice) {
        usingBlock(std::ranges::data(list) + first, std::min(slice, total - first));
    }
}

/// The same for a sequence that is not one block of memory; the slices hold copies, so it is meant for
/// elements that are cheap to copy.
template <std::ranges::input_range Sequence, typename Block>
requires(!std::ranges::contiguous_range<Sequence>) void mw_enumerateObjectsWithBatchSize(
    const Sequence& sequence, size_t batchSize, Block&& usingBlock) {
    std::vector<std::ranges::range_value_t<Sequence>> slice;
    const size_t room = std::max<size_t>(batchSize, 1);
    const auto hand = [&] {
        if (!slice.empty()) {
            usingBlock(slice.data(), slice.size());
            slice.clear();
        }
    };
    for (const auto& element : sequence) {
        slice.push_back(element);
        if (slice.size() == room) {
            hand();
        }
    }
    hand();
}
