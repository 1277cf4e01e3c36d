// Fuzzes the reading of the version file: arbitrary text gives a time or nothing, the age in
// days is computed without running away, and a file as the service writes it reads back as
// the time written.
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>

#include "core/Json.h"
#include "app/RestartServiceSubscriber.h"
#include "core/TimeUtil.h"

namespace {

void check(bool condition) {
    if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    // A fixed zone without clock changes, so that a written time reads back unambiguously.
    setenv("TZ", "UTC", 1);
    tzset();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using kesu::timeutil::Clock;
    const std::string content(reinterpret_cast<const char*>(data), size);
    const auto updated = kesu::RestartServiceSubscriber::versionUpdateTime(content);
    if (updated) {
        const auto now = Clock::from_time_t(1796386800);  // 2026-12-04
        // Without clock changes a calendar day is 24 hours; a negative age counts towards zero.
        using std::chrono::milliseconds;
        const auto age = std::chrono::time_point_cast<milliseconds>(now) - std::chrono::time_point_cast<milliseconds>(*updated);
        const long long days = kesu::timeutil::wholeDays(*updated, now);
        check(days == std::chrono::duration_cast<std::chrono::days>(age).count());
    }

    // Any moment from 1970 to 2100, written as the service writes it, reads back to the millisecond.
    std::uint64_t seed = 0;
    if (size > 0) std::memcpy(&seed, data, size < sizeof seed ? size : sizeof seed);
    const auto written = Clock::time_point(std::chrono::milliseconds(seed % 4102444800000ULL));
    const kesu::Json file = {{"version", "3.6.1.0"}, {"updateTime", kesu::timeutil::formatLocal(written)}};
    const auto read = kesu::RestartServiceSubscriber::versionUpdateTime(file.dump(2));
    check(read && *read == written);
    return 0;
}
