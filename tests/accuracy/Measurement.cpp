#include "accuracy/Measurement.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <memory>
#include <stdexcept>

#include "accuracy/Workload.h"
#include "analysis/MWMemweight.h"
#include "analysis/MWProcessGroup.h"
#include "platform/linux/MWLinuxHost.h"

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

/// A live host that is the current one, in the mode that the tests measure in.
class MeasuringHost {
public:
    MeasuringHost() { MWMemweight::setBreakDownPhysMemweight(true); }
    ~MeasuringHost() { MWHostInterface::setCurrent(_previous); }
    MeasuringHost(const MeasuringHost&) = delete;
    MeasuringHost& operator=(const MeasuringHost&) = delete;

private:
    MWLinuxHost _host;
    MWHostInterface* _previous = MWHostInterface::setCurrent(&_host);
};

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
            measurement.regionStarts[process->pid()].push_back(region->start());
        }
    }
    return measurement;
}

}  // namespace

Measurement measure(const std::vector<pid_t>& pids) {
    const MeasuringHost host;
    MWProcessList processes;
    for (const pid_t pid : pids) {
        processes.push_back(MWProcess::processWithPid(pid));
        if (processes.back() == nullptr) {
            throw std::runtime_error("cannot look at process " + std::to_string(pid));
        }
    }
    return measureProcesses(std::move(processes));
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

namespace {

[[noreturn]] void answerAsUser(uid_t user, const std::vector<pid_t>& pids, int pipe) {
    becomeUser(user);
    const Measurement measurement = measure(pids);
    std::vector<uint64_t> answer = {measurement.summary};
    for (const pid_t pid : pids) {
        answer.push_back(measurement.charges.at(pid));
    }
    const size_t size = answer.size() * sizeof(uint64_t);
    _exit(write(pipe, answer.data(), size) == static_cast<ssize_t>(size) ? 0 : 1);
}

}  // namespace

std::vector<uint64_t> measureAsUser(uid_t user, const std::vector<pid_t>& pids) {
    std::array<int, 2> answers = {};
    pid_t child = -1;
    if (pipe2(answers.data(), O_CLOEXEC) != 0 || (child = fork()) < 0) {
        throw std::runtime_error("cannot measure as another user");
    }
    if (child == 0) {
        answerAsUser(user, pids, answers[1]);
    }
    close(answers[1]);
    std::vector<uint64_t> answer(pids.size() + 1);
    const size_t size = answer.size() * sizeof(uint64_t);
    const bool answered = read(answers[0], answer.data(), size) == static_cast<ssize_t>(size);
    close(answers[0]);
    waitpid(child, nullptr, 0);
    if (!answered) {
        throw std::runtime_error("measuring as another user has failed");
    }
    return answer;
}
