#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "platform/linux/ForkCensus.h"
#include "platform/linux/PageCounts.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/UncountedPages.h"

/// Which process is looked at, and through what.
struct CountedProcess {
    int32_t pid;
    int memoryDirectory;
    const procfs::ProcStatus& status;
    const PageScanner& scan;
    PageSource& pages;
    uint64_t pageSize;
};

struct MappingCounts {
    bool sharesByFork;
    std::vector<ScannedRange> filePages;  ///< of private file mappings, where nothing is shared by fork
};

/// Fills in what `maps` leaves out of the mappings, as far as the figures of a measurement depend on it, for
/// a third of what smaps costs. None where smaps has to be read after all: where its flags could change the
/// kind of a mapping (a program with threads has guards and arenas), where pages can be of kinds that only it
/// tells, and where memory is both shared by fork and swapped out.
std::optional<MappingCounts> countWithoutSmaps(std::vector<BackedVma>& vmas, const CountedProcess& process,
                                               UncountedPages& uncounted, ForkCensus& census);
