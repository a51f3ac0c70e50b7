#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

/// Processes of known memory, which live as long as this. Each runs this program anew, so that nothing is
/// shared but what is meant to be.
class Population {
public:
    /// `count` processes, each of `mappings` mappings beside those of the program, with `bytes` of memory of
    /// its own in them.
    static Population ofProcesses(size_t count, size_t mappings, size_t bytes);
    /// One process that writes `bytes`, and `children` forked from it that write nothing.
    static Population ofFamily(size_t children, size_t bytes);
    ~Population();
    Population(Population&& other) noexcept
        : _workers(std::move(other._workers)), _pids(std::move(other._pids)) {}
    Population(const Population&) = delete;
    Population& operator=(const Population&) = delete;

    const std::vector<pid_t>& pids() const { return _pids; }

private:
    Population() = default;
    void _add(const std::vector<std::string>& arguments, size_t processes);

    std::vector<pid_t> _workers;  ///< started from here, as group leaders
    std::vector<pid_t> _pids;
};

/// A process of `bytes` that maps, writes and unmaps a page in a loop.
class MappingProcess {
public:
    explicit MappingProcess(size_t bytes);
    ~MappingProcess();
    MappingProcess(const MappingProcess&) = delete;
    MappingProcess& operator=(const MappingProcess&) = delete;

    pid_t pid() const { return _pid; }
    /// Forgets the slowest turn of the loop.
    void restart() { *_slowest = 0; }
    double slowestMilliseconds() const { return static_cast<double>(*_slowest) / 1e6; }

private:
    std::atomic<uint64_t>* _slowest;  ///< nanoseconds, in memory that both processes map
    pid_t _pid;
};

/// The part of a worker: answers when `argv` is not that of one.
void runAsWorker(int argc, char* argv[]);
