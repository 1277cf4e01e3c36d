// The control server's workers: as many as blocking tasks need, back down when idle.
#include "control/OnDemandTaskQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>

namespace kesu::test {
namespace {

using namespace std::chrono_literals;

TEST(OnDemandTaskQueue, BlockingTasksGetAWorkerEachAndIdleWorkersEnd) {
    OnDemandTaskQueue queue(16, 50ms, 1);
    EXPECT_EQ(queue.workers(), 0u);

    // Tasks that hold their worker until released, like kept-alive connections.
    constexpr int kHeld = 6;
    std::mutex m;
    std::condition_variable cv;
    int started = 0, finished = 0;
    bool release = false;
    for (int i = 0; i < kHeld; ++i)
        queue.enqueue([&] {
            std::unique_lock<std::mutex> lock(m);
            ++started;
            cv.notify_all();
            cv.wait(lock, [&] { return release; });
            ++finished;
            cv.notify_all();
        });
    {
        std::unique_lock<std::mutex> lock(m);
        ASSERT_TRUE(cv.wait_for(lock, 10s, [&] { return started == kHeld; })) << started;
    }
    EXPECT_EQ(queue.workers(), static_cast<std::size_t>(kHeld));

    // One more task (a HeartBeat) is not queued behind them.
    std::promise<void> answered;
    queue.enqueue([&] { answered.set_value(); });
    EXPECT_EQ(answered.get_future().wait_for(10s), std::future_status::ready);

    {
        std::lock_guard<std::mutex> lock(m);
        release = true;
    }
    cv.notify_all();
    // Idle workers end; one stays.
    EXPECT_TRUE(queue.waitForWorkers(1, 10s)) << queue.workers();
    EXPECT_FALSE(queue.waitForWorkers(0, 200ms));

    // The one left serves; shutdown joins it after queued work ran.
    std::atomic<int> ran{0};
    for (int i = 0; i < 3; ++i) queue.enqueue([&] { ++ran; });
    queue.shutdown();
    EXPECT_EQ(ran.load(), 3);
    EXPECT_EQ(queue.workers(), 0u);
    EXPECT_EQ(finished, kHeld);
}

}  // namespace
}  // namespace kesu::test
