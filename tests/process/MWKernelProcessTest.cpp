#include "process/MWKernelProcess.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <string>
#include <utility>
#include <vector>

#include "platform/MWKernelTags.h"
#include "support/FakeHost.h"

namespace {

mach_memory_info_t site(uint64_t flags, uint64_t number, uint64_t size, const std::string& name = "") {
    mach_memory_info_t record = {};
    record.flags = flags;
    record.site = number;
    record.size = size;
    std::copy_n(name.begin(), std::min<size_t>(name.size(), 80), record.name.begin());
    return record;
}

mach_memory_info_t counter(uint64_t number, uint64_t mapped) {
    mach_memory_info_t record = site(MWSiteCounter, number, 999);
    record.mapped = mapped;
    return record;
}

class KernelProcess : public testing::Test {
protected:
    void gather() {
        _process = std::dynamic_pointer_cast<MWKernelProcess>(MWProcess::processWithPid(0));
        ASSERT_NE(_process, nullptr);
        testing::internal::CaptureStderr();
        _process->gatherData();
        _messages = testing::internal::GetCapturedStderr();
    }
    const MWMemoryRegion& region(size_t index) const { return *_process->memoryRegions()->at(index); }
    std::vector<std::string> names() const {
        std::vector<std::string> names;
        for (const auto& region : *_process->memoryRegions()) {
            names.push_back(region->fullName());
        }
        return names;
    }
    nlohmann::json counters() const { return _process->auxData()->jsonRepresentation(); }

    void SetUp() override {
        _host.processes[0] = {.parent = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM};
        _host.pageSize = 16384;
    }

    FakeHost _host;
    std::shared_ptr<MWKernelProcess> _process;
    std::string _messages;
};

TEST_F(KernelProcess, IsAProcessWithoutATask) {
    gather();
    EXPECT_EQ(_process->displayString(), "kernel [0]");
    EXPECT_EQ(_process->pageSize(), 16384U);
    EXPECT_EQ(_process->idleExitStatus(), IdleExitIneligible);
    EXPECT_TRUE(_process->_isAlive());
    EXPECT_TRUE(_host.openTasks.empty());
    EXPECT_TRUE(_process->memoryRegions()->empty());
    EXPECT_EQ(counters(), nlohmann::json::parse(R"({"Maps": {}})"));
}

TEST_F(KernelProcess, ZonesKeepWhatIsInUse) {
    const std::string longest(80, 'z');
    _host.kernelZones = {
        {"fixed", {.mzi_count = 1, .mzi_cur_size = 8192, .mzi_elem_size = 64}},
        {"collected", {.mzi_count = 10, .mzi_cur_size = 8192, .mzi_elem_size = 64, .mzi_collectable = 1}},
        {"", {.mzi_count = 1000, .mzi_cur_size = 100, .mzi_elem_size = 1, .mzi_collectable = 7}},
        {longest, {}},
    };
    gather();
    EXPECT_EQ(names(), (std::vector<std::string>{"fixed", "collected", "unknown", longest}));
    EXPECT_EQ(region(0).dirtySize(), 8192U);
    EXPECT_EQ(region(0).reclaimableSize(), 0U);
    EXPECT_EQ(region(1).dirtySize(), 640U);
    EXPECT_EQ(region(1).reclaimableSize(), 8192U - 640U);
    EXPECT_EQ(region(2).reclaimableSize(), 0U) << "more in use than the zone holds";
    EXPECT_EQ(region(1).size(), 8192U);
    EXPECT_EQ(region(1).object_id(), 0x200000001U);
    EXPECT_FALSE(region(1).wired());
}

TEST_F(KernelProcess, SitesAreDirtyUnlessSomebodyElseIsCharged) {
    struct Case {
        uint64_t flags;
        uint64_t number;
        bool isDirty;
        const char* name;
    };
    const Case cases[] = {
        {MWSiteWired, MWKernelTagPerCpu, true, "VM_KERN_MEMORY_PERCPU"},
        {0, MWKernelTagPerCpu, false, "VM_KERN_MEMORY_PERCPU"},
        {MWSiteWired | MWSiteZone, MWKernelTagPerCpu, false, "VM_KERN_MEMORY_PERCPU[zone]"},
        {MWSiteWired | MWSiteHidden, MWKernelTagPerCpu, false, "VM_KERN_MEMORY_PERCPU (hidden)"},
        {MWSiteWired, MWKernelTagUserWired, false, "VM_KERN_MEMORY_MLOCK (user wired)"},
        {MWSiteWired | MWSiteHidden, MWKernelTagUserWired, false, "VM_KERN_MEMORY_MLOCK (hidden)"},
    };
    _host.kernelZones = {{"zone", {}}};
    _host.kernelRecords = {site(MWSiteWired, 0, 0)};  // nothing at all
    for (const Case& expected : cases) {
        _host.kernelRecords.push_back(site(expected.flags, expected.number, 4096));
    }
    gather();
    ASSERT_EQ(_process->memoryRegions()->size(), 1 + std::size(cases));
    for (size_t index = 0; index < std::size(cases); ++index) {
        const MWMemoryRegion& made = region(1 + index);
        EXPECT_EQ(made.dirtySize(), cases[index].isDirty ? 4096U : 0U) << index;
        EXPECT_EQ(made.cleanNonSpecSize(), cases[index].isDirty ? 0U : 4096U) << index;
        EXPECT_EQ(made.wired(), (cases[index].flags & MWSiteWired) != 0) << index;
        EXPECT_EQ(made.size(), 4096U);
        EXPECT_EQ(made.user_tag(), index + 1) << "its place among the records";
        EXPECT_EQ(made.object_id(), 0x100000001U + index);
        EXPECT_EQ(made.fullName(), cases[index].name);
    }
}

TEST_F(KernelProcess, SitesAreNamedByTheirType) {
    _host.kernelZones = {{"zone", {}}};
    _host.kernelExtensions = {{.OSBundleLoadTag = 7, .bundleIdentifier = "filesystem"}};
    _host.kernelSymbols[0xFFFF1000] = "do_fork";
    _host.kernelLocations[0xFFFF1000] = {.path = "kernel/fork.c", .line = 12};
    _host.kernelLocations[5] = {.path = "not/code.c", .line = 1};
    mach_memory_info_t outOfRange = site(MWSiteWired | MWSiteZone, 5, 1);
    outOfRange.zone = 1;
    const std::string longest(80, 'n');
    const std::pair<mach_memory_info_t, const char*> cases[] = {
        {site(MWSiteWired, 0, 1), "VM_KERN_MEMORY_NONE"},
        {site(MWSiteWired, 28, 1), "VM_KERN_MEMORY_FILE_SYSTEM"},
        {site(MWSiteWired, 29, 1), "VM_KERN_MEMORY_29"},
        {site(MWSiteWired, 30, 1), "VM_KERN_MEMORY_DRIVER"},
        {site(MWSiteWired, 255, 1), "VM_KERN_MEMORY_ANY"},
        {site(MWSiteWired, 300, 1), "VM_KERN_MEMORY_300"},
        {outOfRange, "VM_KERN_MEMORY_PERCPU"},
        {site(MWSiteWired | MWSiteExtension, 7, 1), "filesystem"},
        {site(MWSiteWired | MWSiteExtension, 8, 1), "unloaded kmod 8"},
        {site(MWSiteWired | MWSiteKernel, 0xFFFF1000, 1), "do_fork (kernel/fork.c:12)"},
        {site(MWSiteWired | MWSiteKernel, 0xFFFF2000, 1), "site 0xffff2000"},
        {site(MWSiteWired | MWSiteKernel, 0, 1), "site 0x0"},
        {site(MWSiteWired | MWSiteCounter, 4, 1), "VM_KERN_COUNT_USER"},
        {site(MWSiteZone | MWSiteCounter, 12, 1), "VM_KERN_COUNT_12[zone]"},
        {site(MWSiteWired | 9, 0x20, 1), "unknown site (0x9, 0x20)"},
        {site(MWSiteWired | MWSiteNamed | MWSiteKernel, 0xFFFF1000, 1, "vmap"), "vmap (kernel/fork.c:12)"},
        {site(MWSiteWired | MWSiteNamed, 5, 1, longest), longest.c_str()},
        {site(MWSiteWired | MWSiteNamed, 5, 1, "broken \xFF"), "VM_KERN_MEMORY_PERCPU"},
        {site(MWSiteWired | MWSiteNamed, 5, 1), "VM_KERN_MEMORY_PERCPU"},
        {site(MWSiteWired | MWSiteNamed | MWSiteZone, 5, 1, "named"), "named[zone]"},
    };
    for (const auto& [record, name] : cases) {
        _host.kernelRecords.push_back(record);
    }
    gather();
    ASSERT_EQ(names().size(), 1 + std::size(cases));
    for (size_t index = 0; index < std::size(cases); ++index) {
        EXPECT_EQ(names()[1 + index], cases[index].second) << index;
    }
}

TEST_F(KernelProcess, CountersAreNoMemory) {
    _host.kernelRecords = {counter(4, 1000), counter(0, 0), counter(1, 0), counter(12, 5), counter(4, 2000)};
    gather();
    EXPECT_TRUE(_process->memoryRegions()->empty());
    const auto maps = counters()["Maps"];
    EXPECT_EQ(maps.size(), 3U) << maps;
    EXPECT_EQ(maps["VM_KERN_COUNT_USER"], 2000) << "the later one of a name";
    EXPECT_EQ(maps["VM_KERN_COUNT_FREE"], 0);
    EXPECT_EQ(maps["VM_KERN_COUNT_12"], 5);
    EXPECT_EQ(_process->auxData()->mergeWithData(nullptr), nullptr) << "not added up over processes";
}

TEST_F(KernelProcess, GatheringAgainAsksAnew) {
    _host.kernelZones = {{"zone", {}}};
    _host.kernelRecords = {counter(1, 1)};
    gather();
    _host.kernelZones = {{"other", {}}, {"third", {}}};
    _host.kernelRecords = {counter(2, 1)};
    _process->gatherData();
    EXPECT_EQ(names(), (std::vector<std::string>{"other", "third"}));
    EXPECT_EQ(counters()["Maps"].size(), 1U);
    EXPECT_TRUE(counters()["Maps"].contains("VM_KERN_COUNT_PER_CPU_FREE"));
}

TEST_F(KernelProcess, FailuresAreTold) {
    _host.kernelMemoryResult = KERN_FAILURE;
    gather();
    EXPECT_EQ(_messages, "kernel [0]: mach_memory_info: code 5\n");
    EXPECT_EQ(_process->errors(), std::vector<std::string>{"kernel [0]: code 5"});
    EXPECT_FALSE(_process->memoryRegions());

    _host.kernelMemoryResult = KERN_SUCCESS;
    _host.deallocationResult = KERN_INVALID_ARGUMENT;
    _host.kernelZones = {{"zone", {}}};
    _host.kernelRecords = {counter(1, 1), counter(2, 1)};
    gather();
    EXPECT_EQ(_messages,
              "kernel [0]: vm_deallocate: code 4\nkernel [0]: vm_deallocate: code 4\n"
              "kernel [0]: vm_deallocate: code 4\n");
    EXPECT_EQ(_host.deallocated, (std::vector<size_t>{64, 80, 2 * 176}));
    EXPECT_TRUE(_process->errors().empty());
    EXPECT_TRUE(_process->memoryRegions());
}

}  // namespace
