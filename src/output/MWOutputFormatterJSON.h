#pragma once

#include <cstdint>
#include <memory>
#include <set>
#include <string>
#include <string_view>

#include "output/MWDateFormatter.h"
#include "output/MWJSONWriter.h"
#include "output/MWOutputFile.h"
#include "output/MWOutputFormatter.h"

/// The measurement as one JSON document, written while it is reported; shared tables come at the end of a
/// measurement. In a sampling run each measurement is an element of "samples". The document is complete only
/// after `close`. All sizes are bytes.
class MWOutputFormatterJSON : public MWOutputFormatter {
public:
    /// None when the file cannot be created; the reason is then already on standard error.
    static std::unique_ptr<MWOutputFormatterJSON> initWithPath(const std::string& path);

    void configureForMultipleOutputs() override;
    void startAtTime(const MWTime& time) override;
    /// From here on every process has a "regions" member.
    void printSpanlistLikeOutputForProcess(const MWProcess& process,
                                           const MWMemoryRegionList& regions) override;
    void printProcessHeader(const MWProcess& process) override;
    void endProcessHeader(const MWProcess&) override {}
    void printProcessTotal(uint64_t memweight, const MWProcess& forProcess) override;
    void printProcessCategories(const MWCategoryTable& categories, const MWCategoryTotals& total) override;
    void printSharedCategories(const MWCategoryTable& categories,
                               const MWSharedCategoriesCall& call) override;
    void printProcessAuxData(const MWAuxDataTree& auxData) override;
    void printProcessesWithWarnings(const std::vector<const MWProcess*>& processes,
                                    const MWProcessErrors& errors) override;
    void printSummaryCategories(const MWCategoryTable& categories, const MWSummaryCall& call) override;
    void printGlobalAuxData(const MWAuxDataTree& auxData) override;
    void endAtTime(const MWTime& time) override;
    void close() override;

    // Internal operations.

    void _emitTimeObjectForTime(const MWTime& time, std::string_view label);

private:
    explicit MWOutputFormatterJSON(std::unique_ptr<MWOutputFile> file);

    bool _verbose = false;
    bool _multipleOutputs = false;
    /// The entries of "shared" of this measurement, as JSON: small beside the tables that they come from.
    MWJSONWriter _shared;
    /// Whose common table is among them.
    std::set<const MWProcessGroup*> _addedProcessGroups;
    /// Of the first process of the run; 0 before.
    uint64_t _pageSize = 0;
    std::unique_ptr<MWOutputFile> _file;
    MWJSONWriter _json;
    MWDateFormatter _dateFormatter{'T'};
};
