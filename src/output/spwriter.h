#pragma once

#include <memory>
#include <string>
#include <string_view>

// Writer of statpack files: metrics of a run as JSON Lines. The first line is the recording; every other line
// is one value, with the group it belongs to. A group reaches the file whole, when the next one begins, by
// spwriter_flush or when the file is closed, so that whatever is in the file at any moment is whole lines.
//
// Names and values are any bytes, written as by MWAppendJSONString. Nothing here fails: a write error is told
// when the file is closed, and what follows it is dropped.

struct spwriter;
struct spwriter_release {
    /// Closes without writing what the last group holds, and without a word.
    void operator()(spwriter* writer) const;
};
using spwriter_ptr = std::unique_ptr<spwriter, spwriter_release>;

/// Of a value.
enum class spunit { B, ms };
inline constexpr spunit spunit_B = spunit::B;
inline constexpr spunit spunit_ms = spunit::ms;
enum class sptag { summary, context };
inline constexpr sptag sptag_summary = sptag::summary;
inline constexpr sptag sptag_context = sptag::context;

/// Creates or empties the file; none with errno when that fails. `version` is that of the format, written as
/// "statpack"; there is 1 alone. No option is defined for `options`.
spwriter_ptr spwriter_open(const std::string& path, std::string_view name, int version, int options);
void spwriter_set_description(spwriter& writer, std::string_view description);
/// A metric with its variables: "total_memory,process=ALL_PROCESSES".
void spwriter_set_primary_metric(spwriter& writer, std::string_view metric);
/// From the first group on the recording cannot be changed. Groups count from 0.
void spwriter_new_group(spwriter& writer);
/// A value of the group; without one it is dropped. One that is no finite number is written as null.
void spwriter_new_value(spwriter& writer, std::string_view metric, spunit unit, double value);
// Of the value recorded last, in the order of the calls.
void spwriter_record_variable_str(spwriter& writer, std::string_view name, std::string_view value);
void spwriter_record_label_str(spwriter& writer, std::string_view name, std::string_view value);
void spwriter_record_tag(spwriter& writer, sptag tag);
/// The group is complete: a run that is killed later leaves it in the file.
void spwriter_flush(spwriter& writer);
/// Writes what there is left and tells a write error on standard error.
void spwriter_close(spwriter_ptr writer);
