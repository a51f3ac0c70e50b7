#include <benchmark/benchmark.h>

#include <algorithm>
#include <numeric>
#include <random>
#include <vector>

#include "model/MWRangeList.h"

namespace {

constexpr uint64_t kPage = 4096;

// Places of spans of two pages with a page between them.
std::vector<uint64_t> ascending(size_t count) {
    std::vector<uint64_t> places(count);
    std::iota(places.begin(), places.end(), 0);
    return places;
}

std::vector<uint64_t> inRandomOrder(size_t count) {
    std::vector<uint64_t> places = ascending(count);
    std::ranges::shuffle(places, std::mt19937(1));
    return places;
}

// From the last to the first and back: each span lies at the other end of the list.
std::vector<uint64_t> fromEndToEnd(size_t count) {
    std::vector<uint64_t> places;
    for (size_t index = 0; index < count; ++index) {
        places.push_back(count + (index % 2 == 0 ? index : 0 - index));
    }
    return places;
}

void addRanges(benchmark::State& state, std::vector<uint64_t> (*order)(size_t)) {
    const std::vector<uint64_t> places = order(static_cast<size_t>(state.range(0)));
    uint64_t dirty = 0;
    for (auto iteration : state) {
        MWRangeList list;
        for (const uint64_t place : places) {
            list.addRange({.start = place * 3 * kPage, .length = 2 * kPage}, kPage, {.dirty = 2 * kPage});
        }
        dirty = list.sum().dirty;
    }
    if (dirty != places.size() * 2 * kPage) {
        state.SkipWithError("spans were lost");
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
}

// One large span that swallows all that were there before it, again and again.
void addCoveringRanges(benchmark::State& state) {
    const auto count = static_cast<uint64_t>(state.range(0));
    for (auto iteration : state) {
        MWRangeList list;
        for (uint64_t round = 0; round < 8; ++round) {
            for (uint64_t place = 0; place < count; ++place) {
                list.addRange({.start = (round * count + place) * 2 * kPage, .length = kPage}, kPage,
                              {.dirty = kPage});
            }
            list.addRange({.start = 0, .length = (round + 1) * count * 2 * kPage}, kPage, {.clean = kPage});
        }
        benchmark::DoNotOptimize(list.sum());
    }
    state.SetItemsProcessed(state.iterations() * 8 * (state.range(0) + 1));
}

BENCHMARK_CAPTURE(addRanges, ascending, ascending)->Arg(1000)->Arg(10000);
BENCHMARK_CAPTURE(addRanges, random, inRandomOrder)->Arg(1000)->Arg(10000)->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(addRanges, end_to_end, fromEndToEnd)->Arg(1000)->Arg(10000)->Unit(benchmark::kMillisecond);
BENCHMARK(addCoveringRanges)->Arg(1000)->Arg(10000);

}  // namespace
