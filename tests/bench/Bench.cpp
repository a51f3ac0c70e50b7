// Measures memweight against what other tools take for less, on populations of its own: the table of the
// README. "memweight_bench MEMWEIGHT [--scale]", as root. Ends with status 1 when a bound is missed.

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iterator>
#include <nlohmann/json.hpp>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "bench/Population.h"
#include "support/LazilyFreed.h"

namespace {

constexpr size_t kMiB = size_t{1} << 20U;
constexpr int kPairs = 9;

using Command = std::vector<std::string>;

struct Usage {
    double wall;  ///< milliseconds
    double cpu;
    double peak;  ///< resident, MiB
};

[[noreturn]] void fail(const std::string& what) {
    std::fprintf(stderr, "memweight_bench: %s\n", what.c_str());
    std::exit(1);
}

double milliseconds(const timeval& time) {
    return static_cast<double>(time.tv_sec) * 1e3 + static_cast<double>(time.tv_usec) / 1e3;
}

Usage runCommand(const Command& command) {
    std::vector<char*> arguments;
    for (const std::string& argument : command) {
        arguments.push_back(const_cast<char*>(argument.c_str()));
    }
    arguments.push_back(nullptr);
    const auto begin = std::chrono::steady_clock::now();
    const pid_t pid = vfork();
    if (pid == 0) {
        const int null = open("/dev/null", O_RDWR);
        dup2(null, STDOUT_FILENO);
        dup2(null, STDERR_FILENO);
        execvp(arguments[0], arguments.data());
        _exit(127);
    }
    int status = 0;
    rusage usage = {};
    wait4(pid, &status, 0, &usage);
    const std::chrono::duration<double, std::milli> wall = std::chrono::steady_clock::now() - begin;
    if (!WIFEXITED(status) || WEXITSTATUS(status) == 127) {
        fail("cannot run " + command[0]);
    }
    return {.wall = wall.count(),
            .cpu = milliseconds(usage.ru_utime) + milliseconds(usage.ru_stime),
            .peak = static_cast<double>(usage.ru_maxrss) / 1024};
}

double median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + static_cast<ptrdiff_t>(values.size() / 2),
                     values.end());
    return values[values.size() / 2];
}

double medianOf(const std::vector<Usage>& usages, double Usage::*figure) {
    std::vector<double> values;
    std::transform(usages.begin(), usages.end(), std::back_inserter(values),
                   [=](const Usage& usage) { return usage.*figure; });
    return median(values);
}

struct Pair {
    Usage own;
    Usage other;
};

/// One after the other, again and again, so that both meet the same moods of the machine.
Pair interleaved(const Command& own, const Command& other) {
    runCommand(own);
    runCommand(other);
    std::vector<Usage> ofOwn;
    std::vector<Usage> ofOther;
    for (int pair = 0; pair < kPairs; ++pair) {
        ofOwn.push_back(runCommand(own));
        ofOther.push_back(runCommand(other));
    }
    const auto medians = [](const std::vector<Usage>& usages) {
        return Usage{medianOf(usages, &Usage::wall), medianOf(usages, &Usage::cpu),
                     medianOf(usages, &Usage::peak)};
    };
    return {medians(ofOwn), medians(ofOther)};
}

Command shell(const std::string& text) {
    return {"/bin/sh", "-c", text};
}

bool isInstalled(const std::string& program) {
    return std::system(("command -v " + program + " >/dev/null 2>&1").c_str()) == 0;
}

size_t mappingsOf(const std::vector<pid_t>& pids) {
    size_t lines = 0;
    for (const pid_t pid : pids) {
        std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
        lines += static_cast<size_t>(
            std::count(std::istreambuf_iterator<char>(maps), std::istreambuf_iterator<char>(), '\n'));
    }
    return lines;
}

/// The rows of the table; remembers whether one is missed.
class Table {
public:
    Table() {
        std::printf("%-34s %-22s %9s %6s %9s %6s\n", "population", "against", "wall", "most", "CPU", "most");
    }

    void add(const std::string& population, const std::string& against, const Pair& pair, double mostWall,
             std::optional<double> mostCpu) {
        const double wall = pair.own.wall / pair.other.wall;
        const double cpu = pair.own.cpu / pair.other.cpu;
        const bool met = wall <= mostWall && (!mostCpu || cpu <= *mostCpu);
        std::printf("%-34s %-22s %9.2f %6.2f %9.2f %6s   %.1f ms, %.1f ms CPU%s\n", population.c_str(),
                    against.c_str(), wall, mostWall, cpu, mostCpu ? _text(*mostCpu).c_str() : "",
                    pair.own.wall, pair.own.cpu, met ? "" : "   MISSED");
        _note(met);
    }
    void addFigure(const std::string& what, double figure, double most, const char* unit) {
        const bool met = figure <= most;
        std::printf("%-57s %9.2f %6.2f %s%s\n", what.c_str(), figure, most, unit, met ? "" : "   MISSED");
        _note(met);
    }
    bool met() const { return _met; }

private:
    static std::string _text(double number) {
        std::ostringstream text;
        text << number;
        return text.str();
    }
    void _note(bool met) {
        _met = _met && met;
        std::fflush(stdout);
    }
    bool _met = true;
};

class Bench {
public:
    explicit Bench(std::string memweight) : _memweight(std::move(memweight)) {}
    ~Bench() { unlink(_report.c_str()); }
    Bench(const Bench&) = delete;
    Bench& operator=(const Bench&) = delete;

    /// Those whose names hold `part`.
    bool run(const std::string& part) {
        const std::vector<std::pair<std::string, void (Bench::*)()>> parts = {
            {"small", &Bench::_manySmallProcesses},
            {"more", &Bench::_manyMoreProcesses},
            {"mappings", &Bench::_manyMappings},
            {"large", &Bench::_muchMemory},
            {"family", &Bench::_family},
            {"stall", &Bench::_stall}};
        for (const auto& [name, measure] : parts) {
            if (name.find(part) != std::string::npos) {
                (this->*measure)();
            }
        }
        return _table.met();
    }

    void runScale() {
        for (const size_t count : {10, 100, 1000, 4000}) {
            const Population population = Population::ofProcesses(count, 17, kMiB);
            std::vector<Usage> usages;
            runCommand(_all());
            for (int time = 0; time < kPairs; ++time) {
                usages.push_back(runCommand(_all()));
            }
            std::printf("%5zu processes, %6zu mappings: %8.1f ms, %8.1f ms CPU, %6.1f MiB\n", count,
                        mappingsOf(population.pids()), medianOf(usages, &Usage::wall),
                        medianOf(usages, &Usage::cpu), medianOf(usages, &Usage::peak));
            std::fflush(stdout);
        }
    }

private:
    Command _all() const { return {_memweight, "-a", "-j", _report}; }
    Command _of(const std::vector<pid_t>& pids) const {
        Command command = {_memweight, "-j", _report};
        for (const pid_t pid : pids) {
            command.push_back(std::to_string(pid));
        }
        return command;
    }
    static Command _catSmaps(const std::vector<pid_t>& pids) {
        Command command = {"cat"};
        for (const pid_t pid : pids) {
            command.push_back("/proc/" + std::to_string(pid) + "/smaps");
        }
        return command;
    }

    /// Every process has at least its own memory and little more, or the times are worth nothing.
    void _check(const std::vector<pid_t>& pids, size_t bytes) const {
        const auto report = nlohmann::json::parse(std::ifstream(_report));
        size_t found = 0;
        for (const auto& process : report.at("processes")) {
            if (std::find(pids.begin(), pids.end(), process.at("pid").get<pid_t>()) == pids.end()) {
                continue;
            }
            ++found;
            const auto memweight = process.at("memweight").get<size_t>();
            // The page tables of a mapping with a page for each 4 KiB take a five-hundredth of it.
            if (memweight < bytes || memweight > bytes + bytes / 256 + 4 * kMiB) {
                fail("a process of " + std::to_string(bytes) + " bytes is reported with " +
                     std::to_string(memweight));
            }
        }
        if (found != pids.size()) {
            fail("only " + std::to_string(found) + " processes are reported");
        }
    }

    void _compare(const std::string& name, const Population& population, size_t bytes, const Command& own,
                  const Command& other, double mostWall, double mostCpu) {
        const Pair pair = interleaved(own, other);
        _check(population.pids(), bytes);
        _table.add(name, "cat smaps", pair, mostWall, mostCpu);
        _addMemory(name, pair.own, mappingsOf(population.pids()));
    }

    void _addMemory(const std::string& name, const Usage& own, size_t regions) {
        _table.addFigure(name + ": memory", own.peak, 24 + static_cast<double>(regions) * 400 / kMiB, "MiB");
    }

    void _manySmallProcesses() {
        const std::string name = "400 processes, 60 mappings, 4 MiB";
        const Population population = Population::ofProcesses(400, 36, 4 * kMiB);
        const Pair pair = interleaved(_all(), shell("exec cat /proc/[0-9]*/smaps"));
        _check(population.pids(), 4 * kMiB / 36 / 4096 * 4096 * 36);
        _table.add(name, "cat smaps", pair, 0.5, 0.8);
        _addMemory(name, pair.own, mappingsOf(population.pids()));
        const auto against = [&](const char* program, const Command& command, double most) {
            if (isInstalled(program)) {
                _table.add(name, command.size() == 1 ? program : "ps -eo pid,pss,uss",
                           interleaved(_all(), command), most, std::nullopt);
            } else {
                std::printf("%-34s %-22s is not installed\n", name.c_str(), program);
            }
        };
        against("ps", {"ps", "-eo", "pid,pss,uss"}, 1.0);
        against("smem", {"smem"}, 0.06);
        against("smemstat", {"smemstat"}, 0.3);
        const Command one = _of({population.pids().front()});
        _table.addFigure("one of them: time", interleaved(one, one).own.wall, 10, "ms");
    }

    void _manyMoreProcesses() {
        std::vector<Usage> fewer;
        std::vector<Usage> more;
        const auto measure = [&](size_t count, std::vector<Usage>& usages) {
            const Population population = Population::ofProcesses(count, 17, kMiB);
            runCommand(_all());
            for (int time = 0; time < kPairs; ++time) {
                usages.push_back(runCommand(_all()));
            }
            return mappingsOf(population.pids());
        };
        measure(400, fewer);
        const size_t mappings = measure(2000, more);
        const double wall = medianOf(fewer, &Usage::wall);
        const Pair pair = {{medianOf(more, &Usage::wall), medianOf(more, &Usage::cpu), 0},
                           {5 * wall, 5 * medianOf(fewer, &Usage::cpu), 0}};
        _table.add("2,000 processes, 40 mappings", "5 times 400 of them", pair, 1.1, std::nullopt);
        _addMemory("2,000 processes, 40 mappings", {0, 0, medianOf(more, &Usage::peak)}, mappings);
    }

    void _manyMappings() {
        const Population population = Population::ofProcesses(1, 60000, 60000 * size_t{4096});
        _compare("1 process, 60,000 mappings", population, 60000 * size_t{4096}, _of(population.pids()),
                 _catSmaps(population.pids()), 0.5, 0.8);
    }

    void _muchMemory() {
        const Population population = Population::ofProcesses(1, 1, 4096 * kMiB);
        _compare("1 process, 4 GiB", population, 4096 * kMiB, _of(population.pids()),
                 _catSmaps(population.pids()), 0.9, 0.9);
    }

    void _family() {
        const Population population = Population::ofFamily(16, 256 * kMiB);
        _compare("17 processes sharing 256 MiB", population, 256 * kMiB, _of(population.pids()),
                 _catSmaps(population.pids()), 1.0, 1.5);
        const auto report = nlohmann::json::parse(std::ifstream(_report));
        const auto total = report.at("total memweight").get<size_t>();
        if (total > 300 * kMiB) {
            fail("what a family shares is reported as " + std::to_string(total) + " bytes");
        }
    }

    void _stall() {
        MappingProcess process(4096 * kMiB);
        std::vector<double> undisturbed;
        std::vector<double> measured;
        for (int pair = 0; pair < kPairs; ++pair) {
            process.restart();
            const auto begin = std::chrono::steady_clock::now();
            runCommand(_of({process.pid()}));
            const auto taken = std::chrono::steady_clock::now() - begin;
            measured.push_back(process.slowestMilliseconds());
            // For as long: the longer one looks, the longer is the longest stall.
            process.restart();
            std::this_thread::sleep_for(taken);
            undisturbed.push_back(process.slowestMilliseconds());
        }
        _table.addFigure("4 GiB, mapping in a loop: longest stall beyond the usual",
                         std::max(0.0, median(measured) - median(undisturbed)), 5, "ms");
    }

    std::string _memweight;
    std::string _report = "/run/memweight-bench." + std::to_string(getpid()) + ".json";
    Table _table;
};

// What a machine is like where somebody has lazily freed memory is a bench of its own (--as-is).
void measureAsIfNobodyFreedLazily() {
    try {
        if (const size_t pages = coverLazilyFreed(); pages != 0) {
            std::printf(
                "%zu pages have been freed lazily since this machine was started: measured as if none had\n",
                pages);
        }
    } catch (const std::runtime_error& error) {
        fail(error.what());
    }
}

}  // namespace

int main(int argc, char* argv[]) {
    runAsWorker(argc, argv);
    if (argc < 2 || geteuid() != 0) {
        fail(
            "as root: memweight_bench MEMWEIGHT [--scale] [--as-is] "
            "[--only=small|more|mappings|large|family|stall]");
    }
    const std::vector<std::string> options(argv + 2, argv + argc);
    const auto has = [&](const char* option) {
        return std::find(options.begin(), options.end(), option) != options.end();
    };
    sync();  // pages of a program that was just built are dirty
    if (!has("--as-is")) {
        measureAsIfNobodyFreedLazily();
    }
    Bench bench(argv[1]);
    if (has("--scale")) {
        bench.runScale();
        return 0;
    }
    constexpr std::string_view kOnly = "--only=";
    const auto only = std::find_if(options.begin(), options.end(),
                                   [=](const std::string& option) { return option.starts_with(kOnly); });
    return bench.run(only == options.end() ? "" : only->substr(kOnly.size())) ? 0 : 1;
}
