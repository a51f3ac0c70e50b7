#pragma once

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

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
};

/// The human-readable report, on a stream that it borrows (standard output in the program).
class MWOutputFormatterText : public MWOutputFormatter {
public:
    explicit MWOutputFormatterText(MWTextStyle style, std::FILE* output = stdout);
    // (the implementer adds the overrides and the internal operations)
};
