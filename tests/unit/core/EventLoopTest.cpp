// The event loop, its worker pool and the periodic timer: where each piece of work runs, and
// that a stopped timer or loop runs nothing more.
#include "core/EventLoop.h"

#include <gtest/gtest.h>

#include <future>

#include "core/PeriodicTimer.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

TEST(EventLoop, BlockingWorkRunsOffTheLoopAndItsResultComesBackOnIt) {
    EventLoop loop;
    loop.start();
    const auto loopId = loop.call([] { return std::this_thread::get_id(); });
    ASSERT_TRUE(loopId);

    std::promise<std::pair<std::thread::id, int>> done;
    std::thread::id workerId;
    loop.offload(
        [&] {
            workerId = std::this_thread::get_id();
            return 41;
        },
        [&](int result) { done.set_value({std::this_thread::get_id(), result + 1}); });
    auto future = done.get_future();
    ASSERT_EQ(future.wait_for(10s), std::future_status::ready);
    const auto [doneId, value] = future.get();
    EXPECT_EQ(value, 42);
    EXPECT_EQ(doneId, *loopId);
    EXPECT_NE(workerId, *loopId);

    // A handler that throws is logged; the loop goes on.
    loop.post([] { throw std::runtime_error("boom"); });
    EXPECT_EQ(loop.call([] { return 7; }), 7);
    loop.stop();
}

TEST(PeriodicTimer, TicksOnTheLoopUntilStoppedAndRunNowTicksAtOnce) {
    EventLoop loop;
    loop.start();
    std::atomic<int> ticks{0};
    std::promise<void> three;
    PeriodicTimer timer(loop.context(), 5ms, [&] {
        EXPECT_TRUE(loop.inLoop());
        if (++ticks == 3) three.set_value();
    });
    timer.start(0ms);
    ASSERT_EQ(three.get_future().wait_for(10s), std::future_status::ready);
    ASSERT_TRUE(loop.call([&] { timer.stop(); }));
    const int stoppedAt = ticks.load();
    // Anything queued before the stop has run by the time a later call returns.
    ASSERT_TRUE(loop.call([] {}));
    EXPECT_EQ(ticks.load(), stoppedAt);

    // A long period: only runNow makes it tick.
    std::promise<void> now;
    PeriodicTimer slow(loop.context(), 1h, [&] { now.set_value(); });
    slow.start();
    slow.runNow();
    EXPECT_EQ(now.get_future().wait_for(10s), std::future_status::ready);
    loop.stop();
}

}  // namespace
}  // namespace kesu
