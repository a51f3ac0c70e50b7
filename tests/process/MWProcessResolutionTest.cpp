#include <gtest/gtest.h>

#include <vector>

#include "process/MWProcess.h"
#include "support/FakeHost.h"
#include "support/FaultyHost.h"

namespace {

using Lines = std::vector<std::string>;
using Pids = std::vector<int32_t>;

TEST(MWProcessResolutionTest, NamesProcessByExecutableThenNameThenComm) {
    using namespace std::string_literals;
    const std::vector<std::pair<FakeProcess, std::string>> cases = {
        {{.comm = "comm", .name = "name", .executable = "/usr/bin/editor"}, "editor"},
        {{.comm = "comm", .name = "name", .executable = "\0\0\0\0relative"s}, "relative"},
        {{.comm = "comm", .name = "name", .executable = "\0\0"s}, "name"},
        {{.comm = "comm", .name = "name"}, "name"},
        {{.comm = "comm"}, "comm"},
        {{.comm = std::string(16, 'c')}, std::string(16, 'c')},  // fills its field, no NUL
        {{.name = std::string(40, 'n')}, std::string(32, 'n')},
        {{}, "Unknown"},
    };
    for (const auto& [process, name] : cases) {
        FakeHost host;
        host.processes[5] = process;
        proc_bsdinfo info = {};
        host.proc_pidinfo(5, info);
        EXPECT_EQ(MWProcess::_nameForBsdInfo(info), name);
    }
}

TEST(MWProcessResolutionTest, MatchesDescriptionsByNameAndPid) {
    FakeHost host;
    host.processes[10] = {.executable = "/bin/shell"};
    host.processes[11] = {.executable = "/bin/12"};
    host.processes[12] = {.executable = "/bin/shell"};
    host.processes[13] = {.executable = "/bin/12"};
    struct Case {
        Lines descriptions;
        MWPidMap pids;
        Lines unmatched;
    };
    const std::vector<Case> cases = {
        {{"shell"}, {{10, "shell"}, {12, "shell"}}, {}},
        {{"12"}, {{11, "12"}, {12, std::nullopt}}, {}},  // the pid match ends the search
        {{" +12abc"}, {{12, std::nullopt}}, {}},
        {{"Shell", "/bin/shell", "-12", "+-12", "", "99999999999999999999", "4294967308"},
         {},
         {"Shell", "/bin/shell", "-12", "+-12", "", "99999999999999999999", "4294967308"}},
        {{"shell", "10", "gone"}, {{10, std::nullopt}, {12, "shell"}}, {"gone"}},
    };
    for (const Case& c : cases) {
        Lines messages;
        EXPECT_EQ(MWProcess::pidsForStringDescriptions(c.descriptions, &messages), c.pids);
        Lines expected;
        for (const std::string& description : c.unmatched) {
            expected.push_back("Unable to find pid for process matching '" + description + "'");
        }
        EXPECT_EQ(messages, expected);
    }
}

// The walk for a pid ends there, so that nobody has to be asked about those behind it.
TEST(MWProcessResolutionTest, LooksAtNoProcessBehindTheLastThatIsDescribed) {
    FakeHost host;
    for (const int32_t pid : {10, 11, 12, 13, 14}) {
        host.processes[pid] = {.executable = "/bin/shell"};
    }
    host.processes[14].executable = "/bin/12";
    EXPECT_EQ(MWProcess::pidsForStringDescriptions({"12", "11"}, nullptr),
              (MWPidMap{{11, std::nullopt}, {12, std::nullopt}}));
    EXPECT_EQ(host.asked("proc_pidinfo.full"), 3);
    host.processes[12].gone = true;
    EXPECT_EQ(MWProcess::pidsForStringDescriptions({"12", "11"}, nullptr),
              (MWPidMap{{11, std::nullopt}, {14, "12"}}))
        << "it was listed and is no process: the walk goes on";
}

// 0 ─┬─ 1 ─┬─ 40 ── 3
//    │     └─ 41 ── 2
//    └─ 50             0 and 51 are their own parents
TEST(MWProcessResolutionTest, FindsDescendantsByGenerationEachOnce) {
    FakeHost host;
    for (const auto& [pid, parent] :
         std::map<int32_t, int32_t>{{0, 0}, {1, 0}, {2, 41}, {3, 40}, {40, 1}, {41, 1}, {50, 0}, {51, 51}}) {
        host.processes[pid].parent = parent;
    }
    EXPECT_EQ(MWProcess::childPidsForPids({1}), (Pids{1, 40, 41, 2, 3}));
    EXPECT_EQ(MWProcess::childPidsForPids({0}), (Pids{0, 1, 50, 40, 41, 2, 3}));
    EXPECT_EQ(MWProcess::childPidsForPids({41, 1, 41}), (Pids{41, 1, 2, 40, 3}));
    EXPECT_EQ(MWProcess::childPidsForPids({51, 777}), (Pids{51, 777}));
}

Pids keysOf(const MWTargetMap& processes) {
    Pids keys;
    for (const auto& [key, process] : processes) {
        keys.push_back(static_cast<int32_t>(key));
    }
    return keys;
}

TEST(MWProcessResolutionTest, TakesEveryProcessThatCanBeRead) {
    constexpr uint32_t idle = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    FakeHost host;
    host.processes[0] = {.parent = 0, .flags = PROC_FLAG_SYSTEM};
    host.processes[5] = {.dirtyFlags = idle};
    host.processes[6] = {.dirtyFlags = idle | PROC_DIRTY_IS_DIRTY};
    host.processes[7] = {.refused = true};
    host.processes[8] = {.gone = true};
    host.processes[9] = {.dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_IS_DIRTY};
    host.processes[10] = {};
    const auto processes = MWProcess::allProcessesExcludingPids({10});
    ASSERT_TRUE(processes);
    EXPECT_EQ(keysOf(*processes), (Pids{0, 5, 6, 9}));
    EXPECT_EQ(host.asked("task_read_for_pid"), 4) << "neither of the kernel nor of excluded processes";
    EXPECT_EQ(processes->at(5)->idleExitStatus(), IdleExitClean);
    EXPECT_EQ(processes->at(6)->idleExitStatus(), IdleExitDirty);
    EXPECT_EQ(processes->at(9)->idleExitStatus(), IdleExitIneligible);
    EXPECT_EQ(keysOf(MWProcess::removeIdleExitCleanProcessesFrom(*processes)), (Pids{0, 6, 9}));
    EXPECT_EQ(MWProcess::processWithPid(8), nullptr);
}

TEST(MWProcessResolutionTest, UnreadableProcessListIsNoEmptyList) {
    const auto allFail = [] {
        Lines messages;
        EXPECT_FALSE(MWProcess::pidsForStringDescriptions({"a", "b"}, &messages));
        EXPECT_EQ(messages, Lines{"Unable to obtain system process list"});
        EXPECT_FALSE(MWProcess::childPidsForPids({1}));
        EXPECT_FALSE(MWProcess::allProcessesExcludingPids({}));
    };
    FakeHost host;
    allFail();  // a list without a single readable record
    host.processes[5] = {};
    host.processListFails = true;
    allFail();
}

TEST(MWProcessResolutionTest, AProcessThatDoesNotRespondIsAnError) {
    constexpr int32_t kStuck = 30;
    FakeHost inner;
    for (int32_t pid = 1; pid <= 40; ++pid) {
        inner.processes[pid] = {.comm = "worker"};
    }
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"proc_pidinfo", "Unknown [30]: not responding"},
        {"task_read_for_pid", "worker [30]: not responding"},
        {"sysctlArgumentArea", "worker [30]: not responding"},
    };
    for (const auto& [operation, message] : cases) {
        SCOPED_TRACE(operation);
        FaultyHost host(inner, HostFault{{operation, kStuck, 1}, FaultKind::hangs});
        const auto processes = MWProcess::allProcessesExcludingPids({});
        host.release();
        ASSERT_TRUE(processes);
        EXPECT_EQ(processes->size(), 40U);
        for (const auto& [pid, process] : *processes) {
            EXPECT_EQ(process->errors(), pid == kStuck ? Lines{message} : Lines{});
        }
    }
    for (const auto& [operation, message] : cases) {
        FaultyHost host(inner, HostFault{{operation, kStuck, 1}, FaultKind::hangs});
        const auto process = MWProcess::processWithPid(kStuck);
        host.release();
        ASSERT_NE(process, nullptr);
        EXPECT_EQ(process->errors(), Lines{message});
    }
    {
        FaultyHost host(inner, HostFault{{"proc_pidinfo", kStuck, 1}, FaultKind::hangs});
        EXPECT_EQ(MWProcess::childPidsForPids({0})->size(), 1U) << "nobody knows whose child it is";
        host.release();
        EXPECT_EQ(MWProcess::pidsForStringDescriptions({"30"}, nullptr), (MWPidMap{{kStuck, std::nullopt}}));
    }
}

}  // namespace
