#include "output/MWOutputFormatterJSON.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>

#include "analysis/MWMemweight.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"

namespace {

std::string contentOf(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    EXPECT_TRUE(file) << path;
    return {std::istreambuf_iterator<char>(file), {}};
}

class JSONDocument : public testing::Test {
protected:
    void SetUp() override {
        setenv("TZ", "UTC0", 1);
        tzset();
        MWPhysMemweightSwitch::set(true);
    }
    void TearDown() override {
        std::filesystem::remove(_path);
        unsetenv("TZ");
        tzset();
    }

    static void addMeasurement(MWOutputFormatterJSON& formatter, MWProcessList processes,
                               bool verbose = false) {
        MWMemweight memweight(std::move(processes));
        memweight.addOutputFormatter(formatter);
        memweight.gatherData();
        memweight.analyzeData();
        memweight.printOutputVerbose({.verbose = verbose, .summarize = false});
    }
    std::string document(const MWProcessList& processes, bool verbose = false) {
        const auto formatter = MWOutputFormatterJSON::initWithPath(_path);
        addMeasurement(*formatter, processes, verbose);
        formatter->close();
        return contentOf(_path);
    }

    FakeHost _host;
    std::string _path = testing::TempDir() + "memweight-" + std::to_string(getpid()) + ".json";
};

/// An editor and a shell that share memory of which the shell sees a part, and a file with one more process;
/// and a process with errors.
MWProcessList fourProcesses() {
    const auto memory = [](uint64_t dirty) {
        return RegionLine{.object_id = 1, .name = "shm", .dirty = dirty, .share_mode = SM_SHARED};
    };
    const RegionLine file = {
        .object_id = 4, .name = "mapped file", .detailedName = "/usr/lib/libx.so", .clean = 4096};
    const auto editor = std::make_shared<FakeProcessSource>(
        10, "editor",
        std::vector<RegionLine>{
            memory(8192),
            file,
            {.object_id = 2, .name = "Stack", .dirty = 8192, .swapped = 4096, .wired = true},
            {.object_id = 3, .name = "page table", .dirty = 4096, .verbose = true}});
    editor->aux = std::make_shared<MWAuxDataContainer>(MWAuxDataContainer::Elements{
        {"phys", std::make_shared<MWAuxData>(-5, true)}, {"empty", makeAuxData({})}});
    editor->_addWarning("slow");
    const auto shell =
        std::make_shared<FakeProcessSource>(11, "shell", std::vector<RegionLine>{memory(4096), file});
    const auto other = std::make_shared<FakeProcessSource>(13, "other", std::vector<RegionLine>{file});
    shell->setIsTranslated(true);
    const auto broken = std::make_shared<FakeProcessSource>(12, "broken");
    broken->setPageSize(16384);
    broken->_addError("cannot read");
    broken->_addGlobalError("interrupted");
    return {editor, shell, broken, other};
}

TEST_F(JSONDocument, OneMeasurementMemberByMember) {
    EXPECT_EQ(document(fourProcesses()) + "\n", contentOf(MEMWEIGHT_REPORTS "/four-processes.json"));
}

TEST_F(JSONDocument, RegionsLeaveOutWhatIsNothing) {
    const auto process = std::make_shared<FakeProcessSource>(
        10, "editor",
        std::vector<RegionLine>{{.object_id = UINT64_MAX, .name = "Heap", .size = 8192, .start = UINT64_MAX},
                                {.object_id = 5,
                                 .name = "mapped file",
                                 .detailedName = "/a b",
                                 .dirty = 1,
                                 .swapped = 2,
                                 .clean = 3,
                                 .reclaimable = 4,
                                 .size = 16384,
                                 .start = 4096,
                                 .offset = 12288,
                                 .wired = true}});
    const std::string text = document({process}, true);
    EXPECT_NE(
        text.find(R"("page size":4096,"regions":[{"id":18446744073709551615,"name":"Heap","vsize":8192},)"
                  R"({"id":5,"name":"mapped file /a b","addr":4096,"vsize":16384,"offset":12288,)"
                  R"("dirty":1,"swapped":2,"clean":3,"reclaimable":4,"wired":16384}],"memweight":3,)"),
        std::string::npos)
        << text;
}

TEST_F(JSONDocument, TheOtherModeIsSaidAndNoProcessIsNoError) {
    MWPhysMemweightSwitch::set(false);
    _host.pageSize = 16384;
    const std::string text = document({});
    EXPECT_TRUE(text.starts_with(
        R"({"unit":"byte","bytes per unit":1,"vm_object_dirty_analysis":true,"start_time":{)"));
    EXPECT_NE(text.find(R"("processes":[],"errors":[],"warnings":[],"summary":{"total":{"dirty":0,)"),
              std::string::npos);
    EXPECT_TRUE(text.ends_with(R"(},"page size":16384})")) << text;
}

TEST_F(JSONDocument, SamplesAreWholeMeasurements) {
    const auto formatter = MWOutputFormatterJSON::initWithPath(_path);
    formatter->configureForMultipleOutputs();
    for (int sample = 0; sample < 3; ++sample) {
        addMeasurement(*formatter, fourProcesses());
    }
    formatter->close();
    const auto json = nlohmann::json::parse(contentOf(_path));
    ASSERT_EQ(json["samples"].size(), 3U);
    EXPECT_EQ(json["samples"][2], json["samples"][0]) << "nothing of a measurement is left for the next";
    EXPECT_EQ(json["samples"][0]["shared"].size(), 3U);
    EXPECT_EQ(json["page size"], 4096);
}

TEST_F(JSONDocument, AnyNameGivesAValidDocument) {
    const std::string hostile =
        "a\"b\\c\n\x01\x7f \xff\xc0\xaf \xed\xa0\x80 \xf4\x90\x80\x80 \xe2\x82 \xe2\x82\xac";
    const auto process = std::make_shared<FakeProcessSource>(
        10, hostile,
        std::vector<RegionLine>{{.object_id = 2, .name = hostile, .detailedName = hostile, .dirty = 4096}});
    process->aux = makeAuxData({{hostile, 1}});
    process->_addWarning(hostile);
    const auto json = nlohmann::json::parse(document({process}, true));
    const std::string name = json["processes"][0]["name"];
    EXPECT_EQ(name,
              "a\"b\\c\n\x01\x7f \\xff\\xc0\\xaf \\xed\\xa0\\x80 \\xf4\\x90\\x80\\x80 \\xe2\\x82 \u20ac");
    EXPECT_EQ(json["processes"][0]["regions"][0]["name"], name + " " + name);
}

TEST_F(JSONDocument, FailuresAreTold) {
    testing::internal::CaptureStderr();
    EXPECT_EQ(MWOutputFormatterJSON::initWithPath("/nonexistent/x.json"), nullptr);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "Unable to open JSON writer: No such file or directory\n");

    const auto formatter = MWOutputFormatterJSON::initWithPath("/dev/full");
    ASSERT_NE(formatter, nullptr);
    testing::internal::CaptureStderr();
    addMeasurement(*formatter, fourProcesses());
    formatter->close();
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "memweight: /dev/full: No space left on device\n");
}

}  // namespace
