// Listens to the kernel's notifications of network links and IPv4 addresses coming, going
// and changing (rtnetlink) and calls `onChange` on the loop once per burst: the first
// notification arms a short timer, and every one that arrives until it fires folds into
// that one call. Wireless-extension chatter (scan results and the like) is not a change.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace kesu {

class EventLoop;

class LinkChangeListener {
public:
    // Opens the notification socket on the calling thread (so in its network namespace) and
    // listens on `loop`, which must outlive the listener. When the socket cannot be opened it
    // logs that and stays silent (the caller's periodic check still runs).
    LinkChangeListener(EventLoop& loop, std::function<void()> onChange,
                       std::chrono::milliseconds debounce = std::chrono::milliseconds(150));
    ~LinkChangeListener();  // stop()
    LinkChangeListener(const LinkChangeListener&) = delete;
    LinkChangeListener& operator=(const LinkChangeListener&) = delete;

    // The notification socket is open and read.
    bool listening() const;
    // Closes the socket and drops a pending call; onChange is not called once this returned.
    // Any thread; idempotent.
    void stop();

private:
    struct State;
    EventLoop& loop_;
    std::shared_ptr<State> state_;
};

}  // namespace kesu
