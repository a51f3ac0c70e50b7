#include "cli/MWEntry.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <mutex>
#include <thread>

#include "analysis/MWMemweight.h"
#include "cli/CommandLine.h"
#include "cli/MWUsage.h"
#include "support/FakeHost.h"

namespace {

struct Run {
    int status;
    std::string output;
    std::string errors;
};

template <typename Work>
Run capture(Work work) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    const int status = work();
    return {status, testing::internal::GetCapturedStdout(), testing::internal::GetCapturedStderr()};
}

Run run(std::initializer_list<std::string> arguments) {
    const CommandLine line(arguments);
    return capture([&] { return MWMemweightMain(line.argc(), line.argv()); });
}

/// A process of one region: four private pages, all dirty.
FakeProcess processOfFourPages(const std::string& executable) {
    FakeRegion region = {.start = 0x10000, .size = 4 * 4096};
    region.info.share_mode = SM_PRIVATE;
    region.info.pages_resident = 4;
    region.info.pages_dirtied = 4;
    region.info.object_id_full = 77;
    FakeProcess process = {.executable = executable};
    process.regions = {region};
    return process;
}

/// A system on which the user interrupts the tool twice before it has read the first process.
class InterruptingHost : public FakeHost {
public:
    kern_return_t mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t& depth,
                                         vm_region_submap_info_64& info, uint32_t& count) override {
        std::call_once(_interrupted, [] {
            interrupt();
            // The second one is taken only when the first one has been dealt with.
            interrupt();
        });
        return FakeHost::mach_vm_region_recurse(task, address, size, depth, info, count);
    }

private:
    static void interrupt() {
        kill(::getpid(), SIGINT);
        sigset_t pending;
        do {
            std::this_thread::yield();
            sigpending(&pending);
        } while (sigismember(&pending, SIGINT) == 1);
    }

    std::once_flag _interrupted;
};

constexpr const char* kNoProcesses =
    "Unable to find any processes matching the supplied process names or pids (try as root?)\n";

}  // namespace

TEST(MWUsage, IsThisText) {
    EXPECT_EQ(
        MWUsageText(),
        "Gather memory information about a process or set of processes\n"
        "Usage: memweight [args] [proc/pid/heapsnap [proc/pid/heapsnap [...]]]\n"
        "    -a, --all                             target all processes\n"
        "    -j, --json <file>                     print json output to a file\n"
        "    -h, --help                            print this output\n"
        "    -p, --proc, --pid [proc/pid]          target pid or process (or interpret for -p)\n"
        "    -x, --exclude [proc/pid]              exclude pid or process\n"
        "    -s, --skip                            skip processes that are idle-exit clean\n"
        "    -v                                    print all regions and spanlist-like output of address "
        "space layout (default output is a summary)\n"
        "    -f, --format (bytes|formatted|pages)  change size formatting preference (default: formatted)\n"
        "    --sort <column>                       change the column used for sorting (default: dirty)\n"
        "    -w, --wide                            show wide output with all columns and full paths "
        "(implies --swapped --wired)\n"
        "    --swapped                             show swapped/compressed column\n"
        "    --wired                               show wired column\n"
        "    --vmObjectDirty                       interpret dirty memory as viewed by VM objects in the "
        "kernel\n"
        "    --unmapped                            search all processes for unmapped memory owned by the "
        "target processes\n"
        "    --sample <interval>                   repeatedly gather memweight at the given sampling "
        "interval in seconds (can be fractional \xE2\x80\x94 e.g. 0.5)\n");
}

TEST(MWEntry, HelpAndRefusedArgumentsPrintTheUsageOnStandardOutput) {
    const FakeHost host;
    const auto help = run({"-w", "-h"});
    EXPECT_EQ(help.status, 0);
    EXPECT_EQ(help.output, MWUsageText());
    EXPECT_EQ(help.errors, "");

    const auto format = run({"-f", "kb"});
    EXPECT_EQ(format.status, 1);
    EXPECT_EQ(format.output, MWUsageText());
    EXPECT_EQ(format.errors,
              "Unrecognized argument to -f / --format.\n"
              "Accepted arguments: 'bytes', 'formatted', 'pages'.\n");

    const auto unknown = run({"--nonsense"});
    EXPECT_EQ(unknown.status, 1);
    EXPECT_EQ(unknown.output, MWUsageText());
    EXPECT_EQ(unknown.errors, "memweight: unrecognized option '--nonsense'\n");
}

TEST(MWEntry, OptionsThatAreNotBuiltEndTheRunBeforeAnythingIsTouched) {
    FakeHost host;
    const auto json = run({"nosuch", "-j", "/dev/null", "-v"});
    EXPECT_EQ(json.status, 1);
    EXPECT_EQ(json.output, "");
    EXPECT_EQ(json.errors, "memweight: --json is not built yet\nmemweight: -v is not built yet\n");
    EXPECT_EQ(run({"--sample", "1", "--statpack", "a.spj", "1"}).errors,
              "memweight: --statpack is not built yet\nmemweight: --sample is not built yet\n");
    EXPECT_TRUE(host.unlinked.empty());
    EXPECT_EQ(host.asked("proc_pidinfo.full"), 0);
}

TEST(MWEntry, SystemWideOptionsNeedRoot) {
    FakeHost host;
    host.processes[5] = processOfFourPages("/bin/five");
    host.effectiveUser = 1000;
    for (const auto& refused : {run({"-a"}), run({"--unmapped", "five"})}) {
        EXPECT_EQ(refused.status, 1);
        EXPECT_EQ(refused.output, "");
        EXPECT_EQ(refused.errors, "Must run as root.\n");
    }
    EXPECT_EQ(host.asked("task_read_for_pid"), 0);
    EXPECT_EQ(run({"five"}).status, 0);
    // The conflicting mode takes --unmapped away, and with it the need for root.
    EXPECT_EQ(run({"--unmapped", "--vmObjectDirty", "five"}).status, 0);
}

TEST(MWEntry, ARunWithoutTargetsSaysSoAndRemovesItsOutputFiles) {
    FakeHost host;
    host.processes[5] = processOfFourPages("/bin/five");
    EXPECT_EQ(run({"nosuch"}).errors, kNoProcesses);
    EXPECT_EQ(run({"--pid", "777"}).errors,
              std::string("Unable to analyze process with pid 777 (try as root?)\n") + kNoProcesses);

    const auto nothing = run({});
    EXPECT_EQ(nothing.status, 1);
    EXPECT_EQ(nothing.output, MWUsageText());
    EXPECT_EQ(nothing.errors, "Must specify at least one process or heapsnap\n");

    MWMemweightArgs args;
    args.setPotentialTargetProcesses({"nosuch"});
    args.setJSONOutputFile("a.json");
    args.setStatpackOutputFile("a.spj");
    const auto withFiles = capture([&] { return MWRunMemweight(args); });
    EXPECT_EQ(withFiles.status, 1);
    EXPECT_EQ(withFiles.output, "");
    EXPECT_EQ(host.unlinked, (std::vector<std::string>{"a.json", "a.spj"}));
}

TEST(MWEntry, OneMeasurementReportsWhatWasFoundAndNamesWhatWasNot) {
    FakeHost host;
    host.processes[5] = processOfFourPages("/bin/five");
    const auto report = run({"-f", "bytes", "five", "nosuch"});
    EXPECT_EQ(report.status, 0);
    EXPECT_EQ(report.errors, "Unable to find pid for process matching 'nosuch'\n");
    EXPECT_NE(report.output.find("five [5]"), std::string::npos) << report.output;
    EXPECT_NE(report.output.find("16384"), std::string::npos) << report.output;
    EXPECT_TRUE(host.openTasks.empty());
}

TEST(MWEntry, TheBreakdownModeIsSwitchedOnUnlessObjectsAreAskedFor) {
    FakeHost host;
    host.processes[5] = processOfFourPages("/bin/five");
    run({"--vmObjectDirty", "five"});
    EXPECT_EQ(host.selfRegionMemweight, 0);
    run({"five"});
    EXPECT_EQ(host.selfRegionMemweight, 1);
}

TEST(MWEntry, AnInterruptEndsTheGatheringButNotTheReport) {
    InterruptingHost host;
    // One process more than are read at once: the lowest pid's turn comes after the interrupt.
    const int32_t highest = static_cast<int32_t>(std::thread::hardware_concurrency()) + 2;
    for (int32_t pid = 1; pid <= highest; ++pid) {
        host.processes[pid] = processOfFourPages("/bin/many");
    }
    const auto report = run({"-f", "bytes", "many"});
    EXPECT_EQ(report.status, 0);
    EXPECT_EQ(report.errors, "Exiting early due to SIGINT\nExiting early due to SIGINT\n");
    const auto contains = [&](const std::string& text) {
        return report.output.find(text) != std::string::npos;
    };
    EXPECT_TRUE(contains("many [" + std::to_string(highest) + "]")) << report.output;
    EXPECT_TRUE(contains("16384")) << report.output;
    EXPECT_TRUE(contains("Memweight exited early due to SIGINT")) << report.output;
}

TEST(MWEntryDeathTest, AnInterruptEndsARunThatWritesToATerminal) {
    InterruptingHost host;
    host.processes[5] = processOfFourPages("/bin/five");
    host.terminals = {STDOUT_FILENO};
    const CommandLine line({"five"});
    const auto interrupted = [&] {
        std::signal(SIGINT, SIG_DFL);  // a background job starts with the signal ignored
        std::exit(MWMemweightMain(line.argc(), line.argv()));
    };
    EXPECT_EXIT(interrupted(), testing::KilledBySignal(SIGINT), "");
}
