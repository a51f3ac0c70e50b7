#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "support/ChildProcess.h"

// The built tool, run on real processes whose memory the test knows.

namespace {

constexpr uint64_t kPage = 4096;

struct Row {
    uint64_t dirty = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t regions = 0;
};

/// One category table, and the line above it ("" for a process's own memory).
struct Table {
    std::string title;
    std::map<std::string, Row> rows;
};

struct Report {
    int status = -1;
    std::string text;
    std::vector<Table> tables;

    /// The first table whose title begins so; an empty one when there is none.
    Table table(const std::string& title) const {
        for (const Table& candidate : tables) {
            if (candidate.title.starts_with(title)) {
                return candidate;
            }
        }
        return {};
    }
};

bool readSize(std::istringstream& line, uint64_t& bytes) {
    std::string unit;
    return line >> bytes >> unit && unit == "B";
}

/// "   DIRTY B   CLEAN B   RECLAIMABLE B   REGIONS    CATEGORY"
bool readRow(const std::string& text, Row& row, std::string& category) {
    std::istringstream line(text);
    if (!readSize(line, row.dirty) || !readSize(line, row.clean) || !readSize(line, row.reclaimable) ||
        !(line >> row.regions >> std::ws)) {
        return false;
    }
    return static_cast<bool>(std::getline(line, category));
}

// The parts sum to the whole, whatever the report is about.
void expectTotal(const Table& table, const Row& total) {
    Row sum;
    for (const auto& [category, row] : table.rows) {
        sum = {sum.dirty + row.dirty, sum.clean + row.clean, sum.reclaimable + row.reclaimable,
               sum.regions + row.regions};
    }
    EXPECT_EQ(sum.dirty, total.dirty) << table.title;
    EXPECT_EQ(sum.clean, total.clean) << table.title;
    EXPECT_EQ(sum.reclaimable, total.reclaimable) << table.title;
    EXPECT_EQ(sum.regions, total.regions) << table.title;
}

std::vector<Table> parseTables(const std::string& text) {
    std::vector<Table> tables;
    Table table;
    std::istringstream lines(text);
    std::string line;
    while (std::getline(lines, line)) {
        Row row;
        std::string category;
        if (line.starts_with("Shared with") || line.starts_with("Summary Memweight")) {
            table.title = line;
        } else if (readRow(line, row, category) && category != "TOTAL") {
            table.rows[category] = row;
        } else if (category == "TOTAL") {
            expectTotal(table, row);
            tables.push_back(std::exchange(table, {}));
        }
    }
    return tables;
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
    report.tables = parseTables(report.text);
    return report;
}

void touchPages(int memfd, size_t first, size_t count) {
    auto* pages = static_cast<char*>(mmap(nullptr, 64 * kPage, PROT_READ | PROT_WRITE, MAP_SHARED, memfd, 0));
    for (size_t page = first; page < first + count; ++page) {
        pages[page * kPage] = 1;
    }
}

TEST(EndToEnd, SharedMemoryIsCountedOnceAndNamed) {
    const int memfd = memfd_create("end-to-end", 0);
    ASSERT_EQ(ftruncate(memfd, 64 * kPage), 0);
    const auto toucher = [=](size_t first) {
        return [=] {
            touchPages(memfd, first, 30);
            return uint64_t{0};
        };
    };
    const ChildProcess low(toucher(0));
    const ChildProcess high(toucher(20));
    close(memfd);
    const Report report = memweight(std::to_string(low.pid()) + " " + std::to_string(high.pid()));
    ASSERT_EQ(report.status, 0) << report.text;

    const std::string category = "shared memory (memfd)";
    const std::string name = "cli_tests [" + std::to_string(low.pid()) + "]";
    const Table sharedWithLow = report.table("Shared with " + name + ":");
    ASSERT_TRUE(sharedWithLow.rows.contains(category)) << report.text;
    EXPECT_EQ(sharedWithLow.rows.at(category).dirty, 30 * kPage) << "what one process has touched of it";
    EXPECT_EQ(report.table("Summary").rows.at(category).dirty, 50 * kPage) << "both together, once";
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
    EXPECT_EQ(report.tables[0].rows.at("shared anonymous memory").dirty, 34 * kPage);
    uint64_t dirty = 0;
    for (const auto& [category, row] : report.tables[0].rows) {
        dirty += row.dirty;
    }
    EXPECT_NE(report.text.find("\tMemweight: " + std::to_string(dirty) + " B ("), std::string::npos)
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
    EXPECT_NE(both.text.find("[" + grandchild + "]: 64-bit"), std::string::npos) << both.text;
    const Report without = memweight("-t --pid " + pid + " -x " + grandchild);
    EXPECT_EQ(without.status, 0);
    EXPECT_NE(without.text.find("[" + pid + "]: 64-bit"), std::string::npos) << without.text;
    EXPECT_EQ(without.text.find("[" + grandchild + "]"), std::string::npos) << without.text;
    kill(static_cast<pid_t>(child.answer()), SIGKILL);
}

TEST(EndToEnd, FormsOfTheReport) {
    const ChildProcess child;
    const std::string pid = std::to_string(child.pid());
    const Report wide = memweight("-w -f formatted --sort category " + pid);
    EXPECT_EQ(wide.status, 0);
    EXPECT_TRUE(wide.text.starts_with(std::string(90, '=') + "\n")) << wide.text;
    EXPECT_LT(wide.text.find(" __DATA"), wide.text.find(" stack")) << "in the order of the names";
    EXPECT_NE(memweight("-f pages --sort clean " + pid).text.find(" pages (4096 bytes per page)"),
              std::string::npos);
    const Report named = memweight("-s cli_tests");
    EXPECT_EQ(named.status, 0);
    EXPECT_NE(named.text.find("cli_tests [" + pid + "]: 64-bit"), std::string::npos) << named.text;
    if (geteuid() == 0) {
        const Report all = memweight("-a");
        EXPECT_EQ(all.status, 0);
        EXPECT_FALSE(all.table("Summary").rows.empty()) << all.text;
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
