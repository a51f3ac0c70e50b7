#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "platform/linux/PageCounts.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/UncountedPages.h"

/// Which process is looked at, and through what.
struct CountedProcess {
    int memoryDirectory;
    const procfs::ProcStatus& status;
    const PageScanner& scan;
    PageSource& pages;
    uint64_t pageSize;
    bool isAlone;  ///< nobody is measured with whom it shares memory by fork
};

/// Fills in what `maps` leaves out of the mappings, as far as the figures of a measurement depend on it, for
/// a third to a half of what smaps costs. Answers the pages of private file mappings, as countPages does.
///
/// None where smaps has to be read after all: where its flags could change the kind of a mapping (a program
/// with threads has guards and arenas), where there are pages of kinds that only it tells, and where memory
/// is both shared by fork and swapped out. That there are no such pages is known for the whole system, or
/// else by the sums that smaps_rollup gives; these are not worth their price where mappings are large.
std::optional<std::vector<ScannedRange>> countWithoutSmaps(std::vector<BackedVma>& vmas,
                                                           const CountedProcess& process,
                                                           UncountedPages& uncounted);
