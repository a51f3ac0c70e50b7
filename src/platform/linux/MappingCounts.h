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
/// a third of what smaps costs. Answers the pages of private file mappings, as countPages does. None where
/// smaps has to be read after all: where its flags could change the kind of a mapping (a program with threads
/// has guards and arenas), where pages can be of kinds that only it tells, and where memory is both shared by
/// fork and swapped out.
std::optional<std::vector<ScannedRange>> countWithoutSmaps(std::vector<BackedVma>& vmas,
                                                           const CountedProcess& process,
                                                           UncountedPages& uncounted);
