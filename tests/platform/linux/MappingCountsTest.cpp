#include "platform/linux/MappingCounts.h"

#include <gtest/gtest.h>

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "support/RecordedTree.h"
#include "support/ScannedProcess.h"

namespace {

constexpr uint64_t kArenaPages = (uint64_t{64} << 20U) / ScannedProcess::kPage;
using Counts = std::vector<std::string>;

/// A process that can be counted, and what a test changes of it.
struct Measured {
    std::vector<WrittenMapping> mappings;
    procfs::ProcStatus status = {};
    bool hasFork = false;
    bool canReadPages = true;
    bool canScan = true;
    std::string sums = {};  ///< what smaps_rollup says behind its first line; nothing where there is none

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
        if (!makeClean("20/map_files/10000-14000")) {
            GTEST_SKIP() << "the kernel does not tell of a file's pages here whether they are clean";
        }
    }

    bool isCounted(const Measured& measured) {
        process.emplace(measured.mappings);
        std::filesystem::remove(place("20/smaps_rollup"));
        if (!measured.sums.empty()) {
            write("20/smaps_rollup", "1000-7ffff000 ---p 00000000 00:00 0 [rollup]\n" + measured.sums);
        }
        const procfs::Descriptor proc = directory("");
        const procfs::Descriptor memory = directory("20");
        UncountedPages uncounted(proc.get(), _top + "/pages_shared");
        process->pages.canBeRead = measured.canReadPages;
        const PageScanner noScan = [](const PageScan&, std::span<ScannedRange>, uint64_t&) { return -1; };
        const PageScanner scan = measured.canScan ? process->scanner() : noScan;
        filePages = countWithoutSmaps(process->vmas,
                                      {.memoryDirectory = memory.get(),
                                       .status = measured.status,
                                       .scan = scan,
                                       .pages = process->pages,
                                       .pageSize = ScannedProcess::kPage,
                                       .isAlone = !measured.hasFork},
                                      uncounted);
        isSwapInUse = uncounted.isSwapInUse();
        return filePages.has_value();
    }

    std::optional<ScannedProcess> process;
    std::optional<std::vector<ScannedRange>> filePages;
    bool isSwapInUse = false;
};

TEST_F(MappingCountsTest, CountsAPlainProcess) {
    ASSERT_TRUE(isCounted(plainProcess()));
    EXPECT_EQ(process->counts(), (Counts{"3/0/0", "2/1/0", "3/3/0", "1/1/0", "0/0/0"}));
    EXPECT_EQ(filePages->size(), 4U) << "the text's two ranges, and two pages of the data";
}

TEST_F(MappingCountsTest, OfMemoryThatIsSharedByForkOnePageIsEnough) {
    Measured measured = plainProcess();
    measured.hasFork = true;
    measured.anonymous().letters = std::string(5000, 'P') + "S" + std::string(10, '.') + "SSS";
    measured.mappings.push_back({91000, "FSS", Backing::file, "rw-p", "/bin/x"});
    ASSERT_TRUE(isCounted(measured));
    std::vector<uint64_t> shared;
    for (const BackedVma& backed : process->vmas) {
        shared.push_back(backed.vma.sharedDirty);
    }
    constexpr uint64_t kOne = ScannedProcess::kPage;
    EXPECT_EQ(shared, (std::vector<uint64_t>{0, 0, kOne, 0, 0, kOne})) << "a file's pages are everybody's";
}

TEST_F(MappingCountsTest, DeclinesWhereSmapsTellsMore) {
    struct Row {
        const char* what;
        bool isCounted;
        std::function<void(Measured&)> change;
    };
    const auto with = [](const WrittenMapping& mapping) {
        return [=](Measured& measured) { measured.mappings.push_back(mapping); };
    };
    const auto swapped = [](uint64_t bytes, bool hasFork) {
        return [=](Measured& measured) {
            measured.anonymous().letters = "Pw";
            measured.status.vmSwap = bytes;
            measured.hasFork = hasFork;
        };
    };
    for (const Row& row : std::vector<Row>{
             {"as it is", true, [](Measured&) {}},
             {"locked", false, [](Measured& measured) { measured.status.vmLck = 4096; }},
             {"huge pages", false, [](Measured& measured) { measured.status.hugetlbPages = 2U << 20U; }},
             {"a shadow stack", false, [](Measured& measured) { measured.status.hasShadowStack = true; }},
             {"mapped huge pages", false, with({512, ".", Backing::hugetlb})},
             {"can write to a file", false, with({80, ".", Backing::file, "rw-s", "/bin/x"})},
             {"shares it as it is", true, with({80, "F", Backing::file, "r--s", "/bin/x"})},
             {"a device's file", false, with({80, ".", Backing::file, "rw-p", "/dev/card"})},
             {"a device's memory", false, with({80, ".", Backing::shmem, "rw-s", "/dev/card"})},
             {"an unknown special", false, with({80, "F", Backing::special, "rw-s", "anon_inode:[x]"})},
             {"the kernel's clock", true, with({80, "K", Backing::special, "r--p", "[vvar_vclock]"})},
             {"a guard", false, with({80, ".", Backing::anonymous, "---p"})},
             {"memory below the stack", false, with({90001, "P"})},
             {"a possible arena", false, with({kArenaPages, std::string(kArenaPages, '.')})},
             {"off its place", true, with({kArenaPages - 1, std::string(kArenaPages, '.')})},
             {"an allocator", false, with({80, "P", Backing::file, "r-xp", "/lib/libjemalloc.so.2"})},
             {"constants that nobody wrote", false, with({21, ".", Backing::file, "r--p", "/bin/x"})},
             {"constants that are written", true, with({21, "P", Backing::file, "r--p", "/bin/x"})},
             {"frames without a page", false, with({80, "K", Backing::file, "r--s", "/bin/x"})},
             {"a file that is gone", false, with({80, "F", Backing::file, "rw-p", "/lib/y"})},
             {"its written copies", true, with({80, "P", Backing::file, "rw-p", "/lib/y"})},
             {"entries like swapped pages", false, swapped(0, false)},
             {"as much swapped as seen", true, swapped(4096, false)},
             {"more swapped than seen", false, swapped(8192, false)},
             {"shared by fork and swapped", false, swapped(4096, true)},
             {"pages that cannot be read", false,
              [](Measured& measured) {
                  measured.hasFork = true;
                  measured.canReadPages = false;
              }},
             {"no scan", false, [](Measured& measured) { measured.canScan = false; }},
         }) {
        Measured measured = plainProcess();
        row.change(measured);
        std::ranges::sort(measured.mappings, {}, &WrittenMapping::firstPage);
        EXPECT_EQ(isCounted(measured), row.isCounted) << row.what;
    }
    for (const char* path : {"/dev/shm/buffer", "/dev/zero", "/memfd:x"}) {
        Measured measured = plainProcess();
        with({90020, "F.F", Backing::shmem, "rw-s", path})(measured);
        EXPECT_EQ(isCounted(measured), !isSwapInUse) << path << ": what of it is in swap cannot be seen";
    }
}

TEST_F(MappingCountsTest, SumsOfTheProcessTellWhatIsNotKnownOfTheSystem) {
    const std::string clean = "Private_Dirty: 20 kB\nAnonymous: 24 kB\n";
    const std::string dirty = "Shared_Dirty: 4 kB\nPrivate_Dirty: 20 kB\nAnonymous: 20 kB\n";
    const auto isCountedWith = [this](const std::string& sums, const WrittenMapping& more = {80, "."}) {
        Measured measured = plainProcess();
        measured.sums = sums;
        measured.mappings.insert(measured.mappings.begin() + 3, more);
        return isCounted(measured);
    };
    const WrittenMapping goneFile = {80, "F", Backing::file, "rw-p", "/lib/y"};
    ASSERT_TRUE(isCountedWith(""));
    EXPECT_EQ(isCountedWith(clean, goneFile), !isSwapInUse) << "its pages cannot be asked about";
    EXPECT_FALSE(isCountedWith(dirty, goneFile));
    EXPECT_TRUE(isCountedWith(dirty)) << "the file's page that was dirty is not any more";

    write("vmstat", "pglazyfree 1\n");
    EXPECT_FALSE(isCountedWith("")) << "any page can be a lazily freed one";
    EXPECT_TRUE(isCountedWith(clean));
    EXPECT_TRUE(isCountedWith(dirty)) << "files are asked about as ever";
    EXPECT_FALSE(isCountedWith(clean + "LazyFree: 4 kB\n"));
    EXPECT_FALSE(isCountedWith(clean + "KSM: 4 kB\n"));
    EXPECT_EQ(isCountedWith(clean, goneFile), !isSwapInUse);
    EXPECT_FALSE(isCountedWith("VmFlags: rd\n")) << "no counts";

    Measured large = plainProcess();
    large.sums = clean;
    large.status.rssAnon = 3U << 20U;
    EXPECT_FALSE(isCounted(large)) << "five mappings are not worth a look at 768 pages more";
}

}  // namespace
