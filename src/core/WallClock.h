// The wall clock, for what is shown or logged (durations use the steady clock). Tests may
// replace it.
#pragma once

#include <chrono>
#include <functional>
#include <string>

namespace kesu {

class WallClock {
public:
    using Clock = std::chrono::system_clock;

    static Clock::time_point now();
    // Replaces the clock (tests); an empty function puts the system clock back.
    static void setClock(std::function<Clock::time_point()> clock);
    static std::string getNowTime();   // local "yyyy-MM-dd HH:mm:ss.SSS"
    static double currentTimeStamp();  // seconds since 1970, with fraction
};

}  // namespace kesu
