#include "platform/linux/OwnershipRuns.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "platform/linux/ForkFamily.h"
#include "support/WrittenPages.h"

namespace {

constexpr uint64_t kPage = 4096;
constexpr uint64_t kBase = 0x7f0000000000;  // the beginning of a window
constexpr uint64_t kWindowPages = MWFamilyWindow / kPage;

/// A private mapping at kBase whose pages are written as one letter each:
/// P the process's own, S shared by fork, F the file's, w swapped, . absent, z the zero page.
class Mapping {
public:
    explicit Mapping(const std::string& letters, uint64_t firstFrame = 0) {
        vma.start = kBase;
        vma.end = kBase + letters.size() * kPage;
        for (size_t page = 0; page < letters.size(); ++page) {
            _add(kBase + page * kPage, letters[page], firstFrame == 0 ? 0 : firstFrame + page);
        }
    }

    std::vector<OwnershipRun> runs(FrameGenerations& generations, bool isFileMapping = false) {
        return *ownershipRuns(
            {.vma = vma, .isFileMapping = isFileMapping, .pageSize = kPage, .isAlone = false}, pages,
            &generations);
    }
    std::vector<OwnershipRun> runs(bool isFileMapping = false) {
        FrameGenerations generations;
        return runs(generations, isFileMapping);
    }

    procfs::Vma vma;
    WrittenPages pages;

private:
    void _add(uint64_t address, char letter, uint64_t frame) {
        if (letter == '.') {
            return;
        }
        const auto isOneOf = [&](std::string_view letters) {
            return letters.find(letter) == std::string_view::npos ? uint64_t{0} : uint64_t{1};
        };
        pages.pages[address] = {isOneOf("PSFz") << 63U | isOneOf("w") << 62U | isOneOf("F") << 61U |
                                isOneOf("P") << 56U | frame};
        vma.rss += isOneOf("PSF") * kPage;
        vma.anonymous += isOneOf("PS") * kPage;
        vma.sharedDirty += isOneOf("S") * kPage;
        vma.swap += isOneOf("w") * kPage;
        if (letter == 'z') {
            pages.zeroPages.insert(address);
        }
    }
};

/// "START+PAGES OWNER resident/swapped", a run for each line; START in pages.
std::string describe(const std::vector<OwnershipRun>& runs) {
    std::string text;
    for (const OwnershipRun& run : runs) {
        static const std::map<PageOwner, const char*> names = {{PageOwner::none, "none"},
                                                               {PageOwner::object, "file"},
                                                               {PageOwner::process, "own"},
                                                               {PageOwner::family, "family"}};
        const std::string generation = run.generation == 0 ? "" : std::to_string(run.generation);
        text += fmt::format("{}+{} {}{} {}/{}\n", (run.start - kBase) / kPage, run.size() / kPage,
                            names.at(run.owner), generation, run.resident, run.swapped);
    }
    return text;
}

TEST(OwnershipRuns, MaximalSpansOfOneOwner) {
    EXPECT_EQ(describe(Mapping("PPSSSP").runs()), "0+2 own 2/0\n2+3 family 3/0\n5+1 own 1/0\n");
    EXPECT_EQ(describe(Mapping("..P.S..P.").runs()), "0+4 own 1/0\n4+3 family 1/0\n7+2 own 1/0\n")
        << "absent pages go with the page before them, the first ones with the one behind";
    EXPECT_EQ(describe(Mapping("FFPPSF").runs(true)),
              "0+2 file 2/0\n2+2 own 2/0\n4+1 family 1/0\n5+1 file 1/0\n");
    EXPECT_EQ(describe(Mapping("PzzzP").runs()), "0+5 own 2/0\n") << "the zero page is nobody's memory";
    EXPECT_EQ(describe(Mapping("zzS").runs()), "0+3 family 1/0\n");
    EXPECT_TRUE(Mapping("....").runs().empty());
}

TEST(OwnershipRuns, SwappedPagesAreSharedAsTheCountsSay) {
    Mapping mapping("PwwS");
    mapping.vma.swapPss = mapping.vma.swap;
    EXPECT_EQ(describe(mapping.runs()), "0+3 own 1/2\n3+1 family 1/0\n");
    mapping.vma.swapPss = mapping.vma.swap / 2;
    EXPECT_EQ(describe(mapping.runs()), "0+1 own 1/0\n1+3 family 1/2\n");
}

TEST(OwnershipRuns, OnlyFamilyMemoryIsCutAtWindowsAndNobodyOwnsAnEmptyOne) {
    const std::string window(kWindowPages, 'S');
    const std::string own(kWindowPages, 'P');
    const std::string nothing(kWindowPages, '.');
    EXPECT_EQ(describe(Mapping(window + nothing + nothing + own + own + "S").runs()),
              "0+1024 family 1024/0\n1024+2048 none 0/0\n3072+2048 own 2048/0\n5120+1 family 1/0\n");
}

// Twenty windows of which two have pages: the holes between are passed over unread.
TEST(OwnershipRuns, SparseMappingsAreReadOnlyWhereTheyHavePages) {
    class CountingPages : public WrittenPages {
    public:
        uint64_t read = 0;
        bool readPages(uint64_t address, std::span<PagemapEntry> entries) override {
            read += entries.size();
            return WrittenPages::readPages(address, entries);
        }
    };
    const Mapping sparse("S" + std::string(200 * kWindowPages, '.') + "S");
    CountingPages pages;
    pages.pages = sparse.pages.pages;
    FrameGenerations generations;
    const auto runs =
        *ownershipRuns({.vma = sparse.vma, .isFileMapping = false, .pageSize = kPage, .isAlone = false},
                       pages, &generations);
    EXPECT_EQ(describe(runs), "0+1024 family 1/0\n1024+203776 none 0/0\n204800+2 family 1/0\n");
    EXPECT_LT(pages.read, 20 * kWindowPages);
}

TEST(OwnershipRuns, CountsAddUpToTheMappingWhateverChangedMeanwhile) {
    Mapping mapping("PPPSS");
    mapping.vma.rss = 7 * kPage;
    mapping.vma.swap = 1 * kPage;
    mapping.vma.swapPss = mapping.vma.swap;
    EXPECT_EQ(describe(mapping.runs()), "0+3 own 5/1\n3+2 family 2/0\n");
    mapping.vma.rss = 1 * kPage;
    mapping.vma.swap = 0;
    EXPECT_EQ(describe(mapping.runs()), "0+3 own 0/0\n3+2 family 1/0\n");
}

TEST(OwnershipRuns, FinelyAlternatingOwnersAreGroupedWithExactCounts) {
    std::mt19937 random(7);
    std::string letters;
    for (uint64_t page = 0; page < 100 * kWindowPages; ++page) {
        letters += "PS.w"[random() % 4];
    }
    Mapping mapping(letters);
    mapping.vma.swapPss = mapping.vma.swap;
    const auto runs = mapping.runs();
    EXPECT_LE(runs.size(), 1024U);
    std::map<PageOwner, uint64_t> resident;
    uint64_t swapped = 0;
    uint64_t next = kBase;
    for (const OwnershipRun& run : runs) {
        ASSERT_EQ(run.start, next) << "runs cover the mapping without a gap";
        next = run.end;
        resident[run.owner] += run.resident;
        swapped += run.swapped;
    }
    EXPECT_EQ(next, mapping.vma.end);
    const auto count = [&](char letter) {
        return static_cast<uint64_t>(std::count(letters.begin(), letters.end(), letter));
    };
    EXPECT_EQ(resident[PageOwner::process], count('P'));
    EXPECT_EQ(resident[PageOwner::family], count('S'));
    EXPECT_EQ(resident[PageOwner::none], 0U);
    EXPECT_EQ(swapped, count('w'));
}

TEST(OwnershipRuns, FramesTellGenerationsOfAFamilyApart) {
    FrameGenerations generations;
    // The parent, then a grandchild whose parent had rewritten the last two pages before it forked again.
    EXPECT_EQ(describe(Mapping("SSSS", 100).runs(generations)), "0+4 family 4/0\n");
    Mapping grandchild("SSSS", 100);
    for (const uint64_t page : {2, 3}) {
        grandchild.pages.pages[kBase + page * kPage].word += 1000;
    }
    EXPECT_EQ(describe(grandchild.runs(generations)), "0+2 family 2/0\n2+2 family1 2/0\n");
}

TEST(OwnershipRuns, EachFrameOfAPageHasOneGenerationWhoeverComesFirst) {
    std::mt19937 random(11);
    FrameGenerations generations;
    std::map<std::pair<uint32_t, uint64_t>, uint32_t> generationOf;
    for (int round = 0; round < 2000; ++round) {
        const FrameGenerations::Page page = {static_cast<uint32_t>(random() % 8), 1 + random() % 20};
        uint32_t generation = 0;
        generations.assign(kBase, std::span(&page, 1), std::span(&generation, 1));
        const auto [known, isNew] = generationOf.try_emplace({page.slot, page.frame}, generation);
        ASSERT_EQ(known->second, generation);
    }
    std::set<std::pair<uint32_t, uint32_t>> places;
    for (const auto& [page, generation] : generationOf) {
        EXPECT_TRUE(places.emplace(page.first, generation).second)
            << "two frames in one place would count as one";
    }
}

TEST(OwnershipRuns, HiddenFramesAreOneGenerationAndCountTheirPagesOnce) {
    FrameGenerations generations;
    EXPECT_EQ(describe(Mapping("SSS.").runs(generations)), "0+4 family 3/0\n");
    EXPECT_EQ(describe(Mapping(".SSS").runs(generations)), "0+4 family 3/0\n");
    EXPECT_EQ(generations.pages(), 4U);
}

TEST(ForkFamily, RandomBytesAreFoundInAuxv) {
    const auto entry = [](uint64_t type, uint64_t value) {
        return std::string(reinterpret_cast<const char*>(&type), 8) +
               std::string(reinterpret_cast<const char*>(&value), 8);
    };
    const std::string auxv =
        entry(33, 0x7ffff7fc0000) + entry(16, 3) + entry(25, 0x7ffe12345678) + entry(0, 0);
    EXPECT_EQ(randomBytesAddress(auxv), 0x7ffe12345678U);
    EXPECT_EQ(randomBytesAddress(auxv.substr(0, 40)), std::nullopt);
    EXPECT_EQ(randomBytesAddress(""), std::nullopt);
}

TEST(ForkFamily, AFamilyIsForgottenWithItsLastMember) {
    ForkFamilies families;
    auto first = families.family(5);
    EXPECT_EQ(families.family(5), first);
    EXPECT_NE(families.family(6), first);
    const FrameGenerations::Page old = {0, 77};
    const FrameGenerations::Page now = {0, 78};
    uint32_t generation = 9;
    first->generations().assign(kBase, std::span(&old, 1), std::span(&generation, 1));
    first.reset();
    families.family(5)->generations().assign(kBase, std::span(&now, 1), std::span(&generation, 1));
    EXPECT_EQ(generation, 0);
}

}  // namespace
