#include "app/RestartServiceSubscriber.h"

#include "core/Config.h"
#include "core/Json.h"
#include "core/TimeUtil.h"
#include "connect/ConnectionState.h"
#include "core/Files.h"
#include "core/Log.h"
#include "core/Process.h"
#include "core/WallClock.h"

namespace kesu {

RestartServiceSubscriber::RestartServiceSubscriber(EventLoop& loop) : IEventSubscriber(loop, {ServiceEvent::LogOn}) {}

void RestartServiceSubscriber::eventNotify(ServiceEvent) {
    if (ConnectionState::getIsCanConnectDevice() && connServiceRunOutOfDate()) process::restartService();
}

std::optional<WallClock::Clock::time_point> RestartServiceSubscriber::versionUpdateTime(const std::string& content) {
    const auto parsed = json::parse(content);
    const std::string updateText = parsed ? json::str(*parsed, "updateTime") : std::string();
    return timeutil::parseLocal(updateText);
}

bool RestartServiceSubscriber::connServiceRunOutOfDate() {
    std::string content;
    Files::readFile(rootedPath(Config::current().versionFile), content);
    if (content.empty()) return false;
    const auto updateTime = versionUpdateTime(content);
    const auto now = timeutil::parseLocal(WallClock::getNowTime());
    if (!updateTime || !now) {
        Log::mPrintlog("[RestartServiceSubscriber::connServiceRunOutOfDate] no valid updateTime, keep running");
        return false;
    }
    const long long days = timeutil::wholeDays(*updateTime, *now);
    Log::mPrintlog("[RestartServiceSubscriber::connServiceRunOutOfDate] Now connservice run " +
                     std::to_string(days) + " day ");
    return days > restartServiceDay;
}

}  // namespace kesu
