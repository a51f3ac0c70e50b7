#include "output/MWOutputFormatterStatpack.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <limits>
#include <nlohmann/json.hpp>

#include "analysis/MWMemweight.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "support/FakeHost.h"
#include "support/FakeProcessSource.h"

namespace {

class StatpackFile : public testing::Test {
protected:
    void SetUp() override { MWPhysMemweightSwitch::set(true); }
    void TearDown() override { std::filesystem::remove(_path); }

    std::string content() const {
        std::ifstream file(_path, std::ios::binary);
        return {std::istreambuf_iterator<char>(file), {}};
    }

    FakeHost _host;
    std::string _path = testing::TempDir() + "memweight-" + std::to_string(getpid()) + ".spj";
};

MWCategoryTable tableOf(const std::vector<RegionLine>& lines) {
    MWCategoryTable table;
    for (const RegionLine& line : lines) {
        auto object = std::make_shared<MWMemoryObject>();
        object->addRegion(makeRegion(line), 4096);
        object->finalize();
        table[line.name].addMemoryObject(object);
    }
    return table;
}

MWTime timeAt(uint64_t nanoseconds) {
    return MWTime({.continuousTicks = nanoseconds});
}

void addMeasurement(MWOutputFormatterStatpack& formatter) {
    const FakeProcessSource editor(10, "editor");
    const FakeProcessSource broken(12, "broken");
    const MWCategoryTotals none;
    const MWProcessGroup group;
    formatter.startAtTime(timeAt(1000000000));
    formatter.printProcessHeader(editor);
    formatter.printProcessTotal(17, editor);
    formatter.endProcessHeader(editor);
    formatter.printProcessCategories(tableOf({{.object_id = 1, .name = "Heap", .dirty = 10, .swapped = 2}}),
                                     none);
    formatter.printSharedCategories(
        tableOf({{.object_id = 2, .name = "Heap", .dirty = 5}}),
        {.sharedWith = group, .forProcess = editor, .hasProcessView = false, .total = none});
    formatter.printProcessAuxData(std::make_shared<MWAuxDataContainer>(
        MWAuxDataContainer::Elements{{"a", makeAuxData({{"b", -7}})}, {"empty", makeAuxData({})}}));
    formatter.printProcessHeader(broken);
    formatter.printProcessCategories({}, none);
    formatter.printProcessAuxData(nullptr);
    formatter.printSummaryCategories(tableOf({{.object_id = 1, .name = "Heap", .dirty = 10, .swapped = 7}}),
                                     {.total = {.dirty = 10, .swapped = 7}, .hadErrors = true});
    formatter.printGlobalAuxData(nullptr);
    formatter.endAtTime(timeAt(3499999999));
}

TEST_F(StatpackFile, GroupsOfOneMeasurementValueByValue) {
    const auto formatter = MWOutputFormatterStatpack::initWithPath(_path);
    EXPECT_EQ(content(), "") << "the recording is written with the first group";
    addMeasurement(*formatter);
    EXPECT_EQ(
        content(),
        R"({"statpack":1,"name":"memweight.phys_memweight","description":"Memory measurements gathered by the memweight(1) tool","primary_metric":"total_memory,process=ALL_PROCESSES"}
{"group":0,"metric":"total_memory","unit":"B","value":17,"variables":{"process":"editor"},"labels":{"pid":"10"},"tags":["summary"]}
{"group":0,"metric":"Heap","unit":"B","value":17,"variables":{"process":"editor"},"labels":{},"tags":[]}
{"group":0,"metric":"aux_data.a.b","unit":"B","value":-7,"variables":{"process":"editor"},"labels":{},"tags":["context"]}
{"group":1,"metric":"aux_data","unit":"B","value":0,"variables":{"process":"broken"},"labels":{},"tags":["context"]}
{"group":2,"metric":"total_memory","unit":"B","value":17,"variables":{"process":"ALL_PROCESSES"},"labels":{},"tags":["summary"]}
{"group":2,"metric":"Heap","unit":"B","value":17,"variables":{"process":"ALL_PROCESSES"},"labels":{},"tags":[]}
{"group":2,"metric":"aux_data","unit":"B","value":0,"variables":{"process":"ALL_PROCESSES"},"labels":{},"tags":["context"]}
{"group":2,"metric":"gather_duration","unit":"ms","value":2499,"variables":{},"labels":{},"tags":["context"]}
)") << "whole with the end of the measurement, whatever becomes of the program";
    const std::string measured = content();
    formatter->close();
    EXPECT_EQ(content(), measured);
}

TEST_F(StatpackFile, MeasurementsFollowEachOther) {
    MWPhysMemweightSwitch::set(false);
    const auto formatter = MWOutputFormatterStatpack::initWithPath(_path);
    formatter->configureForMultipleOutputs();
    for (int sample = 0; sample < 3; ++sample) {
        addMeasurement(*formatter);
    }
    formatter->close();
    std::ifstream file(_path);
    std::string line;
    std::getline(file, line);
    EXPECT_EQ(nlohmann::json::parse(line)["name"], "memweight.vm_object_dirty");
    std::vector<int> groupsOfDurations;
    while (std::getline(file, line)) {
        const auto value = nlohmann::json::parse(line);
        if (value["metric"] == "gather_duration") {
            groupsOfDurations.push_back(value["group"]);
        }
    }
    EXPECT_EQ(groupsOfDurations, (std::vector<int>{2, 5, 8}));
}

TEST_F(StatpackFile, NumbersAndTextsReadBackAsTheyWere) {
    const std::vector<double> numbers = {0.1, -0.0, 1e300, 9007199254740991.0, 1.5e-7, 123456789.25};
    auto writer = spwriter_open(_path, "a\"\n\xff", 1, 0);
    spwriter_new_value(*writer, "of no group", spunit_ms, 1);
    spwriter_new_group(*writer);
    for (const double number : numbers) {
        spwriter_new_value(*writer, "m", spunit_ms, number);
    }
    spwriter_new_value(*writer, "nothing", spunit_B, std::numeric_limits<double>::infinity());
    spwriter_record_label_str(*writer, "z", "1");
    spwriter_record_label_str(*writer, "a", "2");
    spwriter_close(std::move(writer));
    std::ifstream file(_path);
    std::string line;
    std::getline(file, line);
    EXPECT_EQ(nlohmann::json::parse(line)["name"], "a\"\n\\xff");
    for (const double number : numbers) {
        std::getline(file, line);
        EXPECT_EQ(nlohmann::json::parse(line)["value"].get<double>(), number) << line;
    }
    std::getline(file, line);
    EXPECT_EQ(
        line,
        R"({"group":0,"metric":"nothing","unit":"B","value":null,"variables":{},"labels":{"z":"1","a":"2"},"tags":[]})");
    EXPECT_FALSE(std::getline(file, line));
    EXPECT_EQ(content().find("e+15"), std::string::npos);
}

TEST_F(StatpackFile, AFileThatCannotBeCreatedIsTold) {
    testing::internal::CaptureStderr();
    EXPECT_EQ(MWOutputFormatterStatpack::initWithPath("/nonexistent/x.spj"), nullptr);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "Unable to open spwriter: No such file or directory\n");
}

}  // namespace
