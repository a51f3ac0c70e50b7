#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "output/MWOutputFormatter.h"
#include "output/spwriter.h"

/// The main figures of a measurement as metrics: a group of values for each process and one for the sums. In
/// a sampling run the groups of the samples follow each other.
class MWOutputFormatterStatpack : public MWOutputFormatter {
public:
    /// None when the file cannot be created; the reason is then already on standard error.
    static std::unique_ptr<MWOutputFormatterStatpack> initWithPath(const std::string& path);

    void startAtTime(const MWTime& time) override { _startTime = time; }
    void printProcessHeader(const MWProcess& process) override;
    void endProcessHeader(const MWProcess&) override {}
    void printProcessTotal(uint64_t memweight, const MWProcess& forProcess) override;
    void printProcessCategories(const MWCategoryTable& categories, const MWCategoryTotals& total) override;
    void printSharedCategories(const MWCategoryTable& categories,
                               const MWSharedCategoriesCall& call) override;
    void printProcessAuxData(const MWAuxDataTree& auxData) override;
    void printProcessesWithWarnings(const std::vector<const MWProcess*>&, const MWProcessErrors&) override {}
    void printSummaryCategories(const MWCategoryTable& categories, const MWSummaryCall& call) override;
    void printGlobalAuxData(const MWAuxDataTree& auxData) override;
    void endAtTime(const MWTime& time) override;
    void close() override;

    // Internal operations.

    void _addCategories(const MWCategoryTable& categories);
    struct AuxDataMetric {
        const std::string& parentMetric;
        const std::string& processName;
    };
    void _emitAuxData(const MWAuxDataType* value, const AuxDataMetric& metric);

private:
    explicit MWOutputFormatterStatpack(spwriter_ptr writer) : _writer(std::move(writer)) {}
    void _recordBytes(std::string_view metric, double bytes, std::string_view process);

    spwriter_ptr _writer;
    /// Between the header of the process and its auxiliary data.
    const MWProcess* _currentProcess = nullptr;
    /// Dirty and swapped bytes by category; from the process's own table to its auxiliary data.
    std::optional<std::map<std::string, uint64_t>> _currentProcessTotals;
    std::optional<MWTime> _startTime;
};
