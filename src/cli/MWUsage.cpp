#include "cli/MWUsage.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <string_view>

#include "output/MWOutputFormatterText.h"

namespace {

struct OptionLine {
    std::string_view option;
    std::string_view description;
};

}  // namespace

std::string MWLowercased(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(), [](char letter) {
        return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter - 'A' + 'a') : letter;
    });
    return text;
}

std::string MWUsageText() {
    const std::string sorting =
        "change the column used for sorting (default: " + MWLowercased(MWSortColumns().front()) + ")";
    const std::array<OptionLine, 15> optionLines = {{
        {"-a, --all", "target all processes"},
        {"-j, --json <file>", "print json output to a file"},
        {"-h, --help", "print this output"},
        {"-p, --proc, --pid [proc/pid]", "target pid or process (or interpret for -p)"},
        {"-x, --exclude [proc/pid]", "exclude pid or process"},
        {"-s, --skip", "skip processes that are idle-exit clean"},
        {"-v",
         "print all regions and spanlist-like output of address space layout (default output is a summary)"},
        {"-f, --format (bytes|formatted|pages)", "change size formatting preference (default: formatted)"},
        {"--sort <column>", sorting},
        {"-w, --wide", "show wide output with all columns and full paths (implies --swapped --wired)"},
        {"--swapped", "show swapped/compressed column"},
        {"--wired", "show wired column"},
        {"--vmObjectDirty", "interpret dirty memory as viewed by VM objects in the kernel"},
        {"--unmapped", "search all processes for unmapped memory owned by the target processes"},
        {"--sample <interval>",
         "repeatedly gather memweight at the given sampling interval in seconds (can be fractional \u2014 "
         "e.g. "
         "0.5)"},
    }};
    std::string text =
        "Gather memory information about a process or set of processes\n"
        "Usage: memweight [args] [proc/pid/heapsnap [proc/pid/heapsnap [...]]]\n";
    for (const OptionLine& line : optionLines) {
        text += fmt::format("    {:<38}{}\n", line.option, line.description);
    }
    return text;
}

// Not fmt::print, which throws when standard output is closed.
void MWPrintUsage() {
    std::fputs(MWUsageText().c_str(), stdout);
}
