#pragma once

#include <chrono>
#include <string>

/// Calendar instants as ISO 8601 text in the system's local time zone, to the millisecond:
/// "2024-03-05T14:07:09.123-08:00", the offset "Z" where it is zero.
class MWDateFormatter {
public:
    /// `separator` stands between date and time: 'T', or a blank for readers.
    explicit MWDateFormatter(char separator) : _separator(separator) {}

    std::string stringFromDate(std::chrono::sys_time<std::chrono::nanoseconds> date) const;

private:
    char _separator;
};
