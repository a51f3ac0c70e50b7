#include "cli/MWEntry.h"

#include <fmt/printf.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <iterator>
#include <memory>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "analysis/MWMemweight.h"
#include "cli/MWSampling.h"
#include "cli/MWUsage.h"
#include "cli/MWVersion.h"
#include "output/MWOutputFormatterJSON.h"
#include "output/MWOutputFormatterStatpack.h"
#include "platform/MWHostInterface.h"
#include "platform/MWOutputPlace.h"
#include "platform/MWTerminalText.h"

namespace {

constexpr int kSuccess = 0;
constexpr int kFailure = 1;

using Formatters = std::vector<std::unique_ptr<MWOutputFormatter>>;

// Messages are written with the C library's functions or fmt::fprintf, never fmt::print: a closed standard
// error must not end the run with an exception.

void printDescription(const std::optional<MWError>& error) {
    if (error && error->description) {
        fmt::fprintf(stderr, "%s\n", *error->description);
    }
}

int rejectArguments(const MWError& error) {
    const auto isRequest = [&](int code) { return error.domain == MWMemweightError && error.code == code; };
    if (isRequest(MWErrorVersion)) {
        MWPrintVersion("memweight");
        return kSuccess;
    }
    printDescription(error);
    MWPrintUsage();
    return isRequest(MWErrorHelp) ? kSuccess : kFailure;
}

bool needsRoot(const MWMemweightArgs& args) {
    return args.targetAll() || args.searchForUnmapped();
}

/// Appends the formatter that writes to the file, if one is named; false when the file cannot be written.
template <class Formatter>
bool appendFileFormatter(Formatters& formatters, const std::optional<std::string>& path,
                         const char* failure) {
    if (!path) {
        return true;
    }
    if (auto formatter = Formatter::initWithPath(*path)) {
        formatters.push_back(std::move(formatter));
        return true;
    }
    std::fputs(failure, stderr);
    return false;
}

bool isRegularFile(const std::string& path) {
    std::error_code error;
    return std::filesystem::is_regular_file(path, error);
}

/// Two names of one file, there already or not yet. Devices and pipes take everything.
bool areOneFile(const std::string& one, const std::string& other) {
    std::error_code error;
    if (std::filesystem::exists(one, error) || std::filesystem::exists(other, error)) {
        return isRegularFile(one) && std::filesystem::equivalent(one, other, error);
    }
    const auto place = MWOutputPlace::find(one);
    const auto otherPlace = MWOutputPlace::find(other);
    return place && otherPlace && place->isSameAs(*otherPlace);
}

/// A file that two outputs would be written to, or that is a heapsnap to be read and an output as well.
std::optional<std::string> fileOfTwoUses(const MWMemweightArgs& args) {
    // Where the report goes, unless that is a terminal or a pipe.
    std::vector<std::string> others = {"/proc/self/fd/" + std::to_string(STDOUT_FILENO)};
    std::ranges::copy_if(
        args.potentialTargetProcesses(), std::back_inserter(others),
        [](const std::string& target) { return MWHostInterface::current().fileExists(target); });
    for (const auto& output : {args.JSONOutputFile(), args.statpackOutputFile()}) {
        const auto isSame = [&output](const std::string& other) { return areOneFile(other, *output); };
        if (output && std::ranges::any_of(others, isSame)) {
            return output;
        }
        if (output) {
            others.push_back(*output);
        }
    }
    return std::nullopt;
}

/// Text first. None when an output file cannot be written; the user has then been told which.
std::optional<Formatters> createFormatters(const MWMemweightArgs& args) {
    Formatters formatters;
    formatters.push_back(std::make_unique<MWOutputFormatterText>(
        MWTextStyle{.summaryFormat = args.summaryFormat(),
                    .options = args.textOptions(),
                    .sort = args.textSort(),
                    .isForTerminal = MWHostInterface::current().isatty(STDOUT_FILENO)}));
    const bool created = appendFileFormatter<MWOutputFormatterJSON>(formatters, args.JSONOutputFile(),
                                                                    "Unable to create JSON output\n") &&
                         appendFileFormatter<MWOutputFormatterStatpack>(formatters, args.statpackOutputFile(),
                                                                        "Unable to create statpack output\n");
    return created ? std::optional(std::move(formatters)) : std::nullopt;
}

/// None when there is nothing to measure; the user has then been told why.
std::optional<MWTargetMap> resolveTargets(MWMemweightArgs& args) {
    MWTargetResolution resolution = args.targetProcesses();
    if (!resolution.targets) {
        printDescription(resolution.error);
        MWPrintUsage();
        return std::nullopt;
    }
    if (resolution.targets->empty()) {
        std::fputs(
            "Unable to find any processes matching the supplied process names or pids (try as root?)\n",
            stderr);
        return std::nullopt;
    }
    printDescription(resolution.error);
    return std::move(resolution.targets);
}

/// An output file of a failed run would pass for the result of a good one.
int removeOutputFiles(const MWMemweightArgs& args) {
    for (const auto& path : {args.JSONOutputFile(), args.statpackOutputFile()}) {
        if (path) {
            MWHostInterface::current().unlinkRegularFile(*path);
        }
    }
    return kFailure;
}

/// Where a terminal shows the report, an interrupt ends the run as in any other program. Elsewhere it ends
/// the gathering only, so that a report in a file is complete.
void gatherAndAnalyze(MWMemweight& memweight) {
    std::unique_ptr<MWInterruptSource> interrupt;
    if (!MWHostInterface::current().isatty(STDOUT_FILENO)) {
        interrupt = MWMemweight::installCancelHandler([&memweight] {
            memweight.cancel();
            std::fputs("Exiting early due to SIGINT\n", stderr);
        });
    }
    memweight.gatherData();
    memweight.analyzeData();
}

/// Answers the measurement, which still holds everything that was gathered.
std::unique_ptr<MWMemweight> measure(const MWMemweightArgs& args, const MWTargetMap& targets,
                                     const Formatters& formatters) {
    std::vector<std::shared_ptr<MWProcess>> processes;
    processes.reserve(targets.size());
    for (const auto& [pid, process] : targets) {
        processes.push_back(process);
    }
    auto memweight = std::make_unique<MWMemweight>(std::move(processes));
    gatherAndAnalyze(*memweight);
    for (const auto& formatter : formatters) {
        memweight->addOutputFormatter(*formatter);
    }
    memweight->printOutputVerbose({.verbose = args.spanlistLikeOutput(), .summarize = args.summarize()});
    return memweight;
}

}  // namespace

int MWMemweightMain(int argc, char* const argv[], MWKeptUntilExit* kept) {
    auto args = MWMemweightArgs::initWithArgc(argc, argv);
    if (!args) {
        return rejectArguments(args.error());
    }
    return MWRunMemweight(*args, kept);
}

int MWRunMemweight(MWMemweightArgs& args, MWKeptUntilExit* kept) {
    // Before the formatters are made: a document records the mode when it is opened.
    const bool breaksDown = args.shouldGetPhysMemweightBreakdown();
    if (breaksDown) {
        MWMemweight::setBreakDownPhysMemweight(true);
    }
    if (needsRoot(args) && MWHostInterface::current().geteuid() != 0) {
        std::fputs("Must run as root.\n", stderr);
        return kFailure;
    }
    if (const auto path = fileOfTwoUses(args)) {
        fmt::fprintf(stderr, "%s would be both read and written, or written twice.\n", MWErrorText(*path));
        return kFailure;
    }
    // Before the targets are resolved: an output that cannot be written fails before any process is read.
    const auto formatters = createFormatters(args);
    if (!formatters) {
        return removeOutputFiles(args);
    }
    auto targets = resolveTargets(args);
    if (!targets) {
        return removeOutputFiles(args);
    }
    if (breaksDown && !args.shouldGetPhysMemweightBreakdown()) {
        std::fputs("NOTICE: The heapsnap was recorded with --vmObjectDirty. Give that option here as well.\n",
                   stderr);
    }
    bool succeeded = true;
    if (args.sampleInterval() != 0) {
        targets.reset();  // they do exist: each sample resolves them anew
        succeeded = MWSampling(args, *formatters).run();
    } else {
        std::shared_ptr<MWMemweight> measurement = measure(args, *targets, *formatters);
        if (kept != nullptr) {
            *kept = std::move(measurement);
        }
    }
    for (const auto& formatter : *formatters) {
        formatter->close();
    }
    return succeeded ? kSuccess : removeOutputFiles(args);
}
