#include <fmt/core.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>

#include "accuracy/Figures.h"
#include "accuracy/Measurement.h"
#include "accuracy/PhysicalMemory.h"
#include "accuracy/SystemResources.h"
#include "accuracy/Workload.h"

// Frame numbers, and so the truth, are for root alone. What is measured without privilege is told so.
class Accuracy : public testing::Test {
protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "only root can tell which page frames are the same";
        }
    }
};

namespace {

constexpr uid_t kNobody = 65534;
constexpr uint64_t kMiB = 1U << 20U;

/// The sum of all processes, and the charge of each, against the kernel's own figures.
void expectTrueSums(const std::string& scenario, const std::vector<pid_t>& pids) {
    const Measurement measurement = measure(pids);
    EXPECT_EQ(measurement.errors, std::vector<std::string>());
    expectNear({scenario, measurement.summary, physicalMemoryOf(pids)});
    for (const pid_t pid : pids) {
        expectNear(
            {fmt::format("{}: charge of {}", scenario, pid), measurement.charges.at(pid), chargeOf(pid)});
    }
}

void expectTrueSumsForUser(const std::string& scenario, const std::vector<pid_t>& pids) {
    const std::vector<uint64_t> figures = measureAsUser(kNobody, pids);
    expectNear({scenario, figures[0], physicalMemoryOf(pids)});
    for (size_t i = 0; i < pids.size(); ++i) {
        expectNear({fmt::format("{}: charge of {}", scenario, pids[i]), figures[i + 1], chargeOf(pids[i])});
    }
}

std::vector<std::string> forkTree(const std::string& rewrittenLater) {
    return {scaled(256), "16", isFullRun() ? "10" : "3", rewrittenLater};
}

}  // namespace

TEST_F(Accuracy, ForkTree) {
    const Workload tree("fork-tree", forkTree("0"));
    ASSERT_EQ(tree.pids().size(), 18U);
    expectTrueSums("fork tree", tree.pids());
}

TEST_F(Accuracy, ForkTreeWithoutPrivilege) {
    const Workload tree("fork-tree", forkTree("0"), {.user = kNobody});
    expectTrueSumsForUser("fork tree, not root", tree.pids());
}

TEST_F(Accuracy, GenerationsOfAForkTree) {
    const Workload tree("fork-tree", forkTree(scaled(64)));
    ASSERT_EQ(tree.pids().size(), 21U);
    expectTrueSums("fork tree with generations", tree.pids());
}

TEST_F(Accuracy, SharedObjectsInDifferentRanges) {
    const TemporaryDirectory disk("/var/tmp");
    const TemporaryDirectory memory("/dev/shm");
    const Workload sharers("shared-objects", {"8", scaled(64), disk / "file", memory / "file"});
    expectTrueSums("shared objects", sharers.pids());
}

TEST_F(Accuracy, KindsOfPages) {
    const SwapFile swap(scaledBytes(256));
    const HugePages hugePages(scaledBytes(32) / (2 * kMiB));
    if (!swap.isUsed() || !hugePages.areThere()) {
        GTEST_SKIP() << "no swap file or no huge pages to be had";
    }
    const Workload process("page-kinds", {scaled(32)});
    expectTrueSums("kinds of pages", process.pids());
}

TEST_F(Accuracy, PrivateMappingsOfAFile) {
    const TemporaryDirectory directory("/var/tmp");
    writeCleanFile(directory / "file", scaledBytes(256));
    const Workload processes("private-file", {directory / "file", "8"});
    expectTrueSums("private mappings of a file", processes.pids());
}

TEST_F(Accuracy, PrivateMappingsOfAFileWithoutPrivilege) {
    const TemporaryDirectory directory("/var/tmp");
    writeCleanFile(directory / "file", scaledBytes(256));
    const Workload processes("private-file", {directory / "file", "8"}, {.user = kNobody});
    expectTrueSumsForUser("private mappings of a file, not root", processes.pids());
}

// Nothing in these address spaces tells them apart, and a fork of each makes their memory look shared.
TEST_F(Accuracy, UnrelatedRunsAtTheSameAddresses) {
    const Workload::Conditions sameAddresses = {.user = std::nullopt, .hasRandomAddresses = false};
    const Workload first("fork-tree", {scaled(64), "1", "1", "0"}, sameAddresses);
    const Workload second("fork-tree", {scaled(64), "1", "1", "0"}, sameAddresses);
    ASSERT_EQ(largestMapping(first.pid("root")).start, largestMapping(second.pid("root")).start);
    expectTrueSums("unrelated runs at the same addresses", pidsOf({&first, &second}));
}

TEST_F(Accuracy, UnrelatedRunsAtTheSameAddressesWithoutPrivilege) {
    const Workload::Conditions sameAddresses = {.user = kNobody, .hasRandomAddresses = false};
    const Workload first("fork-tree", {scaled(64), "1", "1", "0"}, sameAddresses);
    const Workload second("fork-tree", {scaled(64), "1", "1", "0"}, sameAddresses);
    expectTrueSumsForUser("unrelated runs at the same addresses, not root", pidsOf({&first, &second}));
}

TEST_F(Accuracy, SwappedOutBeforeForks) {
    const SwapFile swap(scaledBytes(128));
    if (!swap.isUsed()) {
        GTEST_SKIP() << "no swap file to be had";
    }
    const Workload family("swapped-then-forked", {scaled(64), "8"});
    expectTrueSums("swapped out before 8 forks", family.pids());
}

TEST_F(Accuracy, IdenticalChildrenOfAParentThatExecs) {
    const Workload family("orphans-of-exec", {scaled(16), "16"});
    expectTrueSums("16 children of a parent that execs", family.pids());
    EXPECT_GE(measure(family.pids()).summary, 16 * scaledBytes(16));
}

TEST_F(Accuracy, OneAddressSpaceOfTwoProcesses) {
    const Workload twins("one-address-space", {scaled(64)});
    ASSERT_EQ(twins.pids().size(), 2U);
    expectTrueSums("two processes, one address space", twins.pids());
}

TEST_F(Accuracy, WithoutItsFirstThread) {
    const Workload process("without-first-thread", {scaled(64)});
    const Measurement measurement = measure(process.pids());
    expectNear({"without its first thread", measurement.summary, scaledBytes(64)}, 2);
}

// Other processes come and go meanwhile, so the truth is what was in use before or after. With a large tree
// the kernel's own rounding (its counters are kept for each processor) and what ends just now stay small.
TEST_F(Accuracy, WholeSystem) {
    const Workload tree("fork-tree", {"768", "4", "8", "0"});
    const uint64_t before = memoryInUse();
    const Measurement measurement = measureAll();
    const uint64_t after = memoryInUse();
    const uint64_t truth = std::clamp(measurement.summary, std::min(before, after), std::max(before, after));
    expectNear({"all processes", measurement.summary, truth}, 2);
}

TEST_F(Accuracy, AlternatingPagesMakeFewRegions) {
    const Workload family("alternating", {scaled(1024), "1"});
    const pid_t pid = family.pid("root");
    const Measurement measurement = measure(family.pids());
    const AddressRange mapping = largestMapping(pid);
    const auto& starts = measurement.regionStarts.at(pid);
    EXPECT_LE(std::count_if(starts.begin(), starts.end(),
                            [&](uint64_t start) { return start >= mapping.start && start < mapping.end; }),
              1024);
    expectTrueSums("alternating pages", family.pids());
}

namespace {

std::chrono::nanoseconds shortestMeasurement(pid_t pid) {
    constexpr int kAttempts = 7;
    std::chrono::nanoseconds shortest = std::chrono::nanoseconds::max();
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        shortest = std::min(shortest, measure({pid}).duration);
    }
    return shortest;
}

}  // namespace

// A benchmark: nothing is asserted of times.
TEST_F(Accuracy, TimeForAlternatingPages) {
    if (!isFullRun()) {
        GTEST_SKIP() << "a benchmark";
    }
    const Workload forked("alternating", {scaled(1024), "1"});
    const Workload alone("alternating", {scaled(1024), "0"});
    const auto forkedTime = shortestMeasurement(forked.pid("root"));
    const auto aloneTime = shortestMeasurement(alone.pid("root"));
    addRemark(fmt::format(
        "alternating pages: measured in {:.2f} ms after a fork, {:.2f} ms without: {:.2f} times",
        static_cast<double>(forkedTime.count()) / 1e6, static_cast<double>(aloneTime.count()) / 1e6,
        static_cast<double>(forkedTime.count()) / static_cast<double>(aloneTime.count())));
}
