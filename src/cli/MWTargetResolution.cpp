#include <fmt/format.h>
#include <fmt/printf.h>
#include <fmt/ranges.h>

#include <algorithm>
#include <cstdio>
#include <functional>
#include <memory>
#include <vector>

#include "cli/MWMemweightArgs.h"
#include "platform/MWHostInterface.h"
#include "platform/MWTerminalText.h"
#include "process/MWHeapsnapProcess.h"

namespace {

constexpr int32_t kKernelPid = 0;

MWError resolutionError(int code, std::string description) {
    return {MWMemweightError, code, std::move(description)};
}

std::vector<std::string> listOf(const std::set<std::string>& strings) {
    return {strings.begin(), strings.end()};
}

std::vector<int32_t> pidsOf(const MWPidMap& map) {
    std::vector<int32_t> pids;
    pids.reserve(map.size());
    for (const auto& [pid, name] : map) {
        pids.push_back(pid);
    }
    return pids;
}

/// Below all pids.
int64_t keyOfHeapsnap(const std::string& path) {
    return -1 - static_cast<int64_t>(std::hash<std::string>()(path) >> 1U);
}

/// All figures of one process are found by its pid: of two, be it two heapsnaps of one process or one from
/// another machine, neither would be right.
MWError secondProcessOfPid(int32_t pid) {
    return resolutionError(MWErrorUnreadableFile,
                           fmt::format("There is more than one target with pid {}: measure heapsnaps of the "
                                       "same pid one at a time",
                                       pid));
}

// Excluded processes are measured then, and descendants are left out.
void reportNoProcessList() {
    std::fputs("Unable to obtain system process list\n", stderr);
}

void reportUnreadable(int32_t pid, const std::optional<std::string>& name) {
    if (name) {
        fmt::fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n", MWErrorText(*name), pid);
    } else {
        fmt::fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", pid);
    }
}

}  // namespace

MWTargetResolution MWMemweightArgs::targetProcesses() {
    MWTargetMap heapsnaps;
    if (auto files = _resolveFiles(heapsnaps); !files) {
        return {.targets = {}, .error = files.error()};
    }
    if (_targetPids.empty() && _potentialTargetProcesses.empty() && heapsnaps.empty() && !_targetAll) {
        return {.targets = {},
                .error = resolutionError(MWErrorNoTarget, "Must specify at least one process or heapsnap")};
    }
    const std::set<int32_t> exclusions = _exclusions();
    if (_targetAll) {
        return {.targets = _withoutSkipped(MWProcess::allProcessesExcludingPids(exclusions)), .error = {}};
    }

    auto unmatched = _resolveDescriptions();
    _excludeTargets(exclusions);
    if (_targetChildren) {
        _addDescendants();
        // An excluded process stays excluded when it descends from a target, the tool itself above all.
        _excludeTargets(exclusions);
    }

    if (const auto pid = _pidMetTwice(heapsnaps)) {
        return {.targets = {}, .error = secondProcessOfPid(*pid)};
    }
    std::optional<MWTargetMap> targets = std::move(heapsnaps);
    if (_searchForUnmapped) {
        targets = _hiddenProcesses(exclusions);
    }
    if (targets) {
        _addTargetProcesses(*targets);
    }
    return {.targets = _withoutSkipped(std::move(targets)), .error = std::move(unmatched)};
}

/// Opens the heapsnaps and takes the descriptions that name a file out of `potentialTargetProcesses`.
MWMemweightArgs::Outcome MWMemweightArgs::_resolveFiles(MWTargetMap& heapsnaps) {
    for (const auto& path : listOf(_potentialTargetProcesses)) {
        if (!MWHostInterface::current().fileExists(path)) {
            continue;
        }
        if (auto resolved = _resolveFile(path, heapsnaps); !resolved) {
            return resolved;
        }
        _potentialTargetProcesses.erase(path);
    }
    return {};
}

/// A file that is no heapsnap can still bear the name of a process, which is then meant.
MWMemweightArgs::Outcome MWMemweightArgs::_resolveFile(const std::string& path, MWTargetMap& heapsnaps) {
    const auto heapsnap = MWHeapsnapProcess::processWithHeapsnap(path);
    if (heapsnap) {
        heapsnaps[keyOfHeapsnap(path)] = *heapsnap;
        return _adoptModeOf(**heapsnap, path);
    }
    const auto processes = MWProcess::pidsForStringDescriptions({path}, nullptr);
    if (!processes || processes->empty()) {
        return tl::make_unexpected(resolutionError(
            MWErrorUnreadableFile,
            fmt::format("Error opening heapsnap {}: {}", path, heapsnap.error().description.value_or(""))));
    }
    const auto& [pid, name] = *processes->begin();
    _targetPids[pid] = name;
    return {};
}

std::optional<int32_t> MWMemweightArgs::_pidMetTwice(const MWTargetMap& heapsnaps) const {
    std::set<int32_t> met;
    for (const auto& [key, heapsnap] : heapsnaps) {
        if (_targetPids.contains(heapsnap->pid()) || !met.insert(heapsnap->pid()).second) {
            return heapsnap->pid();
        }
    }
    return std::nullopt;
}

/// All figures of a run are of one mode: that of its heapsnaps, if it has any.
MWMemweightArgs::Outcome MWMemweightArgs::_adoptModeOf(const MWProcess& heapsnap, const std::string& path) {
    if (_didSetShouldGetPhysMemweightBreakdown &&
        _shouldGetPhysMemweightBreakdown != heapsnap.breakDownPhysMemweight()) {
        return tl::make_unexpected(resolutionError(
            MWErrorMode, fmt::format("Heapsnap was gathered with an analysis mode that conflicts with other "
                                     "heapsnaps or command line arguments: {}",
                                     path)));
    }
    _shouldGetPhysMemweightBreakdown = heapsnap.breakDownPhysMemweight();
    _didSetShouldGetPhysMemweightBreakdown = true;
    return {};
}

std::set<int32_t> MWMemweightArgs::_exclusions() const {
    std::set<int32_t> exclusions;
    if (_excludeSelf) {
        exclusions.insert(MWHostInterface::current().getpid());
    }
    if (!_excludedPidsOrProcesses.empty()) {
        const auto excluded = MWProcess::pidsForStringDescriptions(listOf(_excludedPidsOrProcesses), nullptr);
        if (!excluded) {
            reportNoProcessList();
        }
        for (const int32_t pid : pidsOf(excluded.value_or(MWPidMap{}))) {
            exclusions.insert(pid);
        }
    }
    return exclusions;
}

/// Adds what the remaining descriptions name to `targetPids`; the error tells which of them named nothing.
std::optional<MWError> MWMemweightArgs::_resolveDescriptions() {
    if (_potentialTargetProcesses.empty()) {
        return std::nullopt;  // pids alone need no look at all processes, which a sampling run would repeat
    }
    std::vector<std::string> messages;
    const auto found = MWProcess::pidsForStringDescriptions(listOf(_potentialTargetProcesses), &messages);
    for (const auto& [pid, name] : found.value_or(MWPidMap{})) {
        _targetPids[pid] = name;
    }
    if (messages.empty()) {
        return std::nullopt;
    }
    return resolutionError(MWErrorProcess, fmt::format("{}", fmt::join(messages, "\n")));
}

void MWMemweightArgs::_excludeTargets(const std::set<int32_t>& exclusions) {
    for (const int32_t pid : exclusions) {
        _targetPids.erase(pid);
    }
}

void MWMemweightArgs::_addDescendants() {
    const auto family = MWProcess::childPidsForPids(pidsOf(_targetPids));
    if (!family) {
        reportNoProcessList();
    }
    for (const int32_t pid : family.value_or(std::vector<int32_t>{})) {
        _targetPids[pid] = std::nullopt;
    }
}

std::optional<MWTargetMap> MWMemweightArgs::_hiddenProcesses(const std::set<int32_t>& exclusions) const {
    std::set<int32_t> excluded = exclusions;
    excluded.insert(kKernelPid);
    for (const int32_t pid : pidsOf(_targetPids)) {
        excluded.insert(pid);
    }
    auto hidden = MWProcess::allProcessesExcludingPids(excluded);
    if (hidden) {
        for (const auto& [pid, process] : *hidden) {
            process->setHiddenFromDisplay(true);
        }
    }
    return hidden;
}

void MWMemweightArgs::_addTargetProcesses(MWTargetMap& targets) const {
    for (const auto& [pid, name] : _targetPids) {
        if (auto process = MWProcess::processWithPid(pid)) {
            targets[pid] = std::move(process);
        } else {
            reportUnreadable(pid, name);
        }
    }
}

std::optional<MWTargetMap> MWMemweightArgs::_withoutSkipped(std::optional<MWTargetMap> targets) const {
    if (targets && _skipIdleExitClean) {
        return MWProcess::removeIdleExitCleanProcessesFrom(*targets);
    }
    return targets;
}
