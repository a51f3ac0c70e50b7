#pragma once

#include <cstdint>

/// A word of `pagemap`. The frame number and the swap entry read as 0 without CAP_SYS_ADMIN; the other bits
/// need no privilege.
struct PagemapEntry {
    uint64_t word = 0;

    bool present() const { return (word >> 63U) != 0; }
    bool swapped() const { return ((word >> 62U) & 1U) != 0; }
    /// A page of a file, or shmem.
    bool fileOrShared() const { return ((word >> 61U) & 1U) != 0; }
    /// Mapped once; since 4.2. Says nothing about swapped pages.
    bool exclusive() const { return ((word >> 56U) & 1U) != 0; }
    /// Number of the page frame, or for a swapped page its place in swap.
    uint64_t frame() const { return word & ((uint64_t{1} << 55U) - 1); }
};
