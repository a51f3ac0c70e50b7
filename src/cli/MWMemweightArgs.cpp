#include "cli/MWMemweightArgs.h"

#include <fmt/format.h>
#include <fmt/ranges.h>
#include <getopt.h>
#include <strings.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <limits>

#include "cli/MWUsage.h"

namespace {

// Long options without a short form; above every character.
enum LongOnlyOption : int {
    OptionStatpack = 256,
    OptionPid,
    OptionSort,
    OptionPhysMemweight,
    OptionVmObjectDirty,
    OptionSwapped,
    OptionWired,
    OptionUnmapped,
    OptionSample,
    OptionVersion,
};

constexpr const char* kShortOptions = "aj:htp:x:svf:yw";

constexpr std::array<option, 21> kLongOptions = {{
    {"all", no_argument, nullptr, 'a'},
    {"json", required_argument, nullptr, 'j'},
    {"statpack", required_argument, nullptr, OptionStatpack},
    {"help", no_argument, nullptr, 'h'},
    {"targetChildren", no_argument, nullptr, 't'},
    {"proc", required_argument, nullptr, 'p'},
    {"pid", required_argument, nullptr, OptionPid},
    {"exclude", required_argument, nullptr, 'x'},
    {"skip", no_argument, nullptr, 's'},
    {"format", required_argument, nullptr, 'f'},
    {"sort", required_argument, nullptr, OptionSort},
    {"summary", no_argument, nullptr, 'y'},
    {"physMemweight", no_argument, nullptr, OptionPhysMemweight},
    {"vmObjectDirty", no_argument, nullptr, OptionVmObjectDirty},
    {"wide", no_argument, nullptr, 'w'},
    {"swapped", no_argument, nullptr, OptionSwapped},
    {"wired", no_argument, nullptr, OptionWired},
    {"unmapped", no_argument, nullptr, OptionUnmapped},
    {"sample", required_argument, nullptr, OptionSample},
    {"version", no_argument, nullptr, OptionVersion},
    {nullptr, 0, nullptr, 0},
}};

void warn(const char* message) {
    std::fputs(message, stderr);
}

tl::unexpected<MWError> failure(int code, std::optional<std::string> description = {}) {
    return tl::make_unexpected(MWError{MWMemweightError, code, std::move(description)});
}

}  // namespace

tl::expected<MWMemweightArgs, MWError> MWMemweightArgs::initWithArgc(int argc, char* const argv[]) {
    MWMemweightArgs args;
    if (auto parsed = args._parseOptions(argc, argv); !parsed) {
        return tl::make_unexpected(std::move(parsed.error()));
    }
    args._crossCheckUnmapped();
    // The scanner has moved the arguments that are no options behind those that are.
    for (int index = optind; index < argc; ++index) {
        args._potentialTargetProcesses.insert(argv[index]);
    }
    return args;
}

MWMemweightArgs::Outcome MWMemweightArgs::_parseOptions(int argc, char* const argv[]) {
    // 0 rather than 1: glibc then forgets everything of an earlier scan, one that ended within a group of
    // short options included.
    optind = 0;
    int option = 0;
    while ((option = getopt_long(argc, argv, kShortOptions, kLongOptions.data(), nullptr)) != -1) {
        if (auto applied = _applyOption(option, optarg); !applied) {
            return applied;
        }
    }
    return {};
}

MWMemweightArgs::Outcome MWMemweightArgs::_applyOption(int option, const char* argument) {
    switch (option) {
        case 'a':
            _targetAll = true;
            return {};
        case 'j':
            _JSONOutputFile = argument;
            return {};
        case OptionStatpack:
            _statpackOutputFile = argument;
            return {};
        case 'h':
            return failure(MWErrorHelp);
        case OptionVersion:
            return failure(MWErrorVersion);
        case 't':
            _targetChildren = true;
            return {};
        case 'p':
            _potentialTargetProcesses.insert(argument);
            return {};
        case OptionPid:
            return _applyPid(argument);
        case 'x':
            _excludedPidsOrProcesses.insert(argument);
            return {};
        case 's':
            _skipIdleExitClean = true;
            return {};
        case 'v':
            _spanlistLikeOutput = true;
            _summarize = false;
            return {};
        case 'f':
            return _applyFormat(argument);
        case OptionSort:
            return _applySort(argument);
        case 'y':
            warn("WARNING: -y/--summary options are deprecated because summary is the default mode\n");
            return {};
        case OptionPhysMemweight:
            warn("WARNING: --physMemweight option is deprecated because it is the default mode\n");
            return {};
        case OptionVmObjectDirty:
            _shouldGetPhysMemweightBreakdown = false;
            _didSetShouldGetPhysMemweightBreakdown = true;
            return {};
        case 'w':
            _textOptions |= MWTextWide;
            return {};
        case OptionSwapped:
            _textOptions |= MWTextShowSwapped;
            return {};
        case OptionWired:
            _textOptions |= MWTextShowWired;
            return {};
        case OptionUnmapped:
            _searchForUnmapped = true;
            return {};
        case OptionSample:
            return _applySample(argument);
        default:
            return failure(MWErrorOption);
    }
}

MWMemweightArgs::Outcome MWMemweightArgs::_applyFormat(const std::string& argument) {
    if (argument == "bytes") {
        _summaryFormat = MWSummaryFormat::bytes;
    } else if (argument == "formatted") {
        _summaryFormat = MWSummaryFormat::formatted;
    } else if (argument == "pages") {
        _summaryFormat = MWSummaryFormat::pages;
    } else {
        return failure(MWErrorFormat,
                       "Unrecognized argument to -f / --format.\n"
                       "Accepted arguments: 'bytes', 'formatted', 'pages'.");
    }
    return {};
}

MWMemweightArgs::Outcome MWMemweightArgs::_applySort(const std::string& argument) {
    const auto& columns = MWSortColumns();
    const auto column = std::find_if(columns.begin(), columns.end(), [&](const std::string& name) {
        return strcasecmp(name.c_str(), argument.c_str()) == 0;
    });
    if (column == columns.end()) {
        return failure(MWErrorSort,
                       fmt::format("Unrecognized argument '{}' to --sort.\nAccepted arguments: {}", argument,
                                   MWLowercased(fmt::format("{}", fmt::join(columns, ", ")))));
    }
    _textSort = *column;
    return {};
}

MWMemweightArgs::Outcome MWMemweightArgs::_applyPid(const char* argument) {
    char* end = nullptr;
    const long number = std::strtol(argument, &end, 10);
    if (end == argument) {
        return failure(MWErrorProcess, fmt::format("'{}' is not a valid integer for --pid.\n\n"
                                                   "Use -p / --proc if you meant to specify a process name.",
                                                   argument));
    }
    // A number that is too large must not wrap around to the pid of some innocent process.
    using Limits = std::numeric_limits<int32_t>;
    const long pid = std::clamp<long>(number, Limits::min(), Limits::max());
    _targetPids[static_cast<int32_t>(pid)] = std::nullopt;
    return {};
}

MWMemweightArgs::Outcome MWMemweightArgs::_applySample(const std::string& argument) {
    // from_chars rather than strtod: decimal only, and the same in every locale.
    double seconds = 0;
    const size_t blanks = std::min(argument.find_first_not_of(" \t\n"), argument.size());
    const size_t start = argument.substr(blanks).starts_with('+') ? blanks + 1 : blanks;
    std::from_chars(argument.data() + start, argument.data() + argument.size(), seconds);
    if (!std::isnormal(seconds) || seconds < 0) {
        return failure(MWErrorSample, fmt::format("Invalid sampling interval '{}'", argument));
    }
    _sampleInterval = seconds;
    return {};
}

void MWMemweightArgs::_crossCheckUnmapped() {
    if (!_searchForUnmapped) {
        return;
    }
    if (!_shouldGetPhysMemweightBreakdown) {
        warn(
            "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
            "support unmapped owned VM objects\n");
        _searchForUnmapped = false;
    } else if (_targetAll) {
        warn("NOTICE: '--unmapped' is redundant when using -a/--all\n");
        _searchForUnmapped = false;
    }
}
