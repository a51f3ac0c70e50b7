#include "process/MWHeapsnapProcess.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <string>

#include "platform/MWRegionTags.h"
#include "support/FakeHost.h"
#include "support/RecordedTree.h"

namespace {

class Heapsnaps : public RecordedTree {
protected:
    Heapsnaps() {
        _snapshot = {
            {"format", "heapsnap"},
            {"version", 1},
            {"process", {{"pid", 12}, {"name", "Foo"}, {"is64bit", true}, {"description", "X86-64 ARM64"}}},
            {"page_size", 4096},
            {"breakdown", true},
            {"regions", nlohmann::json::array()}};
    }
    auto open() {
        write("a.heapsnap", _snapshot.dump());
        return MWHeapsnapProcess::processWithHeapsnap(place("a.heapsnap"));
    }
    std::shared_ptr<MWHeapsnapProcess> gathered() {
        auto process = open();
        EXPECT_TRUE(process) << process.error().description.value_or("");
        (*process)->gatherData();
        return *process;
    }
    void add(nlohmann::json region) { _snapshot["regions"].push_back(std::move(region)); }
    /// Whether a dirty region at the address is measured by its pages, in bytes, as in the shared cache.
    bool isShared(uint64_t address) {
        _snapshot["regions"] = {
            {{"start", address}, {"length", 4096}, {"type", "__DATA"}, {"dirty", 100}, {"object_id", 7}}};
        return gathered()->memoryRegions()->front()->dirtySize() == 100;
    }

    FakeHost _host;
    nlohmann::json _snapshot;
};

TEST_F(Heapsnaps, IdentityIsTheFilesAndNotThatOfALivingProcess) {
    _host.processes[12] = {.executable = "/bin/other"};
    _snapshot["phys_memweight"] = 77;
    _snapshot["phys_memweight_peak"] = 99;
    const auto process = *open();
    EXPECT_EQ(process->name(), "Foo");
    EXPECT_EQ(process->displayString(), "Foo [12] (heapsnap)");
    EXPECT_EQ(process->pid(), 12);
    EXPECT_TRUE(process->is64bit());
    EXPECT_FALSE(process->isTranslated());
    EXPECT_FALSE(process->_isAlive());
    EXPECT_EQ(process->idleExitStatus(), IdleExitUnknown);
    EXPECT_TRUE(process->breakDownPhysMemweight());
    EXPECT_EQ(process->phys_memweight(), 77U);
    EXPECT_EQ(process->auxData()->jsonRepresentation()["phys_memweight_peak"], 99);
    EXPECT_TRUE(_host.openTasks.empty());
    process->gatherData();
    EXPECT_EQ(_host.asked("proc_pid_rusage"), 0);
    _snapshot["process"]["description"] = "ARM (translated)";
    _snapshot["process"]["is64bit"] = false;
    _snapshot["breakdown"] = false;
    EXPECT_TRUE((*open())->isTranslated());
    EXPECT_FALSE((*open())->is64bit());
    EXPECT_FALSE((*open())->breakDownPhysMemweight());
}

// A living process may have to be joined with it.
TEST_F(Heapsnaps, IsSurveyedLikeALivingProcess) {
    (*open())->prepareToGatherData();
    EXPECT_EQ(_host.savedProcessesSurveyed, 1U);
}

TEST_F(Heapsnaps, TheDescriptionTellsWhereTheSharedCacheLies) {
    struct Case {
        const char* description;
        const char* images;
        uint64_t base;
        uint64_t end;
    };
    const Case cases[] = {
        {"x X86-64 ARM64", "", 0x7FFF00000000, 0x7FFFFFE00000},
        {"X86", "", 0x90000000, 0xB0000000},
        {"ARM64_32", "", 0x1A000000, 0x5A000000},
        {"ARM64 of some kind", "arm64_32", 0x180000000, 0x280000000},
        {"ARM", "arm64_32", 0x1A000000, 0x5A000000},
        {"ARM", "", 0x40000000, 0x80000000},
    };
    for (const Case& c : cases) {
        _snapshot["process"]["description"] = c.description;
        _snapshot["process"]["binary_images"] = c.images;
        EXPECT_TRUE(isShared(c.base)) << c.description;
        EXPECT_TRUE(isShared(c.end - 4096)) << c.description;
        EXPECT_FALSE(isShared(c.base - 4096)) << c.description;
        EXPECT_FALSE(isShared(c.end)) << c.description;
    }
    _snapshot["process"]["description"] = "X86-64";
    _snapshot["process"]["shared_cache"] = false;
    EXPECT_FALSE(isShared(0x7FFF00000000));
}

TEST_F(Heapsnaps, ImagesAreMetWithTheRegions) {
    const auto region = [](uint64_t start, const char* type) {
        return nlohmann::json{{"start", start}, {"length", 4096}, {"type", type}, {"path", "/lib/a"}};
    };
    _snapshot["regions"] = {region(0x1000, "__TEXT"), region(0x2000, "__DATA"), region(0x3000, "heap"),
                            region(0x4000, "stack"), region(0x5000, "__LINKEDIT")};
    _snapshot["regions"][3]["external_pager"] = true;
    const auto process = gathered();
    const auto& regions = *process->memoryRegions();
    ASSERT_EQ(regions.size(), 5U);
    EXPECT_EQ(regions[0]->fullName(), "__TEXT /lib/a");
    EXPECT_EQ(regions[1]->fullName(), "__DATA /lib/a");
    EXPECT_EQ(regions[1]->segment(), SegmentData);
    EXPECT_EQ(regions[2]->segment(), SegmentNotImage);
    EXPECT_EQ(regions[3]->fullName(), "mapped file /lib/a");
    EXPECT_EQ(regions[4]->segment(), SegmentLinkedit);
}

TEST_F(Heapsnaps, NamesThatProgramsGaveKeepTheirMeaning) {
    _host.tagsOfNames["my cache"] = MWTagFirstDynamic + 5;
    _host.tagDescriptions[MWTagFirstDynamic + 5] = "my cache";
    add({{"start", 0x1000}, {"length", 4096}, {"type", "my cache"}, {"user_tag", MWTagFirstDynamic}});
    EXPECT_EQ(gathered()->memoryRegions()->front()->name(), "my cache");
}

TEST_F(Heapsnaps, WhatCannotBeOpenedIsTold) {
    const auto missing = MWHeapsnapProcess::processWithHeapsnap(_top + "/none");
    EXPECT_EQ(missing.error().description, "No such file or directory");
    _snapshot["process"]["description"] = "PDP-11";
    testing::internal::CaptureStderr();
    const auto refused = open();
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "Unable to determine platform architecture of target\n");
    ASSERT_FALSE(refused);
    EXPECT_EQ(refused.error().domain, MemweightErrorDomain);
    EXPECT_EQ(refused.error().code, 2);
    EXPECT_EQ(refused.error().description,
              "Unable to determine platform from heap snapshot process description");
}

// Figures that no process can have do no more harm than being shown.
TEST_F(Heapsnaps, AbsurdFiguresStayFigures) {
    const uint64_t most = UINT64_MAX;
    add({{"start", 0}, {"length", 1}, {"type", "__DATA"}, {"dirty", most}, {"resident", most}});
    add({{"start", 0x7FFF00000001}, {"length", 5}, {"type", "__DATA"}, {"dirty", most}, {"swapped_out", 1}});
    add({{"start", 0x7FFF00000009}, {"length", 0}, {"reusable", most}, {"user_tag", 0xFFFFFFFF}});
    add({{"start", most - 9},
         {"length", 10},
         {"purgeable", 77},
         {"share_mode", 255},
         {"submap", most >> 32U}});
    const auto process = gathered();
    ASSERT_GE(process->memoryRegions()->size(), 3U);
    EXPECT_EQ(process->memoryRegions()->front()->dirtySize(), uint64_t{UINT32_MAX} * 4096);
    EXPECT_EQ(process->memoryRegions()->at(1)->dirtySize(), UINT32_MAX);
}

}  // namespace
