#pragma once

#include <cstdint>
#include <string>
#include <string_view>

class MWOutputFile;

/// Writes a JSON document from its beginning to its end, without a blank or a line break. Keeps the commas;
/// that every value has its key and every bracket its counterpart is the caller's part.
class MWJSONWriter {
public:
    /// The document goes to `file`, which outlives the writer, in large pieces; without one it is kept.
    explicit MWJSONWriter(MWOutputFile* file = nullptr) : _file(file) {}

    void beginObject() { _begin('{'); }
    void endObject() { _end('}'); }
    void beginArray() { _begin('['); }
    void endArray() { _end(']'); }
    void key(std::string_view key);

    void string(std::string_view value);
    void number(uint64_t value);
    void number(int64_t value);
    /// With six decimals.
    void number(double value);
    void boolean(bool value) { json(value ? "true" : "false"); }
    void null() { json("null"); }
    /// One or more values that are JSON already.
    void json(std::string_view values);

    /// What has not gone to the file.
    const std::string& text() const { return _text; }
    /// Writes that to the file.
    void flush();

private:
    void _comma();
    void _begin(char bracket);
    void _end(char bracket);
    void _endValue();

    MWOutputFile* _file;
    std::string _text;
    /// The last thing written was a whole value.
    bool _needsComma = false;
};
