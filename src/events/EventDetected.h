// The screen-lock watcher: publishes LogOut when the screen gets locked and LogOn when it
// gets unlocked, checking every few seconds (a timer on the loop; the check itself launches
// a program, so it runs on the worker pool). While the machine cannot tell (no login manager,
// no user session) the check runs only about once a minute, and the screen counts as unlocked.
#pragma once

#include <memory>

namespace kesu {

class EventLoop;

class EventDetected {
public:
    explicit EventDetected(EventLoop& loop);  // starts the watcher
    ~EventDetected();                         // stop()
    EventDetected(const EventDetected&) = delete;
    EventDetected& operator=(const EventDetected&) = delete;
    // No check starts after this; a check under way publishes nothing.
    void stop();

private:
    struct State;

    EventLoop& loop_;
    std::shared_ptr<State> state_;
};

}  // namespace kesu
