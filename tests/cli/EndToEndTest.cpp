#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/Procfs.h"
#include "support/ChildProcess.h"

// The built tool, run on real processes whose memory the test knows.

namespace {

constexpr uint64_t kPage = 4096;

/// Dirty, clean and reclaimable bytes, and regions.
using Row = std::array<uint64_t, 4>;

struct Report {
    int status = -1;
    std::string text;
    /// Each category table by the line above it, which is "" for a process's own memory.
    std::map<std::string, std::map<std::string, Row>> tables;

    uint64_t dirty(const std::string& title, const std::string& category) const {
        return tables.at(title).at(category)[0];
    }
    bool contains(const std::string& part) const { return text.find(part) != std::string::npos; }
};

const std::string kSummary = "Summary Memweight";

/// The tables of a report; the rows of each must sum to its total.
void readTables(Report& report) {
    static const std::regex kRow(R"(\s*(\d+) B\s+(\d+) B\s+(\d+) B\s+(\d+)\s+(.*))");
    std::istringstream lines(report.text);
    std::string title;
    std::map<std::string, Row> rows;
    Row sum = {};
    for (std::string line; std::getline(lines, line);) {
        std::smatch cells;
        if (line.starts_with("Shared with") || line.starts_with(kSummary)) {
            title = line.starts_with(kSummary) ? kSummary : line;
        } else if (std::regex_match(line, cells, kRow)) {
            const bool isTotal = cells[5] == "TOTAL";
            Row row;
            for (size_t column = 0; column < row.size(); ++column) {
                row[column] = std::stoull(cells[column + 1]);
                sum[column] += isTotal ? 0 : row[column];
            }
            if (!isTotal) {
                rows[cells[5]] = row;
                continue;
            }
            EXPECT_EQ(std::exchange(sum, {}), row) << report.text;
            report.tables[std::exchange(title, {})] = std::exchange(rows, {});
        }
    }
}

/// Runs the tool with sizes in bytes; standard error comes into the text too.
Report memweight(const std::string& arguments, const std::string& prefix = "") {
    const std::string command = prefix + MEMWEIGHT_BINARY + " -f bytes " + arguments + " 2>&1";
    Report report;
    std::FILE* output = popen(command.c_str(), "r");
    if (output == nullptr) {
        return report;
    }
    std::array<char, 4096> buffer = {};
    for (size_t count = 0; (count = fread(buffer.data(), 1, buffer.size(), output)) != 0;) {
        report.text.append(buffer.data(), count);
    }
    report.status = WEXITSTATUS(pclose(output));
    readTables(report);
    return report;
}

uint64_t touchPages(int memfd, size_t first, size_t count) {
    auto* pages = static_cast<char*>(mmap(nullptr, 64 * kPage, PROT_READ | PROT_WRITE, MAP_SHARED, memfd, 0));
    for (size_t page = first; page < first + count; ++page) {
        pages[page * kPage] = 1;
    }
    return 0;
}

TEST(EndToEnd, SharedMemoryIsCountedOnceAndNamed) {
    const int memfd = memfd_create("end-to-end", 0);
    ASSERT_EQ(ftruncate(memfd, 64 * kPage), 0);
    const auto toucher = [=](size_t first) { return [=] { return touchPages(memfd, first, 30); }; };
    const ChildProcess low(toucher(0));
    const ChildProcess high(toucher(20));
    close(memfd);
    const Report report = memweight(std::to_string(low.pid()) + " " + std::to_string(high.pid()));
    ASSERT_EQ(report.status, 0) << report.text;

    const std::string category = "shared memory (memfd)";
    const std::string others = "Shared with cli_tests [" + std::to_string(low.pid()) + "]:";
    ASSERT_TRUE(report.contains("\n" + others + "\n")) << report.text;
    EXPECT_EQ(report.dirty(others, category), 30 * kPage) << "what one process has touched of it";
    EXPECT_EQ(report.dirty(kSummary, category), 50 * kPage) << "both together, once";
}

TEST(EndToEnd, WhatAProcessHoldsWithoutMappingItIsInItsCharge) {
    constexpr uint64_t kHeld = 64 * kPage;
    const std::string category = "Owned physical memweight (unmapped)";
    const int memfd = memfd_create("end-to-end", 0);
    ASSERT_EQ(posix_fallocate(memfd, 0, kHeld), 0);
    const ChildProcess holder;
    const ChildProcess mapper([=] { return touchPages(memfd, 0, 30); });
    close(memfd);
    const std::string pid = std::to_string(holder.pid());
    EXPECT_EQ(memweight("--pid " + pid).dirty("", category), kHeld);
    EXPECT_FALSE(memweight("--vmObjectDirty --pid " + pid).contains(category));
    if (geteuid() == 0) {
        const Report report = memweight("--unmapped " + pid);
        const std::string others = "Shared with cli_tests [" + std::to_string(mapper.pid()) + "]:";
        ASSERT_TRUE(report.contains("\n" + others + "\n")) << report.text;
        EXPECT_EQ(report.dirty(others, "shared memory (memfd)"), kHeld);
    }
}

TEST(EndToEnd, TheKernelIsAProcessForWhoeverLooks) {
    for (const char* prefix : {"", "setpriv --reuid 65534 --clear-groups "}) {
        if (*prefix != '\0' && geteuid() != 0) {
            continue;
        }
        const Report report = memweight("kernel", prefix);
        EXPECT_EQ(report.status, 0) << report.text;
        EXPECT_TRUE(report.contains("\nkernel [0]: 64-bit\t")) << report.text;
        EXPECT_TRUE(report.contains("\tMaps:\n")) << report.text;
        uint64_t dirty = 0;
        for (const auto& [category, row] : report.tables.at("")) {
            dirty += row[0];
        }
        EXPECT_GT(dirty, uint64_t{1} << 20U) << report.text;
    }
}

std::string contentsOf(const std::filesystem::path& path) {
    std::ifstream file(path);
    return {std::istreambuf_iterator<char>(file), {}};
}

TEST(EndToEnd, HeapsnapsOfOtherPlatformsAreReported) {
    const std::filesystem::path folder = MEMWEIGHT_HEAPSNAPS;
    for (const char* name : {"shared-cache", "purgeable-16k", "translated-32bit"}) {
        const Report report = memweight("-v -w " + (folder / name).string() + ".heapsnap");
        EXPECT_EQ(report.text, contentsOf((folder / name).string() + ".txt")) << name;
        EXPECT_EQ(report.status, 0);
    }
    const Report refused = memweight((folder / "shared-cache.txt").string());
    EXPECT_EQ(refused.status, 1);
    EXPECT_TRUE(refused.contains("shared-cache.txt: not valid JSON at byte 1\n")) << refused.text;
}

/// A folder for heapsnaps, and the program that writes them run in it.
class SavedProcesses : public testing::Test {
protected:
    void SetUp() override { ASSERT_NE(mkdtemp(_folder.data()), nullptr); }
    void TearDown() override { std::filesystem::remove_all(_folder); }
    /// Runs memweight-heapsnap: its exit status, and what it tells.
    std::pair<int, std::string> save(const std::string& arguments) {
        const std::string messages = _folder + "/messages";
        const std::string command = "cd " + _folder + " && " + MEMWEIGHT_HEAPSNAP_BINARY + " " + arguments;
        const int status = std::system((command + " > " + messages + " 2>&1").c_str());
        return {WEXITSTATUS(status), contentsOf(messages)};
    }
    std::string _folder = testing::TempDir() + "memweight-XXXXXX";
};

TEST_F(SavedProcesses, AreOfTheVersionThatBothProgramsTell) {
    const Report reader = memweight("no-such-process --version");
    EXPECT_EQ(reader.status, 0);
    EXPECT_EQ(reader.text, "memweight " MEMWEIGHT_VERSION "\n");
    EXPECT_EQ(save("--version"), std::pair(0, std::string("memweight-heapsnap " MEMWEIGHT_VERSION "\n")));
}

TEST_F(SavedProcesses, AreReportedLikeTheLivingOnes) {
    // Pages of a program that has just been linked are dirty until they are written, be it between the two
    // looks.
    const procfs::Descriptor program = procfs::open(AT_FDCWD, "/proc/self/exe");
    ASSERT_EQ(fsync(program.get()), 0);
    const int memfd = memfd_create("end-to-end", 0);
    ASSERT_EQ(ftruncate(memfd, 64 * kPage), 0);
    const ChildProcess low([=] { return touchPages(memfd, 0, 30); });
    const ChildProcess high([=] { return touchPages(memfd, 0, 30); });
    close(memfd);
    const std::string pids[] = {std::to_string(low.pid()), std::to_string(high.pid())};
    for (const std::string& pid : pids) {
        EXPECT_EQ(save(pid), (std::pair<int, std::string>(0, "")));
    }
    const Report live = memweight("--pid " + pids[0] + " --pid " + pids[1]);
    const Report saved = memweight(_folder + "/*.heapsnap");
    ASSERT_EQ(saved.status, 0) << saved.text;
    const std::string others = "Shared with cli_tests [" + pids[0] + "]";
    const auto& liveShared = live.tables.at(others + ":");
    const auto& savedShared = saved.tables.at(others + " (heapsnap):");
    ASSERT_GE(savedShared.size(), 3U);
    for (const auto& [category, row] : liveShared) {
        ASSERT_TRUE(savedShared.contains(category)) << category;
        const Row& same = savedShared.at(category);
        EXPECT_EQ(std::tie(same[0], same[2], same[3]), std::tie(row[0], row[2], row[3])) << category;
    }
    for (auto& [category, row] : live.tables.at(kSummary)) {
        if (category != "page table") {
            EXPECT_EQ(saved.dirty(kSummary, category), row[0]) << category;
        }
    }
}

TEST_F(SavedProcesses, AreNeverOverwrittenUnasked) {
    const ChildProcess process;
    const std::string pid = std::to_string(process.pid());
    const std::string file = "cli_tests-" + pid + ".heapsnap";
    std::ofstream(_folder + "/" + file) << "precious";
    EXPECT_EQ(save(pid), (std::pair<int, std::string>(1, "memweight-heapsnap: " + file + ": File exists\n")));
    EXPECT_EQ(contentsOf(_folder + "/" + file), "precious");
    EXPECT_EQ(save("--force " + pid).first, 0);
    EXPECT_TRUE(contentsOf(_folder + "/" + file).starts_with("{\"format\""));
    EXPECT_EQ(save("--vmObjectDirty -o other " + pid).first, 0);
    EXPECT_EQ(nlohmann::json::parse(contentsOf(_folder + "/other"))["breakdown"], false);
    const std::pair<std::string, std::string> refused[] = {
        {"--force -o /dev/full " + pid, "memweight-heapsnap: /dev/full: not a regular file\n"},
        {"-o none/file " + pid, "memweight-heapsnap: none/file: No such file or directory\n"},
        {"12abc", "memweight-heapsnap: 12abc: not a pid\n"},
        {"0", "memweight-heapsnap: 0: not a pid\n"},
        {"2147483647", "memweight-heapsnap: 2147483647: unable to read this process (try as root?)\n"},
    };
    for (const auto& [arguments, message] : refused) {
        EXPECT_EQ(save(arguments), std::pair(1, message));
    }
    EXPECT_EQ(save("").first, 1);
    EXPECT_EQ(save("--help").first, 0);
    size_t files = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(_folder)) {
        ++files;
    }
    EXPECT_EQ(files, 3U) << "two heapsnaps and the messages; nothing temporary";
}

/// Goes on taking memory, a little at a time, up to 100 MiB.
uint64_t grow() {
    std::thread([] {
        constexpr size_t kStep = 256 * 1024;
        for (int step = 0; step < 400; ++step) {
            std::memset(mmap(nullptr, kStep, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0), 1,
                        kStep);
            usleep(10000);
        }
    }).detach();
    return 0;
}

TEST(EndToEnd, AGrowingProcessIsSampledUntilTheInterrupt) {
    const ChildProcess child(grow);
    const std::string path = testing::TempDir() + "memweight-" + std::to_string(getpid());
    // Each sample is in the file as soon as it is taken.
    const std::string command =
        std::string(MEMWEIGHT_BINARY) + " --sample 0.05 --pid " + std::to_string(child.pid()) +
        " --statpack " + path + " > " + path + ".text 2>&1 & tool=$!; until [ $(cat " + path +
        " 2>/dev/null | grep -c gather_duration) -ge 3 ]; do sleep 0.05; done; kill -INT $tool; wait $tool";
    EXPECT_EQ(std::system(command.c_str()), 0);
    const std::string text = contentsOf(path + ".text");
    EXPECT_NE(text.find("Sampling at 0.05s interval... (<ctrl-c> to stop)\n"), std::string::npos) << text;
    EXPECT_NE(text.find("\nStopping...\n"), std::string::npos) << text;
    EXPECT_NE(text.find("Analyzing and writing output...\n"), std::string::npos) << text;
    std::ifstream file(path);
    std::vector<double> charges;
    for (std::string line; std::getline(file, line);) {
        const auto value = nlohmann::json::parse(line);
        if (value.value("metric", "") == "total_memory") {
            charges.push_back(value["value"]);
        }
    }
    std::filesystem::remove(path);
    std::filesystem::remove(path + ".text");
    EXPECT_GE(charges.size(), 3U);
    EXPECT_TRUE(std::ranges::is_sorted(charges));
}

TEST(EndToEnd, OneProcessAloneIsOneTable) {
    const ChildProcess child([] {
        auto* memory = static_cast<char*>(
            mmap(nullptr, 100 * kPage, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
        for (size_t page = 0; page < 100; page += 3) {
            memory[page * kPage] = 1;
        }
        return uint64_t{0};
    });
    const Report report = memweight("--pid " + std::to_string(child.pid()));
    ASSERT_EQ(report.status, 0) << report.text;
    ASSERT_EQ(report.tables.size(), 1U) << "no summary of a single process";
    EXPECT_EQ(report.dirty("", "shared anonymous memory"), 34 * kPage);
    uint64_t dirty = 0;
    for (const auto& [category, row] : report.tables.at("")) {
        dirty += row[0];
    }
    EXPECT_TRUE(report.contains("\tMemweight: " + std::to_string(dirty) + " B ("))
        << "the charge is the sum of its table";
}

TEST(EndToEnd, ChildrenAreTargetsWithTheirParent) {
    const ChildProcess child([] {
        const pid_t grandchild = fork();
        if (grandchild == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            while (true) {
                pause();
            }
        }
        return static_cast<uint64_t>(grandchild);
    });
    const std::string pid = std::to_string(child.pid());
    const std::string grandchild = std::to_string(child.answer());
    const Report both = memweight("-t --pid " + pid);
    EXPECT_EQ(both.status, 0);
    EXPECT_TRUE(both.contains("[" + grandchild + "]: 64-bit")) << both.text;
    const Report without = memweight("-t --pid " + pid + " -x " + grandchild);
    EXPECT_EQ(without.status, 0);
    EXPECT_TRUE(without.contains("[" + pid + "]: 64-bit")) << without.text;
    EXPECT_FALSE(without.contains("[" + grandchild + "]")) << without.text;
    kill(static_cast<pid_t>(child.answer()), SIGKILL);
}

TEST(EndToEnd, FormsOfTheReport) {
    const ChildProcess child;
    const std::string pid = std::to_string(child.pid());
    const Report wide = memweight("-w -f formatted --sort category " + pid);
    EXPECT_EQ(wide.status, 0);
    EXPECT_TRUE(wide.text.starts_with(std::string(90, '=') + "\n")) << wide.text;
    EXPECT_LT(wide.text.find(" __DATA"), wide.text.find(" stack")) << "in the order of the names";
    EXPECT_TRUE(memweight("-f pages --sort clean " + pid).contains(" pages (4096 bytes per page)"));
    const Report named = memweight("-s cli_tests");
    EXPECT_EQ(named.status, 0);
    EXPECT_TRUE(named.contains("cli_tests [" + pid + "]: 64-bit")) << named.text;
    if (geteuid() == 0) {
        const Report all = memweight("-a");
        EXPECT_EQ(all.status, 0);
        EXPECT_TRUE(all.tables.contains(kSummary)) << all.text;
        EXPECT_EQ(memweight("--unmapped " + pid).status, 0);
    }
}

TEST(EndToEnd, FailuresAreTold) {
    const std::string notFound =
        "Unable to find any processes matching the supplied process names or pids (try as root?)\n";
    const Report nobody = memweight("no-such-process");
    EXPECT_EQ(nobody.status, 1);
    EXPECT_EQ(nobody.text, notFound);

    if (geteuid() != 0) {
        GTEST_SKIP() << "only root can become somebody else";
    }
    const ChildProcess child;
    const std::string pid = std::to_string(child.pid());
    const std::string asNobody = "setpriv --reuid 65534 --regid 65534 --clear-groups ";
    if (std::system((asNobody + "test -x " + MEMWEIGHT_BINARY).c_str()) != 0) {
        GTEST_SKIP() << "the build lies where other users may not go";
    }
    EXPECT_EQ(memweight("--pid " + pid, asNobody).text,
              "task_read_for_pid: (os/kern) failure\nUnable to analyze process with pid " + pid +
                  " (try as root?)\n" + notFound);
    EXPECT_EQ(memweight("-a", asNobody).text, "Must run as root.\n");
}

}  // namespace
