#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

namespace procfs {

/// One line of `sysvipc/shm`; sizes in bytes.
struct SysVSegment {
    uint64_t identifier = 0;
    uint64_t size = 0;
    int32_t creator = 0;
    uint64_t attached = 0;    ///< number of mappings, of all processes
    uint64_t changeTime = 0;  ///< seconds since 1970; not before the segment was made
    uint64_t resident = 0;
    uint64_t swapped = 0;
};

/// The segments of the text. Columns are found by their headings, as kernels have added some; lines that are
/// cut are passed over.
std::vector<SysVSegment> parseSysVSegments(std::string_view text);

}  // namespace procfs
