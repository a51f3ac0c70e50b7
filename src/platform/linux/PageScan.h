#pragma once

#include <cstdint>
#include <span>

/// What PAGEMAP_SCAN (Linux 6.7) tells of a page; bits of `ScannedRange::categories`.
enum PageCategory : uint64_t {
    kIsFileOrShared = 1U << 2U,
    kIsPresent = 1U << 3U,
    kIsSwapped = 1U << 4U,
    kIsZeroPage = 1U << 5U,
};

/// Consecutive pages of the same categories, as the kernel writes it.
struct ScannedRange {
    uint64_t start;
    uint64_t end;
    uint64_t categories;
};

/// A question about the pages of [start, end).
struct PageScan {
    uint64_t start;
    uint64_t end;
    uint64_t anyOf;          ///< pages that have any of these categories are told
    uint64_t told;           ///< the categories that are told of them
    uint64_t mostPages = 0;  ///< stop behind so many; 0 for no bound

    static PageScan forPages(uint64_t start, uint64_t end, uint64_t categories) {
        return {.start = start, .end = end, .anyOf = categories, .told = categories};
    }
};

/// Asks the kernel through an open `pagemap`. Fills `ranges`, ascending, and sets where the scan stopped,
/// which is the end unless the ranges or the pages ran out. The number of ranges, or -1 with errno where the
/// kernel cannot scan.
int scanPages(int pagemap, const PageScan& scan, std::span<ScannedRange> ranges, uint64_t& walkEnd);
