#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "model/MWAuxData.h"
#include "model/MWCategoryTotals.h"
#include "model/MWMemoryCategory.h"
#include "output/MWTime.h"

class MWProcess;
class MWProcessGroup;

/// Whose memory a shared table shows.
struct MWSharedCategoriesCall {
    const MWProcessGroup& sharedWith;
    const MWProcess& forProcess;
    /// The table is this process's own view of the shared objects rather than the group's common table.
    bool hasProcessView;
    const MWCategoryTotals& total;
};

struct MWProcessErrors {
    const std::vector<const MWProcess*>& processesWithErrors;
    const std::vector<std::string>& globalErrors;
};

struct MWSummaryCall {
    const MWCategoryTotals& total;
    /// Any process had errors, or there are global errors.
    bool hadErrors;
};

/// Where every result of a measurement leaves the program. The driver makes one fixed sequence of calls for
/// each measurement, from one thread at a time:
///
///     startAtTime
///     for each process: printSpanlistLikeOutputForProcess          (verbose only)
///     for each process: printProcessHeader [printProcessTotal] endProcessHeader
///                       printProcessCategories | printSharedCategories ...
///                       printProcessAuxData
///     printProcessesWithWarnings
///     printSummaryCategories printGlobalAuxData endAtTime
///
/// with configureForMultipleOutputs once before the first measurement of a sampling run and close once after
/// the last one. The operations with an empty body are optional. Operations report no errors: a formatter
/// whose output cannot be opened fails at its creation.
class MWOutputFormatter {
public:
    virtual ~MWOutputFormatter() = default;

    virtual void printProcessHeader(const MWProcess& process) = 0;
    virtual void endProcessHeader(const MWProcess& process) = 0;
    /// `memweight` in bytes; made only for a process without errors.
    virtual void printProcessTotal(uint64_t memweight, const MWProcess& forProcess) = 0;
    /// Memory that the process of the last header holds alone.
    virtual void printProcessCategories(const MWCategoryTable& categories, const MWCategoryTotals& total) = 0;
    virtual void printSharedCategories(const MWCategoryTable& categories,
                                       const MWSharedCategoriesCall& call) = 0;
    /// The last call about a process; the data may be none.
    virtual void printProcessAuxData(const MWAuxDataTree& auxData) = 0;
    virtual void printProcessesWithWarnings(const std::vector<const MWProcess*>& processes,
                                            const MWProcessErrors& errors) = 0;
    virtual void printSummaryCategories(const MWCategoryTable& categories, const MWSummaryCall& call) = 0;
    virtual void printGlobalAuxData(const MWAuxDataTree& auxData) = 0;
    virtual void endAtTime(const MWTime& time) = 0;

    virtual void startAtTime(const MWTime&) {}
    virtual void configureForMultipleOutputs() {}
    virtual void close() {}
    virtual void printSpanlistLikeOutputForProcess(const MWProcess&, const MWMemoryRegionList&) {}
};
