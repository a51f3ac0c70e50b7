#include <fcntl.h>
#include <fmt/core.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <nlohmann/json.hpp>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

// churn MEMWEIGHT SECONDS: measures all processes over and over while some of them fork, execute, map, unmap
// and end as fast as they can, and compares with the same processes at rest. All of them end with this
// program, however that ends.

namespace {

constexpr int kWorkers = 16;
constexpr size_t kMappingsOfWorker = 64;
constexpr size_t kMappingSize = 64 * 1024;
constexpr double kMostRatio = 1.5;

using Clock = std::chrono::steady_clock;

/// Forks a process that ends with its parent; what it runs does not return.
template <class Work>
pid_t start(Work work) {
    const pid_t parent = getpid();
    const pid_t child = fork();
    if (child == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) {
            _exit(1);  // it ended before it could have taken this one along
        }
        work();
        _exit(1);
    }
    return child;
}

void* mapTouched(size_t size) {
    void* memory = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory != MAP_FAILED) {
        std::memset(memory, 1, size);
    }
    return memory;
}

// What does little and ends; every other one as another program.
void runShortLife(const char* self, unsigned turn) {
    if (turn % 2 == 0) {
        execl(self, self, "--end", nullptr);
    }
    mapTouched(kMappingSize * (1 + turn % 7));
    _exit(0);
}

[[noreturn]] void churn(const char* self) {
    for (unsigned turn = 0;; ++turn) {
        for (size_t mapping = 1; mapping < 16; ++mapping) {
            munmap(mapTouched(mapping * kMappingSize / 8), mapping * kMappingSize / 8);
        }
        const pid_t child = start([&] { runShortLife(self, turn); });
        if (child > 0) {
            waitpid(child, nullptr, 0);
        }
    }
}

/// Processes at rest until they are told to churn.
class Workers {
public:
    explicit Workers(const char* self) {
        std::array<int, 2> gate = {};
        if (pipe2(gate.data(), O_CLOEXEC) != 0) {
            throw std::runtime_error("no pipe");
        }
        _gate = gate[1];
        for (int worker = 0; worker < kWorkers; ++worker) {
            _pids.insert(start([&] { _work(self, gate); }));
        }
        close(gate[0]);
    }
    ~Workers() {
        for (const pid_t pid : _pids) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }
    Workers(const Workers&) = delete;
    Workers& operator=(const Workers&) = delete;

    const std::set<pid_t>& pids() const { return _pids; }
    void letGo() { close(_gate); }

private:
    static void _work(const char* self, const std::array<int, 2>& gate) {
        close(gate[1]);
        // Of two kinds in turn, so that the kernel does not make one mapping of them.
        for (size_t mapping = 0; mapping < kMappingsOfWorker; ++mapping) {
            mprotect(mapTouched(kMappingSize), kMappingSize,
                     mapping % 2 == 0 ? PROT_READ : PROT_READ | PROT_WRITE);
        }
        char byte = 0;
        while (read(gate[0], &byte, 1) < 0 && errno == EINTR) {
        }
        churn(self);
    }

    std::set<pid_t> _pids;
    int _gate = -1;
};

struct Measurement {
    size_t processes = 0;
    size_t errors = 0;  ///< of processes
    size_t warnings = 0;
    double milliseconds = 0;  ///< of processor time, for each process
    std::string fault;        ///< why it cannot count; empty when nothing is wrong
};

std::string contentsOf(int file) {
    std::string text(static_cast<size_t>(std::max<off_t>(lseek(file, 0, SEEK_END), 0)), '\0');
    const ssize_t count = pread(file, text.data(), text.size(), 0);
    text.resize(static_cast<size_t>(std::max<ssize_t>(count, 0)));
    return text;
}

// Looks for all that must be in a report: the whole document, and all the processes that did not end.
void readReport(const std::string& text, const std::set<pid_t>& workers, Measurement& measurement) {
    const auto document = nlohmann::json::parse(text, nullptr, false);
    if (!document.is_object() || !document.contains("end_time")) {
        measurement.fault = "the document is not valid";
        return;
    }
    std::set<pid_t> missing = workers;
    for (const auto& process : document["processes"]) {
        if (process.contains("memweight")) {
            missing.erase(process["pid"].get<pid_t>());
        }
    }
    if (!missing.empty()) {
        measurement.fault = fmt::format("{} processes that live have no figures", missing.size());
    }
    measurement.processes = document["processes"].size();
    measurement.errors = document["errors"].size();
    measurement.warnings = document["warnings"].size();
}

double milliseconds(const timeval& time) {
    return static_cast<double>(time.tv_sec) * 1e3 + static_cast<double>(time.tv_usec) / 1e3;
}

Measurement measure(const char* memweight, const std::set<pid_t>& workers) {
    const int report = memfd_create("report", 0);
    const std::string path = "/proc/self/fd/" + std::to_string(report);
    const pid_t child = start([&] {
        const int nowhere = open("/dev/null", O_RDWR);
        dup2(nowhere, STDOUT_FILENO);
        dup2(nowhere, STDERR_FILENO);
        execl(memweight, memweight, "-a", "-j", path.c_str(), nullptr);
    });
    int status = 0;
    rusage usage = {};
    wait4(child, &status, 0, &usage);
    Measurement measurement;
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        measurement.fault = fmt::format("the status is {:#x}", status);
    } else {
        readReport(contentsOf(report), workers, measurement);
    }
    close(report);
    if (measurement.fault.empty()) {
        measurement.milliseconds = (milliseconds(usage.ru_utime) + milliseconds(usage.ru_stime)) /
                                   static_cast<double>(measurement.processes);
    }
    return measurement;
}

/// All measurements of one kind, of which there is at least one.
struct Phase {
    std::vector<Measurement> measurements;

    double median() const {
        std::vector<double> times;
        for (const Measurement& measurement : measurements) {
            times.push_back(measurement.milliseconds);
        }
        std::ranges::nth_element(times, times.begin() + static_cast<ptrdiff_t>(times.size() / 2));
        return times[times.size() / 2];
    }
    /// Prints the figures; whether nothing is wrong with any.
    bool report(const char* name) const {
        size_t faults = 0;
        Measurement sum;
        for (const Measurement& measurement : measurements) {
            sum.processes += measurement.processes;
            sum.errors += measurement.errors;
            sum.warnings += measurement.warnings;
            if (!measurement.fault.empty()) {
                ++faults;
                fmt::print("{}: {}\n", name, measurement.fault);
            }
        }
        fmt::print(
            "{}: {} measurements of {} processes on average, {:.3f} ms each (median), {} errors, {} "
            "warnings, {} faults\n",
            name, measurements.size(), sum.processes / measurements.size(), median(), sum.errors,
            sum.warnings, faults);
        return faults == 0;
    }
};

Phase measureFor(std::chrono::seconds length, const char* memweight, const Workers& workers) {
    Phase phase;
    const auto end = Clock::now() + length;
    do {
        phase.measurements.push_back(measure(memweight, workers.pids()));
    } while (Clock::now() < end);
    return phase;
}

bool run(const char* self, const char* memweight, std::chrono::seconds length) {
    Workers workers(self);
    const Phase rest = measureFor(length / 4, memweight, workers);
    workers.letGo();
    const Phase churn = measureFor(length, memweight, workers);
    const bool restIsSound = rest.report("at rest");
    const bool churnIsSound = churn.report("churning");
    const double ratio = churn.median() / rest.median();
    fmt::print("ratio: {:.2f} (at most {:.2f})\n", ratio, kMostRatio);
    return restIsSound && churnIsSound && ratio <= kMostRatio;
}

}  // namespace

int main(int argc, char* argv[]) {
    if (argc == 2 && std::strcmp(argv[1], "--end") == 0) {
        return 0;
    }
    if (argc != 3) {
        fmt::print(stderr, "usage: churn MEMWEIGHT SECONDS\n");
        return 1;
    }
    const bool passed = run("/proc/self/exe", argv[1], std::chrono::seconds(std::atoi(argv[2])));
    return passed ? EXIT_SUCCESS : EXIT_FAILURE;
}
