#pragma once

#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <tl/expected.hpp>
#include <utility>

#include "output/MWOutputFormatterText.h"
#include "platform/MWError.h"
#include "process/MWProcess.h"

/// Codes of MWError in the domain MWMemweightError.
enum MWMemweightErrorCode : int {
    MWErrorHelp = 1,
    MWErrorFormat = 2,
    MWErrorSort = 3,
    /// A `--pid` argument without digits; also descriptions that matched no process.
    MWErrorProcess = 4,
    MWErrorOption = 5,
    MWErrorMode = 6,
    MWErrorUnreadableFile = 7,
    MWErrorNoTarget = 8,
    MWErrorSample = 9,
    /// `--version`: nothing failed, but there is nothing to measure, as with help.
    MWErrorVersion = 10,
};

/// What target resolution found. No map when it failed; a map with an error beside it when some names
/// matched nothing and resolution went on without them.
struct MWTargetResolution {
    std::optional<MWTargetMap> targets;
    std::optional<MWError> error;
};

/// The parsed command line: what to measure and how to show it. Target resolution is an operation of the
/// record and changes it: file paths leave `potentialTargetProcesses`, every pid it finds enters
/// `targetPids`.
class MWMemweightArgs {
public:
    /// The record of a command line without arguments.
    MWMemweightArgs() = default;

    /// Parses `argv`, whose elements are reordered: options first. Deprecation warnings and the option
    /// scanner's own diagnostics go to standard error. Not safe beside another use of getopt.
    static tl::expected<MWMemweightArgs, MWError> initWithArgc(int argc, char* const argv[]);

    /// Takes a new snapshot of the system and makes new process objects with each call. Prints a line on
    /// standard error for each pid that cannot be read.
    MWTargetResolution targetProcesses();

    /// Every descendant of a target is a target too.
    bool targetChildren() const { return _targetChildren; }
    void setTargetChildren(bool targetChildren) { _targetChildren = targetChildren; }
    bool targetAll() const { return _targetAll; }
    void setTargetAll(bool targetAll) { _targetAll = targetAll; }
    bool skipIdleExitClean() const { return _skipIdleExitClean; }
    void setSkipIdleExitClean(bool skip) { _skipIdleExitClean = skip; }
    /// List every region of the address spaces.
    bool spanlistLikeOutput() const { return _spanlistLikeOutput; }
    void setSpanlistLikeOutput(bool spanlistLike) { _spanlistLikeOutput = spanlistLike; }
    bool summarize() const { return _summarize; }
    void setSummarize(bool summarize) { _summarize = summarize; }
    /// The analysis mode: each process's physical charge broken down by region, or dirty memory as the
    /// kernel's VM objects say.
    bool shouldGetPhysMemweightBreakdown() const { return _shouldGetPhysMemweightBreakdown; }
    void setShouldGetPhysMemweightBreakdown(bool should) { _shouldGetPhysMemweightBreakdown = should; }
    /// The analysis mode was chosen and must not change any more.
    bool didSetShouldGetPhysMemweightBreakdown() const { return _didSetShouldGetPhysMemweightBreakdown; }
    void setDidSetShouldGetPhysMemweightBreakdown(bool did) { _didSetShouldGetPhysMemweightBreakdown = did; }
    /// Read all other processes too, for unmapped memory that the targets own.
    bool searchForUnmapped() const { return _searchForUnmapped; }
    void setSearchForUnmapped(bool search) { _searchForUnmapped = search; }
    bool excludeSelf() const { return _excludeSelf; }
    void setExcludeSelf(bool excludeSelf) { _excludeSelf = excludeSelf; }

    MWSummaryFormat summaryFormat() const { return _summaryFormat; }
    void setSummaryFormat(MWSummaryFormat summaryFormat) { _summaryFormat = summaryFormat; }
    MWTextOptions textOptions() const { return _textOptions; }
    void setTextOptions(MWTextOptions textOptions) { _textOptions = textOptions; }
    /// One of MWSortColumns.
    const std::string& textSort() const { return _textSort; }
    void setTextSort(std::string textSort) { _textSort = std::move(textSort); }
    const std::optional<std::string>& JSONOutputFile() const { return _JSONOutputFile; }
    void setJSONOutputFile(std::optional<std::string> path) { _JSONOutputFile = std::move(path); }
    const std::optional<std::string>& statpackOutputFile() const { return _statpackOutputFile; }
    void setStatpackOutputFile(std::optional<std::string> path) { _statpackOutputFile = std::move(path); }

    const MWPidMap& targetPids() const { return _targetPids; }
    void setTargetPids(MWPidMap targetPids) { _targetPids = std::move(targetPids); }
    /// Names, pids written as text and file paths, still to be told apart.
    const std::set<std::string>& potentialTargetProcesses() const { return _potentialTargetProcesses; }
    void setPotentialTargetProcesses(std::set<std::string> targets) {
        _potentialTargetProcesses = std::move(targets);
    }
    const std::set<std::string>& excludedPidsOrProcesses() const { return _excludedPidsOrProcesses; }
    void setExcludedPidsOrProcesses(std::set<std::string> excluded) {
        _excludedPidsOrProcesses = std::move(excluded);
    }
    /// Seconds; 0 for a single measurement.
    double sampleInterval() const { return _sampleInterval; }
    void setSampleInterval(double seconds) { _sampleInterval = seconds; }

private:
    using Outcome = tl::expected<void, MWError>;

    Outcome _parseOptions(int argc, char* const argv[]);
    Outcome _applyOption(int option, const char* argument);
    Outcome _applyFormat(const std::string& argument);
    Outcome _applySort(const std::string& argument);
    Outcome _applyPid(const char* argument);
    Outcome _applySample(const std::string& argument);
    void _crossCheckUnmapped();

    Outcome _resolveFiles(MWTargetMap& heapsnaps);
    Outcome _resolveFile(const std::string& path, MWTargetMap& heapsnaps);
    std::optional<int32_t> _pidMetTwice(const MWTargetMap& heapsnaps) const;
    Outcome _adoptModeOf(const MWProcess& heapsnap, const std::string& path);
    std::set<int32_t> _exclusions() const;
    std::optional<MWError> _resolveDescriptions();
    void _addDescendants();
    void _excludeTargets(const std::set<int32_t>& exclusions);
    std::optional<MWTargetMap> _hiddenProcesses(const std::set<int32_t>& exclusions) const;
    void _addTargetProcesses(MWTargetMap& targets) const;
    std::optional<MWTargetMap> _withoutSkipped(std::optional<MWTargetMap> targets) const;

    bool _targetChildren = false;
    bool _targetAll = false;
    bool _skipIdleExitClean = false;
    bool _spanlistLikeOutput = false;
    bool _summarize = true;
    bool _shouldGetPhysMemweightBreakdown = true;
    bool _didSetShouldGetPhysMemweightBreakdown = false;
    bool _searchForUnmapped = false;
    bool _excludeSelf = true;
    MWSummaryFormat _summaryFormat = MWSummaryFormat::formatted;
    MWTextOptions _textOptions = 0;
    std::string _textSort = MWSortColumns().front();
    std::optional<std::string> _JSONOutputFile;
    std::optional<std::string> _statpackOutputFile;
    MWPidMap _targetPids;
    std::set<std::string> _potentialTargetProcesses;
    std::set<std::string> _excludedPidsOrProcesses;
    double _sampleInterval = 0;
};
