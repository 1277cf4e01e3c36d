// The event bus (order, nothing lost while a subscriber is busy), the screen-lock watcher
// and the system subscriber against a stub PC suite.
#include <gtest/gtest.h>

#include <condition_variable>

#include "core/EventLoop.h"
#include "core/Json.h"
#include "events/EventDetected.h"
#include "events/EventPublisher.h"
#include "events/SystemEventSubscriber.h"
#include "platform/fake/FakePlatform.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"
#include "unit/events/EventRecorder.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using Names = std::vector<std::string>;

// Records the events it handles on the pool; a handler can be held open to keep it busy.
class HeldSubscriber : public IEventSubscriber {
public:
    HeldSubscriber(EventLoop& loop, EventSet events) : IEventSubscriber(loop, events) {}
    void eventNotify(ServiceEvent event) override {
        std::unique_lock<std::mutex> l(m_);
        seen_.push_back(eventName(event));
        cv_.notify_all();
        cv_.wait(l, [this] { return !hold_; });
    }
    void hold(bool on) {
        std::lock_guard<std::mutex> l(m_);
        hold_ = on;
        cv_.notify_all();
    }
    // The events handled so far, once there are at least `n` (or at the time-out).
    Names seen(std::size_t n = 0) {
        std::unique_lock<std::mutex> l(m_);
        cv_.wait_for(l, 10s, [&] { return seen_.size() >= n; });
        return seen_;
    }

private:
    std::mutex m_;
    std::condition_variable cv_;
    bool hold_ = false;
    Names seen_;
};

class EventBus : public ::testing::Test {
protected:
    void SetUp() override { loop.start(); }
    void TearDown() override { EventPublisher::instance().clearObservers(); }
    static void publish(ServiceEvent event) { EventPublisher::instance().notifySubscribers(event); }
    test::HermeticEnv env;
    EventLoop loop;
};

// Nothing is lost while a handler is busy: later events wait, a kind pending again moves
// behind the others (so the last state published is handled last), and the other
// subscribers are not held up.
TEST_F(EventBus, EventsArrivingWhileBusyAreKeptCoalescedAndDeliveredAfter) {
    auto slow = std::make_shared<HeldSubscriber>(loop, EventSet{ServiceEvent::NetworkChange, ServiceEvent::LogOn,
                                                                ServiceEvent::LogOut, ServiceEvent::AccountChange});
    auto other = std::make_shared<HeldSubscriber>(loop, EventSet{ServiceEvent::WifiOpen});
    EventPublisher::instance().addObserver(slow);
    EventPublisher::instance().addObserver(other);

    slow->hold(true);
    publish(ServiceEvent::LogOn);
    ASSERT_EQ(slow->seen(1).size(), 1u);
    for (ServiceEvent e : {ServiceEvent::AccountChange, ServiceEvent::LogOut, ServiceEvent::NetworkChange,
                           ServiceEvent::NetworkChange, ServiceEvent::NetworkChange, ServiceEvent::LogOn,
                           ServiceEvent::LogOut, ServiceEvent::WifiOpen})
        publish(e);
    ASSERT_EQ(other->seen(1).size(), 1u);
    EXPECT_EQ(slow->seen(), Names{"LogOnEvent"});
    slow->hold(false);
    ASSERT_TRUE(slow->waitIdle(10s));
    EXPECT_EQ(slow->seen(),
              (Names{"LogOnEvent", "AccountChangeEvent", "NetworkChangeEvent", "LogOnEvent", "LogOutEvent"}));

    // A stop drops what is pending and waits for the running handler, at most its time-out.
    slow->hold(true);
    publish(ServiceEvent::LogOn);
    ASSERT_EQ(slow->seen(6).size(), 6u);
    publish(ServiceEvent::AccountChange);
    EXPECT_FALSE(slow->stop(50ms));
    slow->hold(false);
    EXPECT_TRUE(slow->stop(10s));
    publish(ServiceEvent::LogOn);
    EXPECT_TRUE(slow->waitIdle(10s));
    EXPECT_EQ(slow->seen().size(), 6u);
    EXPECT_EQ(other->seen(), Names{"WifiOpenEvent"});
}

TEST_F(EventBus, ScreenLockWatcherPublishesLogOutThenLogOn) {
    ScopedFakePlatform fake;
    env.config().screenLockPeriod = 20ms;
    auto events = std::make_shared<test::EventRecorder>();
    EventPublisher::instance().addObserver(events);
    env.config().screenLockUnknownPeriod = 1h;
    fake->setScreenLocked(true);
    {
        EventDetected watcher(loop);
        ASSERT_TRUE(events->waitFor("LogOutEvent", 1, 10s));
        fake->setScreenLocked(std::nullopt);  // unknown counts as unlocked
        ASSERT_TRUE(events->waitFor("LogOnEvent", 1, 10s));
        // While the machine cannot tell, the check waits for the long period.
        const int calls = fake->screenLockedCalls();
        fake->setScreenLocked(true);
        EXPECT_FALSE(events->waitFor("LogOutEvent", 2, 300ms));
        EXPECT_EQ(fake->screenLockedCalls(), calls);
    }
    EXPECT_EQ(events->events(), (Names{"LogOutEvent", "LogOnEvent"}));
}

class SystemEvents : public EventBus {
protected:
    void SetUp() override {
        EventBus::SetUp();
        pcsuite.pointPcsuiteHere(env.config());
        env.config().httpWaitTimeout = 5s;
    }
    void busy(bool phoneBusy) {
        const Json data = phoneBusy ? Json{{"isConnectBusy", true}, {"deviceType", "phone"}, {"connectStatus", "connected"}}
                                    : Json{{"isConnectBusy", false}};
        pcsuite.setAnswer("/isConnectBusy", {200, Json({{"code", "000000"}, {"data", data}}).dump()});
    }
    void handle(ServiceEvent event) {
        auto subscriber = std::make_shared<SystemEventSubscriber>(loop);
        subscriber->notify(event);
        ASSERT_TRUE(subscriber->waitIdle(10s));
    }
    std::vector<Json> bodiesTo(const std::string& path) {
        std::vector<Json> out;
        for (const auto& r : pcsuite.requestsTo(path)) {
            const auto hash = r.body.find('#');
            out.push_back(json::parse(hash == std::string::npos ? r.body : r.body.substr(hash + 1)).value_or(Json()));
        }
        return out;
    }
    test::StubPcSuite pcsuite;
};

TEST_F(SystemEvents, WiredLinkLostGetsABuryPointOnlyDuringAConnection) {
    busy(false);
    handle(ServiceEvent::WiredNetDisconnect);
    EXPECT_EQ(bodiesTo("/notifySystemEvent"), std::vector<Json>{Json::object()});
    EXPECT_TRUE(pcsuite.requestsTo("/buryPoint").empty());
    EXPECT_EQ(pcsuite.requestsTo("/isConnectBusy").size(), 2u);  // both device kinds were asked about

    busy(true);
    handle(ServiceEvent::WiredNetDisconnect);
    const auto bury = bodiesTo("/buryPoint");
    ASSERT_EQ(bury.size(), 1u);
    const std::string text = bury[0].dump();
    for (const char* part : {"W688|10308", R"("net_type":4)", R"("state":2)"})
        EXPECT_NE(text.find(part), std::string::npos) << text;
}

TEST_F(SystemEvents, LogOnAndWifiStatesArePosted) {
    busy(true);
    handle(ServiceEvent::LogOut);
    handle(ServiceEvent::LogOn);
    handle(ServiceEvent::WifiOpen);
    handle(ServiceEvent::WifiClose);  // not this subscriber's
    EXPECT_EQ(bodiesTo("/notifySystemEvent"),
              (std::vector<Json>{{{"event", "LogOn"}, {"status", 0}},
                                 {{"event", "LogOn"}, {"status", 1}},
                                 {{"event", "wifi"}, {"status", 1}}}));
    EXPECT_TRUE(pcsuite.requestsTo("/buryPoint").empty());  // not link events
}

}  // namespace
}  // namespace kesu
