#pragma once

#include <chrono>
#include <string>

/// Calendar instants as ISO 8601 text in the system's local time zone, to the millisecond, with a blank
/// between date and time: "2024-03-05 14:07:09.123-08:00", the offset "Z" where it is zero.
class MWDateFormatter {
public:
    std::string stringFromDate(std::chrono::sys_time<std::chrono::nanoseconds> date) const;
};
