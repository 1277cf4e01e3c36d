// Restarts the whole service when the user unlocks the screen and this build was started
// more than seven days ago (the version file's "updateTime"), unless a connection runs.
#pragma once

#include <optional>
#include <string>

#include "core/WallClock.h"
#include "events/IEventSubscriber.h"

namespace kesu {

class RestartServiceSubscriber : public IEventSubscriber {
public:
    explicit RestartServiceSubscriber(EventLoop& loop);

    void eventNotify(ServiceEvent event) override;
    // True when the version file's update time lies more than `restartServiceDay` whole days
    // back. A missing, empty or unparsable file counts as current.
    bool connServiceRunOutOfDate();
    // The "updateTime" of the version file's text; nothing when the text holds no valid one.
    static std::optional<WallClock::Clock::time_point> versionUpdateTime(const std::string& content);

    const int restartServiceDay = 7;
};

}  // namespace kesu
