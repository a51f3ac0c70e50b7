// The category tables of the text report: sizes, columns and the order of the rows.

#include <bsd/stdlib.h>
#include <fmt/printf.h>

#include <algorithm>
#include <array>
#include <cstddef>

#include "output/MWOutputFormatterText.h"
#include "platform/MWInvariant.h"
#include "platform/MWTerminalText.h"

namespace {

/// "NNNN KB" at most, and the terminating NUL.
constexpr size_t kHumanizedSize = 8;

std::string humanized(uint64_t size) {
    std::array<char, kHumanizedSize> text = {};
    humanize_number(text.data(), text.size(), static_cast<int64_t>(size), "B", HN_AUTOSCALE, 0);
    return text.data();
}

struct ColumnWidths {
    int dirty;
    int swapped;
    int clean;
    int reclaimable;
    int wired;
};

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

std::vector<std::string> MWOutputFormatterText::_sortedKeysForCategories(
    const MWCategoryTable& categories) const {
    const auto* const column = std::ranges::find(kSortColumns, _sort, &SortColumn::name);
    MW_INVARIANT(column != kSortColumns.end(), "Unhandled text sort column");
    std::vector<std::string> keys;
    keys.reserve(categories.size());
    for (const auto& [key, category] : categories) {
        keys.push_back(key);
    }
    if (column->rank != nullptr) {
        std::ranges::stable_sort(keys, std::ranges::greater(),
                                 [&](const std::string& key) { return column->rank(categories.at(key)); });
    }
    return keys;
}

void MWOutputFormatterText::_printTable(const MWCategoryTable& categories,
                                        const MWCategoryTotals& total) const {
    _printTableHeader();
    _printDashes();
    _printCategories(categories);
    _printTotalFooter(total);
}

/// The size columns side by side; those that are not shown take no room.
std::string MWOutputFormatterText::_sizeColumns(const SizeTexts& texts) const {
    const ColumnWidths widths = columnWidths(_summaryFormat);
    const bool swapped = _swappedColumnName.has_value();
    const bool wired = _wiredColumnName.has_value();
    return fmt::sprintf("%*s%*s%*s%*s%*s", widths.dirty, texts.dirty, swapped ? widths.swapped : 0,
                        swapped ? texts.swapped : "", widths.clean, texts.clean, widths.reclaimable,
                        texts.reclaimable, wired ? widths.wired : 0, wired ? texts.wired : "");
}

void MWOutputFormatterText::_printTableHeader() const {
    const SizeTexts names = {.dirty = "Dirty",
                             .swapped = _swappedColumnName.value_or(""),
                             .clean = "Clean",
                             .reclaimable = "Reclaimable",
                             .wired = _wiredColumnName.value_or("")};
    fmt::fprintf(_output, "%s %10s    %s\n", _sizeColumns(names), "Regions", "Category");
}

void MWOutputFormatterText::_printDashes() const {
    const SizeTexts dashes = {
        .dirty = "---", .swapped = "---", .clean = "---", .reclaimable = "---", .wired = "---"};
    fmt::fprintf(_output, "%s %10s    %s\n", _sizeColumns(dashes), "---", "---");
}

void MWOutputFormatterText::_printCategories(const MWCategoryTable& categories) const {
    for (const std::string& key : _sortedKeysForCategories(categories)) {
        const MWMemoryCategory& category = categories.at(key);
        const bool isNamed = category.firstMemoryObject() != nullptr;
        if (isNamed && category.verbose() && !_verbose) {
            continue;
        }
        const auto detail = isNamed ? _truncatedNameForString(category.detailedName()) : std::nullopt;
        _printRow(totalsOfCategory(category), isNamed ? category.name() : key, detail ? " " + *detail : "");
    }
}

void MWOutputFormatterText::_printTotalFooter(const MWCategoryTotals& total) const {
    _printDashes();
    _printRow(total, "TOTAL", "");
}

void MWOutputFormatterText::_printRow(const MWCategoryTotals& total, std::string_view category,
                                      std::string_view detail) const {
    const SizeTexts sizes = {.dirty = formattedStringForSize(total.dirty + total.swapped),
                             .swapped = formattedStringForSize(total.swapped),
                             .clean = formattedStringForSize(total.clean),
                             .reclaimable = formattedStringForSize(total.reclaimable),
                             .wired = formattedStringForSize(total.wired)};
    fmt::fprintf(_output, "%s %10d    %s%s\n", _sizeColumns(sizes), total.regions, MWTerminalText(category),
                 MWTerminalText(detail));
}
