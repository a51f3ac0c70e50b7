#include "output/spwriter.h"

#include <fmt/format.h>

#include <cmath>
#include <iterator>
#include <utility>

#include "output/MWJSONText.h"
#include "output/MWOutputFile.h"

/// Members are kept as the JSON text that they are written as.
struct spwriter {
    /// The value recorded last: its line is complete when the next one begins.
    struct Value {
        std::string beginning;  ///< up to the unit and the number
        std::string variables;
        std::string labels;
        std::string tags;
    };

    std::unique_ptr<MWOutputFile> file;
    int version = 0;
    std::string name;
    std::string description;
    std::string primaryMetric;
    bool isRecordingWritten = false;
    int64_t group = -1;
    std::string lines;  ///< of the group, whole
    Value value;
};

namespace {

void appendMember(std::string& members, std::string_view name, std::string_view value) {
    members += members.empty() ? "" : ",";
    MWAppendJSONString(members, name);
    members += ':';
    MWAppendJSONString(members, value);
}

/// The fewest digits that read back to the same number; no exponent where every integer is exact.
std::string numberText(double value) {
    constexpr double kExactIntegers = 0x1p53;
    if (!std::isfinite(value)) {
        return "null";
    }
    if (value == std::trunc(value) && std::abs(value) < kExactIntegers) {
        return fmt::format("{}", static_cast<int64_t>(value));
    }
    return fmt::format("{}", value);
}

void endValue(spwriter& writer) {
    const spwriter::Value value = std::exchange(writer.value, {});
    if (!value.beginning.empty()) {
        fmt::format_to(std::back_inserter(writer.lines),
                       "{},\"variables\":{{{}}},\"labels\":{{{}}},\"tags\":[{}]}}\n", value.beginning,
                       value.variables, value.labels, value.tags);
    }
}

void writeRecording(spwriter& writer) {
    if (std::exchange(writer.isRecordingWritten, true)) {
        return;
    }
    std::string members;
    appendMember(members, "name", writer.name);
    appendMember(members, "description", writer.description);
    appendMember(members, "primary_metric", writer.primaryMetric);
    writer.file->write(fmt::format("{{\"statpack\":{},{}}}\n", writer.version, members));
}

void writeGroup(spwriter& writer) {
    writeRecording(writer);
    endValue(writer);
    writer.file->write(std::exchange(writer.lines, {}));
}

}  // namespace

void spwriter_release::operator()(spwriter* writer) const {
    delete writer;
}

spwriter_ptr spwriter_open(const std::string& path, std::string_view name, int version, int) {
    auto file = MWOutputFile::create(path);
    if (file == nullptr) {
        return nullptr;
    }
    spwriter_ptr writer(new spwriter);
    writer->file = std::move(file);
    writer->version = version;
    writer->name = name;
    return writer;
}

void spwriter_set_description(spwriter& writer, std::string_view description) {
    writer.description = description;
}

void spwriter_set_primary_metric(spwriter& writer, std::string_view metric) {
    writer.primaryMetric = metric;
}

void spwriter_new_group(spwriter& writer) {
    writeGroup(writer);
    ++writer.group;
}

void spwriter_new_value(spwriter& writer, std::string_view metric, spunit unit, double value) {
    endValue(writer);
    if (writer.group < 0) {
        return;
    }
    std::string& line = writer.value.beginning;
    fmt::format_to(std::back_inserter(line), R"({{"group":{},"metric":)", writer.group);
    MWAppendJSONString(line, metric);
    fmt::format_to(std::back_inserter(line), R"(,"unit":"{}","value":{})", unit == spunit_B ? "B" : "ms",
                   numberText(value));
}

void spwriter_record_variable_str(spwriter& writer, std::string_view name, std::string_view value) {
    appendMember(writer.value.variables, name, value);
}

void spwriter_record_label_str(spwriter& writer, std::string_view name, std::string_view value) {
    appendMember(writer.value.labels, name, value);
}

void spwriter_record_tag(spwriter& writer, sptag tag) {
    writer.value.tags += writer.value.tags.empty() ? "" : ",";
    writer.value.tags += tag == sptag_summary ? "\"summary\"" : "\"context\"";
}

void spwriter_flush(spwriter& writer) {
    writeGroup(writer);
}

void spwriter_close(spwriter_ptr writer) {
    writeGroup(*writer);
    writer->file->close();
}
