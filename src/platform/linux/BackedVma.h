#pragma once

#include <cstdint>

#include "platform/linux/SmapsParser.h"

/// What holds a mapping's pages.
enum class Backing : uint8_t {
    anonymous,
    file,   ///< a file on a disk or network
    shmem,  ///< memfd, SysV, shared anonymous, tmpfs: only swap can take its pages
    hugetlb,
    special,  ///< the kernel's own mappings and devices
};

/// A mapping, which somebody else holds, with its backing. The mappings of one process are ascending.
struct BackedVma {
    procfs::Vma& vma;
    Backing backing = Backing::anonymous;
};
