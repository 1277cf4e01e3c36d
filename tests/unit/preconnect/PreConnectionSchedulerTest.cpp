// The strategy's choice, the scheduler on the loop, a user's request to pre-connect one
// device, and the outcome channel.
#include "PreconnectFixture.h"

#include <thread>

#include "preconnect/PreConnectEventSubscriber.h"
#include "preconnect/PreConnectionThread.h"
#include "support/UdpCatcher.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

class SchedulerTest : public test::SchedulingTest {
protected:
    void SetUp() override {
        SchedulingTest::SetUp();
        env.config().telemetryUdpPort = collector.port();
    }

    // An entry in `registry` whose device reported at `reportTime`.
    static std::shared_ptr<DeviceWaitForPreConnect> add(DeviceWaitForPreConnectManager& registry, EventLoop& loop,
                                                        const std::string& business, const std::string& reportTime,
                                                        int failures = 0) {
        auto record = std::make_shared<FarawayDevice>();
        Json cloud = cloudRecord({"127.0.0.1"}, business);
        cloud["reportTime"] = reportTime;
        record->setAllInfo(cloud);
        auto entry = std::make_shared<DeviceWaitForPreConnect>(loop, record->getDeviceId(), record);
        entry->setFarawayWlanConnectCount(failures);
        registry.addDevices(entry->getDeviceId(), entry);
        return entry;
    }

    // An entry of the simulated phone `phone` in `registry`, its link held.
    std::shared_ptr<DeviceWaitForPreConnect> held(DeviceWaitForPreConnectManager& registry, phonesim::Listener& phone) {
        env.config().phoneTcpPort = phone.port();
        const auto entry = add(registry, loop, "SIMP", "2026-12-06 10:00:00.000");
        entry->setConnectType(FarawayDevice::kWlan);
        EXPECT_EQ(handshake(entry), true);
        return entry;
    }

    // The next telemetry record of `eventId`; null at the time-out.
    Json nextRecord(const std::string& eventId) {
        while (auto datagram = collector.receive(5s)) {
            Json record = Json::parse(*datagram);
            if (record["eventID"] == eventId) return record;
        }
        return Json();
    }

    test::UdpCatcher collector;
};

TEST_F(SchedulerTest, StrategyChoosesPicksThenNeverFailedThenOnceFailed) {
    DeviceWaitForPreConnectManager registry(&loop);
    StrategyDevicePreconnect strategy(registry);
    const auto older = add(registry, loop, "AAAA", "2026-12-01 10:00:00.000");
    const auto newerFailed = add(registry, loop, "BBBB", "2026-12-06 10:00:00.000", 1);
    const auto otherAccount = add(registry, loop, "CCCC", "2026-12-07 10:00:00.000");
    otherAccount->setIsOpenIdSame(false);
    const auto exhausted = add(registry, loop, "DDDD", "2026-12-08 10:00:00.000", CONN_MAX);

    EXPECT_EQ(strategy.pickupWaitforPreconnectDevice(), older);
    EXPECT_EQ(older->getConnectType(), FarawayDevice::kWlan);
    older->setIsConnected(true);
    EXPECT_EQ(strategy.pickupWaitforPreconnectDevice(), newerFailed);
    newerFailed->setIsConnected(true);
    EXPECT_EQ(strategy.pickupWaitforPreconnectDevice(), nullptr);  // another account, or failed out

    // A user's pick overrides the account check, not the failure limit.
    StrategyDevicePreconnect::addUserPickPreconnectDeviceId(otherAccount->getDeviceId());
    EXPECT_EQ(strategy.pickupWaitforPreconnectDevice(), otherAccount);
    otherAccount->setFarawayWlanConnectCount(CONN_MAX);
    EXPECT_EQ(strategy.pickupWaitforPreconnectDevice(), nullptr);
    EXPECT_EQ(exhausted->getConnectType(), "");
}

// The link taken up again after the phone drops it is checked in PreconnectE2ETest.
TEST_F(SchedulerTest, UserRequestIsPreconnectedAndReported) {
    phonesim::Listener phone(phoneOptions());
    env.config().phoneTcpPort = phone.port();
    auto& registry = DeviceWaitForPreConnectManager::instance();
    registry.addFarawayDevices({{"data", {cloudRecord({"127.0.0.1"})}}});
    const std::string id = deviceKeyOf("SIMP");
    scheduler.run();
    EXPECT_TRUE(StrategyDevicePreconnect::preconnectDeviceByDeviceId(id));
    DeviceWaitForPreConnectManager::Entry entry;
    ASSERT_TRUE(registry.lookupDevices(id, entry));
    EXPECT_TRUE(entry->getIsConnected());

    const Json attempt = nextRecord("W688|10253");
    const Json first = nextRecord("W688|10254");
    ASSERT_TRUE(attempt.is_object() && first.is_object());
    EXPECT_EQ(attempt["value"]["connect_result"], 1);
    EXPECT_EQ(attempt["value"]["market_name"], "Sim Phone");
    EXPECT_EQ(attempt["value"]["connect_unique_id"], first["value"]["connect_unique_id"]);
    EXPECT_FALSE(first["value"].contains("duration"));
}

TEST_F(SchedulerTest, UserRequestFailsAfterTwoFailedAttempts) {
    env.config().phoneTcpPort = test::freeTcpPort();
    auto& registry = DeviceWaitForPreConnectManager::instance();
    registry.addFarawayDevices({{"data", {cloudRecord({"127.0.0.1"})}}});
    scheduler.run();
    const std::string id = deviceKeyOf("SIMP");
    EXPECT_FALSE(StrategyDevicePreconnect::preconnectDeviceByDeviceId(id));
    loop.call([] {});  // the attempt that gave the outcome has been booked
    DeviceWaitForPreConnectManager::Entry entry;
    ASSERT_TRUE(registry.lookupDevices(id, entry));
    EXPECT_EQ(entry->getFarawayWlanConnectCount(), CONN_MAX);
    EXPECT_GE(entry->getPreconnectTryNumber(), CONN_MAX);  // an attempt before the pick may add one
    EXPECT_EQ(entry->getConnectType(), "");
    EXPECT_EQ(entry->getFarawayDevice()->getCommunicationChannel(), nullptr);
}

TEST_F(SchedulerTest, PcEventsAdjustEveryEntry) {
    DeviceWaitForPreConnectManager registry(&loop);
    PreConnectEventSubscriber subscriber(loop, registry);
    phonesim::Listener phone(phoneOptions());
    const auto link = held(registry, phone);
    const auto failed = add(registry, loop, "AAAA", "2026-12-06 10:00:00.000", 2);

    subscriber.eventNotify(ServiceEvent::Pcsuite);
    EXPECT_EQ(failed->getFarawayWlanConnectCount(), 1);
    subscriber.eventNotify(ServiceEvent::WifiOpen);
    EXPECT_EQ(failed->getFarawayWlanConnectCount(), 0);
    subscriber.eventNotify(ServiceEvent::NetworkChange);  // held links end
    EXPECT_TRUE(phone.pcClosed(5s));
    link->setFirstConnect(false);
    subscriber.eventNotify(ServiceEvent::AccountChange);  // still signed in
    EXPECT_TRUE(link->getFirstConnect());
    EXPECT_EQ(registry.getDevicesSize(), 2);
    dataInstance().set(&databaseParam::openid, "");
    subscriber.eventNotify(ServiceEvent::AccountChange);  // signed out
    EXPECT_EQ(registry.getDevicesSize(), 0);
    EXPECT_FALSE(link->getIsConnected());

    // Another account signing in, with no sign-out in between and no new list yet, ends every
    // held link of the previous one.
    dataInstance().set(&databaseParam::openid, "openid-of-pc");
    subscriber.eventNotify(ServiceEvent::AccountChange);
    const auto next = held(registry, phone);
    dataInstance().set(&databaseParam::openid, "openid-of-someone-else");
    subscriber.eventNotify(ServiceEvent::AccountChange);
    EXPECT_TRUE(phone.pcClosed(5s));
    EXPECT_EQ(registry.getDevicesSize(), 0);
    EXPECT_FALSE(next->getIsConnected());
}

TEST_F(SchedulerTest, DeviceDroppedDuringItsHandshakeKeepsNoLink) {
    auto& registry = DeviceWaitForPreConnectManager::instance();
    const std::string id = deviceKeyOf("SIMP");
    // The registry drops the device after the phone got the request and before it answers.
    phonesim::Listener phone(phoneOptions(), [&](const phonesim::Listener::Event& event) {
        if (event.kind == phonesim::Listener::Event::Kind::Request) registry.deleteDevices(id);
    });
    env.config().phoneTcpPort = phone.port();
    registry.addFarawayDevices({{"data", {cloudRecord({"127.0.0.1"})}}});
    DeviceWaitForPreConnectManager::Entry entry;
    ASSERT_TRUE(registry.lookupDevices(id, entry));
    scheduler.run();
    ASSERT_TRUE(phone.request(5s));
    EXPECT_TRUE(phone.pcClosed(5s));  // the answered handshake's link is not held
    EXPECT_FALSE(entry->getIsConnected());
    EXPECT_EQ(entry->getFarawayDevice()->getCommunicationChannel(), nullptr);
}

TEST(ReportPreconnectResultTest, OneWaiterPerDeviceAndOnlyItsOwnRemoval) {
    auto& results = ReportPreconnectResult::instance();
    EXPECT_FALSE(results.notify("X", "success"));  // nobody waits
    auto first = std::make_shared<PreconnectObserver>("X");
    auto second = std::make_shared<PreconnectObserver>("X");
    results.addReceiptMessageObserver("X", first);
    results.addReceiptMessageObserver("X", second);
    results.removeReceiptMessageObserver("X", first);  // replaced already: leaves the second
    std::thread scheduler([&] { results.notify("X", "failed"); });
    EXPECT_EQ(second->wait(5s), "failed");
    scheduler.join();
    EXPECT_FALSE(first->isInvoked());
    results.removeReceiptMessageObserver("X", second);
    EXPECT_FALSE(results.notify("X", "success"));
}

}  // namespace
}  // namespace kesu
