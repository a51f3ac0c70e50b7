#include "output/MWJSONWriter.h"

#include <fmt/format.h>

#include <iterator>

#include "output/MWJSONText.h"
#include "output/MWOutputFile.h"

void MWJSONWriter::_comma() {
    if (_needsComma) {
        _text += ',';
    }
}

void MWJSONWriter::_begin(char bracket) {
    _comma();
    _text += bracket;
    _needsComma = false;
}

void MWJSONWriter::_end(char bracket) {
    _text += bracket;
    _endValue();
}

void MWJSONWriter::_endValue() {
    constexpr size_t kPiece = size_t{256} << 10U;
    _needsComma = true;
    if (_file != nullptr && _text.size() >= kPiece) {
        flush();
    }
}

void MWJSONWriter::flush() {
    _file->write(_text);
    _text.clear();
}

void MWJSONWriter::key(std::string_view key) {
    _comma();
    MWAppendJSONString(_text, key);
    _text += ':';
    _needsComma = false;
}

void MWJSONWriter::string(std::string_view value) {
    _comma();
    MWAppendJSONString(_text, value);
    _endValue();
}

void MWJSONWriter::number(uint64_t value) {
    json(fmt::format_int(value).c_str());
}

void MWJSONWriter::number(int64_t value) {
    json(fmt::format_int(value).c_str());
}

void MWJSONWriter::number(double value) {
    json(fmt::format("{:f}", value));
}

void MWJSONWriter::json(std::string_view values) {
    _comma();
    _text += values;
    _endValue();
}
