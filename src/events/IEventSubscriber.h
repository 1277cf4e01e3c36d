// A subscriber of the event bus. The bus only queues: an accepted event joins the
// subscriber's pending set and the subscriber's handler runs on the loop's worker pool, one
// event at a time, in the order the events arrived. An event that arrives while the handler
// is busy is kept and handled after it; a kind already pending is not queued twice (it moves
// to the end, so the last state of the PC is the last one handled). No thread of its own.
#pragma once

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <vector>

#include "events/ServiceEvent.h"

namespace kesu {

class EventLoop;

class IEventSubscriber : public std::enable_shared_from_this<IEventSubscriber> {
public:
    // Handles the kinds in `events` on `loop`'s worker pool; must be held by a shared_ptr.
    IEventSubscriber(EventLoop& loop, EventSet events);
    virtual ~IEventSubscriber() = default;
    IEventSubscriber(const IEventSubscriber&) = delete;
    IEventSubscriber& operator=(const IEventSubscriber&) = delete;

    // Called by the bus for every published event, on the publisher's thread; never blocks
    // for long.
    virtual void notify(ServiceEvent event);
    // Handles one event (worker pool; may block on HTTP or a program launch).
    virtual void eventNotify(ServiceEvent event) = 0;

    bool handles(ServiceEvent event) const { return events_.contains(event); }
    // Waits until nothing is pending or running; false at the time-out.
    bool waitIdle(std::chrono::milliseconds timeout);
    // Takes no more events and drops the pending ones, then waits (at most `timeout`) for a
    // handler that runs; false when it still runs.
    bool stop(std::chrono::milliseconds timeout);

protected:
    // A subscriber that overrides notify and takes events on the publisher's thread.
    explicit IEventSubscriber(EventSet events);

private:
    void runNext();
    bool finishedLocked();

    EventLoop* const loop_;
    const EventSet events_;
    std::mutex mutex_;
    std::condition_variable idle_;
    std::vector<ServiceEvent> pending_;  // in order of arrival, one per kind
    bool running_ = false;               // a handler run is queued on or runs in the pool
    bool stopped_ = false;
};

}  // namespace kesu
