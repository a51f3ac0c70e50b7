#include "output/MWHeapsnapWriter.h"

#include <gtest/gtest.h>

#include "output/MWOutputFile.h"
#include "process/MWHeapsnapProcess.h"
#include "process/MWRecordedProcess.h"
#include "support/FakeHost.h"
#include "support/RecordedTree.h"

namespace {

class HeapsnapWriter : public RecordedTree {
protected:
    FakeHost _host;
};

TEST_F(HeapsnapWriter, ARecordedProcessIsReadBackAsItWas) {
    _host.pageSize = 16384;
    _host.processes[5] = {
        .executable = "/bin/victim",
        .regions = {{.start = 0x10000,
                     .size = 0x8000,
                     .info = {.offset = 3,
                              .user_tag = 2,
                              .pages_resident = 2,
                              .pages_swapped_out = 1,
                              .pages_dirtied = 1,
                              .ref_count = 70000,
                              .external_pager = 1,
                              .share_mode = SM_COW,
                              .pages_reusable = 1,
                              .object_id_full = 0x8000000000000001},
                     .path = "/lib/\xFFnot text"},
                    {.start = 0x20000, .size = 0x4000, .info = {.pages_resident = 1}, .purgeState = 1}},
        .images = {{.path = "/bin/victim",
                    .baseAddress = 0x20000,
                    .segments = {{.name = "__DATA", .start = 0x20000, .length = 0x4000}}}},
        .usage = rusage_info_v5{.ri_phys_memweight = 11, .ri_lifetime_max_phys_memweight = 12}};
    EXPECT_EQ(MWRecordedProcess::processWithPid(4), nullptr);
    const auto process = MWRecordedProcess::processWithPid(5);
    ASSERT_NE(process, nullptr);
    const auto file = MWOutputFile::create(place("out"));
    MWHeapsnapWriter writer(*file, process->identity());
    process->record([&](const HeapsnapRegion& region) { writer.add(region); });
    writer.finish();
    ASSERT_EQ(file->finish(), 0);

    const auto read = MWHeapsnapProcess::processWithHeapsnap(place("out"));
    ASSERT_TRUE(read) << read.error().description.value_or("");
    EXPECT_EQ((*read)->displayString(), "victim [5] (heapsnap)");
    EXPECT_EQ((*read)->pageSize(), 16384U);
    EXPECT_EQ((*read)->phys_memweight(), 11U);
    EXPECT_EQ((*read)->graph().process().physMemweightPeak, 12U);
    (*read)->gatherData();
    const auto& regions = *(*read)->memoryRegions();
    ASSERT_EQ(regions.size(), 2U);
    EXPECT_EQ(regions[0]->fullName(), "mapped file /lib/\\xffnot text");
    EXPECT_EQ(regions[0]->dirtySize(), 16384U);
    EXPECT_EQ(regions[0]->swappedSize(), 16384U);
    EXPECT_EQ(regions[0]->reclaimableSize(), 16384U);
    EXPECT_EQ(regions[0]->object_id(), 0x8000000000000001U);
    EXPECT_EQ(regions[0]->offset(), 3U);
    EXPECT_EQ(regions[1]->fullName(), "__DATA /bin/victim");
    EXPECT_EQ(regions[1]->reclaimableSize(), 16384U) << "as the state of purging says";
}

TEST_F(HeapsnapWriter, AProcessThatEndsOnTheWayIsNoWholeOne) {
    _host.processes[5] = {.executable = "/bin/victim", .walkFailure = MACH_SEND_INVALID_DEST};
    const auto process = MWRecordedProcess::processWithPid(5);
    _host.processes[5].gone = true;
    process->record([](const HeapsnapRegion&) {});
    EXPECT_EQ(process->errors().size(), 1U);
    EXPECT_TRUE(process->warnings().empty());
}

}  // namespace
