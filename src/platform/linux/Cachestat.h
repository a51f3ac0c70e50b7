#pragma once

#include <cstdint>
#include <optional>

/// Pages of one file in the page cache, as cachestat (Linux 6.5) tells them.
struct Cachestat {
    uint64_t cached;
    uint64_t dirty;
    uint64_t writeback;
    uint64_t evicted;  ///< of memory files: in swap
    uint64_t recentlyEvicted;
};

/// None where the kernel does not tell, or not of this file.
std::optional<Cachestat> readCachestat(int file);
