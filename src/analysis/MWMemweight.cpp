#include "analysis/MWMemweight.h"

#include <algorithm>
#include <ranges>
#include <utility>

#include "platform/MWHostInterface.h"
#include "platform/MWPhysMemweightSwitch.h"

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
    std::ranges::stable_partition(processes,
                                  [](const auto& process) { return process->takesLongToGather(); });
    return processes;
}

bool MWMemweight::gatherData() {
    const MWConcurrentQueue queue("org.memweight.memweight.gatherdata", _qualityOfService);
    const MWProcessList ordered = _processesBySortingPidDesc(_processes);
    const MWProcessList scheduled = _longestFirst(ordered);
    _gatherStartTime = MWTime::now();
    _prepareToGather(queue, ordered);
    std::atomic<bool> stoppedEarly = false;
    queue.apply(ordered.size(), [&](size_t index) {
        if (_earlyExit) {
            stoppedEarly = true;
        } else {
            scheduled[index]->gatherData();
        }
    });
    if (stoppedEarly) {
        ordered.back()->_addGlobalError(
            "Memweight exited early due to SIGINT and did not finish gathering all data");
    }
    _gatherEndTime = MWTime::now();
    return stoppedEarly;
}

void MWMemweight::_prepareToGather(const MWConcurrentQueue& queue, const MWProcessList& processes) const {
    MWHostInterface::current().beginOwnedVmObjectSurvey();
    queue.apply(processes.size(), [&](size_t index) {
        if (!_earlyExit) {
            processes[index]->prepareToGatherData();
        }
    });
}

void MWMemweight::analyzeData() {
    _pidToMemweight.clear();
    size_t regions = 0;
    for (const auto& process : _processes) {
        regions += _regionsOf(*process).size();
    }
    _objectMaps.emplace(_processes.size(), regions);
    for (const auto& process : _processes) {
        _addProcess(*process);
    }
    _objectCount = _objectMaps->objectCount();
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
    _objectMaps->forEachObject([](MWMemoryObject& object) { object.finalize(); });
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
