#include <gtest/gtest.h>

#include "analysis/MWMemweight.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"
#include "support/RecordingFormatter.h"

namespace {

using Lines = std::vector<std::string>;
using Source = std::shared_ptr<FakeProcessSource>;

Source makeProcess(int32_t pid, std::string name, const std::vector<RegionLine>& lines) {
    return std::make_shared<FakeProcessSource>(pid, std::move(name), lines);
}

Lines callsFor(MWProcessList processes, MWMemweight::OutputForm form) {
    Lines calls;
    RecordingFormatter formatter("f", calls);
    MWMemweight memweight(std::move(processes));
    memweight.addOutputFormatter(formatter);
    memweight.gatherData();
    memweight.analyzeData();
    memweight.printOutputVerbose(form);
    return calls;
}

}  // namespace

TEST(MWMemweightOutput, DrivesEveryFormatterStepByStep) {
    FakeHost host;
    const RegionLine library = {.object_id = 1, .name = "lib", .detailedName = "/l", .clean = 4096};
    const auto editor = makeProcess(10, "editor", {library, {.object_id = 2, .dirty = 4096}});
    editor->_addWarning("slow");
    editor->aux = makeAuxData({{"phys", 3}});
    const auto shell = makeProcess(11, "shell", {library, {.object_id = 3, .dirty = 8192, .swapped = 4096}});
    shell->aux = makeAuxData({{"phys", 4}});
    Lines calls;
    RecordingFormatter first("a", calls);
    RecordingFormatter second("b", calls);
    MWMemweight memweight({editor, shell});
    memweight.addOutputFormatter(first);
    memweight.addOutputFormatter(second);
    memweight.gatherData();
    memweight.analyzeData();
    memweight.printOutputVerbose({.verbose = true, .summarize = true});
    EXPECT_EQ(calls, (Lines{"a: start 1000",
                            "b: start 1000",
                            "a: listing shell 2",
                            "b: listing shell 2",
                            "a: listing editor 2",
                            "b: listing editor 2",
                            "a: header shell [11]",
                            "a: total 12288 of shell [11]",
                            "a: endHeader shell [11]",
                            "b: header shell [11]",
                            "b: total 12288 of shell [11]",
                            "b: endHeader shell [11]",
                            "a: private {Heap d8192 s4096 n1} = d8192 s4096 n1",
                            "b: private {Heap d8192 s4096 n1} = d8192 s4096 n1",
                            "a: shared editor shell for shell {lib c4096 n2} = c4096 n2",
                            "b: shared editor shell for shell {lib c4096 n2} = c4096 n2",
                            "a: aux phys=4",
                            "b: aux phys=4",
                            "a: header editor [10]",
                            "a: total 4096 of editor [10]",
                            "a: endHeader editor [10]",
                            "b: header editor [10]",
                            "b: total 4096 of editor [10]",
                            "b: endHeader editor [10]",
                            "a: private {Heap d4096 n1} = d4096 n1",
                            "b: private {Heap d4096 n1} = d4096 n1",
                            "a: shared editor shell for editor {lib c4096 n2} = c4096 n2",
                            "b: shared editor shell for editor {lib c4096 n2} = c4096 n2",
                            "a: aux phys=3",
                            "b: aux phys=3",
                            "a: warnings editor, errors",
                            "b: warnings editor, errors",
                            "a: summary {Heap d12288 s4096 n2; lib c4096 n2} = d12288 s4096 c4096 n4",
                            "a: globalAux phys=7",
                            "a: end 1000",
                            "b: summary {Heap d12288 s4096 n2; lib c4096 n2} = d12288 s4096 c4096 n4",
                            "b: globalAux phys=7",
                            "b: end 1000"}));
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
    EXPECT_EQ(
        callsFor({broken, bare, hidden}, {.verbose = false, .summarize = true}),
        (Lines{"f: start 1000", "f: header broken [9]", "f: endHeader broken [9]", "f: private {} = 0",
               "f: aux phys=100", "f: header bare [8]", "f: total 0 of bare [8]", "f: endHeader bare [8]",
               "f: private {} = 0", "f: aux none", "f: warnings, errors broken, global stopped",
               "f: summary {Heap d8192 n1} = d8192 n1 with errors", "f: globalAux none", "f: end 1000"}));
}

TEST(MWMemweightOutput, SharedTablesShowEachProcessItsOwnView) {
    const FakeHost host;
    const auto half = [](uint64_t offset) {
        return RegionLine{.object_id = 3,
                          .name = "shm",
                          .detailedName = "/dev/shm/x",
                          .dirty = 4096,
                          .offset = offset,
                          .share_mode = SM_SHARED};
    };
    const Lines calls = callsFor(
        {makeProcess(1, "a", {half(0)}), makeProcess(2, "b", {half(4096)}), makeProcess(3, "c", {half(0)})},
        {.verbose = false, .summarize = false});
    Lines tables;
    for (const auto& call : calls) {
        if (call.find("{") != std::string::npos) {
            tables.push_back(call);
        }
    }
    EXPECT_EQ(tables, (Lines{"f: shared a b c for c own view {shm /dev/shm/x d4096 n1} = d4096 n1",
                             "f: shared a b c for b own view {shm /dev/shm/x d4096 n1} = d4096 n1",
                             "f: shared a b c for a own view {shm /dev/shm/x d4096 n1} = d4096 n1",
                             "f: summary {shm /dev/shm/x d8192 n3} = d8192 n3"}));
}

namespace {

/// Renames the shared region when it has seen the first table of it, so that a table which is built again
/// has another key.
class RenamingFormatter : public RecordingFormatter {
public:
    RenamingFormatter(std::vector<std::string>& log, MWMemoryRegion& region)
        : RecordingFormatter("f", log), _region(region) {}
    void printSharedCategories(const MWCategoryTable& categories,
                               const MWSharedCategoriesCall& call) override {
        RecordingFormatter::printSharedCategories(categories, call);
        EXPECT_FALSE(call.hasProcessView);
        (categories.contains("original") ? _original : _renamed) += 1;
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
    for (const auto& [members, built] : {std::pair(25, 24), std::pair(26, 0), std::pair(30, 0)}) {
        MWProcessList processes;
        for (int32_t pid = 1; pid <= members; ++pid) {
            processes.push_back(makeProcess(pid, "p" + std::to_string(pid),
                                            {{.object_id = 1, .name = "original", .clean = 4096}}));
        }
        Lines calls;
        RenamingFormatter formatter(calls,
                                    *dynamic_cast<FakeProcessSource&>(*processes.front()).regions.front());
        MWMemweight memweight(processes);
        memweight.addOutputFormatter(formatter);
        memweight.gatherData();
        memweight.analyzeData();
        memweight.printOutputVerbose({.verbose = false, .summarize = true});
        EXPECT_EQ(formatter._renamed, built) << members;
        EXPECT_EQ(formatter._original, members - built) << members;
    }
}

TEST(MWMemweightOutput, AFailingClockStillGivesAReport) {
    FakeHost host;
    host.clockFails = true;
    EXPECT_EQ(
        callsFor({}, {.verbose = true, .summarize = true}),
        (Lines{"f: start 0", "f: warnings, errors", "f: summary {} = 0", "f: globalAux none", "f: end 0"}));
}
