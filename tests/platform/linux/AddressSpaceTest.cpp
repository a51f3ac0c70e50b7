#include "platform/linux/AddressSpace.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/MWRegionTags.h"
#include "support/WrittenPages.h"

namespace {

constexpr uint64_t kPage = 4096;

/// Builds regions from the text of smaps, for a process on whose mounts nothing is tmpfs.
class AddressSpaceTest : public testing::Test {
protected:
    AddressSpace build(const std::string& smaps, int32_t pid = 10, uint64_t ipcNamespace = 1) {
        std::vector<procfs::Vma> vmas = procfs::parseSmaps(smaps);
        return {backedVmas(vmas, _devices, -1),
                {.pid = pid, .startTime = 5, .ipcNamespace = ipcNamespace, .family = _familyOf},
                _pages,
                {_identity, _devices, _names, kPage}};
    }

    AddressSpaceRegion only(const std::string& smaps, int32_t pid = 10, uint64_t ipcNamespace = 1) {
        const AddressSpace space = build(smaps, pid, ipcNamespace);
        EXPECT_EQ(space.regions().size(), 1U);
        return space.regions().front();
    }

    /// Present pages, the second half the process's own.
    void writeHalfShared(uint64_t start, uint64_t count) {
        for (uint64_t page = 0; page < count; ++page) {
            const uint64_t exclusive = page < count / 2 ? 0 : uint64_t{1} << 56U;
            _pages.pages[start + page * kPage] = {(uint64_t{1} << 63U) | exclusive};
        }
    }

    ObjectIdentity _identity{"0dd6b3ac-0f4b-4c3c-8b0f-5f5f1f0a6d11"};
    ShmemDevices _devices;
    RegionNames _names;
    ForkFamily _family{77};
    std::function<ForkFamily&()> _familyOf = [this]() -> ForkFamily& { return _family; };
    WrittenPages _pages;
};

// KIND: what the mapping line says; TAG, SHARE MODE, PAGER: what the region says; DIRTY PAGES of 10 resident
// pages of which 3 are dirty, 4 anonymous and 1 is lazily freed.
struct KindRow {
    const char* line;
    uint32_t tag;
    uint8_t shareMode;
    uint8_t pager;
    uint32_t dirtyPages;
};

TEST_F(AddressSpaceTest, EachKindOfMapping) {
    const std::string counts =
        "\nRss: 40 kB\nPrivate_Dirty: 12 kB\nAnonymous: 16 kB\nLazyFree: 4 kB\nSwap: 8 kB\nSwapPss: 8 "
        "kB\nVmFlags: rd\n";
    for (const KindRow& row : {
             KindRow{"rw-p 00000000 00:00 0", MWTagNone, SM_PRIVATE, 0, 3},
             KindRow{"rw-p 00000000 00:06 4 /dev/zero", MWTagNone, SM_PRIVATE, 0, 3},
             KindRow{"rw-p 00001000 fe:00 9 /usr/lib/libx.so", MWTagNone, SM_COW, 1, 3},
             KindRow{"rw-s 00001000 fe:00 9 /srv/data", MWTagNone, SM_SHARED, 1, 3},
             KindRow{"rw-s 00000000 00:01 9 /memfd:buffer (deleted)", MWTagMemfd, SM_SHARED, 0, 10},
             KindRow{"rw-s 00000000 00:01 0 /SYSV00000000 (deleted)", MWTagSysV, SM_SHARED, 0, 10},
             KindRow{"rw-s 00000000 00:06 9 /dev/dri/card0", MWTagDrm, SM_SHARED, 0, 3},
             KindRow{"rw-s 00000000 00:0e 9 anon_inode:[io_uring]", MWTagIoUring, SM_SHARED, 0, 3},
         }) {
        const AddressSpaceRegion region = only("100000-200000 " + std::string(row.line) + counts);
        EXPECT_EQ(region.info.user_tag, row.tag) << row.line;
        EXPECT_EQ(region.info.share_mode, row.shareMode) << row.line;
        EXPECT_EQ(region.info.external_pager, row.pager) << row.line;
        EXPECT_EQ(region.info.pages_dirtied, row.dirtyPages) << row.line;
        EXPECT_EQ(region.info.pages_resident, 10U) << row.line;
        EXPECT_EQ(region.info.pages_reusable, 1U) << row.line;
        EXPECT_EQ(region.info.pages_swapped_out, 2U) << row.line;
        EXPECT_EQ(region.path.empty(), row.pager == 0) << "only files have a path to report: " << row.line;
    }
}

TEST_F(AddressSpaceTest, HugePagesAreResidentWiredAndDirty) {
    const AddressSpaceRegion region = only(
        "100000-600000 rw-p 00000000 00:0f 12 /anon_hugepage (deleted)\n"
        "Rss: 0 kB\nShared_Hugetlb: 2048 kB\nPrivate_Hugetlb: 4096 kB\nVmFlags: rd wr ht \n");
    EXPECT_EQ(region.info.pages_resident, 1536U);
    EXPECT_EQ(region.info.pages_dirtied, 1536U);
    EXPECT_EQ(region.info.user_wired_count, 1U);
    EXPECT_EQ(region.info.user_tag, MWTagHugetlb);
}

TEST_F(AddressSpaceTest, HugePagesRewrittenAfterForkAreNoLongerOneObject) {
    const auto smaps = [](const std::string& counts) {
        return "7f0000000000-7f0000400000 rw-p 00000000 00:0f 12 /anon_hugepage (deleted)\n" + counts +
               "VmFlags: rd wr ht \n";
    };
    const auto identity = [&](const std::string& counts, int32_t pid) {
        return only(smaps(counts), pid).info.object_id_full;
    };
    EXPECT_EQ(identity("Shared_Hugetlb: 4096 kB\n", 10), identity("Shared_Hugetlb: 4096 kB\n", 11));
    EXPECT_NE(identity("Private_Hugetlb: 4096 kB\n", 10), identity("Private_Hugetlb: 4096 kB\n", 11));

    writeHalfShared(0x7f0000000000, 1024);
    const AddressSpace mixed = build(smaps("Shared_Hugetlb: 2048 kB\nPrivate_Hugetlb: 2048 kB\n"));
    ASSERT_EQ(mixed.regions().size(), 2U);
    EXPECT_EQ(mixed.regions()[0].info.share_mode, SM_COW);
    EXPECT_EQ(mixed.regions()[0].info.pages_dirtied, 512U);
    EXPECT_EQ(mixed.regions()[1].info.share_mode, SM_PRIVATE);
    EXPECT_EQ(mixed.regions()[1].info.pages_dirtied, 512U);
}

// The kernel takes them from all who have them.
TEST_F(AddressSpaceTest, LazilyFreedPagesAreReclaimableThoughTheyAreShared) {
    writeHalfShared(0x100000, 8);
    const AddressSpace space = build(
        "100000-108000 rw-p 00000000 00:00 0\nRss: 32 kB\nPss: 24 kB\nShared_Dirty: 16 kB\n"
        "Private_Dirty: 16 kB\nAnonymous: 32 kB\nLazyFree: 20 kB\n");
    ASSERT_EQ(space.regions().size(), 2U);
    EXPECT_EQ(space.regions()[0].info.pages_reusable, 4U);
    EXPECT_EQ(space.regions()[0].info.pages_dirtied, 0U);
    EXPECT_EQ(space.regions()[1].info.pages_reusable, 1U);
    EXPECT_EQ(space.regions()[1].info.pages_dirtied, 3U);
}

// With whom nobody else is measured, what it shares with others by fork is its own; the file's pages stay the
// file's.
TEST_F(AddressSpaceTest, MemoryOfAProcessThatIsMeasuredAloneIsNotCutForItsSharers) {
    const std::string texts =
        "100000-108000 rw-p 00000000 00:00 0\nRss: 32 kB\nPss: 24 kB\nShared_Dirty: 16 kB\n"
        "Private_Dirty: 16 kB\nAnonymous: 32 kB\nSwap: 8 kB\nSwapPss: 4 kB\n"
        "200000-208000 rw-p 00000000 fe:00 9 /usr/lib/libx.so\nRss: 32 kB\nPss: 24 kB\n"
        "Shared_Clean: 16 kB\nShared_Dirty: 8 kB\nPrivate_Dirty: 8 kB\nAnonymous: 16 kB\n";
    writeHalfShared(0x100000, 8);
    writeHalfShared(0x200000, 8);
    for (uint64_t page = 2; page < 6; ++page) {
        _pages.pages[0x200000 + page * kPage] = {uint64_t{5} << 61U};
    }
    EXPECT_EQ(build(texts).regions().size(), 5U);
    EXPECT_FALSE(build(texts).missesPages());
    _pages.canBeRead = false;
    EXPECT_TRUE(build(texts).missesPages()) << "the process has ended, say";
    _pages.canBeRead = true;
    _familyOf = nullptr;
    const AddressSpace alone = build(texts);
    std::vector<uint64_t> starts;
    for (const AddressSpaceRegion& region : alone.regions()) {
        starts.push_back(region.start);
    }
    ASSERT_EQ(starts, (std::vector<uint64_t>{0x100000, 0x200000, 0x202000, 0x206000}));
    EXPECT_EQ(alone.regions()[0].info.pages_dirtied, 8U);
    EXPECT_EQ(alone.regions()[0].info.pages_swapped_out, 2U);
    EXPECT_EQ(alone.regions()[1].info.object_id_full, alone.regions()[3].info.object_id_full);
    EXPECT_EQ(alone.regions()[1].info.pages_dirtied, 2U);
    EXPECT_EQ(alone.regions()[2].info.pages_dirtied, 0U);
    EXPECT_EQ(alone.partOfFamilyMemory(), 0U);
}

TEST_F(AddressSpaceTest, AnonymousMemoryThatWasNeverTouchedBelongsToNoObject) {
    const AddressSpaceRegion region = only("100000-200000 rw-p 00000000 00:00 0\nRss: 0 kB\nSwap: 0 kB\n");
    EXPECT_EQ(region.info.object_id_full, 0U);
    EXPECT_EQ(region.info.share_mode, SM_EMPTY);
}

TEST_F(AddressSpaceTest, MappingsOfOneObjectAreOneAcrossProcesses) {
    const auto identity = [&](const std::string& line, int32_t pid, uint64_t ipcNamespace = 1) {
        return only("100000-200000 " + line + "\nRss: 4 kB\n", pid, ipcNamespace).info.object_id_full;
    };
    const std::string file = "r--p 00001000 fe:00 9 /usr/lib/libx.so";
    const std::string segment = "rw-s 00000000 00:01 0 /SYSV00000000 (deleted)";
    const std::string anonymous = "rw-p 00000000 00:00 0";
    const std::string kernelFile = "rw-s 00000000 00:0e 9 anon_inode:[io_uring]";

    EXPECT_EQ(identity(file, 10), identity(file, 11));
    EXPECT_NE(identity(file, 10), identity("r--p 00001000 fe:01 9 /usr/lib/libx.so", 10));
    EXPECT_NE(identity(anonymous, 10), identity(anonymous, 11));
    EXPECT_EQ(identity(segment, 10), identity(segment, 11));
    EXPECT_NE(identity(segment, 10, 1), identity(segment, 10, 2)) << "another IPC namespace";
    EXPECT_NE(identity(segment, 10), identity("rw-s 00000000 00:01 0 /memfd:a (deleted)", 10));
    EXPECT_NE(identity(kernelFile, 10), identity(kernelFile, 11)) << "the inode is that of the whole kind";
    const std::string writtenCopy = file + "\nAnonymous: 4 kB";
    EXPECT_NE(identity(writtenCopy, 10), identity(writtenCopy, 11));
    for (const std::string& line : {file, segment, anonymous, kernelFile}) {
        EXPECT_NE(identity(line, 10) >> 63U, 0U) << "apart from the small numbers of kernel objects";
    }
}

TEST_F(AddressSpaceTest, NamesThatProgramsGiveBecomeTags) {
    const AddressSpace space = build(
        "1000-2000 rw-p 00000000 00:00 0 [anon:Arena]\nRss: 4 kB\n"
        "2000-3000 rw-s 00000000 00:01 3 [anon_shmem:Frames]\nRss: 4 kB\n"
        "3000-4000 rw-p 00000000 00:00 0 [anon:Arena]\nRss: 4 kB\n"
        "4000-5000 rw-p 00000000 00:00 0 [anon:]\nRss: 4 kB\n");
    const auto& regions = space.regions();
    EXPECT_EQ(_names.nameForTag(regions[0].info.user_tag), "Arena");
    EXPECT_EQ(_names.nameForTag(regions[1].info.user_tag), "Frames");
    EXPECT_EQ(regions[2].info.user_tag, regions[0].info.user_tag);
    EXPECT_EQ(regions[3].info.user_tag, MWTagNone);
    EXPECT_EQ(regions[1].backing, Backing::shmem);

    for (int extra = 0; extra < 200; ++extra) {
        const uint32_t tag = _names.tagForName("extra " + std::to_string(extra));
        EXPECT_TRUE(tag == MWTagNone || _names.nameForTag(tag) == "extra " + std::to_string(extra));
        EXPECT_LE(tag, MWTagLastDynamic);
    }
}

}  // namespace
