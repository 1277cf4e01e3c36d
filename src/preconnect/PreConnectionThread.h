// The one scheduler of pre-connection: once a period (a timer on the event loop) it asks the
// strategy for the next device, runs its handshake on the loop, books the outcome (counters,
// the waiter's notice, the device report) and sends the attempt's telemetry from the pool.
#pragma once

#include <asio/awaitable.hpp>
#include <asio/steady_timer.hpp>

#include <atomic>
#include <future>
#include <memory>
#include <optional>

#include "preconnect/StrategyDevicePreconnect.h"

namespace kesu {

class EventLoop;

class PreConnectionThread {
public:
    explicit PreConnectionThread(EventLoop& loop,
                                 DeviceWaitForPreConnectManager& registry = DeviceWaitForPreConnectManager::instance());
    ~PreConnectionThread();  // stop()
    PreConnectionThread(const PreConnectionThread&) = delete;
    PreConnectionThread& operator=(const PreConnectionThread&) = delete;

    // Starts the scheduler on the loop; a second call while it runs does nothing.
    void run();
    // Stops it: the timer is cancelled and an attempt in progress ends with its link closed.
    // Returns once the scheduler's coroutine has ended. Not on the loop itself.
    void stop();

private:
    asio::awaitable<void> schedule(std::shared_ptr<std::atomic<bool>> stopped);
    asio::awaitable<void> attempt();

    EventLoop& loop_;
    DeviceWaitForPreConnectManager& registry_;
    StrategyDevicePreconnect strategyDevicePreconnect_;
    std::optional<asio::steady_timer> timer_;   // loop only
    std::shared_ptr<std::atomic<bool>> stopped_;
    DeviceWaitForPreConnectManager::Entry current_;  // loop only: the entry being attempted
    std::shared_ptr<std::promise<void>> ended_;
};

}  // namespace kesu
