#include "analysis/MWMemweight.h"

#include <algorithm>
#include <map>
#include <mutex>
#include <ranges>
#include <utility>

#include "platform/MWHeap.h"
#include "platform/MWHostInterface.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "process/MWUnresponsiveProcess.h"

namespace {

/// The processes that threads of earlier measurements still wait for, so that a run of many samples loses
/// neither ten seconds nor a thread to one of them again and again.
class StuckProcesses {
public:
    static void add(const std::shared_ptr<MWProcess>& process) {
        const std::lock_guard lock(_mutex);
        _processes[process->asNumber()] = process;
    }
    static bool contain(const MWProcess& process) {
        const std::lock_guard lock(_mutex);
        const auto found = _processes.find(process.asNumber());
        return found != _processes.end() && !found->second.expired();
    }

private:
    inline static std::mutex _mutex;  ///< guards what follows
    inline static std::map<int64_t, std::weak_ptr<MWProcess>> _processes;
};

}  // namespace

MWMemweight::MWMemweight(MWProcessList processes) : _processes(std::move(processes)) {}

bool MWMemweight::breakDownPhysMemweight() {
    return MWPhysMemweightSwitch::isOn();
}

void MWMemweight::setBreakDownPhysMemweight(bool on) {
    MWPhysMemweightSwitch::set(on);
}

std::unique_ptr<MWInterruptSource> MWMemweight::installCancelHandler(std::function<void()> handler) {
    return std::make_unique<MWInterruptSource>(std::move(handler));
}

MWProcessList MWMemweight::_processesBySortingPidDesc(MWProcessList processes) {
    std::ranges::stable_sort(processes, std::ranges::greater(),
                             [](const auto& process) { return process->pid(); });
    return processes;
}

// One that takes long must not be begun when all the others are done and the other processors have nothing
// left to do.
MWProcessList MWMemweight::_longestFirst(MWProcessList processes) {
    std::stable_partition(processes.begin(), processes.end(),
                          [](const auto& process) { return process->takesLongToGather(); });
    return processes;
}

bool MWMemweight::gatherData() {
    // Most have some dozens of regions.
    constexpr size_t kKeptOfProcess = 20000;
    _gatherStartTime = MWTime::now();
    MWHostInterface::current().beginSurvey();
    MWProcessList processes = _processesBySortingPidDesc(_processes);
    std::erase_if(processes, [this](const std::shared_ptr<MWProcess>& process) {
        const bool isStuck = StuckProcesses::contain(*process);
        if (isStuck) {
            _replaceUnresponsive(process);
        }
        return isStuck;
    });
    processes = _takeStep(processes, 0, [](MWProcess& process) { process.prepareToGatherData(); });
    // Those of an earlier measurement, which may still be printed, have what they need.
    std::erase_if(processes, [](const auto& process) { return process->memoryRegions().has_value(); });
    processes = _takeStep(_longestFirst(std::move(processes)), kKeptOfProcess,
                          [](MWProcess& process) { process.gatherData(); });
    if (_gathering->stoppedEarly && !processes.empty()) {
        _processesBySortingPidDesc(std::move(processes))
            .back()
            ->_addGlobalError("Memweight exited early due to SIGINT and did not finish gathering all data");
    }
    _gatherEndTime = MWTime::now();
    return _gathering->stoppedEarly;
}

/// Answers those that took it. One that does not get any further is reported as an error: in its place comes
/// another process object, because nobody but the thread that was given up may touch it any more.
MWProcessList MWMemweight::_takeStep(const MWProcessList& processes, size_t bytesKept,
                                     const GatheringStep& step) {
    MWConcurrentQueue queue("org.memweight.memweight.gatherdata", _qualityOfService);
    queue.setBytesKeptOfItem(bytesKept);
    const auto items = std::make_shared<MWProcessList>(processes);
    const auto stuck = queue.apply(items->size(), [items, step, gathering = _gathering](size_t index) {
        if (gathering->earlyExit) {
            gathering->stoppedEarly = true;
        } else {
            step(*(*items)[index]);
        }
    });
    MWProcessList remaining;
    for (size_t index = 0; index < processes.size(); ++index) {
        if (!std::ranges::binary_search(stuck, index)) {
            remaining.push_back(processes[index]);
            (*items)[index].reset();  // a thread that was given up keeps its own process alone
            continue;
        }
        StuckProcesses::add(processes[index]);
        _replaceUnresponsive(processes[index]);
    }
    return remaining;
}

void MWMemweight::_replaceUnresponsive(const std::shared_ptr<MWProcess>& stuck) {
    std::ranges::replace(_processes, stuck,
                         std::shared_ptr<MWProcess>(std::make_shared<MWUnresponsiveProcess>(*stuck)));
}

void MWMemweight::analyzeData() {
    _pidToMemweight.clear();
    size_t regions = 0;
    for (const auto& process : _processes) {
        regions += _regionsOf(*process).size();
    }
    constexpr size_t kMadeOfRegion = 300;
    MWExpectAllocations(regions * kMadeOfRegion);
    _objectMaps.emplace(_processes.size(), regions);
    for (const auto& process : _processes) {
        _addProcess(*process);
    }
    _objectCount = _objectMaps->objects().size();
    finalizeObjects();
    _buildProcessToMemweightMap();
}

void MWMemweight::_addProcess(const MWProcess& process) {
    const bool regionsHaveOwners = breakDownPhysMemweight();
    for (const auto& region : _regionsOf(process)) {
        MWMemoryObject& object = _objectMaps->objectForRegion(*region, process);
        object.addRegion(region, &process);
        if (regionsHaveOwners && region->ownedExclusivelyByParentProcess()) {
            object.setOwnerPid(process.pid());
        }
        region->setMemoryObject(&object);
    }
}

void MWMemweight::finalizeObjects() {
    for (const auto& object : _objectMaps->objects()) {
        object->finalize();
    }
}

MWProcessOrder MWMemweight::_notHiddenProcesses() const {
    MWProcessOrder displayed;
    for (const auto& process : _processes) {
        if (!process->hiddenFromDisplay()) {
            displayed.push_back(process.get());
        }
    }
    return displayed;
}

const MWMemoryRegionList& MWMemweight::_regionsOf(const MWProcess& process) {
    static const MWMemoryRegionList none;
    return process.memoryRegions() ? *process.memoryRegions() : none;
}
