#include <fmt/core.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "accuracy/Figures.h"
#include "accuracy/Measurement.h"
#include "accuracy/Workload.h"

// Who is told to share memory with whom. Needs no privilege to be right.

namespace {

// Where one owner's memory ends and the next one's begins within a window of addresses, the window is shared
// by both; and the program has some written pages beside its workload.
constexpr uint64_t kWindow = 4U << 20U;
constexpr uint64_t kBesideTheWorkload = 512U << 10U;
constexpr uint64_t kTolerance = kWindow + kBesideTheWorkload;

using Names = std::set<std::string>;

/// Bytes for each set of sharers that `name` is told to share with; small sums (the C library's few written
/// pages) are left out.
std::map<Names, uint64_t> tableOf(const Workload& workload, const Measurement& measurement,
                                  const std::string& name) {
    std::map<pid_t, std::string> names;
    for (const auto& [known, pid] : workload.names()) {
        names[pid] = known;
    }
    std::map<Names, uint64_t> table;
    for (const auto& [pids, bytes] : measurement.tables.at(workload.pid(name))) {
        Names sharers;
        for (const pid_t pid : pids) {
            sharers.insert(names.at(pid));
        }
        if (bytes > kTolerance) {
            table[sharers] = bytes;
        }
    }
    return table;
}

void expectTable(const std::map<Names, uint64_t>& table, std::map<Names, uint64_t> expected) {
    for (const auto& [sharers, bytes] : table) {
        const uint64_t wanted = expected[sharers];
        EXPECT_LE(std::max(wanted, bytes) - std::min(wanted, bytes), kTolerance)
            << testing::PrintToString(sharers) << " share " << (bytes >> 20U) << " MiB, not "
            << (wanted >> 20U);
    }
    EXPECT_EQ(table.size(), expected.size()) << testing::PrintToString(table);
}

}  // namespace

TEST(Sharers, AreThoseForkedAfterTheMemoryWasTouched) {
    const Workload family(fmt::format("touched-between-forks {} {}", scaled(256), scaled(100)));
    const Measurement measurement = measure(family.pids());
    const uint64_t first = scaledBytes(256);
    const uint64_t second = scaledBytes(100);
    const Names all = {"root", "A", "B"};
    expectTable(tableOf(family, measurement, "root"), {{all, first}, {{"root", "B"}, second}});
    expectTable(tableOf(family, measurement, "A"), {{all, first}});
    expectTable(tableOf(family, measurement, "B"), {{all, first}, {{"root", "B"}, second}});
}

// The sibling and its child have new frames for the first half; who was there in between has ended.
TEST(Sharers, FollowTheFramesThroughGenerations) {
    const Workload family(fmt::format("descendants {}", scaled(128)));
    const Measurement measurement = measure(family.pids());
    const uint64_t half = scaledBytes(64);
    const Names old = {"root", "A", "AA", "AAA", "orphan"};
    Names all = old;
    all.insert({"sibling", "nephew"});
    const Names rewriters = {"sibling", "nephew"};
    for (const std::string& name : old) {
        SCOPED_TRACE(name);
        expectTable(tableOf(family, measurement, name), {{old, half}, {all, half}});
    }
    for (const std::string& name : rewriters) {
        SCOPED_TRACE(name);
        expectTable(tableOf(family, measurement, name), {{rewriters, half}, {all, half}});
    }
}
