#include <benchmark/benchmark.h>

#include <memory>
#include <string>
#include <vector>

#include "analysis/MWMemweight.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"

// A system of a million regions: into objects, and by who shares them.

namespace {

constexpr uint64_t kProcesses = 1000;
constexpr uint64_t kRegionsOfProcess = 1000;
constexpr uint64_t kSize = 16384;

/// Each region is mapped by as many processes beside one another as there are `sharers`.
MWProcessList population(uint64_t sharers) {
    MWProcessList processes;
    for (uint64_t index = 0; index < kProcesses; ++index) {
        auto process = std::make_shared<FakeProcessSource>(static_cast<int32_t>(index + 1), "worker");
        for (uint64_t region = 0; region < kRegionsOfProcess; ++region) {
            const uint64_t group = index / sharers;
            process->regions.push_back(makeRegion({.object_id = 1 + group * kRegionsOfProcess + region,
                                                   .dirty = kSize,
                                                   .start = 0x10000 + region * 2 * kSize,
                                                   .share_mode = sharers == 1 ? SM_PRIVATE : SM_SHARED}));
        }
        process->gatherData();
        processes.push_back(std::move(process));
    }
    return processes;
}

std::unique_ptr<MWMemweight> analyzed(uint64_t sharers, benchmark::State& state) {
    state.PauseTiming();
    auto memweight = std::make_unique<MWMemweight>(population(sharers));
    state.ResumeTiming();
    memweight->analyzeData();
    return memweight;
}

void joinRegions(benchmark::State& state) {
    FakeHost host;
    for (auto iteration : state) {
        auto memweight = analyzed(static_cast<uint64_t>(state.range(0)), state);
        if (memweight->pidToMemweight().at(1) != kRegionsOfProcess * kSize) {
            state.SkipWithError("regions were lost");
        }
        state.PauseTiming();
        memweight.reset();
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * kProcesses * kRegionsOfProcess);
}

void groupRegions(benchmark::State& state) {
    FakeHost host;
    MWMemweight memweight(population(static_cast<uint64_t>(state.range(0))));
    memweight.analyzeData();
    for (auto iteration : state) {
        const MWProcessToProcessGroups groups = memweight._generateProcessToProcessGroups();
        if (groups.size() != kProcesses) {
            state.SkipWithError("processes were lost");
        }
    }
    state.SetItemsProcessed(state.iterations() * kProcesses * kRegionsOfProcess);
}

BENCHMARK(joinRegions)->Arg(1)->Arg(4)->Arg(100)->Unit(benchmark::kMillisecond);
BENCHMARK(groupRegions)->Arg(1)->Arg(4)->Arg(100)->Unit(benchmark::kMillisecond);

}  // namespace
