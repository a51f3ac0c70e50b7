#include "platform/linux/PageCounts.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "support/ScannedProcess.h"

namespace {

constexpr uint64_t kPage = ScannedProcess::kPage;
using Counts = std::vector<std::string>;

char letterOf(PagemapEntry entry) {
    const char present = entry.fileOrShared() ? 'F' : entry.exclusive() ? 'P' : '?';
    return entry.present() ? present : entry.swapped() ? 'w' : '.';
}

/// So many pages from this one on, as letters.
std::string lettersOf(ScannedPages& pages, uint64_t first, uint64_t count) {
    std::vector<PagemapEntry> entries(count, PagemapEntry{~uint64_t{0}});
    EXPECT_TRUE(pages.readPages(first * kPage, entries));
    std::string letters;
    std::ranges::transform(entries, std::back_inserter(letters), letterOf);
    return letters;
}

constexpr const char* kDeclined = "declined";

struct KindRow {
    Backing backing;
    const char* permissions;
    const char* letters;
    const char* counts;
    const char* filePages;  ///< of what is kept for looking at the pages again
};

TEST(PageCounts, EachKindOfPageInEachKindOfMapping) {
    for (const KindRow& row : {
             KindRow{Backing::anonymous, "rw-p", "PP.Swz", "3/3/1", ""},
             KindRow{Backing::file, "rw-p", "FPw.zF", "3/1/1", "FPw..F"},
             KindRow{Backing::shmem, "rw-p", "FPwF.z", "3/1/1", "FPwF.."},
             KindRow{Backing::file, "r--s", "F.Fz", "2/0/0", ""},
             KindRow{Backing::shmem, "rw-s", "FFF.", "3/0/0", ""},
             KindRow{Backing::file, "r--s", "Fw", kDeclined, ""},
             KindRow{Backing::file, "r--s", "KF", kDeclined, ""},
             KindRow{Backing::shmem, "rw-s", ".w", kDeclined, ""},
             KindRow{Backing::special, "r--p", "FK.w", "1/0/0", ""},
         }) {
        ScannedProcess process({{0, row.letters, row.backing, row.permissions}});
        const auto filePages = countPages(process.vmas, process.scanner());
        const std::string counts = filePages ? process.counts().front() : kDeclined;
        EXPECT_EQ(counts, row.counts) << row.letters;
        ScannedPages pages(filePages.value_or(std::vector<ScannedRange>()), kPage);
        EXPECT_EQ(lettersOf(pages, 0, std::string_view(row.filePages).size()), row.filePages);
        EXPECT_EQ(process.vmas.front().vma.swapPss, process.vmas.front().vma.swap)
            << "nobody else has what was swapped out";
    }
}

// Whatever lies beside whatever, and wherever the kernel stops.
TEST(PageCounts, AreThoseOfEachMappingHoweverTheScanIsCut) {
    std::mt19937 random(3);
    for (int round = 0; round < 300; ++round) {
        std::vector<WrittenMapping> mappings;
        Counts expected;
        uint64_t next = random() % 3;
        for (size_t count = 1 + random() % 12; count > 0; --count) {
            const bool isFile = random() % 2 != 0;
            const char* const kinds = isFile ? "FPw." : "PPw.";
            std::string letters;
            for (size_t runs = 1 + random() % 6; runs > 0; --runs) {
                letters += std::string(1 + random() % (random() % 4 == 0 ? 60 : 4), kinds[random() % 4]);
            }
            const auto pages = [&](char letter) {
                return std::count(letters.begin(), letters.end(), letter);
            };
            expected.push_back(fmt::format("{}/{}/{}", pages('F') + pages('P'), pages('P'), pages('w')));
            mappings.push_back({next, letters, isFile ? Backing::file : Backing::anonymous});
            next += letters.size() + random() % 2 * (random() % 100);
        }
        ScannedProcess process(mappings);
        process.mostPages = random() % 2 == 0 ? 1 + random() % 20 : UINT64_MAX;
        ASSERT_TRUE(countPages(process.vmas, process.scanner()));
        ASSERT_EQ(process.counts(), expected) << "round " << round;
    }
}

// The kernel holds the memory map for as long as it answers, and to tell whose a page is costs it much.
TEST(PageCounts, QuestionsAreBoundedAndOnlyOfObjectsWhereThereCanBeSome) {
    constexpr uint64_t kMany = 40000;
    std::string alternating;
    for (uint64_t page = 0; page < kMany; ++page) {
        alternating += page % 3 == 0 ? '.' : 'P';
    }
    const uint64_t kernelsOwn = 0xffffffffff600;
    ScannedProcess process({{16, "FFP", Backing::file},
                            {19, std::string(10, 'P')},
                            {100, "F.P", Backing::file},
                            {1000, std::string(kMany, 'P')},
                            {1000 + kMany, alternating},
                            {kernelsOwn, "K", Backing::special}});
    ASSERT_TRUE(countPages(process.vmas, process.scanner()));
    EXPECT_EQ(process.counts(),
              (Counts{"3/1/0", "10/10/0", "2/1/0", "40000/40000/0", "26666/26666/0", "0/0/0"}));
    size_t ofObjects = 0;
    for (const PageScan& question : process.questions) {
        EXPECT_TRUE(question.mostPages > 0 && question.mostPages <= 16384) << question.mostPages;
        EXPECT_LT(question.start, kernelsOwn * kPage);
        const bool asksForObjects = (question.told & kIsFileOrShared) != 0;
        ofObjects += asksForObjects ? 1 : 0;
        EXPECT_EQ(asksForObjects, question.start < 1000 * kPage);
    }
    EXPECT_EQ(ofObjects, 1U) << "small pieces of memory between files are asked about with them";
}

TEST(PageCounts, AScanThatFailsOrGoesNowhereIsNoAnswer) {
    struct Reply {
        int count;
        uint64_t walkEnd;
    };
    for (const Reply reply : {Reply{-1, 12}, Reply{0, 10}, Reply{0, 9}, Reply{1, 0}, Reply{INT32_MAX, 12}}) {
        ScannedProcess process({{10, "PPP"}});
        int questions = 0;
        const auto scan = [&](const PageScan&, std::span<ScannedRange>, uint64_t& walkEnd) {
            ++questions;
            walkEnd = reply.walkEnd * kPage;
            return reply.count;
        };
        EXPECT_FALSE(countPages(process.vmas, scan)) << reply.count << " " << reply.walkEnd;
        EXPECT_EQ(questions, 1) << "nothing is asked after that";
    }
}

TEST(ScannedPages, ReadLikeThePagesThatWereScanned) {
    const std::string letters = "....FFP..wwP...";
    ScannedProcess process({{0, letters, Backing::file}});
    const auto ranges = countPages(process.vmas, process.scanner());
    ScannedPages pages(ranges.value(), kPage);
    for (uint64_t first = 0; first < letters.size(); ++first) {
        for (uint64_t count = 0; first + count <= letters.size(); ++count) {
            ASSERT_EQ(lettersOf(pages, first, count), letters.substr(first, count)) << first;
            const size_t populated = letters.substr(first, count).find_first_not_of('.');
            ASSERT_EQ(pages.nextPopulated(first * kPage, (first + count) * kPage),
                      (first + std::min(populated, count)) * kPage)
                << first << "+" << count;
        }
    }
}

}  // namespace
