// Device-list reports against a stub PC suite on loopback that records what was posted.
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <string>

#include "core/EventLoop.h"
#include "app/ServiceManager.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpMessage.h"
#include "reports/DeviceReports.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"
#include "support/StubPcSuite.h"
#include "unit/discovery/DiscoveryFixture.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

const char* const kLanPath = "/SSDPQueryAll";
const char* const kPreconnectPath = "/RH2RF_PUSH_GATT_CLIENT_LIST";

using test::phoneBody;

// The list element the PC suite receives for phoneBody(id) heard from `ip`.
std::string element(const std::string& hexId, const std::string& ip, const std::string& account = "138****000") {
    return R"({"account":")" + account + R"(","deviceId":")" + hexId +
           R"(","deviceName":"X1 Pro","deviceType":"phone","guide":"G1","ip":[")" + ip +
           R"("],"isAccountFull":false,"isDeviceNameFull":true,"isOpenIdSame":true,"openId":"openid-of-this-pc"})";
}

// A pre-connect entry as the registry holds it; only its PC suite form matters here.
class ListedEntry : public IDeviceWaitForPreConnect {
public:
    explicit ListedEntry(Json info) : info_(std::move(info)) {}
    std::string getDeviceId() const override { return json::str(info_, "id"); }
    bool getIsConnected() const override { return json::boolean(info_, "isConnected"); }
    bool getIsFarawayDiscovered() const override { return true; }
    Json getPcsuiteDeviceInfo() const override { return info_; }
    void setIsDisconnectNow(bool) override {}
    void reduceConnectCount() override {}
    void resetConnectCount() override {}
    void setFirstConnect(bool) override {}
    void disconnectPreConnect() override {}

private:
    Json info_;
};

class DeviceReportsTest : public test::DiscoveryTest {
protected:
    void SetUp() override {
        test::DiscoveryTest::SetUp();
        pcsuite.pointPcsuiteHere(env.config());
        env.config().httpWaitTimeout = 5s;
        env.config().reportDelay = 20ms;
        env.config().reportThrottle = 100ms;
        env.config().expirySweepPeriod = 20ms;
        fake->addAdapter("Ethernet", "eth0", "aa:bb:cc:dd:ee:01", "192.168.1.20");
        loop.start();
    }

    // A started LAN reporter woken by the table's change rule.
    std::shared_ptr<WlanReportDevices> lanReporter() {
        auto reporter = std::make_shared<WlanReportDevices>(table);
        reporter->start(loop);
        compare.addObserver(reporter);
        return reporter;
    }

    // Waits for the n-th request to `path` (LAN list unless told); other paths may come meanwhile.
    bool reports(std::size_t n, std::chrono::milliseconds timeout, const std::string& path = kLanPath) {
        const auto deadline = std::chrono::steady_clock::now() + timeout;
        for (;;) {
            if (pcsuite.requestsTo(path).size() >= n) return true;
            const auto left =
                std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
            if (left <= 0ms || !pcsuite.waitForRequests(pcsuite.requestCount() + 1, left))
                return pcsuite.requestsTo(path).size() >= n;
        }
    }
    // Every recorded request as "METHOD path", for failure messages.
    std::string seen() const {
        std::string out;
        for (const auto& r : pcsuite.requests()) out += r.method + " " + r.path + "; ";
        return out;
    }
    std::string body(std::size_t i) const { return pcsuite.requestsTo(kLanPath).at(i).body; }

    void hear(const Json& announcement, const std::string& ip, SsdpDeviceManager& into) {
        SsdpMessage::insertResponseDevice(json::compact(announcement), ip, "openid-of-this-pc", true, into);
    }
    void hear(const Json& announcement, const std::string& ip) { hear(announcement, ip, table); }

    test::StubPcSuite pcsuite;
    SsdpDeviceManager table{64, 30.0, clock};
    WlanDetectedDeviceCompare compare{table};
    EventLoop loop;
};

TEST_F(DeviceReportsTest, OnlyNewDevicesAndAccountGuideOpenIdChangesCount) {
    env.config().reportDelay = 1h;  // nothing is sent: a waiting report shows a notification
    auto reporter = lanReporter();
    auto notified = [&] {
        const bool waiting = !reporter->waitIdle(0ms);
        reporter->cancel();
        return waiting;
    };

    // Through the table's hook, as announcements arrive.
    hear(phoneBody("abcd"), "10.0.0.1");
    EXPECT_TRUE(notified());  // new
    advance(5);
    hear(phoneBody("abcd"), "10.0.0.9");
    EXPECT_FALSE(notified());  // same values, another address and time
    hear(phoneBody("abcd", "139****1111"), "10.0.0.1");
    EXPECT_TRUE(notified());  // account

    hear(phoneBody("abcd", "139****1111", "Renamed"), "10.0.0.1");
    EXPECT_FALSE(notified());  // the name alone
    SsdpDevicePtr stored;
    ASSERT_TRUE(table.ssdpDeviceMap.lookup("61626364", stored));
    SsdpDevice flipped = *stored;
    flipped.isOpenIdSame = !flipped.isOpenIdSame;
    EXPECT_TRUE(compare.checkWhetherDeviceChange(flipped));
    EXPECT_TRUE(notified());

    // A reporter taken off the list is not woken any more.
    compare.removeObserver(reporter);
    hear(phoneBody("wxyz"), "10.0.0.2");
    EXPECT_FALSE(notified());
    EXPECT_TRUE(pcsuite.requestsTo(kLanPath).empty());
}

TEST_F(DeviceReportsTest, BurstGoesAsOneListAndTheThrottleHoldsTheNext) {
    env.config().reportDelay = 300ms;
    env.config().reportThrottle = 1h;
    auto reporter = lanReporter();

    hear(phoneBody("bbbb"), "10.0.0.2");
    hear(phoneBody("aaaa"), "10.0.0.1");
    ASSERT_TRUE(reports(1, 10s)) << seen();
    EXPECT_EQ(body(0), "[" + element("61616161", "10.0.0.1") + ", " + element("62626262", "10.0.0.2") + "]");

    // The next change waits for the throttle; stop() ends that wait and nothing goes.
    hear(phoneBody("cccc"), "10.0.0.3");
    EXPECT_FALSE(reports(2, 500ms)) << seen();
    reporter->stop();
    compare.notifySubscribers();  // a stopped reporter ignores notifications
    EXPECT_FALSE(reports(2, 200ms)) << seen();
}

TEST_F(DeviceReportsTest, ChangeWhileAListIsPostedGetsAFollowUp) {
    env.config().reportThrottle = 200ms;
    pcsuite.queueAnswer(kLanPath, {200, R"({"code":"000000"})", "application/json", 700ms});
    auto reporter = lanReporter();

    hear(phoneBody("aaaa"), "10.0.0.1");
    ASSERT_TRUE(reports(1, 10s)) << seen();  // its answer is still held back
    hear(phoneBody("bbbb"), "10.0.0.2");
    hear(phoneBody("bbbb", "139****1111"), "10.0.0.2");
    ASSERT_TRUE(reports(2, 10s)) << seen();
    EXPECT_FALSE(reports(3, 600ms)) << seen();  // one follow-up, not one per change
    EXPECT_EQ(body(0), "[" + element("61616161", "10.0.0.1") + "]");
    EXPECT_EQ(body(1), "[" + element("61616161", "10.0.0.1") + ", " +
                                    element("62626262", "10.0.0.2", "139****111") + "]");
}

// A PC suite that is down is PcsuiteRequestTest's.
TEST_F(DeviceReportsTest, NetworkAndApplicationTests) {
    env.config().reportThrottle = 0ms;
    WlanReportDevices lan(table);
    hear(phoneBody("aaaa"), "10.0.0.1");
    const std::string url = pcsuite.baseUrl() + "SSDPQueryAll";
    const std::string preconnectUrl = pcsuite.baseUrl() + "RH2RF_PUSH_GATT_CLIENT_LIST";
    auto sent = [&](const char* path) { return pcsuite.requestsTo(path).size(); };

    // No Ethernet adapter and Wi-Fi off: nothing posted.
    fake->setNetworkServices({{"Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:02"}});
    EXPECT_FALSE(lan.send(url));
    EXPECT_EQ(sent(kLanPath), 0u);

    // Wi-Fi switched on is enough; so is an Ethernet adapter, even without an address.
    fake->setWifiPowerOn(true);
    EXPECT_TRUE(lan.send(url));
    fake->setWifiPowerOn(false);
    fake->setNetworkServices({{"Ethernet", "eth1", "aa:bb:cc:dd:ee:03"}});
    EXPECT_TRUE(lan.send(url));

    // The application test: exactly two of the PC suite's processes read as "not running".
    const std::string app = DeviceListReporter::pcsuiteAppName;
    DeviceWaitForPreConnectManager registry;
    ReportDevicesV2 preconnect(registry);
    fake->setRunningApplicationNames({app, "bash", app});
    EXPECT_FALSE(lan.send(url));
    EXPECT_FALSE(preconnect.send(preconnectUrl));
    EXPECT_EQ(sent(kLanPath) + sent(kPreconnectPath), 2u);
    fake->setRunningApplicationNames({app});
    EXPECT_TRUE(lan.send(url));

    // The pre-connect list has no network test.
    fake->setNetworkServices({});
    EXPECT_TRUE(preconnect.send(preconnectUrl));
    EXPECT_FALSE(lan.send(url));
    EXPECT_EQ(sent(kLanPath), 3u);
    EXPECT_EQ(sent(kPreconnectPath), 1u);
}

TEST_F(DeviceReportsTest, PreconnectListPostsEveryEntry) {
    DeviceWaitForPreConnectManager registry;
    ReportDevicesV2 reporter(registry);
    reporter.start(loop);
    const Json one{{"id", "a1"}, {"deviceName", "X1"}, {"isConnected", true}, {"rssi", -99}};
    const Json two{{"id", "b2"}, {"deviceName", "Tab"}, {"isConnected", false}, {"inets", Json::array()}};
    registry.addDevices("6131", std::make_shared<ListedEntry>(one));
    registry.addDevices("6232", std::make_shared<ListedEntry>(two));

    reporter.notify();
    reporter.notify();
    ASSERT_TRUE(reports(1, 10s, kPreconnectPath)) << seen();
    ASSERT_TRUE(reporter.waitIdle(10s));
    EXPECT_EQ(pcsuite.requestsTo(kPreconnectPath).size(), 1u);  // two notifications, one list
    EXPECT_EQ(pcsuite.requestsTo(kPreconnectPath).at(0).body,
              R"([{"deviceName":"X1","id":"a1","isConnected":true,"rssi":-99}, )"
              R"({"deviceName":"Tab","id":"b2","inets":[],"isConnected":false}])");
}

TEST_F(DeviceReportsTest, ReannouncedDeviceIsReportedOnceThenOnceMoreWhenItExpires) {
    WlanDeviceDelete expiry(loop, table);
    auto reporter = lanReporter();
    expiry.addObserver(reporter);
    expiry.detectedToDelete(env.config().expirySweepPeriod);

    hear(phoneBody("aaaa"), "10.0.0.1");
    ASSERT_TRUE(reports(1, 10s)) << seen();
    for (int i = 0; i < 5; ++i) {  // the sweep runs meanwhile: every 5 s keeps it listed
        advance(5);
        hear(phoneBody("aaaa"), "10.0.0.1");
    }
    EXPECT_FALSE(reports(2, 400ms)) << seen();

    advance(30.5);  // silent for more than 30 s: removed, the empty list goes
    ASSERT_TRUE(reports(2, 10s)) << seen();
    EXPECT_EQ(body(1), "[]");
    EXPECT_EQ(table.ssdpDeviceMap.size(), 0u);

    // Sweeps that remove nothing send nothing; a stopped sweep removes no more.
    EXPECT_FALSE(reports(3, 300ms)) << seen();
    expiry.stop();
    hear(phoneBody("bbbb"), "10.0.0.2");
    ASSERT_TRUE(reports(3, 10s)) << seen();
    advance(60);
    EXPECT_FALSE(reports(4, 300ms)) << seen();
    EXPECT_EQ(table.ssdpDeviceMap.size(), 1u);
}

// An empty table's sweep wakes at the next expiry, not on its (hour-long) period.
TEST_F(DeviceReportsTest, SweepWakesForTheNextExpiryOfAFreshlyFilledTable) {
    SsdpDeviceManager live{64, 0.2};  // the real clock
    WlanDeviceDelete expiry(loop, live);
    auto reporter = std::make_shared<WlanReportDevices>(live);
    reporter->start(loop);
    expiry.addObserver(reporter);
    expiry.detectedToDelete(1h);
    for (const std::string id : {"aaaa", "bbbb"}) {
        const std::size_t before = pcsuite.requestsTo(kLanPath).size();
        hear(phoneBody(id), "10.0.0.1", live);
        ASSERT_TRUE(reports(before + 1, 10s)) << seen();
        EXPECT_EQ(pcsuite.requestsTo(kLanPath).back().body, "[]");
        EXPECT_EQ(live.ssdpDeviceMap.size(), 0u);
    }
}

// Service wiring: a LAN list at start, per new device, on startSSDPScan, none after stop().
TEST_F(DeviceReportsTest, ServiceStartWiresTheLanReports) {
    env.config().phoneTcpPort = test::freeTcpPort();
    env.config().ssdpPort = test::freeTcpPort();
    SsdpDeviceManager& global = SsdpDeviceManager::instance();
    global.ssdpDeviceMap.clear();

    EventLoop loop;
    loop.start();
    ServiceManager manager(loop);
    manager.start();
    ASSERT_TRUE(reports(1, 10s));
    EXPECT_EQ(body(0), "[]");

    hear(phoneBody("aaaa"), "10.0.0.1", global);
    ASSERT_TRUE(reports(2, 10s));
    EXPECT_EQ(body(1), "[" + element("61616161", "10.0.0.1") + "]");

    EXPECT_EQ(test::control("startSSDPScan")["error"], 0);
    ASSERT_TRUE(reports(3, 10s));
    EXPECT_EQ(body(2), body(1));

    manager.stop();
    WlanDetectedDeviceCompare::instance().notifySubscribers();
    hear(phoneBody("bbbb"), "10.0.0.2", global);
    EXPECT_FALSE(reports(4, 300ms));
    global.ssdpDeviceMap.clear();
}

}  // namespace
}  // namespace kesu
