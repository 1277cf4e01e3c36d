// The control server's workers: a worker starts when a connection arrives and none is idle,
// up to a limit, and one that has been idle for a while ends (the first `keep` stay). A
// kept-alive connection holds its worker, and some requests wait long for a phone, so a new
// connection must get a worker of its own rather than queue behind them.
#pragma once

#include <httplib.h>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <list>
#include <mutex>
#include <thread>
#include <vector>

namespace kesu {

class OnDemandTaskQueue : public httplib::TaskQueue {
public:
    OnDemandTaskQueue(std::size_t maxWorkers, std::chrono::milliseconds idleTimeout, std::size_t keep = 1);
    ~OnDemandTaskQueue() override;  // shutdown()

    void enqueue(std::function<void()> fn) override;
    // Runs what is queued, then ends and joins every worker. Idempotent.
    void shutdown() override;

    // Workers alive now.
    std::size_t workers() const;
    // Waits until exactly `count` workers are alive; false at the time-out.
    bool waitForWorkers(std::size_t count, std::chrono::milliseconds timeout) const;

private:
    void work(std::list<std::thread>::iterator self);

    const std::size_t maxWorkers_;
    const std::chrono::milliseconds idleTimeout_;
    const std::size_t keep_;

    mutable std::mutex mutex_;
    std::condition_variable jobReady_;
    mutable std::condition_variable workersChanged_;
    std::deque<std::function<void()>> jobs_;
    std::list<std::thread> threads_;  // one per live worker
    std::vector<std::thread> ended_;  // workers that ended, to be joined
    std::size_t alive_ = 0;
    std::size_t idle_ = 0;
    bool shutdown_ = false;
};

}  // namespace kesu
