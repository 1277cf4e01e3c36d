#include "events/EventDetected.h"

#include "core/Config.h"
#include "core/EventLoop.h"
#include "platform/SystemInfo.h"
#include "events/EventPublisher.h"

namespace kesu {

// Loop only.
struct EventDetected::State {
    bool unlocked = true;  // no event at start while the screen stays unlocked
    bool checking = false;
    bool stopped = false;
};

EventDetected::EventDetected(EventLoop& loop)
    : loop_(loop),
      state_(std::make_shared<State>()),
      timer_(loop.context(), [] { return Config::current().screenLockPeriod; },
             [&loop, state = state_] {
                 if (state->checking) return;  // the previous check still runs
                 state->checking = true;
                 loop.offload([] { return SystemInfo::isScreenUnlocked(); }, [state](bool unlocked) {
                     state->checking = false;
                     if (state->stopped || unlocked == state->unlocked) return;
                     state->unlocked = unlocked;
                     EventPublisher::instance().notifySubscribers(unlocked ? ServiceEvent::LogOn
                                                                           : ServiceEvent::LogOut);
                 });
             }) {
    timer_.start();
}

EventDetected::~EventDetected() { stop(); }

void EventDetected::stop() {
    loop_.call([this] {
        timer_.stop();
        state_->stopped = true;
    });
}

}  // namespace kesu
