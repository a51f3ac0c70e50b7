#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/linux/BackedVma.h"

/// A file that a process runs code of, its program or a library, and where it is mapped. The mappings of one
/// file are one image, however often it was loaded.
struct LinuxImage {
    struct Segment {
        uint64_t start = 0;
        uint64_t size = 0;
        const char* name = nullptr;
    };

    std::string path;
    uint64_t device = 0;
    uint64_t inode = 0;
    std::vector<Segment> segments = {};  ///< ascending, one for each mapping; never empty

    uint64_t baseAddress() const { return segments.front().start; }
};

struct LinuxImages {
    static constexpr size_t kNoImage = SIZE_MAX;

    std::vector<LinuxImage> images = {};  ///< ascending by base address
    std::vector<size_t> imageOfVma = {};  ///< for each mapping its index in `images`, or kNoImage
};

/// What a loader made of the mappings (ascending), told from these alone. An image is a file of which some
/// part is mapped private and executable. Its segments:
///
///     r--  __TEXT          headers, constants
///     r-x  __TEXT
///     r--  __DATA_CONST    written by the loader, then protected
///     rw-  __DATA
///     rw-  __DATA          no file, begins where that ends: its bss
///
/// Shared mappings belong to no image, nor does memory that only looks like a file (tmpfs, memfd): their
/// pages count as dirty, and would be counted as text and as data where a program maps its code buffer twice.
/// Costs n log n in mappings.
LinuxImages imagesOfVmas(const std::vector<BackedVma>& vmas);

/// Whether, of mappings without flags, one could be constants or be code: it lies where constants do and has
/// no written pages to tell.
bool imagesNeedFlags(const std::vector<BackedVma>& vmas);
