// Date formatting and calendar arithmetic in the local zone and in GMT.
#pragma once

#include <chrono>
#include <optional>
#include <string>

namespace kesu::timeutil {

using Clock = std::chrono::system_clock;

std::string formatLocal(Clock::time_point t);      // "yyyy-MM-dd HH:mm:ss.SSS", local zone
std::string formatGmtDate(Clock::time_point t);    // "yyyy-MM-dd", GMT
std::string formatLocalDate(Clock::time_point t);  // "yyyy-MM-dd", local zone

// Strict parses in the local zone; nullopt when the text does not have the exact form.
std::optional<Clock::time_point> parseLocal(const std::string& text);      // with milliseconds
std::optional<Clock::time_point> parseLocalDate(const std::string& text);  // midnight

// Whole calendar days from `from` to `to` in the local calendar: the largest n such that
// `from` moved n days ahead (same wall-clock time) is not after `to`. Negative when `to`
// comes first.
long long wholeDays(Clock::time_point from, Clock::time_point to);

}  // namespace kesu::timeutil
