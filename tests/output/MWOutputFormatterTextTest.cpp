#include "output/MWOutputFormatterText.h"

#include <gtest/gtest.h>

#include <cstdlib>

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

const MWTextStyle kFormatted = {.summaryFormat = MWSummaryFormat::formatted, .options = 0, .sort = "Dirty"};
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

/// A row of these sizes.
MWMemoryCategory category(uint64_t dirty, uint64_t swapped, uint64_t reclaimable, uint64_t clean) {
    MWMemoryCategory row;
    row.setTotalDirtySize(dirty);
    row.setTotalSwappedSize(swapped);
    row.setTotalReclaimableSize(reclaimable);
    row.setTotalCleanSize(clean);
    return row;
}

}  // namespace

TEST(MWOutputFormatterText, ReportsTwoProcesses) {
    const FakeHost host;
    MWMemweight::setBreakDownPhysMemweight(true);
    EXPECT_EQ(report(kFormatted, true),
              R"(======================================================================
editor [10]: 64-bit	Memweight: 10 MB (4096 bytes per page)
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
  10 MB        0 B          0 B          1    Heap
 8193 B        0 B          0 B          1    Stack
    ---        ---          ---        ---    ---
  10 MB        0 B          0 B          3    TOTAL

Shared with sh?[31m [11]:
  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
    0 B    1024 KB          0 B          2    mapped file
    ---        ---          ---        ---    ---
    0 B    1024 KB          0 B          2    TOTAL

======================================================================
sh?[31m [11]: 32-bit (translated)
Warnings were encountered while examining the process.
	slow
	Memweight: 0 B (4096 bytes per page)
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
    0 B        0 B       4095 B          1    Heap
    ---        ---          ---        ---    ---
    0 B        0 B       4095 B          1    TOTAL

Shared with editor [10]:
  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
    0 B    1024 KB          0 B          2    mapped file
    ---        ---          ---        ---    ---
    0 B    1024 KB          0 B          2    TOTAL

Auxiliary data:
	kernel:
		maps: 10 KB
	phys: 9999 B


Warnings were encountered while examining the following processes:
	sh?[31m
======================================================================
Summary Memweight: 10 MB
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
  10 MB        0 B       4095 B          2    Heap
 8193 B        0 B          0 B          1    Stack
    0 B    1024 KB          0 B          2    mapped file
    ---        ---          ---        ---    ---
  10 MB    1024 KB       4095 B          6    TOTAL

Auxiliary data:
	kernel:
		maps: 10 KB
	phys: 9999 B

)");
}

TEST(MWOutputFormatterText, ReportsAllColumnsInBytes) {
    const FakeHost host;
    EXPECT_EQ(report(kBytesWide, false),
              R"(==========================================================================================
editor [10]: 64-bit	Memweight: 10502145 B (4096 bytes per page)
==========================================================================================

      Dirty     (Swapped)         Clean   Reclaimable       (Wired)    Regions    Category
        ---           ---           ---           ---           ---        ---    ---
 10489856 B        4096 B           0 B           0 B           0 B          1    Heap
     8193 B           0 B           0 B           0 B        8193 B          1    Stack
        0 B           0 B     1048576 B           0 B           0 B          1    mapped file /usr/lib/libx.so
        ---           ---           ---           ---           ---        ---    ---
 10502145 B        4096 B     1048576 B           0 B        8193 B          4    TOTAL

VM Object Dirty Analysis: Enabled
)");
}

TEST(MWOutputFormatterText, ReportsPages) {
    const FakeHost host;
    EXPECT_EQ(report(kPages, false),
              R"(================================================================================
editor [10]: 64-bit	Memweight: 2565 pages (4096 bytes per page)
================================================================================

      Dirty     (Swapped)         Clean   Reclaimable    Regions    Category
        ---           ---           ---           ---        ---    ---
    0 pages       0 pages     256 pages       0 pages          1    mapped file .../libx.so
 2561 pages       1 pages       0 pages       0 pages          1    Heap
    3 pages       0 pages       0 pages       0 pages          1    Stack
        ---           ---           ---           ---        ---    ---
 2565 pages       1 pages     256 pages       0 pages          4    TOTAL

VM Object Dirty Analysis: Enabled
)");
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
    EXPECT_EQ(sizes(kFormatted, {0, 9999, 10000, 1048576, 10485760, uint64_t{20} << 40}),
              "0 B, 9999 B, 10 KB, 1024 KB, 10 MB, 20 TB, ");
    EXPECT_EQ(sizes(kBytesWide, {0, 10000, UINT64_MAX}), "0 B, 10000 B, -1 B, ");
    EXPECT_EQ(sizes(kPages, {1}), "0 pages, ") << "no header was printed, so that the page size is unknown";
}

TEST(MWOutputFormatterText, NamesAreShortenedToTheirLastComponent) {
    const MWOutputFormatterText brief(kFormatted);
    const auto truncated = [&](const char* name) { return *brief._truncatedNameForString(name); };
    EXPECT_EQ(truncated("/usr/lib/libx.so"), ".../libx.so");
    EXPECT_EQ(truncated("/usr/lib//"), ".../lib");
    EXPECT_EQ(truncated("main stack"), "main stack");
    EXPECT_EQ(truncated("/"), "/");
    EXPECT_EQ(truncated(""), "");
    EXPECT_EQ(brief._truncatedNameForString(std::nullopt), std::nullopt);
    EXPECT_EQ(MWOutputFormatterText(kBytesWide)._truncatedNameForString("/a/b"), "/a/b");
}

TEST(MWOutputFormatterText, RowsAreSortedByTheColumnAndThenByKey) {
    MWCategoryTable table = {{"a", category(14, 0, 9, 9)},
                             {"b", category(10, 5, 1, 5)},
                             {"c", category(15, 0, 2, 4)},
                             {"d", category(12, 3, 1, 7)},
                             {"E", category(0, 0, 1, 0)}};
    table["a"].setTotalWiredSize(1);
    table["d"].setTotalRegions(2);
    const auto order = [&](const char* sort) {
        const MWTextStyle style = {.summaryFormat = MWSummaryFormat::bytes, .options = 0, .sort = sort};
        std::string keys;
        for (const std::string& key : MWOutputFormatterText(style)._sortedKeysForCategories(table)) {
            keys += key;
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
    EXPECT_EQ(MWSortColumns(), (std::vector<std::string>{"Dirty", "Swapped", "Clean", "Reclaimable", "Wired",
                                                         "Regions", "Category"}));
    EXPECT_DEATH(order("dirty"), "Unhandled text sort column");
}

TEST(MWOutputFormatterText, SharersAreListedUpToTwenty) {
    const auto sharersOf = [](int32_t members, int32_t reported) {
        std::vector<std::unique_ptr<FakeProcessSource>> processes;
        MWProcessGroupMinimal minimal;
        for (int32_t pid = 1; pid <= members; ++pid) {
            processes.push_back(std::make_unique<FakeProcessSource>(pid, "p"));
            minimal.addProcess(*processes.back());
        }
        const std::string text = printed(kFormatted, [&](MWOutputFormatterText& formatter) {
            formatter.printSharedCategories({},
                                            {.sharedWith = *minimal.immutableCopy(),
                                             .forProcess = *processes.at(static_cast<size_t>(reported) - 1),
                                             .hasProcessView = true,
                                             .total = {}});
        });
        return text.substr(0, text.find('\n') + 1);
    };
    EXPECT_EQ(sharersOf(2, 1), "Shared with p [2]:\n");
    EXPECT_EQ(sharersOf(3, 3), "Shared with p [1], p [2]:\n");
    EXPECT_EQ(sharersOf(20, 2).substr(0, 26), "Shared with p [1], p [3], ");
    EXPECT_EQ(sharersOf(21, 2), "Shared with 21 processes:\n");
}

TEST(MWOutputFormatterText, ListsProcessesWithWarningsAndErrors) {
    const FakeProcessSource a(1, "a");
    const FakeProcessSource b(2, "b");
    using Processes = std::vector<const MWProcess*>;
    const auto lists = [](const Processes& warned, const Processes& failed,
                          const std::vector<std::string>& global) {
        return printed(kFormatted, [&](MWOutputFormatterText& formatter) {
            formatter.printProcessesWithWarnings(warned,
                                                 {.processesWithErrors = failed, .globalErrors = global});
        });
    };
    EXPECT_EQ(lists({}, {}, {}), "");
    EXPECT_EQ(lists({&a, &b}, {}, {}),
              "\nWarnings were encountered while examining the following processes:\n\ta\n\tb\n");
    EXPECT_EQ(lists({&a}, {&b}, {"stopped\x1b"}),
              "\nWarnings were encountered while examining the following processes:\n\ta\n"
              "\nErrors were encountered while examining the following processes:\n\tb\n"
              "\nErrors were encountered:\n\tstopped?\n"
              "\nDue to errors, summary results may be invalid\n");
    EXPECT_EQ(lists({}, {}, {"stopped"}),
              "\nErrors were encountered:\n\tstopped\n\nDue to errors, summary results may be invalid\n");
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
