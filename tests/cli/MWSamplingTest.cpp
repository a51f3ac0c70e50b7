#include "cli/MWSampling.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <nlohmann/json.hpp>
#include <semaphore>
#include <string>
#include <thread>
#include <vector>

#include "cli/CommandLine.h"
#include "cli/MWEntry.h"
#include "platform/MWSignalMask.h"
#include "support/FakeHost.h"
#include "support/RecordingFormatter.h"

namespace {

constexpr uint64_t kSecond = 1'000'000'000;

FakeProcess processOfPages(uint64_t pages) {
    return {.executable = "/bin/victim",
            .regions = {{.start = 0x10000,
                         .size = pages * 4096,
                         .info = {.pages_resident = static_cast<uint32_t>(pages),
                                  .pages_dirtied = static_cast<uint32_t>(pages),
                                  .share_mode = SM_PRIVATE,
                                  .object_id_full = 100 + pages}}},
            .usage = rusage_info_v5{.ri_phys_memweight = pages * 4096}};
}

/// Runs `drive` once the timer is armed, and then interrupts the process.
std::thread driving(FakeHost& host, const std::function<void()>& drive) {
    const MWSignalMask mask;
    return std::thread([&host, &drive] {
        host.timerArmed.acquire();
        drive();
        kill(getpid(), SIGINT);
    });
}

/// The tool sampling on the main thread, as interrupts need it, while the test drives it from another one.
class Sampling : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_NE(mkdtemp(_directory.data()), nullptr);
        _host.processes[5] = processOfPages(4);
    }
    void TearDown() override { std::filesystem::remove_all(_directory); }

    /// Runs the tool until it ends; `drive` runs once the timer is armed, and is then followed by an
    /// interrupt.
    void run(std::vector<std::string> arguments, const std::function<void()>& drive) {
        arguments.insert(arguments.end(),
                         {"-f", "bytes", "-j", _directory + "/a.json", "--statpack", _directory + "/a.spj"});
        const CommandLine line(arguments);
        std::thread driver = driving(_host, drive);
        testing::internal::CaptureStdout();
        testing::internal::CaptureStderr();
        _status = MWMemweightMain(line.argc(), line.argv());
        driver.join();
        _output = testing::internal::GetCapturedStdout();
        _errors = testing::internal::GetCapturedStderr();
        std::ifstream file(_directory + "/a.json");
        _document = nlohmann::json::parse(file);
    }
    void fireAt(uint64_t uptime, uint64_t fires = 1) {
        _host.uptime = uptime;
        _host.fireTimer(fires);
    }

    FakeHost _host;
    std::string _directory = testing::TempDir() + "memweight-XXXXXX";
    int _status = -1;
    std::string _output;
    std::string _errors;
    nlohmann::json _document;
};

/// Takes every sample and says nothing.
class SilentFormatter : public MWOutputFormatter {
public:
    void printProcessHeader(const MWProcess&) override {}
    void endProcessHeader(const MWProcess&) override {}
    void printProcessTotal(uint64_t, const MWProcess&) override {}
    void printProcessCategories(const MWCategoryTable&, const MWCategoryTotals&) override {}
    void printSharedCategories(const MWCategoryTable&, const MWSharedCategoriesCall&) override {}
    void printProcessAuxData(const MWAuxDataTree&) override {}
    void printProcessesWithWarnings(const std::vector<const MWProcess*>&, const MWProcessErrors&) override {}
    void printSummaryCategories(const MWCategoryTable&, const MWSummaryCall&) override {}
    void printGlobalAuxData(const MWAuxDataTree&) override {}
    void endAtTime(const MWTime&) override {}
};

const std::string kStopped = "\nStopping...\nAnalyzing and writing output...\n";

TEST_F(Sampling, EachFireIsOneSampleOfAllOutputs) {
    _host.clock.continuousTicks = 5;
    run({"--sample", "0.5", "victim"}, [this] {
        fireAt(2000);
        _host.processes[5] = processOfPages(9);
        _host.processes[6] = processOfPages(1);
        fireAt(2000 + kSecond / 2);
        _host.processes.erase(5);
        _host.processes.erase(6);
        fireAt(2000 + kSecond);
    });
    EXPECT_EQ(_status, 0);
    EXPECT_TRUE(_errors.starts_with("Sampling at 0.5s interval... (<ctrl-c> to stop)\n")) << _errors;
    EXPECT_TRUE(_errors.ends_with(kStopped)) << _errors;
    ASSERT_EQ(_document["samples"].size(), 3U);
    EXPECT_EQ(_document["samples"][0]["total memweight"], 4 * 4096);
    EXPECT_EQ(_document["samples"][1]["processes"].size(), 2U) << "a new process of the name takes part";
    EXPECT_EQ(_document["samples"][1]["total memweight"], 10 * 4096);
    EXPECT_TRUE(_document["samples"][2]["processes"].empty());
    ASSERT_EQ(_host.schedules.size(), 1U);
    EXPECT_EQ(_host.schedules[0].firstAfter, 0U);
    EXPECT_EQ(_host.schedules[0].interval, kSecond / 2);
    EXPECT_EQ(_host.schedules[0].leeway, kSecond / 4);
    std::ifstream metrics(_directory + "/a.spj");
    int durations = 0;
    for (std::string line; std::getline(metrics, line);) {
        durations += nlohmann::json::parse(line).value("metric", "") == "gather_duration" ? 1 : 0;
    }
    EXPECT_EQ(durations, 3);
    EXPECT_TRUE(_host.openTasks.empty());
}

TEST_F(Sampling, TheIntervalGrowsFromTheSecondOverrunOn) {
    run({"--sample", "1", "victim"}, [this] {
        fireAt(10 * kSecond);
        fireAt(12 * kSecond + kSecond / 2, 2);
        fireAt(15 * kSecond, 2);
        EXPECT_EQ(_host.schedules.back().firstAfter, 2650000000U);
        fireAt(16 * kSecond, 2);
    });
    EXPECT_NE(
        _errors.find("WARNING: Unable to keep up with sampling interval. Increasing interval to 2.65s.\n"),
        std::string::npos)
        << _errors;
    ASSERT_EQ(_host.schedules.size(), 2U) << "neither the first overrun nor one within the interval counts";
    EXPECT_EQ(_host.schedules[1].interval, 2650000000U);
    EXPECT_EQ(_host.schedules[1].leeway, kSecond / 2);
    EXPECT_EQ(_document["samples"].size(), 4U);
}

TEST_F(Sampling, WithoutASampleTheDocumentsAreCompleteAllTheSame) {
    run({"--sample", "1", "victim"}, [] {});
    EXPECT_EQ(_status, 0);
    EXPECT_TRUE(_document["samples"].empty());
    // The interrupt can come before the beginning is told.
    EXPECT_NE(_errors.find("\nStopping...\n"), std::string::npos) << _errors;
    EXPECT_TRUE(_errors.ends_with("Analyzing and writing output...\n")) << _errors;
}

TEST_F(Sampling, WithoutATimerItIsToldWhy) {
    _host.noTimers = true;
    const CommandLine line({"--sample", "1", "victim"});
    testing::internal::CaptureStderr();
    EXPECT_EQ(MWMemweightMain(line.argc(), line.argv()), 1);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "memweight: no timer for sampling: Too many open files\n");
}

/// Holds every sample's output up until the test lets it go on.
class HeldUpFormatter : public RecordingFormatter {
public:
    using RecordingFormatter::RecordingFormatter;
    void startAtTime(const MWTime&) override {
        started.release();
        goOn.acquire();
    }
    std::counting_semaphore<> started = std::counting_semaphore<>(0);
    std::counting_semaphore<> goOn = std::counting_semaphore<>(0);
};

/// Sampling with one formatter, driven from another thread, until an interrupt.
void sampleWith(std::unique_ptr<MWOutputFormatter> formatter, FakeHost& host,
                const std::function<void()>& drive) {
    const CommandLine line({"--sample", "1", "victim"});
    auto args = MWMemweightArgs::initWithArgc(line.argc(), line.argv());
    MWSampling::Formatters formatters;
    formatters.push_back(std::move(formatter));
    MWSampling sampling(*args, formatters);
    std::thread driver = driving(host, drive);
    testing::internal::CaptureStderr();
    EXPECT_TRUE(sampling.run());
    driver.join();
    testing::internal::GetCapturedStderr();
}

TEST_F(Sampling, AnUnchangedProcessIsNotWalkedAgain) {
    std::vector<std::string> log;
    auto formatter = std::make_unique<HeldUpFormatter>(log);
    HeldUpFormatter& output = *formatter;
    _host.processes[6] = processOfPages(2);
    _host.processes[7] = processOfPages(3);
    sampleWith(std::move(formatter), _host, [&] {
        fireAt(2000);
        output.started.acquire();
        const int walked = _host.asked("mach_vm_region_recurse");
        _host.processes[6] = processOfPages(8);
        _host.processes[7].startTime += 1;  // another one, of the same size
        fireAt(3000);
        EXPECT_EQ(_host.asked("mach_vm_region_recurse") - walked, walked / 3 * 2);
        output.goOn.release(2);
    });
    const std::string unchanged = "total 16384 of victim [5]";
    EXPECT_EQ(std::ranges::count(log, unchanged), 2) << "its figures are in both samples";
    EXPECT_EQ(std::ranges::count(log, "total 32768 of victim [6]"), 1);
}

// What tells two processes' pages of one object apart is used up by the first sample.
TEST_F(Sampling, AProcessWhosePagesDifferFromItsSharersIsWalkedAgain) {
    std::vector<std::string> log;
    auto formatter = std::make_unique<HeldUpFormatter>(log);
    HeldUpFormatter& output = *formatter;
    constexpr int32_t kDirty = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
    MWMemweight::setBreakDownPhysMemweight(true);
    const auto holding = [](std::vector<int32_t> pages) {
        FakeProcess process = processOfPages(4);
        process.regions[0].info = {
            .pages_resident = 2, .pages_dirtied = 2, .share_mode = SM_SHARED, .object_id_full = 7};
        process.regions[0].pages = std::move(pages);
        return process;
    };
    _host.processes[5] = holding({kDirty, kDirty});
    _host.processes[6] = holding({0, 0, kDirty, kDirty});
    sampleWith(std::move(formatter), _host, [&] {
        fireAt(2000);
        output.started.acquire();
        fireAt(3000);
        output.goOn.release(2);
    });
    const auto isOfBoth = [](const std::string& line) { return line.ends_with("} = d16384 n2"); };
    EXPECT_EQ(std::ranges::count_if(log, isOfBoth), 2) << testing::PrintToString(log);
}

TEST_F(Sampling, EndsWhenNobodyTakesTheReportAnyMore) {
    class Full : public SilentFormatter {
    public:
        void endAtTime(const MWTime&) override { std::fputs("report", stdout); }
    };
    std::fflush(stdout);
    const int before = dup(STDOUT_FILENO);
    const int full = open("/dev/full", O_WRONLY);
    dup2(full, STDOUT_FILENO);
    const CommandLine line({"--sample", "1", "victim"});
    auto args = MWMemweightArgs::initWithArgc(line.argc(), line.argv());
    MWSampling::Formatters formatters;
    formatters.push_back(std::make_unique<Full>());
    MWSampling sampling(*args, formatters);
    std::thread driver([this] {
        _host.timerArmed.acquire();
        fireAt(2000);
    });
    testing::internal::CaptureStderr();
    EXPECT_TRUE(sampling.run());
    driver.join();
    dup2(before, STDOUT_FILENO);
    close(before);
    close(full);
    std::clearerr(stdout);
    EXPECT_NE(testing::internal::GetCapturedStderr().find(
                  "memweight: standard output: No space left on device\nAnalyzing and writing output...\n"),
              std::string::npos);
}

TEST_F(Sampling, SamplesAreLeftOutWhileOutputIsHeldUp) {
    std::vector<std::string> log;
    auto formatter = std::make_unique<HeldUpFormatter>(log);
    HeldUpFormatter& output = *formatter;
    sampleWith(std::move(formatter), _host, [&] {
        for (int sample = 0; sample < 100; ++sample) {
            fireAt(2000 + kSecond * static_cast<uint64_t>(sample));
        }
        output.goOn.release(100);
    });
    const auto written = std::ranges::count(log, "total 16384 of victim [5]");
    EXPECT_GE(written, 9) << "the one that is being written, and those that wait";
    EXPECT_LT(written, 12);
}

TEST_F(Sampling, NothingGrows) {
    std::vector<std::string> log;
    const auto descriptors = [] {
        return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
    };
    const auto sample = [&](int samples) {
        for (int number = 0; number < samples; ++number) {
            const auto& process = _host.processes[5] = processOfPages(1 + static_cast<uint64_t>(number % 7));
            EXPECT_TRUE(process.usage);
            fireAt(_host.uptime + kSecond);
        }
    };
    for (int32_t pid = 6; pid < 10; ++pid) {
        _host.processes[pid] = processOfPages(5);
    }
    sampleWith(std::make_unique<SilentFormatter>(), _host, [&] {
        sample(500);
        const auto openBefore = descriptors();
        const size_t heapBefore = mallinfo2().uordblks;
        sample(10000);
        EXPECT_EQ(descriptors(), openBefore);
        EXPECT_LT(mallinfo2().uordblks, heapBefore + (size_t{1} << 20U));
    });
}

}  // namespace
