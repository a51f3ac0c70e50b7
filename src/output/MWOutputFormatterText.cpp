#include "output/MWOutputFormatterText.h"

#include <fmt/printf.h>

#include <algorithm>
#include <utility>

#include "analysis/MWProcessGroup.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWTerminalText.h"
#include "process/MWProcess.h"

namespace {

/// Groups of this many processes are counted rather than listed.
constexpr size_t kMembersTooManyToList = 21;

}  // namespace

MWOutputFormatterText::MWOutputFormatterText(MWTextStyle style, std::FILE* output)
    : _summaryFormat(style.summaryFormat),
      _options(style.options),
      _sort(std::move(style.sort)),
      _isForTerminal(style.isForTerminal),
      _output(output) {
    if (_shows(MWTextShowSwapped)) {
        _swappedColumnName = "(Swapped)";
    }
    if (_shows(MWTextShowWired)) {
        _wiredColumnName = "(Wired)";
    }
}

std::string MWOutputFormatterText::_shown(std::string_view text) const {
    return _isForTerminal ? MWTerminalText(text) : std::string(text);
}

void MWOutputFormatterText::startAtTime(const MWTime& time) {
    _processCount = 0;
    if (_multipleOutputs) {
        fmt::fprintf(_output, "Time: %s\n", _dateFormatter.stringFromDate(time.date()));
    }
}

void MWOutputFormatterText::endAtTime(const MWTime&) {
    std::fflush(_output);
}

void MWOutputFormatterText::printProcessHeader(const MWProcess& process) {
    _processCount = static_cast<uint8_t>(std::min(_processCount + 1, 2));
    _pageSize = process.pageSize();
    _printSeparator("\n");
    fmt::fprintf(_output, "%s: %s-bit%s", _shown(process.displayString()), process.is64bit() ? "64" : "32",
                 process.isTranslated() ? " (translated)" : "");
    _printMessages("\nWarnings were encountered while examining the process.\n", process.warnings());
    _printMessages("\nErrors were encountered while examining the process. No results gathered.\n",
                   process.errors());
}

void MWOutputFormatterText::printProcessTotal(uint64_t memweight, const MWProcess& forProcess) {
    fmt::fprintf(_output, "\tMemweight: %s (%lu bytes per page)\n", formattedStringForSize(memweight),
                 forProcess.pageSize());
}

void MWOutputFormatterText::endProcessHeader(const MWProcess&) {
    _printSeparator("\n\n");
}

void MWOutputFormatterText::printProcessCategories(const MWCategoryTable& categories,
                                                   const MWCategoryTotals& total) {
    _printTable(categories, total);
    fmt::fprintf(_output, "\n");
}

void MWOutputFormatterText::printSharedCategories(const MWCategoryTable& categories,
                                                  const MWSharedCategoriesCall& call) {
    _printSharers(call);
    _printTable(categories, call.total);
    fmt::fprintf(_output, "\n");
}

void MWOutputFormatterText::_printSharers(const MWSharedCategoriesCall& call) const {
    const MWProcessSet& members = call.sharedWith.processes();
    if (members.size() >= kMembersTooManyToList) {
        fmt::fprintf(_output, "Shared with %lu processes:\n", members.size());
        return;
    }
    std::string others;
    for (const MWProcess* member : members) {
        if (member != &call.forProcess) {
            others += (others.empty() ? " " : ", ") + _shown(member->displayString());
        }
    }
    fmt::fprintf(_output, "Shared with%s:\n", others);
}

void MWOutputFormatterText::printProcessAuxData(const MWAuxDataTree& auxData) {
    if (auxData) {
        printAuxData(*auxData);
        fmt::fprintf(_output, "\n");
    }
}

void MWOutputFormatterText::printProcessesWithWarnings(const std::vector<const MWProcess*>& processes,
                                                       const MWProcessErrors& errors) {
    _printNames("\nWarnings were encountered while examining the following processes:\n", processes);
    _printNames("\nErrors were encountered while examining the following processes:\n",
                errors.processesWithErrors);
    _printMessages("\nErrors were encountered:\n", errors.globalErrors);
    if (!errors.processesWithErrors.empty() || !errors.globalErrors.empty()) {
        fmt::fprintf(_output, "\nDue to errors, summary results may be invalid\n");
    }
}

void MWOutputFormatterText::printSummaryCategories(const MWCategoryTable& categories,
                                                   const MWSummaryCall& call) {
    _printPhysMemweightBreakdownEnabled();
    if (_processCount == 1) {
        return;
    }
    _printSeparator("\n");
    fmt::fprintf(_output, "Summary Memweight: %s%s\n",
                 formattedStringForSize(call.total.dirty + call.total.swapped),
                 call.hadErrors ? " (may be invalid due to errors)" : "");
    _printSeparator("\n\n");
    _printTable(categories, call.total);
}

void MWOutputFormatterText::printGlobalAuxData(const MWAuxDataTree& auxData) {
    if (_processCount == 1) {
        return;
    }
    fmt::fprintf(_output, "\n");
    printProcessAuxData(auxData);
}

void MWOutputFormatterText::_printPhysMemweightBreakdownEnabled() const {
    if (!MWPhysMemweightSwitch::isOn()) {
        fmt::fprintf(_output, "VM Object Dirty Analysis: Enabled\n");
    }
}

void MWOutputFormatterText::printAuxData(const MWAuxDataContainer& auxData) const {
    fmt::fprintf(_output, "Auxiliary data:\n");
    _printAuxData(auxData, 1);
}

void MWOutputFormatterText::_printAuxData(const MWAuxDataContainer& auxData, size_t withIndent) const {
    for (const auto& [key, datum] : auxData.elements()) {
        const std::string name = std::string(withIndent, '\t') + _shown(key);
        if (datum->isContainer()) {
            fmt::fprintf(_output, "%s:\n", name);
            _printAuxData(static_cast<const MWAuxDataContainer&>(*datum), withIndent + 1);
        } else {
            const int64_t value = static_cast<const MWAuxData&>(*datum).value();
            fmt::fprintf(_output, "%s: %s\n", name, formattedStringForSize(static_cast<uint64_t>(value)));
        }
    }
}

void MWOutputFormatterText::_printMessages(const char* heading,
                                           const std::vector<std::string>& messages) const {
    if (messages.empty()) {
        return;
    }
    fmt::fprintf(_output, "%s", heading);
    for (const std::string& message : messages) {
        fmt::fprintf(_output, "\t%s\n", _shown(message));
    }
}

void MWOutputFormatterText::_printNames(const char* heading,
                                        const std::vector<const MWProcess*>& processes) const {
    std::vector<std::string> names;
    std::ranges::transform(processes, std::back_inserter(names),
                           [](const auto* process) { return process->name(); });
    _printMessages(heading, names);
}

void MWOutputFormatterText::_printSeparator(const char* end) const {
    constexpr size_t kPieces = 7;
    constexpr size_t kPieceWidth = 10;
    const size_t shownColumns = (_swappedColumnName ? 1U : 0U) + (_wiredColumnName ? 1U : 0U);
    fmt::fprintf(_output, "%s%s", std::string((kPieces + shownColumns) * kPieceWidth, '='), end);
}
