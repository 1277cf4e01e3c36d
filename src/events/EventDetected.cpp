#include "events/EventDetected.h"

#include <asio/steady_timer.hpp>

#include <algorithm>
#include <optional>

#include "core/Config.h"
#include "core/EventLoop.h"
#include "events/EventPublisher.h"
#include "platform/Platform.h"

namespace kesu {

// Loop only. One check at a time: the next wait starts when a check has answered, and its
// length depends on that answer.
struct EventDetected::State : std::enable_shared_from_this<State> {
    State(EventLoop& l) : loop(l), timer(l.context()) {}

    void arm(std::chrono::milliseconds wait) {
        timer.expires_after(wait);
        timer.async_wait([self = shared_from_this()](const std::error_code& error) {
            if (!error && !self->stopped) self->check();
        });
    }
    void check() {
        loop.offload([] { return Platform::current().screenLocked(); },
                     [self = shared_from_this()](std::optional<bool> locked) { self->answered(locked); });
    }
    void answered(std::optional<bool> locked) {
        if (stopped) return;
        const Config& config = Config::current();
        // While the machine cannot tell (no login manager, no user session) it is unlikely to
        // tell a moment later: look again much later.
        arm(locked ? config.screenLockPeriod : std::max(config.screenLockPeriod, config.screenLockUnknownPeriod));
        const bool nowUnlocked = !locked.value_or(false);  // unknown counts as unlocked
        if (nowUnlocked == unlocked) return;
        unlocked = nowUnlocked;
        EventPublisher::instance().notifySubscribers(unlocked ? ServiceEvent::LogOn : ServiceEvent::LogOut);
    }

    EventLoop& loop;
    asio::steady_timer timer;
    bool unlocked = true;  // no event at start while the screen stays unlocked
    bool stopped = false;
};

EventDetected::EventDetected(EventLoop& loop) : loop_(loop), state_(std::make_shared<State>(loop)) {
    loop_.post([state = state_] {
        if (!state->stopped) state->arm(Config::current().screenLockPeriod);
    });
}

EventDetected::~EventDetected() { stop(); }

void EventDetected::stop() {
    loop_.call([state = state_] {
        state->stopped = true;
        state->timer.cancel();
    });
}

}  // namespace kesu
