#include "platform/linux/MappingCounts.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/Cachestat.h"
#include "support/RecordedTree.h"
#include "support/ScannedProcess.h"

namespace {

constexpr int32_t kPid = 20;
constexpr uint64_t kArenaPages = (uint64_t{64} << 20U) / ScannedProcess::kPage;
using Counts = std::vector<std::string>;

/// A process that can be counted, and what a test changes of it.
struct Measured {
    std::vector<WrittenMapping> mappings;
    procfs::ProcStatus status = {};
    bool hasFork = false;
    bool canReadPages = true;
    bool canScan = true;

    WrittenMapping& data() { return mappings[1]; }
    WrittenMapping& anonymous() { return mappings[2]; }
};

Measured plainProcess() {
    return {.mappings = {{16, "FF.F", Backing::file, "r-xp", "/bin/x"},
                         {22, "PF", Backing::file, "rw-p", "/bin/x"},
                         {40, "PP.zP"},
                         {90000, "P", Backing::anonymous, "rw-p", "[stack]"},
                         {90010, "K", Backing::special, "r--p", "[vvar]"}}};
}

class MappingCountsTest : public RecordedTree {
protected:
    // The program's file is clean, where the test runs on a disk.
    void SetUp() override {
        RecordedTree::SetUp();
        write("vmstat", "pglazyfree 0\n");
        write("self/mountinfo", "24 1 8:0 / / rw - ext4 /dev/sda rw\n");
        write("20/map_files/10000-14000", "a program");
        const auto file = procfs::open(AT_FDCWD, (_top + "/20/map_files/10000-14000").c_str());
        fsync(file.get());
        const auto pages = readCachestat(file.get());
        if (!pages || pages->cached == 0) {
            GTEST_SKIP() << "the kernel does not tell of a file's pages here whether they are clean";
        }
    }

    bool isCounted(const Measured& measured) {
        class GonePages : public WrittenPages {
            bool readPages(uint64_t, std::span<PagemapEntry>) override { return false; }
        };
        process.emplace(measured.mappings);
        const procfs::Descriptor proc = directory("");
        const procfs::Descriptor memory = directory("20");
        UncountedPages uncounted(proc.get(), _top + "/pages_shared");
        const ObjectIdentity identity("boot");
        ForkCensus census(proc.get(), identity);
        census.add(kPid, 5);
        if (measured.hasFork) {
            census.add(kPid + 1, 5);
        }
        GonePages gone;
        gone.pages = process->pages.pages;
        const PageScanner noScan = [](const PageScan&, std::span<ScannedRange>, uint64_t&) { return -1; };
        const PageScanner scan = measured.canScan ? process->scanner() : noScan;
        PageSource& pages = measured.canReadPages ? process->pages : static_cast<PageSource&>(gone);
        counts = countWithoutSmaps(process->vmas,
                                   {.pid = kPid,
                                    .memoryDirectory = memory.get(),
                                    .status = measured.status,
                                    .scan = scan,
                                    .pages = pages,
                                    .pageSize = ScannedProcess::kPage},
                                   uncounted, census);
        isSwapInUse = uncounted.isSwapInUse();
        return counts.has_value();
    }

    std::optional<ScannedProcess> process;
    std::optional<MappingCounts> counts;
    bool isSwapInUse = false;
};

TEST_F(MappingCountsTest, CountsAPlainProcess) {
    Measured measured = plainProcess();
    ASSERT_TRUE(isCounted(measured));
    EXPECT_EQ(process->counts(), (Counts{"3/0/0", "2/1/0", "3/3/0", "1/1/0", "0/0/0"}));
    EXPECT_FALSE(counts->sharesByFork);
    EXPECT_EQ(counts->filePages.size(), 4U) << "the text's two ranges, and two pages of the data";

    measured.anonymous().letters = "PwwP";
    measured.status.vmSwap = 2 * ScannedProcess::kPage;
    ASSERT_TRUE(isCounted(measured));
    EXPECT_EQ(process->counts()[2], "2/2/2");
}

TEST_F(MappingCountsTest, OfMemoryThatIsSharedByForkOnePageIsEnough) {
    Measured measured = plainProcess();
    measured.hasFork = true;
    measured.anonymous().letters = std::string(5000, 'P') + "S" + std::string(10, '.') + "SSS";
    measured.mappings.push_back({91000, "FSS", Backing::file, "rw-p", "/bin/x"});
    ASSERT_TRUE(isCounted(measured));
    EXPECT_TRUE(counts->sharesByFork);
    std::vector<uint64_t> shared;
    for (const BackedVma& backed : process->vmas) {
        shared.push_back(backed.vma.sharedDirty);
    }
    constexpr uint64_t kOne = ScannedProcess::kPage;
    EXPECT_EQ(shared, (std::vector<uint64_t>{0, 0, kOne, 0, 0, kOne})) << "a file's pages are everybody's";
}

TEST_F(MappingCountsTest, DeclinesWhereSmapsTellsMore) {
    struct Row {
        const char* why;
        std::function<void(Measured&)> change;
    };
    const auto append = [](WrittenMapping mapping) {
        return [=](Measured& measured) { measured.mappings.push_back(mapping); };
    };
    for (const Row& row : std::vector<Row>{
             {"locked", [](Measured& measured) { measured.status.vmLck = 4096; }},
             {"huge pages", [](Measured& measured) { measured.status.hugetlbPages = 2U << 20U; }},
             {"a shadow stack", [](Measured& measured) { measured.status.hasShadowStack = true; }},
             {"mapped huge pages", append({512, ".", Backing::hugetlb})},
             {"can write to a file", append({80, ".", Backing::file, "rw-s", "/bin/x"})},
             {"a device's file", append({80, ".", Backing::file, "rw-p", "/dev/card"})},
             {"a device's memory", append({80, ".", Backing::shmem, "rw-s", "/dev/card"})},
             {"an unknown special", append({80, "F", Backing::special, "rw-s", "anon_inode:[io_uring]"})},
             {"a guard", append({80, ".", Backing::anonymous, "---p"})},
             {"memory below the stack", append({90001, "P"})},
             {"a possible arena", append({kArenaPages, std::string(kArenaPages, '.')})},
             {"an allocator's library", append({80, "P", Backing::file, "r-xp", "/lib/libjemalloc.so.2"})},
             {"constants that nobody wrote", append({21, ".", Backing::file, "r--p", "/bin/x"})},
             {"entries like swapped pages", [](Measured& measured) { measured.anonymous().letters = "Pw"; }},
             {"more swapped than seen", [](Measured& measured) { measured.status.vmSwap = 4096; }},
             {"frames without a page", append({80, "K", Backing::file, "r--s", "/bin/x"})},
             {"shared by fork and swapped",
              [](Measured& measured) {
                  measured.hasFork = true;
                  measured.anonymous().letters = "Pw";
                  measured.status.vmSwap = 4096;
              }},
             {"pages that cannot be read",
              [](Measured& measured) {
                  measured.hasFork = true;
                  measured.canReadPages = false;
              }},
             {"no scan", [](Measured& measured) { measured.canScan = false; }},
             {"a file that is not there any more", append({80, "F", Backing::file, "rw-p", "/lib/y"})},
         }) {
        Measured measured = plainProcess();
        row.change(measured);
        std::ranges::sort(measured.mappings, {}, &WrittenMapping::firstPage);
        EXPECT_FALSE(isCounted(measured)) << row.why;
    }
    EXPECT_TRUE(isCounted(plainProcess()));
    write("vmstat", "pglazyfree 1\n");
    EXPECT_FALSE(isCounted(plainProcess())) << "any page can be a lazily freed one";
}

// What is next to each of the above and does not matter.
TEST_F(MappingCountsTest, CountsWhatOnlyLooksLikeThat) {
    const std::vector<WrittenMapping> mappings = {
        {80, "F", Backing::file, "r--s", "/bin/x"},
        {80, "P", Backing::file, "rw-p", "/lib/y"},
        {2 * kArenaPages - 1, std::string(kArenaPages, '.')},
        {80, "K", Backing::special, "r--p", "[vvar_vclock]"},
        {21, "P", Backing::file, "r--p", "/bin/x"},
    };
    for (const WrittenMapping& mapping : mappings) {
        Measured measured = plainProcess();
        measured.mappings.push_back(mapping);
        std::ranges::sort(measured.mappings, {}, &WrittenMapping::firstPage);
        EXPECT_TRUE(isCounted(measured)) << mapping.path << " at " << mapping.firstPage;
    }
    for (const char* path : {"/dev/shm/buffer", "/dev/zero", "/memfd:x"}) {
        Measured measured = plainProcess();
        measured.mappings.push_back({80, "F.F", Backing::shmem, "rw-s", path});
        EXPECT_EQ(isCounted(measured), !isSwapInUse) << path << ": what of it is in swap cannot be seen";
    }
}

}  // namespace
