#include <fmt/core.h>

#include <algorithm>
#include <charconv>
#include <cstddef>
#include <functional>
#include <iterator>
#include <memory>
#include <new>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

#include "platform/MWHostInterface.h"
#include "platform/MWWorkQueue.h"
#include "process/MWKernelProcess.h"
#include "process/MWProcess.h"
#include "process/MWUnresponsiveProcess.h"
#include "process/MWUserProcess.h"

namespace {

using ProcessSnapshot = std::vector<proc_bsdinfo>;
using Record = std::optional<proc_bsdinfo>;

/// Processes that may start between asking for their number and asking for them.
constexpr size_t kRoomForNewPids = 20;

std::optional<std::vector<int32_t>> listAllPids() {
    MWHostInterface& host = MWHostInterface::current();
    const int expected = host.proc_listallpids({});
    if (expected < 0) {
        return std::nullopt;
    }
    std::vector<int32_t> pids(static_cast<size_t>(expected) + kRoomForNewPids);
    const int found = host.proc_listallpids(pids);
    if (found < 0) {
        return std::nullopt;
    }
    pids.resize(std::min(pids.size(), static_cast<size_t>(found)));
    return pids;
}

Record recordOfPid(int32_t pid) {
    proc_bsdinfo info = {};
    if (MWHostInterface::current().proc_pidinfo(pid, info) != static_cast<int>(sizeof(info))) {
        return std::nullopt;
    }
    return info;
}

/// What `make` makes of each of 0 ... count - 1; where the system does not answer, what `instead` makes.
template <class Result>
std::vector<Result> makeEach(size_t count, const std::function<Result(size_t)>& make,
                             const std::function<Result(size_t)>& instead) {
    const auto results = std::make_shared<std::vector<Result>>(count);
    const MWConcurrentQueue queue("org.memweight.memweight.processes", QOS_CLASS_UTILITY);
    const auto stuck = queue.apply(count, [results, make](size_t index) { (*results)[index] = make(index); });
    if (stuck.empty()) {
        return std::move(*results);
    }
    std::vector<Result> answered(count);
    for (size_t index = 0; index < count; ++index) {
        const bool isStuck = std::ranges::binary_search(stuck, index);
        answered[index] = isStuck ? instead(index) : std::move((*results)[index]);
    }
    return answered;
}

/// Of a record that holds nothing but a pid, as the system does not answer about the process.
constexpr uint32_t kNotResponding = 1U << 31U;

bool isResponding(const proc_bsdinfo& info) {
    return (info.pbi_flags & kNotResponding) == 0;
}

Record recordOfPidAlone(int32_t pid) {
    proc_bsdinfo info = {};
    info.pbi_pid = static_cast<uint32_t>(pid);
    info.pbi_flags = kNotResponding;
    return info;
}

/// Those of the pids that are there, in their order.
std::vector<Record> recordsOfPids(const std::vector<int32_t>& pids) {
    return makeEach<Record>(
        pids.size(), [pids](size_t index) { return recordOfPid(pids[index]); },
        [&](size_t index) { return recordOfPidAlone(pids[index]); });
}

/// The processes of those of the pids that are there, in their order; null when none is.
std::shared_ptr<const ProcessSnapshot> snapshotOf(const std::vector<int32_t>& pids) {
    auto snapshot = std::make_shared<ProcessSnapshot>();
    snapshot->reserve(pids.size());
    for (const Record& record : recordsOfPids(pids)) {
        if (record) {
            snapshot->push_back(*record);
        }
    }
    return snapshot->empty() ? nullptr : std::move(snapshot);
}

/// Every process there is now, in the order of the system's list; null when there is no telling.
std::shared_ptr<const ProcessSnapshot> takeSnapshot() {
    const auto pids = listAllPids();
    return pids ? snapshotOf(*pids) : nullptr;
}

int32_t pidOf(const proc_bsdinfo& info) {
    return static_cast<int32_t>(info.pbi_pid);
}
int32_t parentOf(const proc_bsdinfo& info) {
    return static_cast<int32_t>(info.pbi_ppid);
}

template <size_t N>
std::string_view textOf(const std::array<char, N>& field) {
    return {field.data(), static_cast<size_t>(std::find(field.begin(), field.end(), '\0') - field.begin())};
}

std::string_view lastPathComponent(std::string_view path) {
    const size_t end = path.find_last_not_of('/');
    if (end == std::string_view::npos) {
        return path.substr(0, 1);
    }
    path = path.substr(0, end + 1);
    return path.substr(path.rfind('/') + 1);
}

/// The executable's path: the first text behind the 32-bit argument count, or empty.
std::string_view executablePathInArgumentArea(std::string_view area) {
    area.remove_prefix(std::min(area.size(), sizeof(int32_t)));
    area.remove_prefix(std::min(area.size(), area.find_first_not_of('\0')));
    return area.substr(0, area.find('\0'));
}

std::optional<std::string> executableNameOfPid(int32_t pid) {
    MWHostInterface& host = MWHostInterface::current();
    uint64_t maximum = 0;
    if (host.sysctlArgumentMaximum(maximum) != 0) {
        return std::nullopt;
    }
    // Megabytes of which a few hundred bytes get used: the buffer stays untouched where nothing is written.
    thread_local std::unique_ptr<char[]> buffer;
    thread_local uint64_t room = 0;
    if (room < maximum) {
        buffer.reset(new (std::nothrow) char[maximum]);
        room = buffer == nullptr ? 0 : maximum;
    }
    size_t length = 0;
    if (buffer == nullptr || host.sysctlArgumentArea(pid, {buffer.get(), maximum}, length) != 0) {
        return std::nullopt;
    }
    const std::string_view path =
        executablePathInArgumentArea({buffer.get(), std::min<size_t>(length, maximum)});
    return path.empty() ? std::nullopt : std::optional<std::string>(lastPathComponent(path));
}

/// The integer that a description begins with: white space, an optional sign, digits, anything. A number too
/// large for any pid stays too large.
std::optional<int64_t> leadingInteger(std::string_view text) {
    text.remove_prefix(std::min(text.size(), text.find_first_not_of(" \t\n\v\f\r")));
    const bool negative = text.starts_with('-');
    if (negative || text.starts_with('+')) {
        text.remove_prefix(1);
    }
    if (text.empty() || text.front() < '0' || text.front() > '9') {
        return std::nullopt;
    }
    int64_t number = 0;
    if (std::from_chars(text.data(), text.data() + text.size(), number).ec != std::errc()) {
        number = INT64_MAX;
    }
    return negative ? -number : number;
}

/// Matches descriptions against one snapshot. A process's name costs a read of its argument area, so it is
/// read once for the snapshot's life.
class DescriptionMatcher {
public:
    explicit DescriptionMatcher(const std::shared_ptr<const ProcessSnapshot>& snapshot)
        : _snapshot(*snapshot),
          _names(makeEach<std::string>(
              snapshot->size(),
              [snapshot](size_t index) { return MWProcess::_nameForBsdInfo((*snapshot)[index]); },
              [&](size_t index) { return MWProcess::_nameForBsdInfoCommName(_snapshot[index]); })) {}

    /// Adds what `description` selects to `pids`; false when that is nothing.
    bool match(const std::string& description, MWPidMap& pids) {
        const std::optional<int64_t> number = leadingInteger(description);
        bool matched = false;
        for (size_t index = 0; index < _snapshot.size(); ++index) {
            const int32_t pid = pidOf(_snapshot[index]);
            if (_names[index] == description) {
                pids[pid] = description;
                matched = true;
            } else if (number == pid) {
                pids[pid] = std::nullopt;
                return true;
            }
        }
        return matched;
    }

private:
    const ProcessSnapshot& _snapshot;
    std::vector<std::string> _names;
};

/// As much of the system's list as matching the descriptions meets: the walk for a pid ends at that process.
/// Null when there is no telling.
std::shared_ptr<const ProcessSnapshot> takeSnapshotFor(const std::vector<std::string>& descriptions) {
    const auto pids = listAllPids();
    if (!pids) {
        return nullptr;
    }
    auto last = pids->begin();
    for (const std::string& description : descriptions) {
        const auto met = std::ranges::find(*pids, leadingInteger(description));
        if (met == pids->end()) {
            return snapshotOf(*pids);
        }
        last = std::max(last, met + 1);
    }
    const auto snapshot = snapshotOf({pids->begin(), last});
    const bool meetsAll =
        snapshot && std::ranges::all_of(descriptions, [&](const std::string& description) {
            return std::ranges::find(*snapshot, leadingInteger(description), pidOf) != snapshot->end();
        });
    return meetsAll ? snapshot : snapshotOf(*pids);
}

/// Parent to the places of its children in the snapshot.
using ChildrenByParent = std::unordered_map<int32_t, std::vector<size_t>>;

ChildrenByParent childrenByParent(const ProcessSnapshot& snapshot) {
    ChildrenByParent children;
    for (size_t index = 0; index < snapshot.size(); ++index) {
        if (isResponding(snapshot[index])) {
            children[parentOf(snapshot[index])].push_back(index);
        }
    }
    return children;
}

/// The places of all children of pids[from...], in snapshot order.
std::vector<size_t> childrenOfGeneration(const ChildrenByParent& children, const std::vector<int32_t>& pids,
                                         size_t from) {
    std::vector<size_t> places;
    for (size_t index = from; index < pids.size(); ++index) {
        if (const auto found = children.find(pids[index]); found != children.end()) {
            places.insert(places.end(), found->second.begin(), found->second.end());
        }
    }
    std::sort(places.begin(), places.end());
    return places;
}

/// Null for those that cannot be made.
std::vector<std::shared_ptr<MWProcess>> makeProcesses(ProcessSnapshot snapshot) {
    const auto records = std::make_shared<const ProcessSnapshot>(std::move(snapshot));
    return makeEach<std::shared_ptr<MWProcess>>(
        records->size(), [records](size_t index) { return MWProcess::processWithBsdInfo((*records)[index]); },
        [&](size_t index) { return std::make_shared<MWUnresponsiveProcess>((*records)[index]); });
}

}  // namespace

std::shared_ptr<MWProcess> MWProcess::processWithPid(int32_t pid) {
    const Record info = recordsOfPids({pid}).front();
    return info ? makeProcesses({*info}).front() : nullptr;
}

std::shared_ptr<MWProcess> MWProcess::processWithBsdInfo(const proc_bsdinfo& info) {
    if (!isResponding(info)) {
        return std::make_shared<MWUnresponsiveProcess>(info);
    }
    if ((info.pbi_flags & PROC_FLAG_SYSTEM) != 0) {
        return MWKernelProcess::initWithBsdInfo(info);
    }
    return MWUserProcess::initWithBsdInfo(info);
}

std::string MWProcess::_nameForBsdInfo(const proc_bsdinfo& info) {
    auto name = isResponding(info) ? executableNameOfPid(pidOf(info)) : std::nullopt;
    return name ? *std::move(name) : _nameForBsdInfoCommName(info);
}

std::string MWProcess::_nameForBsdInfoCommName(const proc_bsdinfo& info) {
    if (info.pbi_name.front() != '\0') {
        return std::string(textOf(info.pbi_name));
    }
    if (info.pbi_comm.front() != '\0') {
        return std::string(textOf(info.pbi_comm));
    }
    return "Unknown";
}

std::optional<MWTargetMap> MWProcess::allProcessesExcludingPids(const std::set<int32_t>& excludedPids) {
    const auto snapshot = takeSnapshot();
    if (!snapshot) {
        return std::nullopt;
    }
    ProcessSnapshot wanted;
    std::ranges::copy_if(*snapshot, std::back_inserter(wanted),
                         [&](const proc_bsdinfo& info) { return !excludedPids.contains(pidOf(info)); });
    MWTargetMap processes;
    for (auto& process : makeProcesses(std::move(wanted))) {
        if (process != nullptr) {
            processes[process->asNumber()] = std::move(process);
        }
    }
    return processes;
}

std::optional<MWPidMap> MWProcess::pidsForStringDescriptions(const std::vector<std::string>& descriptions,
                                                             std::vector<std::string>* errors) {
    const auto addError = [errors](std::string message) {
        if (errors != nullptr) {
            errors->push_back(std::move(message));
        }
    };
    const auto snapshot = takeSnapshotFor(descriptions);
    if (!snapshot) {
        addError("Unable to obtain system process list");
        return std::nullopt;
    }
    DescriptionMatcher matcher(snapshot);
    MWPidMap pids;
    for (const std::string& description : descriptions) {
        if (!matcher.match(description, pids)) {
            addError(fmt::format("Unable to find pid for process matching '{}'", description));
        }
    }
    return pids;
}

std::optional<std::vector<int32_t>> MWProcess::childPidsForPids(const std::vector<int32_t>& pids) {
    const auto snapshot = takeSnapshot();
    if (!snapshot) {
        return std::nullopt;
    }
    const ChildrenByParent children = childrenByParent(*snapshot);
    std::vector<int32_t> result;
    // Pid 0 is its own parent: only what is new goes on to the next generation.
    std::unordered_set<int32_t> known;
    const auto add = [&](int32_t pid) {
        if (known.insert(pid).second) {
            result.push_back(pid);
        }
    };
    std::for_each(pids.begin(), pids.end(), add);
    for (size_t generation = 0; generation < result.size();) {
        const auto places = childrenOfGeneration(children, result, generation);
        generation = result.size();
        for (const size_t place : places) {
            add(pidOf((*snapshot)[place]));
        }
    }
    return result;
}

MWTargetMap MWProcess::removeIdleExitCleanProcessesFrom(const MWTargetMap& processes) {
    MWTargetMap remaining = processes;
    for (const auto& [key, process] : processes) {
        if (process->idleExitStatus() == IdleExitClean) {
            remaining.erase(process->asNumber());
        }
    }
    return remaining;
}
