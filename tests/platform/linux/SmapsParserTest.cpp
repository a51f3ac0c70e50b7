#include "platform/linux/SmapsParser.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <string>

#include "platform/RecordedFile.h"

namespace {

using procfs::parseSmaps;
using procfs::SmapsParser;
using procfs::Vma;

// As Linux 6.18 writes it: a program's text, a mapping of an unlinked file with a line feed and a blank in
// its name, and locked memory without a name.
std::string recorded() {
    return recordedFile("mappings.smaps");
}

std::string describe(const std::vector<Vma>& vmas) {
    std::string text;
    for (const Vma& vma : vmas) {
        text += fmt::format("{:x}-{:x} {} {} {} {} {} {}\n", vma.start, vma.end, vma.path, vma.rss,
                            vma.anonymous, vma.swap, vma.privateDirty, vma.flags);
    }
    return text;
}

TEST(SmapsParser, ReadsMappingsWithTheirCounts) {
    const std::vector<Vma> vmas = parseSmaps(recorded());
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
    const std::string text = recorded();
    const std::string whole = describe(parseSmaps(text));
    for (size_t cut = 0; cut <= text.size(); ++cut) {
        SmapsParser parser;
        parser.feed(std::string_view(text).substr(0, cut));
        parser.feed(std::string_view(text).substr(cut));
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

TEST(SmapsParser, LinesTooLongForAnyMappingAreCutAlikeWhereverReadsEnd) {
    const std::string text = "1000-2000 rw-p 00000000 00:00 7 /" + std::string(50000, 'a') + "\nRss: 4 kB\n";
    const std::vector<Vma> whole = parseSmaps(text);
    ASSERT_EQ(whole.size(), 1U);
    EXPECT_LT(whole[0].path.size(), 25000U);
    EXPECT_EQ(whole[0].rss, 4096U);
    for (const size_t step : {100U, 16384U, 30000U}) {
        SmapsParser parser;
        for (size_t at = 0; at < text.size(); at += step) {
            parser.feed(std::string_view(text).substr(at, step));
        }
        EXPECT_EQ(parser.finish(), whole) << step;
    }
}

}  // namespace
