#include "output/MWDateFormatter.h"

#include <fmt/format.h>

#include <cstdlib>
#include <ctime>

namespace {

std::string zoneOffset(long seconds) {
    if (seconds == 0) {
        return "Z";
    }
    const long minutes = std::labs(seconds) / 60;
    return fmt::format("{}{:02}:{:02}", seconds < 0 ? '-' : '+', minutes / 60, minutes % 60);
}

}  // namespace

std::string MWDateFormatter::stringFromDate(std::chrono::sys_time<std::chrono::nanoseconds> date) const {
    using std::chrono::milliseconds;
    using std::chrono::seconds;
    // Rounded, not cut: an instant that went through a double can be a little less than what was read.
    const auto rounded = std::chrono::round<milliseconds>(date);
    const auto wholeSeconds = std::chrono::floor<seconds>(rounded);
    const std::time_t time = std::chrono::system_clock::to_time_t(wholeSeconds);
    std::tm local = {};
    localtime_r(&time, &local);
    return fmt::format("{:04}-{:02}-{:02}{}{:02}:{:02}:{:02}.{:03}{}", local.tm_year + 1900, local.tm_mon + 1,
                       local.tm_mday, _separator, local.tm_hour, local.tm_min, local.tm_sec,
                       (rounded - wholeSeconds).count(), zoneOffset(local.tm_gmtoff));
}
