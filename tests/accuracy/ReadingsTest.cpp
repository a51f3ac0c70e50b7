#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/sysinfo.h>
#include <sys/utsname.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <linux/magic.h>
#include <algorithm>
#include <fstream>
#include <iterator>
#include <optional>

#include "accuracy/Measurement.h"
#include "accuracy/SystemResources.h"
#include "accuracy/Workload.h"
#include "support/ChildProcess.h"
#include "support/LazilyFreed.h"

// What is read of processes for less than smaps costs gives the figures that smaps gives.

namespace {

/// Why this machine leaves nothing but smaps; empty where it does not.
std::string whySmapsIsNeeded() {
    constexpr long kXfsMagic = 0x58465342;
    utsname system = {};
    uname(&system);
    struct statfs files = {};
    statfs("/proc/self/exe", &files);
    uint64_t mergedPages = 0;
    std::ifstream("/sys/kernel/mm/ksm/pages_shared") >> mergedPages;
    if (geteuid() != 0) {
        return "only root can tell whether the pages of a file are clean";
    }
    if (strverscmp(system.release, "6.7") < 0) {
        return "the kernel does not scan page tables before 6.7";
    }
    if (files.f_type != EXT4_SUPER_MAGIC && files.f_type != kXfsMagic) {
        return "programs do not lie on a disk that is known for one";
    }
    return mergedPages != 0 ? "pages are merged, which only smaps tells" : "";
}

using Lines = std::set<std::string>;

Lines figuresOf(const Measurement& measurement) {
    Lines figures = {fmt::format("summary {}", measurement.summary)};
    for (const auto& [pid, charge] : measurement.charges) {
        figures.insert(fmt::format("{} charge {}", pid, charge));
        for (const auto& [sharers, bytes] : measurement.tables.at(pid)) {
            figures.insert(fmt::format("{} with {}: {}", pid, testing::PrintToString(sharers), bytes));
        }
        for (const Measurement::Region& region : measurement.regions.at(pid)) {
            figures.insert(fmt::format("{} region {:x} {}", pid, region.start, region.text));
        }
    }
    figures.insert(measurement.errors.begin(), measurement.errors.end());
    return figures;
}

struct Comparison {
    std::string differences;  ///< figures that only one of the readings has, a line each
    size_t counted;           ///< processes that were read without smaps
};

// Which process of a family is read first decides how the memory of a window goes to its generations, and a
// page may be written back meanwhile. What smaps gives in one of some looks is right.
Comparison compareReadings(const std::vector<pid_t>& pids) {
    constexpr int kLooks = 12;
    Comparison comparison = {};
    for (int look = 0; look < kLooks; ++look) {
        const Measurement smaps = measure(pids, MappingSource::smaps);
        const Measurement cheapest = measure(pids);
        Lines lines;
        std::ranges::set_symmetric_difference(figuresOf(smaps), figuresOf(cheapest),
                                              std::inserter(lines, lines.end()));
        comparison = {fmt::format("{}", fmt::join(lines, "\n")), pids.size() - cheapest.readFromSmaps.size()};
        if (smaps.readFromSmaps.size() != pids.size()) {
            return {"not every process that was read from smaps looks so", 0};
        }
        if (lines.empty()) {
            break;
        }
    }
    return comparison;
}

/// Who compares, and where.
struct Reader {
    const char* name;
    bool onFreshMachine;  ///< where nobody has lazily freed memory, whoever has
    std::optional<uid_t> user;
};

Comparison compareAs(const Reader& reader, const std::vector<pid_t>& pids) {
    constexpr size_t kRoom = 1U << 20U;
    void* memory = mmap(nullptr, kRoom, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    char* text = static_cast<char*>(memory);
    const ChildProcess measuring([&] {
        if (reader.onFreshMachine) {
            coverLazilyFreed();
        }
        if (reader.user) {
            becomeUser(*reader.user);
        }
        const Comparison comparison = compareReadings(pids);
        comparison.differences.copy(text, kRoom - 1);
        return uint64_t{comparison.counted};
    });
    const Comparison comparison = {text, measuring.answer()};
    munmap(memory, kRoom);
    return comparison;
}

bool isSwapInUse() {
    struct sysinfo system = {};
    sysinfo(&system);
    return system.freeswap != system.totalswap;
}

/// Where a scenario's processes are read without smaps.
enum class Counted : uint8_t { nowhere, onFreshMachine, everywhere };

}  // namespace

TEST(Readings, GiveTheFiguresThatSmapsGives) {
    if (const std::string reason = whySmapsIsNeeded(); !reason.empty()) {
        GTEST_SKIP() << reason;
    }
    const auto disk = temporaryDirectory("/var/tmp");
    const auto memory = temporaryDirectory("/dev/shm");
    const std::string file = *disk / "file";
    const std::string smallFile = *disk / "small-file";
    const std::filesystem::path memoryFile = *memory / "file";
    writeCleanFile(file, 20);
    writeCleanFile(smallFile, 6);
    for (const std::filesystem::path& writtenByAll : {*memory, std::filesystem::path(file)}) {
        std::filesystem::permissions(writtenByAll, std::filesystem::perms::all);
    }
    sync();  // pages of a program that was just built are dirty
    const std::string sharedObjects = "shared-objects 8 10 " + file + " " + memoryFile.string();
    // None of a size that could be an arena's, which needs the flags of smaps; nor do they have to do without
    // where they can write to a file or have the stack of a thread.
    for (const auto& [scenario, counted] : std::vector<std::pair<std::string, Counted>>{
             {"plain 17", Counted::everywhere},
             {"fork-tree 10 9 1 0", Counted::everywhere},
             {"fork-tree 40 3 3 9", Counted::onFreshMachine},
             {"private-file " + smallFile + " 8", Counted::everywhere},
             {"private-file " + file + " 0", Counted::onFreshMachine},
             {"touched-between-forks 20 9", Counted::onFreshMachine},
             {"descendants 24", Counted::onFreshMachine},
             {"alternating 40 1", Counted::onFreshMachine},
             {"orphans-of-exec 3 16", Counted::onFreshMachine},
             {"one-address-space 20", Counted::onFreshMachine},
             {sharedObjects, Counted::nowhere},
             {"without-first-thread 20", Counted::nowhere},
         }) {
        for (const Reader& reader : {Reader{"root, fresh machine", true, {}}, Reader{"root", false, {}},
                                     Reader{"an ordinary user", false, kNobody}}) {
            std::filesystem::remove(memoryFile);
            const Workload workload(scenario, {.user = reader.user});
            const Comparison comparison = compareAs(reader, workload.pids());
            EXPECT_EQ(comparison.differences, "") << scenario << ", " << reader.name;
            const bool isCounted = reader.onFreshMachine ? counted != Counted::nowhere
                                                         : counted == Counted::everywhere && !isSwapInUse();
            EXPECT_TRUE(!isCounted || comparison.counted == workload.pids().size())
                << scenario << ", " << reader.name << ": smaps was read of all but " << comparison.counted;
        }
    }
}
