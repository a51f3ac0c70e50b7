#include "cli/MWEntry.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <thread>

#include "analysis/MWMemweight.h"
#include "cli/CommandLine.h"
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

Run run(const std::vector<std::string>& arguments) {
    const CommandLine line(arguments);
    return capture([&] { return MWMemweightMain(line.argc(), line.argv()); });
}

/// A process of one region: four private pages, all dirty.
FakeProcess processOfFourPages(const std::string& executable) {
    return {.executable = executable,
            .regions = {{.start = 0x10000,
                         .size = 4 * 4096,
                         .info = {.pages_resident = 4, .pages_dirtied = 4, .share_mode = SM_PRIVATE}}}};
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

}  // namespace

TEST(MWEntry, RefusedArgumentsPrintTheUsageOnStandardOutput) {
    std::ifstream file(std::filesystem::path(__FILE__).replace_filename("usage.txt"));
    const std::string usage{std::istreambuf_iterator<char>(file), {}};
    const FakeHost host;
    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::string errors;
    };
    const std::vector<Case> cases = {
        {{"-w", "-h"}, 0, ""},
        {{"-f", "kb"},
         1,
         "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n"},
        {{"--nonsense"}, 1, "memweight: unrecognized option '--nonsense'\n"},
        {{}, 1, "Must specify at least one process or heapsnap\n"},
    };
    for (const Case& c : cases) {
        const auto refused = run(c.arguments);
        EXPECT_EQ(refused.status, c.status);
        EXPECT_EQ(refused.output, usage);
        EXPECT_EQ(refused.errors, c.errors);
    }
}

TEST(MWEntry, RefusesBeforeAnythingIsTouched) {
    FakeHost host;
    host.processes[5] = processOfFourPages("/bin/five");
    host.effectiveUser = 1000;
    const std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
        {{"-a"}, "Must run as root.\n"},
        {{"--unmapped", "five"}, "Must run as root.\n"},
    };
    for (const auto& [arguments, errors] : cases) {
        const auto refused = run(arguments);
        EXPECT_EQ(refused.status, 1);
        EXPECT_EQ(refused.output, "");
        EXPECT_EQ(refused.errors, errors);
    }
    EXPECT_TRUE(host.unlinked.empty());
    EXPECT_EQ(host.asked("proc_pidinfo.full") + host.asked("task_read_for_pid"), 0);
    // The conflicting mode takes --unmapped away, and with it the need for root.
    EXPECT_EQ(run({"--unmapped", "--vmObjectDirty", "five"}).status, 0);
}

/// Where a test's output files go.
class MWEntryFiles : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_NE(mkdtemp(_directory.data()), nullptr);
        _host.processes[5] = processOfFourPages("/bin/five");
    }
    void TearDown() override { std::filesystem::remove_all(_directory); }
    std::string path(const std::string& name) const { return _directory + "/" + name; }
    static std::string contentOf(const std::string& path) {
        std::ifstream file(path);
        return {std::istreambuf_iterator<char>(file), {}};
    }

    FakeHost _host;
    std::string _directory = testing::TempDir() + "memweight-XXXXXX";
};

TEST_F(MWEntryFiles, ARunWithoutTargetsSaysSoAndRemovesItsOutputFiles) {
    const auto none = run({"--pid", "777", "-j", path("a.json"), "--statpack", path("a.spj")});
    EXPECT_EQ(none.status, 1);
    EXPECT_EQ(none.output, "");
    EXPECT_EQ(none.errors,
              "Unable to analyze process with pid 777 (try as root?)\n"
              "Unable to find any processes matching the supplied process names or pids (try as root?)\n");
    EXPECT_EQ(_host.unlinked, (std::vector<std::string>{path("a.json"), path("a.spj")}));
}

TEST_F(MWEntryFiles, AnOutputThatCannotBeWrittenFailsBeforeAnythingIsRead) {
    const auto noDocument = run({"five", "-j", "/nonexistent/a.json", "--statpack", path("a.spj")});
    EXPECT_EQ(noDocument.status, 1);
    EXPECT_EQ(noDocument.output, "");
    EXPECT_EQ(noDocument.errors,
              "Unable to open JSON writer: No such file or directory\nUnable to create JSON output\n");
    EXPECT_EQ(_host.unlinked, (std::vector<std::string>{"/nonexistent/a.json", path("a.spj")}));
    const auto noMetrics = run({"five", "-j", path("a.json"), "--statpack", _directory});
    EXPECT_EQ(noMetrics.status, 1);
    EXPECT_EQ(noMetrics.errors,
              "Unable to open spwriter: Is a directory\nUnable to create statpack output\n");
    EXPECT_EQ(_host.asked("task_read_for_pid"), 0);
}

TEST_F(MWEntryFiles, NoFileIsBothReadAndWrittenOrWrittenTwice) {
    std::ofstream(path("saved.heapsnap")) << "precious";
    std::filesystem::create_directory(path("folder"));
    std::filesystem::create_symlink("saved.heapsnap", path("link"));
    _host.files = {path("saved.heapsnap")};
    using Arguments = std::vector<std::string>;
    const std::vector<std::pair<Arguments, std::string>> cases = {
        {{path("saved.heapsnap"), "-j", path("link")}, path("link")},
        {{path("saved.heapsnap"), "--statpack", path("folder/../saved.heapsnap")},
         path("folder/../saved.heapsnap")},
        {{"five", "-j", path("new"), "--statpack", path("./new")}, path("./new")},
        {{"five", "-j", "/dev/stdout"}, "/dev/stdout"},  // which the test has in a file
    };
    for (const auto& [arguments, file] : cases) {
        const auto refused = run(arguments);
        EXPECT_EQ(refused.status, 1);
        EXPECT_EQ(refused.errors, file + " would be both read and written, or written twice.\n");
    }
    EXPECT_EQ(contentOf(path("saved.heapsnap")), "precious");
    EXPECT_TRUE(_host.unlinked.empty());
    EXPECT_EQ(run({"five", "-j", "/dev/null", "--statpack", "/dev/null"}).status, 0);
}

TEST_F(MWEntryFiles, NamesAreEscapedOnATerminalAlone) {
    _host.processes[5] = processOfFourPages("/bin/a\033[2Jb");
    const auto document = [&] { return contentOf(path("a.json")); };
    EXPECT_NE(run({"--pid", "5", "-j", path("a.json")}).output.find("a\033[2Jb [5]"), std::string::npos);
    const std::string toFile = document();
    _host.terminals = {STDOUT_FILENO};
    EXPECT_NE(run({"--pid", "5", "-j", path("a.json")}).output.find("a\\033[2Jb [5]"), std::string::npos);
    EXPECT_EQ(document(), toFile);
}

TEST_F(MWEntryFiles, OneMeasurementGoesToAllOutputs) {
    const auto report = run({"five", "-v", "-f", "bytes", "-j", path("a.json"), "--statpack", path("a.spj")});
    EXPECT_EQ(report.status, 0);
    EXPECT_EQ(report.errors, "");
    EXPECT_LT(report.output.find("[objectid]"), report.output.find("16384 B"));
    const std::string document = contentOf(path("a.json"));
    EXPECT_NE(document.find(R"("regions":[{)"), std::string::npos);
    EXPECT_TRUE(document.ends_with(R"("page size":4096})")) << "closed";
    EXPECT_EQ(document.find("vm_object_dirty_analysis"), std::string::npos)
        << "the mode is known when the document is opened";
    EXPECT_NE(contentOf(path("a.spj")).find(R"("metric":"total_memory","unit":"B","value":16384)"),
              std::string::npos);
}

TEST_F(MWEntryFiles, AFullDiskIsToldAndTheReportComesOut) {
    const auto report = run({"five", "-f", "bytes", "-j", "/dev/full", "--statpack", "/dev/full"});
    EXPECT_EQ(report.status, 0);
    EXPECT_EQ(
        report.errors,
        "memweight: /dev/full: No space left on device\nmemweight: /dev/full: No space left on device\n");
    EXPECT_NE(report.output.find("16384 B"), std::string::npos);
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
    EXPECT_EQ(host.selfRegionMemweight, 1) << "broken down";
    host.selfRegionMemweight = 0;
    run({"--vmObjectDirty", "five"});
    EXPECT_EQ(host.selfRegionMemweight, 0);
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
    for (const std::string& text : {"many [" + std::to_string(highest) + "]", std::string("16384"),
                                    std::string("Memweight exited early due to SIGINT")}) {
        EXPECT_NE(report.output.find(text), std::string::npos) << text << " in " << report.output;
    }
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
