#include "accuracy/Measurement.h"

#include <fmt/format.h>
#include <sys/mman.h>

#include <algorithm>
#include <memory>
#include <mutex>
#include <span>
#include <stdexcept>

#include "accuracy/Workload.h"
#include "analysis/MWMemweight.h"
#include "analysis/MWProcessGroup.h"
#include "support/ChildProcess.h"

namespace {

uint64_t bytesOf(const MWCategoryTotals& total) {
    return total.dirty + total.swapped;
}

/// Keeps the totals of everything that is printed.
class TotalsFormatter : public MWOutputFormatter {
public:
    explicit TotalsFormatter(Measurement& measurement) : _measurement(measurement) {}

    void printProcessHeader(const MWProcess& process) override { _process = process.pid(); }
    void endProcessHeader(const MWProcess&) override {}
    void printProcessTotal(uint64_t memweight, const MWProcess& forProcess) override {
        _measurement.charges[forProcess.pid()] = memweight;
    }
    void printProcessCategories(const MWCategoryTable&, const MWCategoryTotals& total) override {
        _measurement.tables[_process][{_process}] += bytesOf(total);
    }
    void printSharedCategories(const MWCategoryTable&, const MWSharedCategoriesCall& call) override {
        std::set<pid_t> sharers;
        for (const MWProcess* process : call.sharedWith.processes()) {
            sharers.insert(process->pid());
        }
        _measurement.tables[_process][sharers] += bytesOf(call.total);
    }
    void printProcessAuxData(const MWAuxDataTree&) override {}
    void printProcessesWithWarnings(const std::vector<const MWProcess*>&,
                                    const MWProcessErrors& errors) override {
        for (const MWProcess* process : errors.processesWithErrors) {
            _measurement.errors.push_back(process->displayString() + ": " + process->errors().front());
        }
    }
    void printSummaryCategories(const MWCategoryTable&, const MWSummaryCall& call) override {
        _measurement.summary = bytesOf(call.total);
    }
    void printGlobalAuxData(const MWAuxDataTree&) override {}
    void endAtTime(const MWTime&) override {}

private:
    Measurement& _measurement;
    pid_t _process = -1;
};

/// A live host that notes whose regions have protections which only smaps tells: a program's text, for one,
/// may be written to, but is not.
class WatchedHost : public MWLinuxHost {
public:
    explicit WatchedHost(MappingSource source) : MWLinuxHost("/proc", "/sys", source) {}

    kern_return_t task_read_for_pid(int32_t pid, task_t& task) override {
        const kern_return_t code = MWLinuxHost::task_read_for_pid(pid, task);
        const std::lock_guard lock(_mutex);
        _pids[task] = pid;
        return code;
    }
    kern_return_t mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t& depth,
                                         vm_region_submap_info_64& info, uint32_t& count) override {
        const auto code = MWLinuxHost::mach_vm_region_recurse(task, address, size, depth, info, count);
        if (code == KERN_SUCCESS && info.max_protection != info.protection) {
            const std::lock_guard lock(_mutex);
            _readFromSmaps.insert(_pids.at(task));
        }
        return code;
    }
    std::set<pid_t> readFromSmaps() const { return _readFromSmaps; }

private:
    std::mutex _mutex;  ///< guards what follows while there is a measurement
    std::map<task_t, pid_t> _pids;
    std::set<pid_t> _readFromSmaps;
};

/// A live host that is the current one, in the mode that the tests measure in.
class MeasuringHost {
public:
    explicit MeasuringHost(MappingSource source = MappingSource::cheapest) : _host(source) {
        MWMemweight::setBreakDownPhysMemweight(true);
    }
    ~MeasuringHost() { MWHostInterface::setCurrent(_previous); }
    MeasuringHost(const MeasuringHost&) = delete;
    MeasuringHost& operator=(const MeasuringHost&) = delete;

    std::set<pid_t> readFromSmaps() const { return _host.readFromSmaps(); }

private:
    WatchedHost _host;
    MWHostInterface* _previous = MWHostInterface::setCurrent(&_host);
};

std::string textOf(const MWMemoryRegion& region) {
    const MWCategoryTotals totals = region.totals();
    return fmt::format("{} {} at {} mode {}: dirty {} swapped {} clean {} reclaimable {} wired {}",
                       region.size(), region.fullName(), region.offset(), region.share_mode(), totals.dirty,
                       totals.swapped, totals.clean, totals.reclaimable, totals.wired);
}

Measurement measureProcesses(MWProcessList processes) {
    Measurement measurement;
    TotalsFormatter formatter(measurement);
    const auto begin = std::chrono::steady_clock::now();
    MWMemweight memweight(std::move(processes));
    memweight.addOutputFormatter(formatter);
    memweight.gatherData();
    memweight.analyzeData();
    memweight.printOutputVerbose({.verbose = false, .summarize = false});
    measurement.duration = std::chrono::steady_clock::now() - begin;
    for (const auto& process : memweight.processes()) {
        for (const auto& region : process->memoryRegions().value_or(MWMemoryRegionList())) {
            measurement.regions[process->pid()].push_back({region->start(), textOf(*region)});
        }
    }
    return measurement;
}

}  // namespace

Measurement measure(const std::vector<pid_t>& pids, MappingSource source) {
    const MeasuringHost host(source);
    MWProcessList processes;
    for (const pid_t pid : pids) {
        processes.push_back(MWProcess::processWithPid(pid));
        if (processes.back() == nullptr) {
            throw std::runtime_error("cannot look at process " + std::to_string(pid));
        }
    }
    Measurement measurement = measureProcesses(std::move(processes));
    measurement.readFromSmaps = host.readFromSmaps();
    return measurement;
}

Measurement measureAll() {
    const MeasuringHost host;
    MWProcessList processes;
    const auto all = MWProcess::allProcessesExcludingPids({0});
    for (const auto& [number, process] : all.value()) {
        processes.push_back(process);
    }
    return measureProcesses(std::move(processes));
}

Measurement measureAsUser(uid_t user, const std::vector<pid_t>& pids) {
    const size_t count = pids.size() + 2;
    const size_t size = count * sizeof(uint64_t);
    void* shared = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    const std::span answer(static_cast<uint64_t*>(shared), count);
    const ChildProcess measuring([&] {
        becomeUser(user);
        const Measurement measurement = measure(pids);
        answer[0] = measurement.summary;
        answer[1] = measurement.errors.size();
        std::transform(pids.begin(), pids.end(), answer.begin() + 2,
                       [&](pid_t pid) { return measurement.charges.at(pid); });
        return uint64_t{0};
    });
    Measurement measurement;
    measurement.summary = answer[0];
    measurement.errors.resize(answer[1], "an error");
    for (size_t i = 0; i < pids.size(); ++i) {
        measurement.charges[pids[i]] = answer[i + 2];
    }
    munmap(shared, size);
    return measurement;
}
