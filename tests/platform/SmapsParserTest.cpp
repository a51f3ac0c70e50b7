#include "platform/linux/SmapsParser.h"

#include <gtest/gtest.h>

#include <random>
#include <string>

namespace {

using procfs::parseSmaps;
using procfs::SmapsParser;
using procfs::Vma;

// As Linux 6.18 writes it: a program's text, a mapping of an unlinked file with a line feed and a blank in
// its name, and locked memory without a name.
const std::string kRecorded =
    "55e943639000-55e94363b000 r-xp 00002000 fe:00 247134                     /usr/bin/cat\n"
    "Size:                  8 kB\nKernelPageSize:        4 kB\nRss:                   8 kB\nPss:             "
    "      4 kB\n"
    "Shared_Dirty:          0 kB\nPrivate_Dirty:         0 kB\nAnonymous:             0 kB\nLazyFree:        "
    "      0 kB\n"
    "Swap:                  0 kB\nSwapPss:               0 kB\nTHPeligible:           0\nVmFlags: rd ex mr "
    "mw me \n"
    "7f0000000000-7f0000004000 rw-s 00001000 00:01 77 /tmp/a\\012 b (deleted)\n"
    "Rss:                  16 kB\nShared_Dirty:          4 kB\nPrivate_Dirty:         8 kB\nSwap:            "
    "     12 kB\n"
    "VmFlags: rd wr sh mr mw me ms \n"
    "7f0000010000-7f0000020000 rw-p 00000000 00:00 0 \n"
    "Rss:                  64 kB\nAnonymous:            60 kB\nLazyFree:              4 kB\nSwapPss:         "
    "      2 kB\n"
    "VmFlags: rd wr mr mw me lo ac nh \n";

std::string describe(const Vma& vma) {
    return std::to_string(vma.start) + "-" + std::to_string(vma.end) + " " + vma.path + " " +
           std::to_string(vma.rss + 3 * vma.anonymous + 5 * vma.swap + 7 * vma.privateDirty) + " " +
           std::to_string(vma.flags);
}

std::string describe(const std::vector<Vma>& vmas) {
    std::string text;
    for (const Vma& vma : vmas) {
        text += describe(vma) + "\n";
    }
    return text;
}

// What every text must give, however broken.
void expectOrdered(const std::vector<Vma>& vmas) {
    uint64_t lowest = 0;
    for (const Vma& vma : vmas) {
        ASSERT_GE(vma.start, lowest);
        ASSERT_LT(vma.start, vma.end);
        lowest = vma.end;
    }
}

TEST(SmapsParser, ReadsMappingsWithTheirCounts) {
    const std::vector<Vma> vmas = parseSmaps(kRecorded);
    ASSERT_EQ(vmas.size(), 3U);

    EXPECT_EQ(vmas[0].start, 0x55e943639000U);
    EXPECT_EQ(vmas[0].size(), 0x2000U);
    EXPECT_EQ(vmas[0].offset, 0x2000U);
    EXPECT_EQ(vmas[0].device(), 0xfe00000000U);
    EXPECT_EQ(vmas[0].inode, 247134U);
    EXPECT_TRUE(vmas[0].readable && vmas[0].executable && !vmas[0].writable && !vmas[0].shared);
    EXPECT_EQ(vmas[0].path, "/usr/bin/cat");
    EXPECT_EQ(vmas[0].rss, 8192U);

    EXPECT_EQ(vmas[1].path, "/tmp/a\n b");
    EXPECT_TRUE(vmas[1].deleted && vmas[1].shared);
    EXPECT_EQ(vmas[1].sharedDirty, 4096U);
    EXPECT_EQ(vmas[1].privateDirty, 8192U);
    EXPECT_EQ(vmas[1].swap, 12288U);
    EXPECT_EQ(vmas[1].swapPss, 0U) << "a field that is not there is 0, not the last mapping's";

    EXPECT_EQ(vmas[2].path, "");
    EXPECT_EQ(vmas[2].anonymous, 61440U);
    EXPECT_EQ(vmas[2].lazyFree, 4096U);
    EXPECT_TRUE(vmas[2].has(procfs::VmFlagLocked) && vmas[2].has(procfs::VmFlagNoHugepage));
    EXPECT_FALSE(vmas[2].has(procfs::VmFlagHugetlb));
}

TEST(SmapsParser, GivesTheSameWhereverReadsCutTheText) {
    const std::string whole = describe(parseSmaps(kRecorded));
    for (size_t cut = 0; cut <= kRecorded.size(); ++cut) {
        SmapsParser parser;
        parser.feed(std::string_view(kRecorded).substr(0, cut));
        parser.feed(std::string_view(kRecorded).substr(cut));
        ASSERT_EQ(describe(parser.finish()), whole) << "cut at " << cut;
    }
}

TEST(SmapsParser, PassesOverWhatItCannotRead) {
    // Counts of a mapping that could not be read must not land on its neighbour.
    const std::vector<Vma> vmas = parseSmaps(
        "Rss: 4 kB\n"
        "1000-2000 rw-p 00000000 00:00 0\n"
        "Rss: 4 kB\nRss_of_the_future: 99 kB\nSwap: 99999999999999999999 kB\nPss: 18446744073709551615 kB\n"
        "3000-2000 rw-p 00000000 00:00 0\n"
        "Rss: 8 kB\n"
        "1800-4000 rw-p 00000000 00:00 0 overlaps\n"
        "Rss: 8 kB\n"
        "5000-6000 rw-p 00000000 00:0");
    ASSERT_EQ(vmas.size(), 1U);
    EXPECT_EQ(vmas[0].rss, 4096U);
    EXPECT_EQ(vmas[0].swap, 0U);
    EXPECT_EQ(vmas[0].pss, 0U) << "does not fit in bytes";

    EXPECT_TRUE(parseSmaps("").empty());
    EXPECT_TRUE(parseSmaps(std::string(1 << 20, 'a')).empty())
        << "a line without an end is not kept for ever";
}

TEST(SmapsParser, SurvivesBrokenText) {
    std::mt19937 random(20);
    for (int round = 0; round < 20000; ++round) {
        std::string text = kRecorded;
        for (int change = 0; change < 8; ++change) {
            const size_t at = random() % text.size();
            switch (random() % 3) {
                case 0:
                    text[at] = static_cast<char>(random());
                    break;
                case 1:
                    text.erase(at, random() % 40);
                    break;
                default:
                    text.insert(at, text.substr(random() % text.size(), random() % 40));
            }
        }
        expectOrdered(parseSmaps(text));
    }
}

}  // namespace
