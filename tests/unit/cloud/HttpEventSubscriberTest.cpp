// The cloud subscriber against a real stub center on loopback, a running event loop and a real
// pre-connect registry: what each event sends and in which order, the throttle, and the
// center's failures (down, refusing, slow, malformed or huge lists, a late list for an
// account that is gone), none of which may reach the registry or hold up the loop.
#include <future>
#include <string>
#include <vector>

#include "cloud/HttpEventSubscriber.h"
#include "core/EventLoop.h"
#include "platform/fake/FakePlatform.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"
#include "support/UdpCatcher.h"
#include "unit/cloud/CloudFixture.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

// A device-list reply naming phones of the four-character business ids `ids`, and a PC (never
// an entry).
std::string listReply(const std::vector<std::string>& ids) {
    const auto record = [](const std::string& id, int type) {
        return Json{{"deviceId", "cloud-" + id}, {"type", type}, {"bizInfo", {{"conn_base", {{"businessId", id}}}}}};
    };
    Json data = Json::array({record("pc09", 3)});
    for (const auto& id : ids) data.push_back(record(id, 1));
    return Json{{"code", 0}, {"msg", "ok"}, {"data", data}}.dump();
}

class HttpEventSubscriberTest : public test::CloudAccountTest {
protected:
    void SetUp() override {
        CloudAccountTest::SetUp();
        env.config().httpRequestTimeout = 5s;
        env.config().telemetryUdpPort = telemetry.port();
        fake->addAdapter("Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:01", "10.0.0.5", "255.255.255.0");
        center.setDefaultAnswer({200, R"({"code":0})"});
        center.setAnswer("/device/list", {200, listReply({})});
        loop.start();
    }
    void TearDown() override {
        EXPECT_TRUE(subscriber->stop(10s));
        loop.stop();
        center.stop();
        CloudAccountTest::TearDown();
    }

    // Publishes `event` to the subscriber and waits until it has been handled.
    void handle(ServiceEvent event) {
        subscriber->notify(event);
        ASSERT_TRUE(subscriber->waitIdle(20s));
    }
    std::vector<std::string> paths() const {
        std::vector<std::string> out;
        for (const auto& request : center.requests()) out.push_back(request.path);
        return out;
    }
    ScopedFakePlatform fake;
    test::UdpCatcher telemetry;
    EventLoop loop;
    DeviceWaitForPreConnectManager registry{&loop};
    ManualClock clock;
    std::shared_ptr<HttpEventSubscriber> subscriber = std::make_shared<HttpEventSubscriber>(loop, registry, clock);
};

TEST_F(HttpEventSubscriberTest, AccountChangeUnbindsReportsAndFetchesInThatOrder) {
    center.setAnswer("/device/list", {200, listReply({"dev1", "dev2"})});
    handle(ServiceEvent::AccountChange);

    EXPECT_EQ(paths(), (std::vector<std::string>{"/device/unBind", "/device/report", "/device/list"}));
    EXPECT_EQ(subscriber->lastReportDeviceInfo(), Json::array());  // accepted
    EXPECT_EQ(registry.getDevicesSize(), 2);                       // the phones, not the PC

    // Other events report then fetch; a device-info request only reports; others do nothing.
    center.clearRequests();
    handle(ServiceEvent::WifiOpen);
    handle(ServiceEvent::DeviceInfoReport);
    handle(ServiceEvent::WifiClose);
    EXPECT_EQ(paths(), (std::vector<std::string>{"/device/report", "/device/list", "/device/report"}));
}

TEST_F(HttpEventSubscriberTest, ListRequestsWithinThreeSecondsAreSkippedOtherEventsNot) {
    handle(ServiceEvent::DeviceListUpdate);
    handle(ServiceEvent::DeviceListUpdate);  // same instant: skipped
    handle(ServiceEvent::Pcsuite);           // skipped too
    handle(ServiceEvent::NetworkChange);     // never throttled
    clock.advance(2900ms);
    handle(ServiceEvent::Pcsuite);  // 2.9 s after the network change
    clock.advance(100ms);
    handle(ServiceEvent::DeviceListUpdate);
    EXPECT_EQ(paths(), (std::vector<std::string>{"/device/list", "/device/report", "/device/list", "/device/list"}));
}

TEST_F(HttpEventSubscriberTest, ACenterThatRefusesIsDownOrSlowChangesNothingAndHoldsNothing) {
    center.setAnswer("/device/list", {200, listReply({"dev1"})});
    handle(ServiceEvent::DeviceListUpdate);
    ASSERT_EQ(registry.getDevicesSize(), 1);

    // Refusing: the report stays pending, the list is kept, a failure record names the code.
    center.setAnswer("/device/report", {200, R"({"code":120000,"msg":"token invalid"})"});
    center.setAnswer("/device/list", {200, R"({"code":120002,"msg":"token expired"})"});
    clock.advance(3s);
    handle(ServiceEvent::LogOn);
    EXPECT_EQ(subscriber->lastReportDeviceInfo().size(), 1u);
    const auto record = telemetry.receive(5s);
    ASSERT_TRUE(record);
    Json failure = Json::parse(*record);
    EXPECT_GT(failure["createTime"].get<long long>(), 1700000000000LL);
    failure.erase("createTime");
    EXPECT_EQ(failure, Json::parse(R"({"pType":0,"eventID":"W688|10316","isDayReport":0,"value":)"
                                   R"({"fail_code":120002,"fail_reason":"token expired","trigger_reason":"LogOnEvent"}})"));
    EXPECT_TRUE(test::logged(
        "[HttpEventSubscriber::getPreDeviceList] device/list request failed! status: 120002, msg: token expired"));

    // Slow: while the center holds the answer the loop and the pool still run other work; the
    // request gives up at its time-out.
    env.config().httpRequestTimeout = 1s;
    center.setAnswer("/device/list", {200, listReply({}), "application/json", 30s});
    clock.advance(3s);
    center.clearRequests();
    subscriber->notify(ServiceEvent::DeviceListUpdate);
    ASSERT_TRUE(center.waitForRequest([](const auto& r) { return r.path == "/device/list"; }, 5s));
    EXPECT_TRUE(loop.call([] {}, 5s));
    std::promise<void> ran;
    loop.offload([&] { ran.set_value(); });
    EXPECT_EQ(ran.get_future().wait_for(5s), std::future_status::ready);
    ASSERT_TRUE(subscriber->waitIdle(20s));

    // Down (connection refused): no HTTP status, so no failure record.
    Endpoints::setConnectCenterServerUrl("http://127.0.0.1:" + std::to_string(test::freeTcpPort()));
    clock.advance(3s);
    handle(ServiceEvent::DeviceListUpdate);
    EXPECT_EQ(registry.getDevicesSize(), 1);
    EXPECT_FALSE(telemetry.receive(300ms));
}

TEST_F(HttpEventSubscriberTest, MalformedOrHugeListsAreBounded) {
    center.setAnswer("/device/list", {200, listReply({"dev1"})});
    handle(ServiceEvent::DeviceListUpdate);
    // No JSON object, or "data" that is no array: the registry keeps what it had.
    for (const std::string body : {R"({"code":0,"data":"dev2"})", R"({"code":0,"data":{"a":1}})", "[{", "no"}) {
        center.setAnswer("/device/list", {200, body});
        clock.advance(3s);
        handle(ServiceEvent::DeviceListUpdate);
        EXPECT_EQ(registry.getDevicesSize(), 1) << body;
    }

    // A thousand records: a hundred ids repeated give a hundred entries; of a thousand
    // distinct ones only the first maxListedDevices records are taken (one is the PC).
    for (const int distinct : {100, 1000}) {
        std::vector<std::string> ids;
        for (int i = 0; i < 1000; ++i) ids.push_back(std::to_string(1000 + i % distinct));
        center.setAnswer("/device/list", {200, listReply(ids)});
        clock.advance(3s);
        handle(ServiceEvent::DeviceListUpdate);
        EXPECT_EQ(registry.getDevicesSize(), distinct == 100 ? 100 : int(HttpEventSubscriber::maxListedDevices) - 1);
    }
}

TEST_F(HttpEventSubscriberTest, AListForTheAccountSignedOutMeanwhileIsNeverMerged) {
    center.setAnswer("/device/list", {200, listReply({"dev1"}), "application/json", 1s});
    subscriber->notify(ServiceEvent::DeviceListUpdate);
    ASSERT_TRUE(center.waitForRequest([](const auto& r) { return r.path == "/device/list"; }, 5s));

    // Signed out while the center still holds the answer; the change is published.
    dataInstance().update([](databaseParam& p) {
        p.openid.clear();
        p.token.clear();
    });
    subscriber->notify(ServiceEvent::AccountChange);
    ASSERT_TRUE(subscriber->waitIdle(20s));

    EXPECT_EQ(registry.getDevicesSize(), 0);
    EXPECT_EQ(center.requestCount(), 1u);  // signed out: nothing more is sent
    EXPECT_TRUE(test::logged(
        "[HttpEventSubscriber::getPreDeviceList] account changed while the list was fetched, the list is dropped"));
}

}  // namespace
}  // namespace kesu
