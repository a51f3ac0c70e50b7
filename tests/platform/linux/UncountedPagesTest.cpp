#include "platform/linux/UncountedPages.h"

#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <optional>
#include <string>

#include "support/RecordedTree.h"

namespace {

class UncountedPagesTest : public RecordedTree {
protected:
    /// Whether the file is dirty once it is written. Somebody else may write everything back in between.
    bool becomesDirty(UncountedPages& pages, int memory, const procfs::Vma& vma, const std::string& path) {
        constexpr int kAttempts = 1000;
        for (int attempt = 0; attempt < kAttempts; ++attempt) {
            // Behind its end: a disk writes a file that was emptied first back at once.
            std::ofstream(place(path), std::ios::app) << "dirty";
            pages.begin();
            if (!pages.isCleanFile(memory, vma)) {
                return true;
            }
        }
        return false;
    }
};

procfs::Vma mappingOf(uint64_t start, uint64_t inode, uint32_t deviceMajor = 8) {
    procfs::Vma vma;
    vma.start = start;
    vma.end = start + 0x1000;
    vma.inode = inode;
    vma.deviceMajor = deviceMajor;
    return vma;
}

// What cannot be understood can mean anything, so smaps is read.
TEST_F(UncountedPagesTest, OnlyPlainZerosSayThatThereAreNone) {
    const procfs::Descriptor proc = directory("");
    UncountedPages pages(proc.get(), _top + "/pages_shared");
    bool last = pages.canBeInAnonymousMemory();
    struct Row {
        std::optional<const char*> vmstat;
        std::optional<const char*> merged;
        bool canBe;
    };
    for (const Row& row : {
             Row{"nr_free_pages 5\npglazyfree 0\npglazyfreed 9\n", {}, false},
             Row{"pglazyfreed 9\npglazyfree 0", "0\n", false},
             Row{"nr_free_pages 0\npglazyfree 18432\npglazyfreed 0\n", {}, true},
             Row{{}, {}, true},
             Row{"", {}, true},
             Row{"pglazyfreed 0\nxpglazyfree 0\n", {}, true},
             Row{"pglazyfree\n0\n", {}, true},
             Row{"pglazyfree \n", {}, true},
             Row{"pglazyfree -1\n", {}, true},
             Row{"pglazyfree 99999999999999999999999\n", {}, true},
             Row{"pglazyfree 0\n", "7\n", true},
             Row{"pglazyfree 0\n", "", true},
             Row{"pglazyfree 0\n", "none\n", true},
         }) {
        for (const auto& [name, text] : {std::pair("vmstat", row.vmstat), {"pages_shared", row.merged}}) {
            std::filesystem::remove(_top + "/" + name);
            if (text) {
                write(name, *text);
            }
        }
        EXPECT_EQ(pages.canBeInAnonymousMemory(), last) << "one measurement has one answer";
        pages.begin();
        last = pages.canBeInAnonymousMemory();
        EXPECT_EQ(last, row.canBe) << row.vmstat.value_or("no vmstat") << " " << row.merged.value_or("");
    }
}

TEST_F(UncountedPagesTest, AFileIsCleanWhereNoPageOfItIsDirty) {
    write("self/mountinfo",
          "24 1 8:0 / / rw - ext4 /dev/sda rw\n25 24 9:0 / /srv rw - nfs server:/srv rw\n"
          "26 24 10:0 / /x rw - ext4\n");
    write("20/map_files/1000-2000", "clean");
    write("20/map_files/2000-3000", "another");
    write("20/map_files/4000-5000", "");
    if (!makeClean("20/map_files/1000-2000")) {
        GTEST_SKIP() << "the kernel does not tell of a file's pages here whether they are clean";
    }
    const procfs::Descriptor proc = directory("");
    const procfs::Descriptor process = directory("20");
    const int memory = process.get();
    UncountedPages pages(proc.get());
    EXPECT_TRUE(pages.isCleanFile(memory, mappingOf(0x1000, 1)));
    EXPECT_FALSE(pages.isCleanFile(memory, mappingOf(0x1000, 1, 9))) << "not on a disk of this machine";
    EXPECT_FALSE(pages.isCleanFile(memory, mappingOf(0x1000, 1, 11))) << "not mounted here";
    EXPECT_TRUE(becomesDirty(pages, memory, mappingOf(0x2000, 2), "20/map_files/2000-3000"));
    EXPECT_FALSE(pages.isCleanFile(memory, mappingOf(0x3000, 3))) << "gone meanwhile";
    EXPECT_FALSE(pages.isCleanFile(memory, mappingOf(0x4000, 4))) << "has not the pages that are mapped";

    ASSERT_TRUE(makeClean("20/map_files/2000-3000"));
    EXPECT_TRUE(becomesDirty(pages, memory, mappingOf(0x1000, 1), "20/map_files/1000-2000"));
    EXPECT_FALSE(pages.isCleanFile(memory, mappingOf(0x9000, 1))) << "looked at once, wherever it is mapped";
    EXPECT_TRUE(pages.isCleanFile(memory, mappingOf(0x2000, 2)));
}

// To open a device can have effects; a named pipe stands for it.
TEST_F(UncountedPagesTest, NothingButRegularFilesIsOpened) {
    write("self/mountinfo", "24 1 8:0 / / rw - ext4 /dev/sda rw\n");
    const std::string pipe = place("20/map_files/1000-2000");
    ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
    const procfs::Descriptor watch(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    ASSERT_GE(inotify_add_watch(watch.get(), pipe.c_str(), IN_OPEN), 0);
    const procfs::Descriptor proc = directory("");
    const procfs::Descriptor process = directory("20");
    EXPECT_FALSE(UncountedPages(proc.get()).isCleanFile(process.get(), mappingOf(0x1000, 1)));
    std::array<char, 256> events = {};
    EXPECT_LT(read(watch.get(), events.data(), events.size()), 0);
}

}  // namespace
