#pragma once

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "output/MWDateFormatter.h"
#include "output/MWOutputFormatter.h"

/// The size style of the text report.
enum class MWSummaryFormat : int64_t { bytes = 0, formatted = 1, pages = 2 };

/// Bits of MWTextOptions.
using MWTextOptions = int64_t;
inline constexpr MWTextOptions MWTextShowWired = 1;
inline constexpr MWTextOptions MWTextShowSwapped = 2;
inline constexpr MWTextOptions MWTextShowFullPaths = 4;
inline constexpr MWTextOptions MWTextWide = MWTextShowWired | MWTextShowSwapped | MWTextShowFullPaths;

/// The names of the columns that tables can be sorted by, the default first.
const std::vector<std::string>& MWSortColumns();

/// How the text report looks; `sort` is one of MWSortColumns.
struct MWTextStyle {
    MWSummaryFormat summaryFormat;
    MWTextOptions options;
    std::string sort;
    bool isForTerminal = false;  ///< names, paths and messages as MWTerminalText
};

/// The human-readable report, on a stream that it borrows (standard output in the program). Write errors are
/// ignored. A measurement of a single process gets neither a summary table nor global auxiliary data.
class MWOutputFormatterText : public MWOutputFormatter {
public:
    /// (initWithSummaryFormat:options:sort:)
    explicit MWOutputFormatterText(MWTextStyle style, std::FILE* output = stdout);

    void printProcessHeader(const MWProcess& process) override;
    void endProcessHeader(const MWProcess& process) override;
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
    void startAtTime(const MWTime& time) override;
    void configureForMultipleOutputs() override { _multipleOutputs = true; }
    /// One line for each region, in the order of the list; also shows, from here on, the rows marked verbose.
    void printSpanlistLikeOutputForProcess(const MWProcess& process,
                                           const MWMemoryRegionList& regions) override;

    // Internal operations.

    /// A size in the configured style; in pages of the process whose header was printed last.
    std::string formattedStringForSize(uint64_t size) const;
    /// "/usr/lib/libx.so" as ".../libx.so", unless full paths are on; otherwise unchanged.
    std::optional<std::string> _truncatedNameForString(const std::optional<std::string>& string) const;
    /// The table's rows in report order; rows that are equal in every compared value stand in order of key.
    std::vector<const MWCategoryTable::value_type*> _sortedKeysForCategories(
        const MWCategoryTable& categories) const;

private:
    /// One text for each size column that can be shown.
    struct SizeTexts {
        std::string_view dirty;
        std::string_view swapped;
        std::string_view clean;
        std::string_view reclaimable;
        std::string_view wired;
    };

    /// Rounded up; 0 where the page size is not known.
    static uint64_t _pagesForSize(uint64_t size, uint64_t pageSize);

    bool _shows(MWTextOptions option) const { return (_options & option) != 0; }
    void _printTable(const MWCategoryTable& categories, const MWCategoryTotals& total) const;
    void _appendSizeColumns(std::string& line, const SizeTexts& texts) const;
    std::string _headerLine() const;
    std::string _dashesLine() const;
    void _appendCategory(std::string& table, const std::string& key, const MWMemoryCategory& category) const;
    void _appendRow(std::string& table, const MWCategoryTotals& total, std::string_view category,
                    std::string_view detail) const;
    /// Valid until the next call of _makeRoomForSizeTexts.
    const std::string& _sizeText(uint64_t size) const;
    void _makeRoomForSizeTexts() const;

    std::string _spanlistHeader() const;
    std::string _spanlistRow(const MWMemoryRegion& region, uint64_t pageSize) const;

    /// A name, a path or a message, as it is printed.
    std::string _shown(std::string_view text) const;
    void _printSeparator(const char* end) const;
    void _printSharers(const MWSharedCategoriesCall& call) const;
    void _printMessages(const char* heading, const std::vector<std::string>& messages) const;
    void _printNames(const char* heading, const std::vector<const MWProcess*>& processes) const;
    void _printPhysMemweightBreakdownEnabled() const;
    void printAuxData(const MWAuxDataContainer& auxData) const;
    void _printAuxData(const MWAuxDataContainer& auxData, size_t withIndent) const;

    /// Headers printed in this measurement: 0, 1, or 2 for more than one.
    uint8_t _processCount = 0;
    /// Of the process whose header was printed last, in bytes.
    uint64_t _pageSize = 0;
    /// Headers of the optional columns that are shown.
    std::optional<std::string> _swappedColumnName;
    std::optional<std::string> _wiredColumnName;
    bool _multipleOutputs = false;
    MWDateFormatter _dateFormatter{' '};
    /// Rows marked verbose are shown; on for good once a region listing was printed.
    bool _verbose = false;
    MWSummaryFormat _summaryFormat;
    MWTextOptions _options;
    std::string _sort;
    bool _isForTerminal;
    std::FILE* _output;
    // Texts that have been made before.
    mutable std::unordered_map<uint64_t, std::string> _sizeTexts;
    mutable uint64_t _sizeTextsPageSize = 0;
};
