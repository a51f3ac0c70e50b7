#include <gtest/gtest.h>

#include "analysis/MWMemweight.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"
#include "support/RecordingFormatter.h"

namespace {

using Lines = std::vector<std::string>;

std::shared_ptr<FakeProcessSource> makeProcess(int32_t pid, std::string name,
                                               const std::vector<RegionLine>& lines) {
    return std::make_shared<FakeProcessSource>(pid, std::move(name), lines);
}

/// What the first of two formatters is called with; the second one must be called with the same.
Lines callsFor(MWProcessList processes, MWMemweight::OutputForm form) {
    Lines calls;
    Lines callsOfSecond;
    RecordingFormatter formatter(calls);
    RecordingFormatter second(callsOfSecond);
    MWMemweight memweight(std::move(processes));
    memweight.addOutputFormatter(formatter);
    memweight.addOutputFormatter(second);
    memweight.gatherData();
    memweight.analyzeData();
    memweight.printOutputVerbose(form);
    EXPECT_EQ(calls, callsOfSecond);
    return calls;
}

}  // namespace

TEST(MWMemweightOutput, DrivesEveryFormatterStepByStep) {
    const FakeHost host;
    const RegionLine library = {.object_id = 1, .name = "lib", .clean = 4096};
    const auto editor = makeProcess(10, "editor", {library, {.object_id = 2, .dirty = 4096}});
    editor->_addWarning("slow");
    editor->aux = makeAuxData({{"phys", 3}});
    const auto shell = makeProcess(11, "shell", {library, {.object_id = 3, .dirty = 8192, .swapped = 4096}});
    shell->aux = makeAuxData({{"phys", 4}});
    EXPECT_EQ(
        callsFor({editor, shell}, {.verbose = true, .summarize = true}),
        (Lines{"start 1000", "listing shell 2", "listing editor 2", "header shell [11]",
               "total 12288 of shell [11]", "endHeader shell [11]",
               "private {Heap d8192 s4096 n1} = d8192 s4096 n1",
               "shared editor shell for shell {lib c4096 n2} = c4096 n2", "aux phys=4", "header editor [10]",
               "total 4096 of editor [10]", "endHeader editor [10]", "private {Heap d4096 n1} = d4096 n1",
               "shared editor shell for editor {lib c4096 n2} = c4096 n2", "aux phys=3",
               "warnings editor, errors",
               "summary {Heap d12288 s4096 n2; lib c4096 n2} = d12288 s4096 c4096 n4", "globalAux phys=7",
               "end 1000"}));
}

TEST(MWMemweightOutput, ProcessesWithErrorsGetAnEmptyTableAndSpoilTheSummary) {
    const FakeHost host;
    const auto broken = makeProcess(9, "broken", {{.object_id = 1, .dirty = 8192}});
    broken->_addError("vanished");
    broken->aux = makeAuxData({{"phys", 100}});
    const auto bare = makeProcess(8, "bare", {});
    bare->_addGlobalError("stopped");
    const auto hidden = makeProcess(7, "hidden", {});
    hidden->setHiddenFromDisplay(true);
    hidden->_addGlobalError("unseen");
    hidden->_addError("unseen");
    EXPECT_EQ(callsFor({broken, bare, hidden}, {.verbose = false, .summarize = true}),
              (Lines{"start 1000", "header broken [9]", "endHeader broken [9]", "private {} = 0",
                     "aux phys=100", "header bare [8]", "total 0 of bare [8]", "endHeader bare [8]",
                     "private {} = 0", "aux none", "warnings, errors broken, global stopped",
                     "summary {Heap d8192 n1} = d8192 n1 with errors", "globalAux none", "end 1000"}));
}

TEST(MWMemweightOutput, SharedTablesShowEachProcessItsOwnView) {
    const FakeHost host;
    const auto half = [](int32_t pid, uint64_t offset) {
        return makeProcess(
            pid, "p" + std::to_string(pid),
            {{.object_id = 3, .name = "shm", .dirty = 4096, .offset = offset, .share_mode = SM_SHARED}});
    };
    Lines calls = callsFor({half(1, 0), half(2, 4096), half(3, 0)}, {.verbose = false, .summarize = false});
    std::erase_if(calls, [](const std::string& call) { return !call.starts_with("shared"); });
    EXPECT_EQ(calls, (Lines{"shared p1 p2 p3 for p3 own view {shm d4096 n1} = d4096 n1",
                            "shared p1 p2 p3 for p2 own view {shm d4096 n1} = d4096 n1",
                            "shared p1 p2 p3 for p1 own view {shm d4096 n1} = d4096 n1"}));
}

namespace {

/// Renames the shared region when it has seen a table of it, so that a table which is built again has
/// another key.
class RenamingFormatter : public RecordingFormatter {
public:
    RenamingFormatter(Lines& log, MWMemoryRegion& region) : RecordingFormatter(log), _region(region) {}
    void printSharedCategories(const MWCategoryTable& categories,
                               const MWSharedCategoriesCall& call) override {
        EXPECT_FALSE(call.hasProcessView);
        (categories.contains("renamed") ? _renamed : _original) += 1;
        _region.setName("renamed");
    }
    int _original = 0;
    int _renamed = 0;

private:
    MWMemoryRegion& _region;
};

}  // namespace

TEST(MWMemweightOutput, TablesOfLargeGroupsAreBuiltOnce) {
    const FakeHost host;
    for (const auto& [members, builtAgain] : {std::pair(25, 24), std::pair(26, 0)}) {
        MWProcessList processes;
        for (int32_t pid = 1; pid < members; ++pid) {
            processes.push_back(makeProcess(pid, "p", {{.object_id = 1, .clean = 4096}}));
        }
        const auto first = makeProcess(members, "p", {{.object_id = 1, .clean = 4096}});
        processes.insert(processes.begin(), first);
        Lines calls;
        RenamingFormatter formatter(calls, *first->regions.front());
        MWMemweight memweight(processes);
        memweight.addOutputFormatter(formatter);
        memweight.gatherData();
        memweight.analyzeData();
        memweight.printOutputVerbose({.verbose = false, .summarize = true});
        EXPECT_EQ(formatter._renamed, builtAgain) << members;
        EXPECT_EQ(formatter._original, members - builtAgain) << members;
    }
}

TEST(MWMemweightOutput, AFailingClockStillGivesAReport) {
    FakeHost host;
    host.clockFails = true;
    EXPECT_EQ(callsFor({}, {.verbose = true, .summarize = true}),
              (Lines{"start 0", "warnings, errors", "summary {} = 0", "globalAux none", "end 0"}));
}
