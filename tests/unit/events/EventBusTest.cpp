// The event bus, the screen-lock watcher and the system subscriber against a stub PC suite.
#include <gtest/gtest.h>

#include <condition_variable>
#include <future>

#include "core/Json.h"
#include "core/Utils.h"
#include "events/EventDetected.h"
#include "events/EventPublisher.h"
#include "events/SystemEventSubscriber.h"
#include "platform/fake/FakePlatform.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

// Records the events it handles; a handler can be held open to make the subscriber busy.
class RecordingSubscriber : public IEventSubscriber {
public:
    explicit RecordingSubscriber(std::vector<std::string> names) : IEventSubscriber(std::move(names)) {}
    bool eventNotify(const std::string& eventName) override {
        std::unique_lock<std::mutex> l(m_);
        seen_.push_back(eventName);
        cv_.notify_all();
        cv_.wait(l, [this] { return !hold_; });
        return true;
    }
    void hold(bool on) {
        std::lock_guard<std::mutex> l(m_);
        hold_ = on;
        cv_.notify_all();
    }
    bool waitSeen(std::size_t n, std::chrono::milliseconds timeout) {
        std::unique_lock<std::mutex> l(m_);
        return cv_.wait_for(l, timeout, [&] { return seen_.size() >= n; });
    }
    std::vector<std::string> seen() {
        std::lock_guard<std::mutex> l(m_);
        return seen_;
    }

private:
    std::mutex m_;
    std::condition_variable cv_;
    bool hold_ = false;
    std::vector<std::string> seen_;
};

class EventBus : public ::testing::Test {
protected:
    void TearDown() override { EventPublisher::instance().clearObservers(); }
    test::HermeticEnv env;
};

TEST_F(EventBus, BusySubscriberDropsEventsOthersStillGetThem) {
    auto slow = std::make_shared<RecordingSubscriber>(std::vector<std::string>{"NetworkChangeEvent", "LogOnEvent"});
    auto other = std::make_shared<RecordingSubscriber>(std::vector<std::string>{"NetworkChangeEvent"});
    EventPublisher::instance().addObserver(slow);
    EventPublisher::instance().addObserver(other);

    slow->hold(true);
    EventPublisher::instance().notifySubscribers("NetworkChangeEvent");
    ASSERT_TRUE(slow->waitSeen(1, 5s));
    ASSERT_TRUE(other->waitSeen(1, 5s));
    ASSERT_TRUE(other->waitIdle(5s));
    EventPublisher::instance().notifySubscribers("NetworkChangeEvent");  // slow is busy: dropped
    EventPublisher::instance().notifySubscribers("WifiOpenEvent");       // nobody takes it
    ASSERT_TRUE(other->waitSeen(2, 5s));
    slow->hold(false);
    ASSERT_TRUE(slow->waitIdle(5s));
    ASSERT_TRUE(other->waitIdle(5s));
    EventPublisher::instance().notifySubscribers("LogOnEvent");
    ASSERT_TRUE(slow->waitSeen(2, 5s));
    ASSERT_TRUE(slow->waitIdle(5s));

    EXPECT_EQ(slow->seen(), (std::vector<std::string>{"NetworkChangeEvent", "LogOnEvent"}));
    EXPECT_EQ(other->seen(), (std::vector<std::string>{"NetworkChangeEvent", "NetworkChangeEvent"}));
}

TEST_F(EventBus, ScreenLockWatcherPublishesLogOutThenLogOn) {
    ScopedFakePlatform fake;
    env.config().screenLockPeriod = 20ms;
    auto subscriber = std::make_shared<RecordingSubscriber>(std::vector<std::string>{"LogOnEvent", "LogOutEvent"});
    EventPublisher::instance().addObserver(subscriber);
    {
        EventDetected watcher;
        fake->setScreenLocked(true);
        ASSERT_TRUE(subscriber->waitSeen(1, 5s));
        ASSERT_TRUE(subscriber->waitIdle(5s));
        fake->setScreenLocked(std::nullopt);  // unknown counts as unlocked
        ASSERT_TRUE(subscriber->waitSeen(2, 5s));
        ASSERT_TRUE(subscriber->waitIdle(5s));
    }
    EXPECT_EQ(subscriber->seen(), (std::vector<std::string>{"LogOutEvent", "LogOnEvent"}));
}

class SystemEvents : public EventBus {
protected:
    void SetUp() override {
        pcsuite.pointPcsuiteHere(env.config());
        env.config().httpWaitTimeout = 5s;
    }
    void busy(bool phoneBusy) {
        const Json data = phoneBusy ? Json{{"isConnectBusy", true}, {"deviceType", "phone"}, {"connectStatus", "connected"}}
                                    : Json{{"isConnectBusy", false}};
        pcsuite.setAnswer("/isConnectBusy", {200, Json({{"code", "000000"}, {"data", data}}).dump()});
    }
    void handle(const std::string& event) {
        auto subscriber = std::make_shared<SystemEventSubscriber>();
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
    handle("WiredNetDisconnectEvent");
    EXPECT_EQ(bodiesTo("/notifySystemEvent"), std::vector<Json>{Json::object()});
    EXPECT_TRUE(pcsuite.requestsTo("/buryPoint").empty());
    EXPECT_EQ(pcsuite.requestsTo("/isConnectBusy").size(), 2u);  // both device kinds were asked about

    busy(true);
    handle("WiredNetDisconnectEvent");
    const auto bury = bodiesTo("/buryPoint");
    ASSERT_EQ(bury.size(), 1u);
    EXPECT_NE(bury[0].dump().find("W688|10308"), std::string::npos) << bury[0];
    EXPECT_NE(bury[0].dump().find(R"("net_type":4)"), std::string::npos) << bury[0];
    EXPECT_NE(bury[0].dump().find(R"("state":2)"), std::string::npos) << bury[0];
}

TEST_F(SystemEvents, LogOnAndWifiStatesArePosted) {
    busy(true);
    handle("LogOutEvent");
    handle("LogOnEvent");
    handle("WifiOpenEvent");
    handle("WifiCloseEvent");  // not this subscriber's
    EXPECT_EQ(bodiesTo("/notifySystemEvent"),
              (std::vector<Json>{{{"event", "LogOn"}, {"status", 0}},
                                 {{"event", "LogOn"}, {"status", 1}},
                                 {{"event", "wifi"}, {"status", 1}}}));
    EXPECT_TRUE(pcsuite.requestsTo("/buryPoint").empty());  // not link events
}

}  // namespace
}  // namespace kesu
