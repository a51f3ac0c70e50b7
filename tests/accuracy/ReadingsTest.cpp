#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/utsname.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <linux/magic.h>
#include <cstdio>
#include <filesystem>
#include <fstream>

#include "accuracy/Measurement.h"
#include "accuracy/SystemResources.h"
#include "accuracy/Workload.h"
#include "support/ChildProcess.h"
#include "support/LazilyFreed.h"

// What is read of processes for less than smaps costs gives the figures that smaps gives.

namespace {

constexpr long kXfsMagic = 0x58465342;

/// Why this machine leaves nothing but smaps; empty where it does not.
std::string whySmapsIsNeeded() {
    utsname system = {};
    int major = 0;
    int minor = 0;
    uname(&system);
    std::sscanf(system.release, "%d.%d", &major, &minor);
    struct statfs files = {};
    statfs("/proc/self/exe", &files);
    uint64_t mergedPages = 0;
    std::ifstream("/sys/kernel/mm/ksm/pages_shared") >> mergedPages;
    if (geteuid() != 0) {
        return "only root can tell whether the pages of a file are clean";
    }
    if (major < 6 || (major == 6 && minor < 7)) {
        return "the kernel does not scan page tables before 6.7";
    }
    if (files.f_type != EXT4_SUPER_MAGIC && files.f_type != kXfsMagic) {
        return "programs do not lie on a disk that is known for one";
    }
    return mergedPages != 0 ? "pages are merged, which only smaps tells" : "";
}

std::map<std::string, std::string> figuresOf(const Measurement& measurement) {
    std::map<std::string, std::string> figures = {{"summary", std::to_string(measurement.summary)}};
    for (const auto& [pid, charge] : measurement.charges) {
        figures[fmt::format("charge of {}", pid)] = std::to_string(charge);
    }
    for (const auto& [pid, tables] : measurement.tables) {
        for (const auto& [sharers, bytes] : tables) {
            figures[fmt::format("{} with {}", pid, testing::PrintToString(sharers))] = std::to_string(bytes);
        }
    }
    for (const auto& [pid, regions] : measurement.regions) {
        for (const Measurement::Region& region : regions) {
            figures[fmt::format("{}: {:x}", pid, region.start)] += region.text + "; ";
        }
    }
    for (const std::string& error : measurement.errors) {
        figures["errors"] += error + "; ";
    }
    return figures;
}

/// A line for each figure that is not the same in both.
std::string differences(const Measurement& cheapest, const Measurement& smaps) {
    auto expected = figuresOf(smaps);
    auto found = figuresOf(cheapest);
    auto keys = expected;
    keys.insert(found.begin(), found.end());
    std::string text;
    for (const auto& [key, ignored] : keys) {
        if (found[key] != expected[key]) {
            text += fmt::format("{} is {}, by smaps {}\n", key, found[key], expected[key]);
        }
    }
    return text;
}

struct Comparison {
    std::string differences;
    size_t counted;  ///< processes that were read without smaps
};

// Which process of a family is read first decides how the memory of a window goes to its generations, and a
// page may be written back meanwhile. What smaps can give in one of these looks is right.
Comparison compareReadings(const std::vector<pid_t>& pids) {
    constexpr int kLooks = 6;
    Comparison comparison = {};
    for (int look = 0; look < kLooks; ++look) {
        const Measurement before = measure(pids, MappingSource::smaps);
        const Measurement cheapest = measure(pids);
        const Measurement after = measure(pids, MappingSource::smaps);
        if (before.readFromSmaps.size() != pids.size()) {
            return {"not every process that was read from smaps looks so\n", 0};
        }
        comparison = {differences(cheapest, after), pids.size() - cheapest.readFromSmaps.size()};
        if (comparison.differences.empty() || differences(cheapest, before).empty()) {
            return {"", comparison.counted};
        }
    }
    return comparison;
}

/// The same where nobody has lazily freed memory, whoever has.
Comparison compareAsOnFreshMachine(const std::vector<pid_t>& pids) {
    constexpr size_t kRoom = 1U << 20U;
    void* memory = mmap(nullptr, kRoom, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    char* text = static_cast<char*>(memory);
    const ChildProcess measuring([&] {
        coverLazilyFreed();
        const Comparison comparison = compareReadings(pids);
        comparison.differences.copy(text, kRoom - 1);
        return uint64_t{comparison.counted};
    });
    const Comparison comparison = {text, measuring.answer()};
    munmap(memory, kRoom);
    return comparison;
}

enum class Reading : uint8_t { counted, any };

void expectSameFigures(const std::string& scenario, Reading reading) {
    const Workload workload(scenario);
    const std::vector<pid_t> pids = workload.pids();
    const Comparison comparison = compareAsOnFreshMachine(pids);
    EXPECT_EQ(comparison.differences, "") << scenario;
    if (reading == Reading::counted) {
        EXPECT_EQ(comparison.counted, pids.size()) << scenario << ": smaps was read";
    }
}

}  // namespace

TEST(Readings, GiveTheFiguresThatSmapsGives) {
    if (const std::string reason = whySmapsIsNeeded(); !reason.empty()) {
        GTEST_SKIP() << reason;
    }
    const auto disk = temporaryDirectory("/var/tmp");
    const auto memory = temporaryDirectory("/dev/shm");
    const std::string file = *disk / "file";
    writeCleanFile(file, 20);
    sync();  // pages of a program that was just built are dirty
    // None of a size that could be an arena's, which needs the flags of smaps.
    expectSameFigures("plain 17", Reading::counted);
    expectSameFigures("fork-tree 20 16 1 0", Reading::counted);
    expectSameFigures("fork-tree 40 3 3 9", Reading::counted);
    expectSameFigures("private-file " + file + " 8", Reading::counted);
    expectSameFigures("private-file " + file + " 0", Reading::counted);
    expectSameFigures("touched-between-forks 20 9", Reading::counted);
    expectSameFigures("descendants 24", Reading::counted);
    expectSameFigures("alternating 40 1", Reading::counted);
    expectSameFigures("orphans-of-exec 3 16", Reading::counted);
    expectSameFigures("one-address-space 20", Reading::counted);
    // Some can write to a file, or have the stack of a thread: smaps may be read.
    expectSameFigures(fmt::format("shared-objects 8 10 {} {}", file, (*memory / "file").string()),
                      Reading::any);
    expectSameFigures("without-first-thread 20", Reading::any);
}
