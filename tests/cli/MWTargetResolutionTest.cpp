#include <gtest/gtest.h>

#include "cli/CommandLine.h"
#include "cli/MWMemweightArgs.h"
#include "support/FakeHost.h"
#include "support/RecordedTree.h"

namespace {

using Pids = std::vector<int64_t>;

/// 1 init ── 10 server ─┬─ 11 worker ── 13 helper
///           20 shell ──┤  12 worker
///                      └─ 21 memweight (the tool itself) ── 22 pager (clean, and may exit when idle)
class FamilyHost : public FakeHost {
public:
    FamilyHost() {
        processes[0] = {.parent = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM};
        processes[1] = {.parent = 0, .executable = "/sbin/init"};
        processes[10] = {.parent = 1, .executable = "/usr/bin/server"};
        processes[11] = {.parent = 10, .executable = "/usr/bin/worker"};
        processes[12] = {.parent = 10, .executable = "/usr/bin/worker"};
        processes[13] = {.parent = 11, .executable = "/usr/bin/helper"};
        processes[20] = {.parent = 1, .executable = "/bin/shell"};
        processes[21] = {.parent = 20, .executable = "/usr/bin/memweight"};
        processes[22] = {.parent = 21,
                         .executable = "/usr/bin/pager",
                         .dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT};
        ownPid = 21;
    }
};

MWMemweightArgs parsed(const std::vector<std::string>& arguments) {
    const CommandLine line(arguments);
    return MWMemweightArgs::initWithArgc(line.argc(), line.argv()).value();
}

struct Resolved {
    std::optional<Pids> pids;  ///< keys of the target map
    std::string error;         ///< "CODE: DESCRIPTION" or empty
    std::string standardError;
    MWTargetResolution resolution;
};

Resolved resolve(MWMemweightArgs& args, bool keysArePids = true) {
    testing::internal::CaptureStderr();
    Resolved result = {.pids = {}, .error = {}, .standardError = {}, .resolution = args.targetProcesses()};
    result.standardError = testing::internal::GetCapturedStderr();
    if (const auto& targets = result.resolution.targets) {
        result.pids.emplace();
        for (const auto& [key, process] : *targets) {
            EXPECT_TRUE(!keysArePids || process->pid() == key);
            result.pids->push_back(key);
        }
    }
    if (const auto& error = result.resolution.error) {
        EXPECT_EQ(error->domain, MWMemweightError);
        result.error = std::to_string(error->code) + ": " + error->description.value_or("(none)");
    }
    return result;
}

struct Case {
    std::vector<std::string> arguments;
    std::optional<Pids> pids = {};
    std::string error = {};
    std::string standardError = {};
    std::set<int32_t> refused = {};
    bool listFails = false;
    std::set<std::string> files = {};
};

void expectResolutions(const std::vector<Case>& cases) {
    for (const Case& c : cases) {
        FamilyHost host;
        for (const int32_t pid : c.refused) {
            host.processes[pid].refused = true;
        }
        host.processListFails = c.listFails;
        host.files = c.files;
        MWMemweightArgs args = parsed(c.arguments);
        const Resolved found = resolve(args);
        const std::string arguments = testing::PrintToString(c.arguments);
        EXPECT_EQ(found.pids, c.pids) << arguments;
        EXPECT_EQ(found.error, c.error) << arguments;
        EXPECT_EQ(found.standardError, c.standardError) << arguments;
    }
}

}  // namespace

TEST(MWTargetResolution, TakesWhatIsNamedButForTheExcluded) {
    expectResolutions({
        {{"worker", "20", "--pid", "1"}, Pids{1, 11, 12, 20}},
        {{"worker", "shell", "memweight", "-x", "12", "-x", "shell", "-x", "nosuch"}, Pids{11}},
        {{"-s", "worker", "pager"}, Pids{11, 12}},
        // A descendant is known by its pid alone.
        {.arguments = {"--targetChildren", "server", "shell", "-x", "12"},
         .pids = Pids{10, 11, 20, 22},
         .standardError = "Unable to analyze process with pid 13 (try as root?)\n",
         .refused = {13}},
        {.arguments = {"-a", "nosuch", "-x", "worker"}, .pids = Pids{0, 1, 13, 20, 22}, .refused = {10}},
        // One process only for a name that is also a file's.
        {.arguments = {"worker", "shell"}, .pids = Pids{11, 20}, .files = {"worker"}},
        {{"0", "shell", "-x", "kernel"}, Pids{20}},
        {{"kernel", "shell"}, Pids{0, 20}},
    });
}

TEST(MWTargetResolution, TellsWhatItCannotTake) {
    expectResolutions({
        {{"Worker", "server", "work"},
         Pids{10},
         "4: Unable to find pid for process matching 'Worker'\n"
         "Unable to find pid for process matching 'work'"},
        {{"777"}, Pids{}, "4: Unable to find pid for process matching '777'"},
        {{}, {}, "8: Must specify at least one process or heapsnap"},
        {.arguments = {"worker", "--pid", "20"},
         .pids = Pids{20},
         .error = "4: Unable to obtain system process list",
         .listFails = true},
        {.arguments = {"-a"}, .listFails = true},
        {.arguments = {"worker", "--pid", "777"},
         .pids = Pids{11},
         .standardError = "Unable to analyze process worker [12] (try as root?)\n"
                          "Unable to analyze process with pid 777 (try as root?)\n",
         .refused = {12}},
        {.arguments = {"/tmp", "shell"},
         .error = "7: Error opening heapsnap /tmp: Is a directory",
         .files = {"/tmp"}},
    });
}

class HeapsnapTargets : public RecordedTree {
protected:
    std::string heapsnap(int pid, bool breakdown) {
        const std::string name = std::to_string(pid) + (breakdown ? "a" : "b");
        write(name, R"({"format": "heapsnap", "version": 1, "process": {"pid": )" + std::to_string(pid) +
                        R"(, "name": "saved", "is64bit": true, "description": "X86"}, "page_size": 4096,)" +
                        R"("regions": [], "breakdown": )" + (breakdown ? "true}" : "false}"));
        _host.files.insert(place(name));
        return place(name);
    }
    /// The display strings of the targets, or the error.
    std::string targets(const std::vector<std::string>& arguments) {
        MWMemweightArgs args = parsed(arguments);
        const auto found = resolve(args, false);
        std::string text = found.error;
        for (const auto& [key, process] : found.resolution.targets.value_or(MWTargetMap())) {
            EXPECT_EQ(key < 0, process->displayString().ends_with(" (heapsnap)"));
            text += process->displayString() + ";";
        }
        EXPECT_EQ(args.didSetShouldGetPhysMemweightBreakdown(), found.resolution.targets.has_value());
        return text;
    }
    FamilyHost _host;
};

TEST_F(HeapsnapTargets, AreTargetsBesideProcesses) {
    EXPECT_EQ(targets({heapsnap(7, true)}), "saved [7] (heapsnap);");
    EXPECT_EQ(targets({heapsnap(7, true), "shell"}), "saved [7] (heapsnap);shell [20];");
}

TEST_F(HeapsnapTargets, OneModeForAll) {
    const std::string conflict =
        "6: Heapsnap was gathered with an analysis mode that conflicts with other heapsnaps or command line "
        "arguments: ";
    EXPECT_EQ(targets({"--vmObjectDirty", heapsnap(7, false)}), "saved [7] (heapsnap);");
    const CommandLine line({"--vmObjectDirty", heapsnap(7, true)});
    MWMemweightArgs args = MWMemweightArgs::initWithArgc(line.argc(), line.argv()).value();
    EXPECT_EQ(resolve(args, false).error, conflict + heapsnap(7, true));
    args = parsed({heapsnap(7, true), heapsnap(8, false)});
    EXPECT_TRUE(resolve(args, false).error.starts_with(conflict));
    args = parsed({heapsnap(8, false)});
    resolve(args, false);
    EXPECT_FALSE(args.shouldGetPhysMemweightBreakdown());
}

TEST_F(HeapsnapTargets, OnePidIsOneTarget) {
    const std::string twice =
        "7: There is more than one target with pid 20: measure heapsnaps of the same pid one at a time";
    for (const auto& arguments : {std::vector{heapsnap(20, true), std::string("shell")},
                                  std::vector{heapsnap(20, true), _top + "/./20a"}}) {
        _host.files.insert(arguments.back());
        MWMemweightArgs args = parsed(arguments);
        EXPECT_EQ(resolve(args).error, twice);
    }
}

TEST(MWTargetResolution, UnmappedAddsAllOtherProcessesHidden) {
    const FamilyHost host;
    MWMemweightArgs args = parsed({"worker", "--unmapped", "-x", "shell"});
    const auto found = resolve(args);
    EXPECT_EQ(found.pids, (Pids{1, 10, 11, 12, 13, 22}));
    for (const auto& [pid, process] : *found.resolution.targets) {
        EXPECT_EQ(process->hiddenFromDisplay(), pid != 11 && pid != 12) << pid;
    }
}

TEST(MWTargetResolution, ResolvingAgainFindsNewProcessesAndKeepsFormerPids) {
    FamilyHost host;
    MWMemweightArgs args = parsed({"worker", "20"});
    const auto first = resolve(args);
    EXPECT_EQ(args.targetPids(), (MWPidMap{{11, "worker"}, {12, "worker"}, {20, std::nullopt}}));
    host.processes[14] = {.parent = 10, .executable = "/usr/bin/worker"};
    host.processes.erase(11);
    const auto second = resolve(args);
    EXPECT_EQ(second.pids, (Pids{12, 14, 20}));
    EXPECT_EQ(second.standardError, "Unable to analyze process worker [11] (try as root?)\n");
    EXPECT_NE(first.resolution.targets->at(12), second.resolution.targets->at(12));
}
