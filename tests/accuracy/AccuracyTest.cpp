#include <fmt/core.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <optional>

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

/// Who measures: root, or a user.
using User = std::optional<uid_t>;

/// The sum of all processes, and the charge of each, against the kernel's own figures.
void expectTrueSums(std::string scenario, const std::vector<pid_t>& pids, User user = {}) {
    const Measurement measurement = user ? measureAsUser(*user, pids) : measure(pids);
    EXPECT_EQ(measurement.errors, std::vector<std::string>());
    scenario += user ? ", not root" : "";
    expectNear({scenario, measurement.summary, physicalMemoryOf(pids)});
    for (const pid_t pid : pids) {
        expectNear(
            {fmt::format("{}: charge of {}", scenario, pid), measurement.charges.at(pid), chargeOf(pid)});
    }
}

std::string forkTree(uint64_t rewrittenLater) {
    return fmt::format("fork-tree {} 16 {} {}", scaled(256), isFullRun() ? 10 : 3, rewrittenLater);
}

class AccuracyForUser : public Accuracy, public testing::WithParamInterface<User> {};

INSTANTIATE_TEST_SUITE_P(Users, AccuracyForUser, testing::Values(User(), User(kNobody)),
                         [](const auto& user) { return user.param ? "Nobody" : "Root"; });

}  // namespace

TEST_P(AccuracyForUser, ForkTree) {
    const Workload tree(forkTree(0), {.user = GetParam()});
    ASSERT_EQ(tree.pids().size(), 18U);
    expectTrueSums("fork tree", tree.pids(), GetParam());
}

TEST_P(AccuracyForUser, PrivateMappingsOfAFile) {
    const auto directory = temporaryDirectory("/var/tmp");
    writeCleanFile(*directory / "file", scaled(256));
    const Workload processes(fmt::format("private-file {} 8", (*directory / "file").string()),
                             {.user = GetParam()});
    expectTrueSums("private mappings of a file", processes.pids(), GetParam());
}

// Nothing in these address spaces tells them apart, and a fork of each makes their memory look shared.
TEST_P(AccuracyForUser, UnrelatedRunsAtTheSameAddresses) {
    const std::string scenario = fmt::format("fork-tree {} 1 1 0", scaled(64));
    const Workload::Conditions sameAddresses = {.user = GetParam(), .hasRandomAddresses = false};
    const Workload first(scenario, sameAddresses);
    const Workload second(scenario, sameAddresses);
    ASSERT_EQ(largestMapping(first.pid("root")).start, largestMapping(second.pid("root")).start);
    auto pids = first.pids();
    for (const pid_t pid : second.pids()) {
        pids.push_back(pid);
    }
    expectTrueSums("unrelated runs at the same addresses", pids, GetParam());
}

TEST_F(Accuracy, GenerationsOfAForkTree) {
    const Workload tree(forkTree(scaled(64)));
    ASSERT_EQ(tree.pids().size(), 21U);
    expectTrueSums("fork tree with generations", tree.pids());
}

TEST_F(Accuracy, SharedObjectsInDifferentRanges) {
    const auto disk = temporaryDirectory("/var/tmp");
    const auto memory = temporaryDirectory("/dev/shm");
    const Workload sharers(fmt::format("shared-objects 8 {} {} {}", scaled(64), (*disk / "file").string(),
                                       (*memory / "file").string()));
    expectTrueSums("shared objects", sharers.pids());
}

TEST_F(Accuracy, KindsOfPages) {
    const auto swap = swapFile(scaled(256));
    const auto huge = hugePages(scaled(32) / 2);
    if (!swap || !huge) {
        GTEST_SKIP() << "no swap file or no huge pages to be had";
    }
    const Workload process(fmt::format("page-kinds {}", scaled(32)));
    expectTrueSums("kinds of pages", process.pids());
}

TEST_F(Accuracy, SwappedOutBeforeForks) {
    const auto swap = swapFile(scaled(128));
    if (!swap) {
        GTEST_SKIP() << "no swap file to be had";
    }
    const Workload family(fmt::format("swapped-then-forked {} 8", scaled(64)));
    expectTrueSums("swapped out before 8 forks", family.pids());
}

TEST_F(Accuracy, IdenticalChildrenOfAParentThatExecs) {
    const Workload family(fmt::format("orphans-of-exec {} 16", scaled(16)));
    expectTrueSums("16 children of a parent that execs", family.pids());
    EXPECT_GE(measure(family.pids()).summary, 16 * scaledBytes(16));
}

// The page tables are in the charge of one of them alone.
TEST_F(Accuracy, OneAddressSpaceOfTwoProcesses) {
    const Workload twins(fmt::format("one-address-space {}", scaled(128)));
    ASSERT_EQ(twins.pids().size(), 2U);
    expectTrueSums("two processes, one address space", twins.pids());
}

// The kernel gives no figure of such a process, so what it took stands for it: the rest is its libraries' and
// what is not yet written back of a program just built.
TEST_F(Accuracy, WithoutItsFirstThread) {
    const Workload process(fmt::format("without-first-thread {}", scaled(64)));
    expectNear({"without its first thread", measure(process.pids()).summary, scaledBytes(64)}, 10);
}

// Other processes come and go meanwhile, so the truth is what was in use before or after, and a look that
// fell into a bad moment is repeated. With a large tree the kernel's own rounding (its counters are kept for
// each processor) stays small.
TEST_F(Accuracy, WholeSystem) {
    constexpr double kPercent = 2;
    const Workload tree("fork-tree 768 4 8 0");
    uint64_t measured = 0;
    uint64_t truth = 0;
    for (int look = 0; look < 3; ++look) {
        const uint64_t before = memoryInUse();
        measured = measureAll().summary;
        const uint64_t after = memoryInUse();
        truth = std::clamp(measured, std::min(before, after), std::max(before, after));
        const uint64_t off = std::max(measured, truth) - std::min(measured, truth);
        if (static_cast<double>(off) * 100 <= static_cast<double>(truth) * kPercent) {
            break;
        }
    }
    expectNear({"all processes", measured, truth}, kPercent);
}

TEST_F(Accuracy, AlternatingPagesMakeFewRegions) {
    const Workload family(fmt::format("alternating {} 1", scaled(1024)));
    const pid_t pid = family.pid("root");
    const AddressRange mapping = largestMapping(pid);
    const auto regionsOf = [&](const Measurement& measurement) {
        return std::ranges::count_if(measurement.regions.at(pid), [&](const Measurement::Region& region) {
            return region.start >= mapping.start && region.start < mapping.end;
        });
    };
    EXPECT_LE(regionsOf(measure(family.pids())), 1024);
    expectTrueSums("alternating pages", family.pids());
    expectTrueSums("alternating pages, measured alone", {pid});
    EXPECT_EQ(regionsOf(measure({pid})), 1) << "there is nobody to share it with";
}

// A benchmark: nothing is asserted of times.
TEST_F(Accuracy, TimeForAlternatingPages) {
    if (!isFullRun()) {
        GTEST_SKIP() << "a benchmark";
    }
    using Milliseconds = std::chrono::duration<double, std::milli>;
    const auto timeOf = [](const std::vector<pid_t>& pids) {
        Milliseconds best = std::chrono::hours(1);
        for (int attempt = 0; attempt < 7; ++attempt) {
            best = std::min(best, Milliseconds(measure(pids).duration));
        }
        return best;
    };
    const auto start = [](int forked) {
        return std::make_unique<Workload>(fmt::format("alternating {} {}", scaled(1024), forked));
    };
    auto workload = start(0);
    const Milliseconds without = timeOf({workload->pid("root")});
    auto other = start(0);
    const Milliseconds twoWithout = timeOf({workload->pid("root"), other->pid("root")});
    other.reset();
    workload = start(1);
    const Milliseconds after = timeOf({workload->pid("root")});
    const Milliseconds family = timeOf(workload->pids());
    fmt::print("alternating pages: {:.2f} ms after a fork, {:.2f} ms without: {:.2f} times\n", after.count(),
               without.count(), after / without);
    fmt::print("with the child:    {:.2f} ms after a fork, {:.2f} ms two without: {:.2f} times\n",
               family.count(), twoWithout.count(), family / twoWithout);
}
