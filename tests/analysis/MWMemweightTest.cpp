#include "analysis/MWMemweight.h"

#include <gtest/gtest.h>

#include <set>

#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"
#include "support/FaultyHost.h"
#include "support/RecordingFormatter.h"

namespace {

using Source = std::shared_ptr<FakeProcessSource>;

Source makeProcess(int32_t pid, const std::vector<RegionLine>& lines) {
    return std::make_shared<FakeProcessSource>(pid, "p" + std::to_string(pid), lines);
}

std::unique_ptr<MWMemweight> analyzed(MWProcessList processes) {
    auto memweight = std::make_unique<MWMemweight>(std::move(processes));
    memweight->gatherData();
    memweight->analyzeData();
    return memweight;
}

const MWMemoryObject* objectOf(const Source& process, size_t region) {
    return process->regions.at(region)->memoryObject();
}

/// The members of each group that a process belongs to, in order: "1 | 1 2".
std::string groupsOf(const MWProcessToProcessGroups& groups, int32_t pid) {
    std::string text;
    for (const auto& group : groups.at(pid)) {
        text += text.empty() ? "" : " |";
        for (const MWProcess* process : group->processes()) {
            text += (text.empty() ? "" : " ") + std::to_string(process->pid());
        }
    }
    return text;
}

}  // namespace

TEST(MWMemweight, DoesNotAskAgainWhileAThreadStillWaits) {
    FakeHost inner;
    inner.processes[7] = {.comm = "stuck"};
    inner.processes[8] = {.comm = "other"};
    FaultyHost host(inner, HostFault{{"mach_vm_region_recurse", 7, 1}, FaultKind::hangs});
    const auto measure = [] {
        auto memweight = std::make_unique<MWMemweight>(
            MWProcessList{MWProcess::processWithPid(7), MWProcess::processWithPid(8)});
        EXPECT_FALSE(memweight->gatherData());
        memweight->analyzeData();
        return memweight;
    };
    const std::vector<std::string> notResponding = {"stuck [7]: not responding"};
    EXPECT_EQ(measure()->processes()[0]->errors(), notResponding);
    const uint64_t waited = host.uptimeNanoseconds();
    EXPECT_GE(waited, MWConcurrentQueue::patience);
    EXPECT_EQ(measure()->processes()[0]->errors(), notResponding);
    EXPECT_LT(host.uptimeNanoseconds(), waited + MWConcurrentQueue::patience);
    EXPECT_EQ(inner.asked("mach_vm_region_recurse"), 2) << "the other one, twice";
    host.release();
    EXPECT_TRUE(measure()->processes()[0]->errors().empty()) << "it has answered";
}

TEST(MWMemweight, GathersUnlessCancelled) {
    const FakeHost host;
    const auto high = makeProcess(9, {{.object_id = 1, .dirty = 4096}});
    const auto low = makeProcess(2, {});
    const auto middle = makeProcess(5, {});
    MWMemweight cancelled({high, low, middle});
    EXPECT_EQ(cancelled.gatherStartTime(), std::nullopt);
    cancelled.cancel();
    EXPECT_TRUE(cancelled.gatherData());
    EXPECT_TRUE(cancelled.gatherStartTime() && cancelled.gatherEndTime());
    EXPECT_EQ(low->globalErrors(),
              std::vector<std::string>{"Memweight exited early due to SIGINT and did not "
                                       "finish gathering all data"});
    EXPECT_TRUE(high->globalErrors().empty() && middle->globalErrors().empty());
    cancelled.analyzeData();
    EXPECT_EQ(cancelled.pidToMemweight().at(9), 0U) << "what was not gathered is charged nothing";

    MWMemweight again({high, low, middle});
    EXPECT_FALSE(again.gatherData());
    again.analyzeData();
    EXPECT_EQ(again.pidToMemweight().at(9), 4096U);
}

TEST(MWMemweight, JoinsRegionsOfOneKernelObjectAndKind) {
    const FakeHost host;
    const std::vector<RegionLine> lines = {{.object_id = 77},
                                           {.object_id = 77, .segment = SegmentData},
                                           {.object_id = 77, .segment = SegmentText},
                                           {.object_id = 77, .segment = SegmentLinkedit},
                                           {.object_id = 0},
                                           {.object_id = UINT64_MAX}};
    const auto a = makeProcess(1, lines);
    const auto b = makeProcess(2, lines);
    const auto memweight = analyzed({a, b});
    std::vector<size_t> joined;
    std::set<const MWMemoryObject*> objects;
    for (size_t i = 0; i < lines.size(); ++i) {
        objects.insert({objectOf(a, i), objectOf(b, i)});
        joined.push_back(objectOf(a, i)->memoryRegions().size());
    }
    EXPECT_EQ(joined, (std::vector<size_t>{4, 4, 2, 2, 1, 1})) << "data of an image is ordinary memory";
    EXPECT_EQ(objects.size(), 7U);
    EXPECT_EQ(objectOf(a, 2), objectOf(b, 2));
}

TEST(MWMemweight, JoinsSharedCacheRangesByAddress) {
    const FakeHost host;
    const auto inCache = [](int32_t pid, const RegionLine& own) {
        RegionLine line = own;
        line.object_id = 5;
        line.size = 8192;
        line.start = 0x7000;
        line.inSharedCache = true;
        return makeProcess(pid, {line});
    };
    const auto clean = inCache(1, {.segment = SegmentData});
    const auto dirtyText = inCache(2, {.dirty = 4096, .segment = SegmentText});
    const auto written = inCache(3, {.dirty = 4096, .segment = SegmentData});
    const auto swapped = inCache(4, {.swapped = 4096, .segment = SegmentData});
    const auto translated = inCache(5, {.segment = SegmentData});
    translated->setIsTranslated(true);
    const auto memweight = analyzed({clean, dirtyText, written, swapped, translated});
    EXPECT_EQ(objectOf(clean, 0), objectOf(dirtyText, 0)) << "only written data is a copy";
    EXPECT_EQ(objectOf(clean, 0)->memoryRegions().size(), 2U);
    for (const auto& own : {written, swapped, translated}) {
        EXPECT_EQ(objectOf(own, 0)->memoryRegions().size(), 1U) << own->name();
    }
}

TEST(MWMemweight, ObjectsHaveOwnersOnlyWhileThePhysicalChargeIsBrokenDown) {
    FakeHost host;
    for (const bool breakDown : {false, true}) {
        MWMemweight::setBreakDownPhysMemweight(breakDown);
        EXPECT_EQ(host.selfRegionMemweight, breakDown ? 1 : 0);
        const auto owner = makeProcess(8, {{.object_id = 1, .owned = true}});
        const auto other = makeProcess(9, {{.object_id = 1}});
        const auto memweight = analyzed({owner, other});
        EXPECT_EQ(objectOf(other, 0)->ownerPid(), breakDown ? 8 : -1);
    }
    host.selfRegionMemweightError = ENOENT;
    testing::internal::CaptureStderr();
    MWMemweight::setBreakDownPhysMemweight(true);
    EXPECT_FALSE(MWMemweight::breakDownPhysMemweight());
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

TEST(MWMemweight, ChargesDirtyAndSwappedMemory) {
    const FakeHost host;
    // Both processes map object 1; it counts once in each, and process 4 maps it twice at the same offset.
    const RegionLine shared = {.object_id = 1, .dirty = 8192, .swapped = 4096, .share_mode = SM_SHARED};
    const auto build = [&] {
        const auto hidden = makeProcess(7, {shared});
        hidden->setHiddenFromDisplay(true);
        return MWProcessList{makeProcess(3, {shared, {.object_id = 2, .clean = 4096}}), hidden,
                             makeProcess(4, {shared, shared}), makeProcess(5, {shared})};
    };
    MWMemweight::setBreakDownPhysMemweight(true);
    auto memweight = analyzed(build());
    using Charges = std::map<int32_t, uint64_t>;
    EXPECT_EQ(memweight->pidToMemweight(), (Charges{{3, 12288}, {4, 24576}, {5, 12288}}));
    std::vector<int32_t> order;
    for (const MWProcess* process :
         memweight->_processesBySortingMemweight(memweight->_notHiddenProcesses())) {
        order.push_back(process->pid());
    }
    EXPECT_EQ(order, (std::vector<int32_t>{4, 5, 3})) << "largest first, among equals the higher pid";

    MWMemweight::setBreakDownPhysMemweight(false);
    memweight = analyzed(build());
    EXPECT_EQ(memweight->pidToMemweight(), (Charges{{3, 12288}, {4, 12288}, {5, 12288}}));
    EXPECT_EQ(describe(memweight->_categoriesForAllProcessesShouldSummarize(true)),
              "Heap d8192 s4096 c4096 n6")
        << "each object once, with the regions of hidden processes";
}

TEST(MWMemweight, GroupsObjectsByTheirSharers) {
    const FakeHost host;
    const auto object = [](uint64_t id) { return RegionLine{.object_id = id, .size = 4096}; };
    const auto a = makeProcess(1, {object(1), object(2), object(3), object(5)});
    const auto b = makeProcess(2, {object(2), object(1), object(2), object(5)});
    const auto c = makeProcess(3, {object(5), object(6)});
    const auto hidden = makeProcess(4, {object(3), object(9)});
    hidden->setHiddenFromDisplay(true);
    const auto memweight = analyzed({hidden, c, a, b});
    const auto groups = memweight->_generateProcessToProcessGroups();
    EXPECT_EQ(groups.size(), 3U) << "a hidden process joins no group of memory that has no owner";
    EXPECT_EQ(groupsOf(groups, 1), "1 | 1 2 | 1 2 3");
    EXPECT_EQ(groupsOf(groups, 2), "1 2 | 1 2 3");
    EXPECT_EQ(groupsOf(groups, 3), "3 | 1 2 3");
    const auto& pair = groups.at(2).front();
    EXPECT_EQ(pair, groups.at(1)[1]) << "one group for all its members";
    EXPECT_EQ(pair->objects()->size(), 2U);
}

TEST(MWMemweight, HiddenProcessesShareWhatADisplayedProcessOwnsUnmapped) {
    const FakeHost host;
    MWMemweight::setBreakDownPhysMemweight(true);
    const RegionLine unmapped = {
        .object_id = 1, .name = "owned unmapped memory", .dirty = 4096, .owned = true, .fake = true};
    const auto owner = makeProcess(1, {unmapped, {.object_id = 2, .dirty = 4096, .owned = true}});
    const auto hidden = makeProcess(2, {{.object_id = 1, .name = "Surface", .size = 4096},
                                        {.object_id = 2, .size = 4096},
                                        {.object_id = 3, .dirty = 4096, .owned = true, .fake = true}});
    hidden->setHiddenFromDisplay(true);
    const auto memweight = analyzed({owner, hidden});
    const auto groups = memweight->_generateProcessToProcessGroups();
    EXPECT_EQ(groupsOf(groups, 1), "1 | 1 2") << "the mapped object stays the owner's alone";
    EXPECT_EQ(groups.at(1)[1]->objects()->front().get(), objectOf(owner, 0));
    EXPECT_EQ(describe(memweight->_categoriesForAllProcessesShouldSummarize(true)),
              "Heap d4096 n2; Surface d4096 n2")
        << "what only hidden processes map does not count, the unmapped memory has the mapping's name";
}

TEST(MWMemweight, TablesShowWhatTheProcessSees) {
    const FakeHost host;
    MWMemweight::setBreakDownPhysMemweight(true);
    const RegionLine fileA = {.object_id = 1, .name = "file", .detailedName = "/a", .clean = 4096};
    const RegionLine fileB = {.object_id = 2, .name = "file", .detailedName = "/b", .clean = 4096};
    const auto half = [](uint64_t offset) {
        return RegionLine{
            .object_id = 3, .name = "shm", .dirty = 4096, .offset = offset, .share_mode = SM_SHARED};
    };
    const auto a = makeProcess(1, {fileA, fileB, half(0)});
    const auto b = makeProcess(2, {fileA, half(4096)});
    const auto owner = makeProcess(3, {{.object_id = 4, .name = "own", .dirty = 4096, .owned = true}});
    const auto memweight = analyzed({a, b, owner});
    const auto table = [](const Source& process, const std::vector<const MWMemoryObject*>& objects,
                          bool summarize, MWProcessViewState expected) {
        MWProcessGroup::Objects held;
        for (const MWMemoryObject* object : objects) {
            held.push_back(object->shared_from_this());
        }
        MWProcessViewState state = ProcessViewDiffers;
        const MWCategoryTable categories = MWMemweight::_categoriesForObjects(
            held, {.viewedByProcess = *process, .hasProcessView = &state, .summarize = summarize});
        EXPECT_EQ(state, expected);
        return describe(categories);
    };
    const auto* file = objectOf(a, 0);
    const auto* owned = objectOf(owner, 0);
    EXPECT_EQ(table(a, {file, objectOf(a, 1)}, true, ProcessViewImpossible), "file c8192 n3");
    EXPECT_EQ(table(a, {file, objectOf(a, 1)}, false, ProcessViewImpossible),
              "file /a c4096 n2; file /b c4096 n1");
    EXPECT_EQ(table(a, {objectOf(a, 2), file}, true, ProcessViewDiffers), "file c4096 n2; shm d4096 n1");
    EXPECT_EQ(table(owner, {file, owned}, true, ProcessViewPossible), "file c4096 n2; own d4096 n1");
    EXPECT_EQ(table(a, {owned, file}, true, ProcessViewDiffers), "file c4096 n2; own c4096 n1");
}
