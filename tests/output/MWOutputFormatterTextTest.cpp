#include "output/MWOutputFormatterText.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <list>
#include <map>

#include "analysis/MWMemweight.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"

namespace {

/// What `print` writes to a formatter of the style.
template <typename Print>
std::string printed(const MWTextStyle& style, Print&& print) {
    char* text = nullptr;
    size_t length = 0;
    std::FILE* stream = open_memstream(&text, &length);
    MWOutputFormatterText formatter(style, stream);
    print(formatter);
    std::fclose(stream);
    const std::string result(text, length);
    std::free(text);
    return result;
}

const MWTextStyle kFormatted = {
    .summaryFormat = MWSummaryFormat::formatted, .options = 0, .sort = "Dirty", .isForTerminal = true};
const MWTextStyle kBytesWide = {
    .summaryFormat = MWSummaryFormat::bytes, .options = MWTextWide, .sort = "Category"};
const MWTextStyle kPages = {
    .summaryFormat = MWSummaryFormat::pages, .options = MWTextShowSwapped, .sort = "Clean"};

/// The report of a measurement of an editor, and of a shell that shares a library with it.
std::string report(const MWTextStyle& style, bool withShell) {
    const RegionLine library = {
        .object_id = 1, .name = "mapped file", .detailedName = "/usr/lib/libx.so", .clean = 1048576};
    const auto editor = std::make_shared<FakeProcessSource>(
        10, "editor",
        std::vector<RegionLine>{library,
                                {.object_id = 2, .name = "Stack", .dirty = 8193, .wired = true},
                                {.object_id = 3, .name = "Heap", .dirty = 10485760, .swapped = 4096},
                                {.object_id = 4, .name = "page table", .dirty = 4096, .verbose = true}});
    const auto shell = std::make_shared<FakeProcessSource>(
        11, "sh\x1b[31m", std::vector<RegionLine>{library, {.object_id = 5, .reclaimable = 4095}});
    shell->setIs64bit(false);
    shell->setIsTranslated(true);
    shell->_addWarning("slow");
    shell->aux = std::make_shared<MWAuxDataContainer>(MWAuxDataContainer::Elements{
        {"phys", std::make_shared<MWAuxData>(9999, true)}, {"kernel", makeAuxData({{"maps", 10000}})}});
    return printed(style, [&](MWOutputFormatterText& formatter) {
        MWMemweight memweight(withShell ? MWProcessList{editor, shell} : MWProcessList{editor});
        memweight.addOutputFormatter(formatter);
        memweight.gatherData();
        memweight.analyzeData();
        memweight.printOutputVerbose({.verbose = false, .summarize = withShell});
    });
}

}  // namespace

TEST(MWOutputFormatterText, ReportsAreTheseTexts) {
    const FakeHost host;
    const auto expected = [](const std::string& name) {
        std::ifstream file(MEMWEIGHT_REPORTS "/" + name + ".txt");
        return std::string(std::istreambuf_iterator<char>(file), {});
    };
    EXPECT_EQ(report(kBytesWide, false), expected("bytes-wide"));
    EXPECT_EQ(report(kPages, false), expected("pages-swapped"));
    MWMemweight::setBreakDownPhysMemweight(true);
    EXPECT_EQ(report(kFormatted, true), expected("formatted"));
}

TEST(MWOutputFormatterText, SizesAreRoundedAsTheStyleSays) {
    const auto sizes = [](const MWTextStyle& style, const std::vector<uint64_t>& bytes) {
        MWOutputFormatterText formatter(style);
        std::string text;
        for (const uint64_t size : bytes) {
            text += formatter.formattedStringForSize(size) + ", ";
        }
        return text;
    };
    EXPECT_EQ(sizes(kFormatted, {9999, 10000, uint64_t{20} << 40}), "9999 B, 10 KB, 20 TB, ");
    EXPECT_EQ(sizes(kBytesWide, {UINT64_MAX}), "-1 B, ");
    EXPECT_EQ(sizes(kPages, {1}), "0 pages, ") << "no header was printed, so that the page size is unknown";
}

TEST(MWOutputFormatterText, NamesAreShortenedToTheirLastComponent) {
    const MWOutputFormatterText brief(kFormatted);
    const std::map<std::string, std::string> expected = {
        {"/usr/lib//", ".../lib"}, {"main stack", "main stack"}, {"/", "/"}, {"", ""}};
    for (const auto& [name, shortened] : expected) {
        EXPECT_EQ(brief._truncatedNameForString(name), shortened);
    }
    EXPECT_EQ(brief._truncatedNameForString(std::nullopt), std::nullopt);
}

TEST(MWOutputFormatterText, RowsAreSortedByTheColumnAndThenByKey) {
    MWCategoryTable table;
    const auto addRow = [&table](const std::string& key, const MWCategoryTotals& sizes) {
        table[key].setTotalDirtySize(sizes.dirty);
        table[key].setTotalSwappedSize(sizes.swapped);
        table[key].setTotalReclaimableSize(sizes.reclaimable);
        table[key].setTotalCleanSize(sizes.clean);
    };
    addRow("a", {.dirty = 14, .clean = 9, .reclaimable = 9});
    addRow("b", {.dirty = 10, .swapped = 5, .clean = 5, .reclaimable = 1});
    addRow("c", {.dirty = 15, .clean = 4, .reclaimable = 2});
    addRow("d", {.dirty = 12, .swapped = 3, .clean = 7, .reclaimable = 1});
    addRow("E", {.reclaimable = 1});
    table["a"].setTotalWiredSize(1);
    table["d"].setTotalRegions(2);
    const auto order = [&](const char* sort) {
        const MWTextStyle style = {.summaryFormat = MWSummaryFormat::bytes, .options = 0, .sort = sort};
        std::string keys;
        for (const auto* row : MWOutputFormatterText(style)._sortedKeysForCategories(table)) {
            keys += row->first;
        }
        return keys;
    };
    EXPECT_EQ(order("Dirty"), "cdbaE") << "with swapped, then by reclaimable, then by clean";
    EXPECT_EQ(order("Swapped"), "bdEac");
    EXPECT_EQ(order("Clean"), "adbcE");
    EXPECT_EQ(order("Reclaimable"), "acEbd");
    EXPECT_EQ(order("Wired"), "aEbcd");
    EXPECT_EQ(order("Regions"), "dEabc");
    EXPECT_EQ(order("Category"), "Eabcd") << "by character code";
    EXPECT_DEATH(order("dirty"), "Unhandled text sort column");
}

TEST(MWOutputFormatterText, SharersAreListedUpToTwenty) {
    const auto sharersOf = [](int32_t members) {
        std::list<FakeProcessSource> processes;
        MWProcessGroupMinimal group;
        for (int32_t pid = 1; pid <= members; ++pid) {
            group.addProcess(processes.emplace_back(pid, "p"));
        }
        const auto shared = group.immutableCopy();
        const MWSharedCategoriesCall call = {.sharedWith = *shared,
                                             .forProcess = *std::next(processes.begin()),
                                             .hasProcessView = true,
                                             .total = {}};
        const std::string text =
            printed(kFormatted, [&](auto& formatter) { formatter.printSharedCategories({}, call); });
        return text.substr(0, text.find('\n'));
    };
    EXPECT_EQ(sharersOf(2), "Shared with p [1]:");
    EXPECT_EQ(sharersOf(3), "Shared with p [1], p [3]:");
    EXPECT_EQ(sharersOf(20).substr(0, 26), "Shared with p [1], p [3], ");
    EXPECT_EQ(sharersOf(21), "Shared with 21 processes:");
}

TEST(MWOutputFormatterText, ListsProcessesWithWarningsAndErrors) {
    const FakeProcessSource a(1, "a");
    const FakeProcessSource b(2, "b");
    using Processes = std::vector<const MWProcess*>;
    const auto lists = [&](const Processes& failed, const std::vector<std::string>& global) {
        return printed(kFormatted, [&](auto& formatter) {
            formatter.printProcessesWithWarnings({&a},
                                                 {.processesWithErrors = failed, .globalErrors = global});
        });
    };
    const std::string warnings =
        "\nWarnings were encountered while examining the following processes:\n\ta\n";
    EXPECT_EQ(lists({}, {}), warnings);
    EXPECT_EQ(lists({&b, &a}, {"stopped\x1b"}),
              warnings +
                  "\nErrors were encountered while examining the following processes:\n\tb\n\ta\n"
                  "\nErrors were encountered:\n\tstopped\\033\n"
                  "\nDue to errors, summary results may be invalid\n");
}

TEST(MWOutputFormatterText, OneProcessGetsNoSummaryAndEachSampleStartsAnew) {
    const FakeHost host;
    setenv("TZ", "UTC0", 1);
    tzset();
    FakeProcessSource broken(7, "broken");
    broken._addError("vanished");
    broken._addError("again");
    const std::string separator(70, '=');
    const std::string emptyTable =
        "  Dirty      Clean  Reclaimable    Regions    Category\n"
        "    ---        ---          ---        ---    ---\n"
        "    ---        ---          ---        ---    ---\n"
        "    0 B        0 B          0 B          0    TOTAL\n";
    const auto measure = [&](MWOutputFormatterText& formatter, bool withProcess) {
        const MWTime time({.wallSeconds = 0, .wallNanoseconds = 0});
        formatter.startAtTime(time);
        if (withProcess) {
            formatter.printProcessHeader(broken);
            formatter.endProcessHeader(broken);
            formatter.printProcessCategories({}, {});
            formatter.printProcessAuxData(makeAuxData({}));
        }
        formatter.printSummaryCategories({}, {.total = {}, .hadErrors = true});
        formatter.printGlobalAuxData(nullptr);
        formatter.endAtTime(time);
    };
    const std::string single = separator +
                               "\nbroken [7]: 64-bit"
                               "\nErrors were encountered while examining the process. No results gathered.\n"
                               "\tvanished\n\tagain\n" +
                               separator + "\n\n" + emptyTable + "\nAuxiliary data:\n\n";
    const std::string mode = "VM Object Dirty Analysis: Enabled\n";
    EXPECT_EQ(printed(kFormatted, [&](auto& formatter) { measure(formatter, true); }), single + mode);

    const std::string time = "Time: 1970-01-01 00:00:00.000Z\n";
    const std::string summary = separator + "\nSummary Memweight: 0 B (may be invalid due to errors)\n" +
                                separator + "\n\n" + emptyTable + "\n";
    EXPECT_EQ(printed(kFormatted,
                      [&](auto& formatter) {
                          formatter.configureForMultipleOutputs();
                          measure(formatter, true);
                          measure(formatter, false);
                      }),
              time + single + mode + time + mode + summary);
    unsetenv("TZ");
    tzset();
}

TEST(MWOutputFormatterText, RegionsAreListedInPages) {
    FakeProcessSource process(10, "editor\x1b");
    process.setPageSize(16384);
    MWMemoryRegionList regions = {
        makeRegion({.object_id = 0x123456789AB,
                    .name = "mapped file",
                    .detailedName = "/usr/lib/libx.so",
                    .dirty = 0,
                    .swapped = 100,
                    .clean = 16384,
                    .reclaimable = 16385,
                    .size = 16385,
                    .start = 0x7f0000004000,
                    .wired = true}),
        makeRegion({.object_id = 7, .name = "page table", .dirty = 4096, .start = UINT64_MAX}),
    };
    const auto listing = [&](const MWTextStyle& style) {
        return printed(style, [&](MWOutputFormatterText& formatter) {
            formatter.printSpanlistLikeOutputForProcess(process, regions);
        });
    };
    EXPECT_EQ(listing(kFormatted), R"(editor\033 [10]

           start                end  [objectid]      VRT     DRT     CLN     RCL   tag (detail)
      ----------         ----------  ----------    -----   -----   -----   -----   ------------
    7f0000004000 -     7f0000008001 [23456789ab]       2       1       1       2   mapped file .../libx.so
        unmapped -         unmapped [         7]       1       1       0       0   page table

)");
    EXPECT_EQ(listing(kBytesWide), std::string("editor\x1b [10]") + R"(

           start                end  [objectid]      VRT     DRT     SWP     CLN     RCL    WIRE   tag (detail)
      ----------         ----------  ----------    -----   -----   -----   -----   -----   -----   ------------
    7f0000004000 -     7f0000008001 [23456789ab]       2       1       1       1       2       2   mapped file /usr/lib/libx.so
        unmapped -         unmapped [         7]       1       1       0       0       0       0   page table

)");
    process.setPageSize(0);
    EXPECT_NE(listing(kFormatted).find("]       0       0       0       0   page table\n"),
              std::string::npos);
}

TEST(MWOutputFormatterText, AListingShowsTheVerboseRowsFromThenOn) {
    const FakeProcessSource process(10, "editor");
    MWCategoryTable table;
    auto object = std::make_shared<MWMemoryObject>();
    object->addRegion(makeRegion({.object_id = 3, .name = "reserved", .dirty = 4096, .verbose = true}), 4096);
    object->finalize();
    table["reserved"].addMemoryObject(object);
    const auto shows = [&](bool verbose) {
        return printed(kFormatted, [&](MWOutputFormatterText& formatter) {
                   if (verbose) {
                       formatter.printSpanlistLikeOutputForProcess(process, {});
                   }
                   formatter.printProcessHeader(process);
                   formatter.printProcessCategories(table, {});
               }).find("reserved") != std::string::npos;
    };
    EXPECT_FALSE(shows(false));
    EXPECT_TRUE(shows(true));
}
