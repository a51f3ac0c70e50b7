// The category tables of the text report: sizes, columns and the order of the rows.

#include <bsd/stdlib.h>
#include <fmt/format.h>
#include <fmt/printf.h>

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdio>

#include "output/MWOutputFormatterText.h"
#include "platform/MWInvariant.h"

namespace {

/// "NNNN KB" at most, and the terminating NUL.
constexpr size_t kHumanizedSize = 8;

std::string humanized(uint64_t size) {
    std::array<char, kHumanizedSize> text = {};
    humanize_number(text.data(), text.size(), static_cast<int64_t>(size), "B", HN_AUTOSCALE, 0);
    return text.data();
}

struct ColumnWidths {
    size_t dirty;
    size_t swapped;
    size_t clean;
    size_t reclaimable;
    size_t wired;
};
constexpr size_t kRegionsWidth = 11;

void appendRight(std::string& line, std::string_view text, size_t width) {
    line.append(width - std::min(width, text.size()), ' ').append(text);
}

ColumnWidths columnWidths(MWSummaryFormat format) {
    if (format == MWSummaryFormat::formatted) {
        return {.dirty = 7, .swapped = 11, .clean = 11, .reclaimable = 13, .wired = 11};
    }
    return {.dirty = 11, .swapped = 14, .clean = 14, .reclaimable = 14, .wired = 14};
}

/// What the rows are compared by, most significant first; the largest stands first.
using SortRank = std::array<uint64_t, 3>;
using SortRankFunction = SortRank (*)(const MWMemoryCategory&);

struct SortColumn {
    const char* name;
    /// None: the table's keys are the order.
    SortRankFunction rank;
};

constexpr std::array kSortColumns = {
    SortColumn{"Dirty",
               [](const MWMemoryCategory& c) {
                   return SortRank{c.totalDirtySize() + c.totalSwappedSize(), c.totalReclaimableSize(),
                                   c.totalCleanSize()};
               }},
    SortColumn{"Swapped", [](const MWMemoryCategory& c) { return SortRank{c.totalSwappedSize()}; }},
    SortColumn{"Clean", [](const MWMemoryCategory& c) { return SortRank{c.totalCleanSize()}; }},
    SortColumn{"Reclaimable", [](const MWMemoryCategory& c) { return SortRank{c.totalReclaimableSize()}; }},
    SortColumn{"Wired", [](const MWMemoryCategory& c) { return SortRank{c.totalWiredSize()}; }},
    SortColumn{"Regions",
               [](const MWMemoryCategory& c) { return SortRank{static_cast<uint32_t>(c.totalRegions())}; }},
    SortColumn{"Category", nullptr},
};

MWCategoryTotals totalsOfCategory(const MWMemoryCategory& category) {
    return {.dirty = category.totalDirtySize(),
            .swapped = category.totalSwappedSize(),
            .clean = category.totalCleanSize(),
            .reclaimable = category.totalReclaimableSize(),
            .wired = category.totalWiredSize(),
            .regions = static_cast<uint32_t>(category.totalRegions())};
}

}  // namespace

const std::vector<std::string>& MWSortColumns() {
    static const std::vector<std::string> names = [] {
        std::vector<std::string> list;
        list.reserve(kSortColumns.size());
        for (const SortColumn& column : kSortColumns) {
            list.emplace_back(column.name);
        }
        return list;
    }();
    return names;
}

uint64_t MWOutputFormatterText::_pagesForSize(uint64_t size, uint64_t pageSize) {
    return pageSize == 0 ? 0 : (size + pageSize - 1) / pageSize;
}

std::string MWOutputFormatterText::formattedStringForSize(uint64_t size) const {
    switch (_summaryFormat) {
        case MWSummaryFormat::bytes:
            return fmt::sprintf("%lld B", static_cast<int64_t>(size));
        case MWSummaryFormat::pages:
            return fmt::sprintf("%llu pages", _pagesForSize(size, _pageSize));
        case MWSummaryFormat::formatted:
            break;
    }
    return humanized(size);
}

std::optional<std::string> MWOutputFormatterText::_truncatedNameForString(
    const std::optional<std::string>& string) const {
    if (_shows(MWTextShowFullPaths) || !string) {
        return string;
    }
    const size_t last = string->find_last_not_of('/');
    if (last == std::string::npos) {
        return string->size() > 1 ? ".../" + string->substr(0, 1)
                                  : string;  // slashes alone: one is the component
    }
    const size_t slash = string->rfind('/', last);
    const size_t first = slash == std::string::npos ? 0 : slash + 1;
    const std::string component = string->substr(first, last + 1 - first);
    return component.size() == string->size() ? string : ".../" + component;
}

std::vector<const MWCategoryTable::value_type*> MWOutputFormatterText::_sortedKeysForCategories(
    const MWCategoryTable& categories) const {
    const auto* const column = std::ranges::find(kSortColumns, _sort, &SortColumn::name);
    MW_INVARIANT(column != kSortColumns.end(), "Unhandled text sort column");
    std::vector<const MWCategoryTable::value_type*> rows;
    rows.reserve(categories.size());
    for (const auto& row : categories) {
        rows.push_back(&row);
    }
    if (column->rank != nullptr) {
        std::ranges::stable_sort(rows, std::ranges::greater(),
                                 [&](const auto* row) { return column->rank(row->second); });
    }
    return rows;
}

void MWOutputFormatterText::_printTable(const MWCategoryTable& categories,
                                        const MWCategoryTotals& total) const {
    std::string table = _headerLine();
    const std::string dashes = _dashesLine();
    table += dashes;
    for (const auto* row : _sortedKeysForCategories(categories)) {
        _appendCategory(table, row->first, row->second);
    }
    table += dashes;
    _appendRow(table, total, "TOTAL", "");
    std::fwrite(table.data(), 1, table.size(), _output);
}

/// The size columns side by side; those that are not shown take no room.
void MWOutputFormatterText::_appendSizeColumns(std::string& line, const SizeTexts& texts) const {
    const ColumnWidths widths = columnWidths(_summaryFormat);
    appendRight(line, texts.dirty, widths.dirty);
    if (_swappedColumnName) {
        appendRight(line, texts.swapped, widths.swapped);
    }
    appendRight(line, texts.clean, widths.clean);
    appendRight(line, texts.reclaimable, widths.reclaimable);
    if (_wiredColumnName) {
        appendRight(line, texts.wired, widths.wired);
    }
}

std::string MWOutputFormatterText::_headerLine() const {
    std::string line;
    _appendSizeColumns(line, {.dirty = "Dirty",
                              .swapped = _swappedColumnName.value_or(""),
                              .clean = "Clean",
                              .reclaimable = "Reclaimable",
                              .wired = _wiredColumnName.value_or("")});
    appendRight(line, "Regions", kRegionsWidth);
    return line += "    Category\n";
}

std::string MWOutputFormatterText::_dashesLine() const {
    constexpr std::string_view kDashes = "---";
    std::string line;
    _appendSizeColumns(
        line,
        {.dirty = kDashes, .swapped = kDashes, .clean = kDashes, .reclaimable = kDashes, .wired = kDashes});
    appendRight(line, kDashes, kRegionsWidth);
    return line += "    ---\n";
}

void MWOutputFormatterText::_appendCategory(std::string& table, const std::string& key,
                                            const MWMemoryCategory& category) const {
    const bool isNamed = category.firstMemoryObject() != nullptr;
    if (isNamed && category.verbose() && !_verbose) {
        return;
    }
    const auto detail = isNamed ? _truncatedNameForString(category.detailedName()) : std::nullopt;
    _appendRow(table, totalsOfCategory(category), isNamed ? category.name() : key,
               detail ? " " + *detail : "");
}

void MWOutputFormatterText::_appendRow(std::string& table, const MWCategoryTotals& total,
                                       std::string_view category, std::string_view detail) const {
    _makeRoomForSizeTexts();
    _appendSizeColumns(table, {.dirty = _sizeText(total.dirty + total.swapped),
                               .swapped = _sizeText(total.swapped),
                               .clean = _sizeText(total.clean),
                               .reclaimable = _sizeText(total.reclaimable),
                               .wired = _sizeText(total.wired)});
    appendRight(table, fmt::format_int(static_cast<int32_t>(total.regions)).c_str(), kRegionsWidth);
    table.append("    ").append(_shown(category)).append(_shown(detail)) += '\n';
}

// Most sizes of a report are few and small, and are written many times over. In pages one size has another
// text for each page size.
void MWOutputFormatterText::_makeRoomForSizeTexts() const {
    constexpr size_t kMostTexts = 4096;
    constexpr size_t kTextsOfARow = 5;
    if (_sizeTexts.size() + kTextsOfARow > kMostTexts || _sizeTextsPageSize != _pageSize) {
        _sizeTexts.clear();
        _sizeTextsPageSize = _pageSize;
    }
}

const std::string& MWOutputFormatterText::_sizeText(uint64_t size) const {
    std::string& text = _sizeTexts[size];
    if (text.empty()) {
        text = formattedStringForSize(size);
    }
    return text;
}
