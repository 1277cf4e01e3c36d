#include "core/RestartServiceSubscriber.h"

#include "core/Config.h"
#include "core/Json.h"
#include "core/TimeUtil.h"
#include "core/Utils.h"

namespace kesu {

RestartServiceSubscriber::RestartServiceSubscriber(EventLoop& loop) : IEventSubscriber(loop, {ServiceEvent::LogOn}) {}

void RestartServiceSubscriber::eventNotify(ServiceEvent) {
    if (Utils::getIsCanConnectDevice() && connServiceRunOutOfDate()) Utils::restartService();
}

std::optional<Utils::Clock::time_point> RestartServiceSubscriber::versionUpdateTime(const std::string& content) {
    const auto parsed = json::parse(content);
    const std::string updateText = parsed ? json::str(*parsed, "updateTime") : std::string();
    return timeutil::parseLocal(updateText);
}

bool RestartServiceSubscriber::connServiceRunOutOfDate() {
    std::string content;
    Utils::readFile(rootedPath(Config::current().versionFile), content);
    if (content.empty()) return false;
    const auto updateTime = versionUpdateTime(content);
    const auto now = timeutil::parseLocal(Utils::getNowTime());
    if (!updateTime || !now) {
        Utils::mPrintlog("[RestartServiceSubscriber::connServiceRunOutOfDate] no valid updateTime, keep running");
        return false;
    }
    const long long days = timeutil::wholeDays(*updateTime, *now);
    Utils::mPrintlog("[RestartServiceSubscriber::connServiceRunOutOfDate] Now connservice run " +
                     std::to_string(days) + " day ");
    return days > restartServiceDay;
}

}  // namespace kesu
