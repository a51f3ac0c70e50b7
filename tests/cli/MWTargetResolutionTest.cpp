#include <gtest/gtest.h>

#include "cli/MWMemweightArgs.h"
#include "support/FakeHost.h"

namespace {

using Pids = std::vector<int64_t>;

/// 1 init ── 10 server ─┬─ 11 worker ── 13 helper
///           20 shell ──┤  12 worker
///                      └─ 21 memweight (the tool itself) ── 22 pager
void addFamily(FakeHost& host) {
    host.processes[1] = {.parent = 0, .executable = "/sbin/init"};
    host.processes[10] = {.parent = 1, .executable = "/usr/bin/server"};
    host.processes[11] = {.parent = 10, .executable = "/usr/bin/worker"};
    host.processes[12] = {.parent = 10, .executable = "/usr/bin/worker"};
    host.processes[13] = {.parent = 11, .executable = "/usr/bin/helper"};
    host.processes[20] = {.parent = 1, .executable = "/bin/shell"};
    host.processes[21] = {.parent = 20, .executable = "/usr/bin/memweight"};
    host.processes[22] = {.parent = 21, .executable = "/usr/bin/pager"};
    host.ownPid = 21;
}

MWMemweightArgs targeting(std::set<std::string> descriptions) {
    MWMemweightArgs args;
    args.setPotentialTargetProcesses(std::move(descriptions));
    return args;
}

struct Resolved {
    std::optional<Pids> pids;  ///< keys of the target map
    std::string error;         ///< "CODE: DESCRIPTION" or empty
    std::string standardError;
    MWTargetResolution resolution;
};

Resolved resolve(MWMemweightArgs& args) {
    testing::internal::CaptureStderr();
    Resolved result = {.pids = {}, .error = {}, .standardError = {}, .resolution = args.targetProcesses()};
    result.standardError = testing::internal::GetCapturedStderr();
    if (const auto& targets = result.resolution.targets) {
        result.pids.emplace();
        for (const auto& [key, process] : *targets) {
            EXPECT_EQ(process->pid(), key);
            result.pids->push_back(key);
        }
    }
    if (const auto& error = result.resolution.error) {
        EXPECT_EQ(error->domain, MWMemweightError);
        result.error = std::to_string(error->code) + ": " + error->description.value_or("(none)");
    }
    return result;
}

Resolved resolve(MWMemweightArgs&& args) {
    return resolve(args);
}

}  // namespace

TEST(MWTargetResolution, NamesAndPidsBecomeProcesses) {
    FakeHost host;
    addFamily(host);
    MWMemweightArgs args = targeting({"worker", "20"});
    args.setTargetPids({{1, std::nullopt}});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, (Pids{1, 11, 12, 20}));
    EXPECT_EQ(found.error, "");
    EXPECT_EQ(args.targetPids(),
              (MWPidMap{{1, std::nullopt}, {11, "worker"}, {12, "worker"}, {20, std::nullopt}}));
    EXPECT_FALSE(found.resolution.targets->at(11)->hiddenFromDisplay());
}

TEST(MWTargetResolution, WhatMatchesNothingIsToldBesideTheMap) {
    FakeHost host;
    addFamily(host);
    const auto some = resolve(targeting({"Worker", "server", "work"}));
    EXPECT_EQ(some.pids, Pids{10});
    EXPECT_EQ(some.error,
              "4: Unable to find pid for process matching 'Worker'\n"
              "Unable to find pid for process matching 'work'");
    const auto none = resolve(targeting({"777"}));
    EXPECT_EQ(none.pids, Pids{});
    EXPECT_EQ(none.error, "4: Unable to find pid for process matching '777'");
    EXPECT_EQ(none.standardError, "");
}

TEST(MWTargetResolution, NothingToTargetFails) {
    const FakeHost host;
    const auto nothing = resolve(MWMemweightArgs());
    EXPECT_FALSE(nothing.pids);
    EXPECT_EQ(nothing.error, "8: Must specify at least one process or heapsnap");
}

TEST(MWTargetResolution, AnUnreadableProcessListLeavesThePidsGivenAsNumbers) {
    FakeHost host;
    addFamily(host);
    host.processListFails = true;
    MWMemweightArgs args = targeting({"worker"});
    args.setTargetPids({{20, std::nullopt}});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, Pids{20});
    EXPECT_EQ(found.error, "4: Unable to obtain system process list");

    MWMemweightArgs all;
    all.setTargetAll(true);
    const auto none = resolve(all);
    EXPECT_FALSE(none.pids);
    EXPECT_EQ(none.error, "");
}

TEST(MWTargetResolution, ProcessesThatCannotBeReadAreNamedAndSkipped) {
    FakeHost host;
    addFamily(host);
    host.processes[12].refused = true;
    MWMemweightArgs args = targeting({"worker"});
    args.setTargetPids({{777, std::nullopt}});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, Pids{11});
    EXPECT_EQ(found.standardError,
              "Unable to analyze process worker [12] (try as root?)\n"
              "Unable to analyze process with pid 777 (try as root?)\n");
}

TEST(MWTargetResolution, ExclusionsHoldAndUnknownOnesAreIgnored) {
    FakeHost host;
    addFamily(host);
    MWMemweightArgs args = targeting({"worker", "shell", "memweight"});
    args.setExcludedPidsOrProcesses({"12", "shell", "nosuch"});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, Pids{11});
    EXPECT_EQ(found.error, "");

    MWMemweightArgs self = targeting({"memweight"});
    self.setExcludeSelf(false);
    EXPECT_EQ(resolve(self).pids, Pids{21});
}

TEST(MWTargetResolution, ChildrenAreTargetsButForExcludedOnesAndTheToolItself) {
    FakeHost host;
    addFamily(host);
    host.processes[13].refused = true;
    MWMemweightArgs args = targeting({"server", "shell"});
    args.setTargetChildren(true);
    args.setExcludedPidsOrProcesses({"12"});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, (Pids{10, 11, 20, 22}));
    // No name: a descendant is known by its pid alone.
    EXPECT_EQ(found.standardError, "Unable to analyze process with pid 13 (try as root?)\n");
    EXPECT_EQ(args.targetPids().at(10), std::nullopt);
}

TEST(MWTargetResolution, AllTakesEveryReadableProcessButTheExcluded) {
    FakeHost host;
    addFamily(host);
    host.processes[10].refused = true;
    MWMemweightArgs args = targeting({"nosuch"});
    args.setTargetAll(true);
    args.setExcludedPidsOrProcesses({"worker"});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, (Pids{1, 13, 20, 22}));
    EXPECT_EQ(found.error, "");
    EXPECT_EQ(found.standardError, "");
}

TEST(MWTargetResolution, UnmappedAddsAllOtherProcessesHidden) {
    FakeHost host;
    addFamily(host);
    host.processes[0] = {.parent = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM};
    MWMemweightArgs args = targeting({"worker"});
    args.setSearchForUnmapped(true);
    args.setExcludedPidsOrProcesses({"shell"});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, (Pids{1, 10, 11, 12, 13, 22}));
    for (const auto& [pid, process] : *found.resolution.targets) {
        EXPECT_EQ(process->hiddenFromDisplay(), pid != 11 && pid != 12) << pid;
    }
}

TEST(MWTargetResolution, SkipDropsIdleExitCleanProcesses) {
    FakeHost host;
    addFamily(host);
    host.processes[11].dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    MWMemweightArgs args = targeting({"worker"});
    EXPECT_EQ(resolve(args).pids, (Pids{11, 12}));
    args.setSkipIdleExitClean(true);
    EXPECT_EQ(resolve(args).pids, Pids{12});
}

TEST(MWTargetResolution, AFileIsMeantUnlessItBearsTheNameOfAProcess) {
    FakeHost host;
    addFamily(host);
    host.files = {"worker", "/tmp"};
    MWMemweightArgs args = targeting({"worker", "shell"});
    EXPECT_EQ(resolve(args).pids, (Pids{11, 20}));  // one process only for a name that is also a file's
    EXPECT_EQ(args.potentialTargetProcesses(), std::set<std::string>{"shell"});

    const auto directory = resolve(targeting({"/tmp", "shell"}));
    EXPECT_FALSE(directory.pids);
    EXPECT_EQ(directory.error, "7: Error opening heapsnap /tmp: reading heapsnap files is not built yet");
}

TEST(MWTargetResolution, TheKernelIsRefusedUnlessExcluded) {
    FakeHost host;
    addFamily(host);
    host.processes[0] = {.parent = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM};
    const auto kernel = resolve(targeting({"0", "shell"}));
    EXPECT_FALSE(kernel.pids);
    EXPECT_EQ(kernel.error, "10: Measuring the kernel (pid 0) is not built yet");

    MWMemweightArgs without = targeting({"0", "shell"});
    without.setExcludedPidsOrProcesses({"kernel"});
    EXPECT_EQ(resolve(without).pids, Pids{20});
}

TEST(MWTargetResolution, ResolvingAgainFindsNewProcessesAndKeepsFormerPids) {
    FakeHost host;
    addFamily(host);
    MWMemweightArgs args = targeting({"worker"});
    const auto first = resolve(args);
    host.processes[14] = {.parent = 10, .executable = "/usr/bin/worker"};
    host.processes.erase(11);
    const auto second = resolve(args);
    EXPECT_EQ(second.pids, (Pids{12, 14}));
    EXPECT_EQ(second.standardError, "Unable to analyze process worker [11] (try as root?)\n");
    EXPECT_NE(first.resolution.targets->at(12), second.resolution.targets->at(12));
}
