#include "core/TimeUtil.h"

#include <chrono>
#include <cstdio>
#include <ctime>

namespace kesu::timeutil {

namespace {

std::tm localTm(Clock::time_point t) {
    std::time_t secs = Clock::to_time_t(t);
    std::tm tm{};
    localtime_r(&secs, &tm);
    return tm;
}

// Floor to whole seconds also for times before 1970.
std::time_t floorSeconds(Clock::time_point t) {
    auto s = std::chrono::floor<std::chrono::seconds>(t.time_since_epoch());
    return static_cast<std::time_t>(s.count());
}

std::string formatDate(const std::tm& tm) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%04d-%02d-%02d", tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday);
    return buf;
}

// The clock counts nanoseconds and so holds only the years 1678 to 2262. Times beyond that,
// less a week of room for the day steps of wholeDays, do not parse: converting them would
// overflow.
constexpr std::time_t kClockSecondsLimit =
    std::chrono::duration_cast<std::chrono::seconds>(Clock::duration::max()).count() - 7 * 86400;

bool validDate(int y, int mo, int d) {
    return y >= 1 && y <= 9999 && mo >= 1 && mo <= 12 && d >= 1 && d <= 31;
}

std::optional<Clock::time_point> makeLocal(int y, int mo, int d, int h, int mi, int s, int ms) {
    std::tm tm{};
    tm.tm_year = y - 1900;
    tm.tm_mon = mo - 1;
    tm.tm_mday = d;
    tm.tm_hour = h;
    tm.tm_min = mi;
    tm.tm_sec = s;
    tm.tm_isdst = -1;
    std::time_t secs = std::mktime(&tm);
    // mktime normalises 31 February into March: such dates do not parse.
    if (secs == static_cast<std::time_t>(-1) && !(y == 1969 || y == 1970)) return std::nullopt;
    if (tm.tm_mday != d || tm.tm_mon != mo - 1) return std::nullopt;
    if (secs > kClockSecondsLimit || secs < -kClockSecondsLimit) return std::nullopt;
    return Clock::from_time_t(secs) + std::chrono::milliseconds(ms);
}

}  // namespace

std::string formatLocal(Clock::time_point t) {
    std::time_t secs = floorSeconds(t);
    std::tm tm{};
    localtime_r(&secs, &tm);
    auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(t - Clock::from_time_t(secs)).count();
    char buf[64];
    std::snprintf(buf, sizeof buf, "%04d-%02d-%02d %02d:%02d:%02d.%03d", tm.tm_year + 1900, tm.tm_mon + 1,
                  tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, static_cast<int>(ms));
    return buf;
}

std::string formatGmtDate(Clock::time_point t) {
    std::time_t secs = floorSeconds(t);
    std::tm tm{};
    gmtime_r(&secs, &tm);
    return formatDate(tm);
}

std::string formatLocalDate(Clock::time_point t) { return formatDate(localTm(t)); }

std::optional<Clock::time_point> parseLocal(const std::string& text) {
    int y, mo, d, h, mi, s, ms, used = -1;
    if (text.size() != 23) return std::nullopt;
    if (std::sscanf(text.c_str(), "%4d-%2d-%2d %2d:%2d:%2d.%3d%n", &y, &mo, &d, &h, &mi, &s, &ms, &used) != 7 ||
        used != 23)
        return std::nullopt;
    if (!validDate(y, mo, d) || h > 23 || mi > 59 || s > 60 || h < 0 || mi < 0 || s < 0 || ms < 0)
        return std::nullopt;
    return makeLocal(y, mo, d, h, mi, s, ms);
}

std::optional<Clock::time_point> parseLocalDate(const std::string& text) {
    int y, mo, d, used = -1;
    if (text.size() != 10) return std::nullopt;
    if (std::sscanf(text.c_str(), "%4d-%2d-%2d%n", &y, &mo, &d, &used) != 3 || used != 10) return std::nullopt;
    if (!validDate(y, mo, d)) return std::nullopt;
    return makeLocal(y, mo, d, 0, 0, 0, 0);
}

long long wholeDays(Clock::time_point from, Clock::time_point to) {
    if (to < from) return -wholeDays(to, from);
    std::time_t fromSecs = floorSeconds(from);
    auto fraction = from - Clock::from_time_t(fromSecs);
    std::tm base{};
    localtime_r(&fromSecs, &base);
    auto shifted = [&](long long days) {
        std::tm tm = base;
        tm.tm_mday += static_cast<int>(days);
        tm.tm_isdst = -1;
        return Clock::from_time_t(std::mktime(&tm)) + fraction;
    };
    // In seconds: the distance of two far-apart times overflows the clock's nanoseconds.
    long long n = (floorSeconds(to) - fromSecs) / 86400;
    while (n > 0 && shifted(n) > to) --n;
    while (shifted(n + 1) <= to) ++n;
    return n;
}

}  // namespace kesu::timeutil
