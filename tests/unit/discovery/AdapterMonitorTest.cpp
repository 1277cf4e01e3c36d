// The adapter monitor over the fake platform: the events and socket rebuilds of adapters
// coming, going, changing address and power, of a network on which the PC stops hearing
// itself, the announcement pass on a real loopback socket, the rebuild pause as a timer,
// and the discovery start-up's stop.
#include <gtest/gtest.h>
#include <unistd.h>

#include <asio/steady_timer.hpp>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>

#include "DiscoveryFixture.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "discovery/Base64.h"
#include "discovery/KesuAdapterManager.h"
#include "discovery/ServiceWorker.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpMessage.h"
#include "support/NetNs.h"
#include "unit/events/EventRecorder.h"
#include "platform/SystemInfo.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using Names = std::vector<std::string>;

using Events = test::EventRecorder::Events;
using test::Adapter;

class AdapterMonitor : public test::DiscoveryTest {
protected:
    void SetUp() override {
        DiscoveryTest::SetUp();
        // Interfaces named here do not exist on this machine: their sockets bind but never
        // join nor send, so only the monitor's bookkeeping is under test.
        env.config().ssdpPort = test::freeUdpPort();
        env.config().ssdpRebuildPause = 0ms;
        EventPublisher::instance().addObserver(events);
        loop.start();
    }
    void TearDown() override {
        EventPublisher::instance().clearObservers();
        DiscoveryTest::TearDown();
    }

    std::shared_ptr<test::EventRecorder> events = std::make_shared<test::EventRecorder>();
    EventLoop loop;
    SsdpDeviceManager devices{64, 30.0, clock};
};

const Adapter kWlan{"Wi-Fi", "kf-wlan0", "192.168.5.2"};
const Adapter kEth{"Ethernet", "kf-eth0", "10.1.1.2"};

TEST_F(AdapterMonitor, StartOpensASocketPerAdapterSilentlyAndTheFirstCheckReportsWifiOn) {
    fake->setWifiPowerOn(true);
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    EXPECT_TRUE(events->take().empty());
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-eth0", "kf-wlan0"}));
    EXPECT_EQ(monitor.networkStatus(),
              (std::map<std::string, std::string>{{"Ethernet", "10.1.1.2"}, {"Wi-Fi", "192.168.5.2"}}));
    ASSERT_TRUE(monitor.managerFor("kf-wlan0")->socket());
    EXPECT_EQ(devices.lastOwnEcho(), clock.now());

    const auto wlanManager = monitor.managerFor("kf-wlan0");
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"WifiOpenEvent"}));
    monitor.checkNetWorkStatus();
    EXPECT_TRUE(events->take().empty());
    EXPECT_EQ(monitor.managerFor("kf-wlan0"), wlanManager);  // nothing rebuilt

    // Announcing through sockets whose interface is missing sends nothing anywhere.
    EXPECT_FALSE(wlanManager->sendResponseData("n", "id", "acc", "open", "svc"));
    monitor.sendSsdp();
}

TEST_F(AdapterMonitor, UnpluggingAndPluggingEthernetBack) {
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    const auto ethManager = monitor.managerFor("kf-eth0");

    network({kWlan});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetDisconnectEvent"}));
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-wlan0"}));
    EXPECT_FALSE(ethManager->socket());  // closed, not just forgotten

    network({kWlan, kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetConnectEvent"}));
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-eth0", "kf-wlan0"}));
    EXPECT_NE(monitor.managerFor("kf-eth0"), ethManager);
}

TEST_F(AdapterMonitor, NewAddressesRebuildTheSocketAndReportDisconnectThenConnect) {
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    const auto wlanManager = monitor.managerFor("kf-wlan0");
    const auto ethManager = monitor.managerFor("kf-eth0");

    network({{"Wi-Fi", "kf-wlan0", "192.168.5.9"}, kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WlanNetDisconnectEvent", "WlanNetConnectEvent"}));
    EXPECT_NE(monitor.managerFor("kf-wlan0"), wlanManager);
    EXPECT_FALSE(wlanManager->socket());
    EXPECT_EQ(monitor.managerFor("kf-eth0"), ethManager);
    EXPECT_EQ(monitor.networkStatus().at("Wi-Fi"), "192.168.5.9");

    // Losing the address keeps the adapter (and a socket on it); getting one back connects.
    network({{"Wi-Fi", "kf-wlan0", "192.168.5.9"}, {"Ethernet", "kf-eth0", ""}});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetDisconnectEvent"}));
    ASSERT_TRUE(monitor.managerFor("kf-eth0"));
    EXPECT_TRUE(monitor.managerFor("kf-eth0")->socket());
    EXPECT_EQ(monitor.networkStatus().at("Ethernet"), "");

    network({{"Wi-Fi", "kf-wlan0", "192.168.5.9"}, kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetConnectEvent"}));
}

TEST_F(AdapterMonitor, WifiPowerOffAndOn) {
    fake->setWifiPowerOn(true);
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"WifiOpenEvent"}));

    // The radio goes off and the interface stays, without its address.
    fake->setWifiPowerOn(false);
    network({{"Wi-Fi", "kf-wlan0", ""}, kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"WifiCloseEvent", "NetworkChangeEvent", "WlanNetDisconnectEvent"}));

    // The interface disappears too: only the removal is new.
    network({kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WlanNetDisconnectEvent"}));
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-eth0"}));

    fake->setWifiPowerOn(true);
    network({kWlan, kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"WifiOpenEvent", "NetworkChangeEvent", "WlanNetConnectEvent"}));
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-eth0", "kf-wlan0"}));

    // Power and interface gone in the same check.
    fake->setWifiPowerOn(false);
    network({kEth});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"WifiCloseEvent", "NetworkChangeEvent", "WlanNetDisconnectEvent"}));
}

TEST_F(AdapterMonitor, SilentNetworkRebuildsEverySocketOncePerTimeoutAndOwnEchoOnAnyAdapterPreventsIt) {
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    auto wlan = monitor.managerFor("kf-wlan0");
    auto eth = monitor.managerFor("kf-eth0");

    advance(60.0);  // exactly the time-out: not yet
    monitor.checkNetWorkStatus();
    EXPECT_EQ(monitor.managerFor("kf-wlan0"), wlan);

    advance(0.5);
    monitor.checkNetWorkStatus();
    EXPECT_TRUE(events->take().empty());
    EXPECT_NE(monitor.managerFor("kf-wlan0"), wlan);
    EXPECT_NE(monitor.managerFor("kf-eth0"), eth);
    EXPECT_FALSE(wlan->socket());
    EXPECT_FALSE(eth->socket());
    EXPECT_EQ(devices.lastOwnEcho(), clock.now());  // reset once for the whole check

    wlan = monitor.managerFor("kf-wlan0");
    eth = monitor.managerFor("kf-eth0");
    monitor.checkNetWorkStatus();  // the next check does not rebuild again
    EXPECT_EQ(monitor.managerFor("kf-wlan0"), wlan);

    // One socket heard the PC's own announcement 30 s ago: no socket is rebuilt, although
    // the last rebuild is 70 s old.
    advance(40.0);
    devices.markOwnEcho();
    advance(30.0);
    monitor.checkNetWorkStatus();
    EXPECT_EQ(monitor.managerFor("kf-wlan0"), wlan);
    EXPECT_EQ(monitor.managerFor("kf-eth0"), eth);
}

TEST_F(AdapterMonitor, SocketFollowsItsAdapterToAnotherInterface) {
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    const auto eth0 = monitor.managerFor("kf-eth0");

    network({kWlan, {"Ethernet", "kf-eth1", "10.1.1.7"}});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetDisconnectEvent", "WiredNetConnectEvent"}));
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-eth1", "kf-wlan0"}));
    EXPECT_FALSE(eth0->socket());

    // Same address on yet another interface: no event, but the socket moves.
    network({kWlan, {"Ethernet", "kf-eth2", "10.1.1.7"}});
    monitor.checkNetWorkStatus();
    EXPECT_TRUE(events->take().empty());
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-eth2", "kf-wlan0"}));

    network({kWlan});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetDisconnectEvent"}));
    EXPECT_EQ(monitor.socketInterfaces(), (Names{"kf-wlan0"}));
}

// Ethernet is the loopback interface here, so the announcement really goes out and comes
// back: the PC hears itself, and that keeps its socket from being rebuilt.
TEST_F(AdapterMonitor, AnnouncesThePcOnEachSocketAndHearsItself) {
    network({{"Ethernet", "lo", "127.0.0.1"}});

    std::mutex m;
    std::condition_variable cv;
    std::vector<std::string> heard;  // by the monitor's own socket, after classification
    auto record = [&](std::string_view data, const std::string& host, std::uint16_t) {
        SsdpMessage::handleDatagram(data, host, devices);
        std::lock_guard<std::mutex> l(m);
        heard.emplace_back(data);
        cv.notify_all();
    };
    KesuAdapterManager monitor(loop, devices, record);
    ASSERT_TRUE(monitor.managerFor("lo"));
    ASSERT_TRUE(monitor.managerFor("lo")->socket()->isReceiving());

    advance(50.0);
    monitor.sendSsdp();
    {
        std::unique_lock<std::mutex> l(m);
        ASSERT_TRUE(cv.wait_for(l, 10s, [&] { return !heard.empty(); }));
    }
    EXPECT_EQ(devices.lastOwnEcho(), clock.now());

    const std::string datagram = heard.front();
    ASSERT_TRUE(datagram.starts_with("RESPONSE * HTTP/1.1\r\nDATE:"));
    // The body's text is checked where it is built, the account's fields end to end.
    const Json pc = json::parse(SsdpMessage::decodeCompatPayload(datagram)).value_or(Json());
    EXPECT_EQ(pc["deviceName"], "Off****-PC");
    EXPECT_EQ(pc["deviceId"], SystemInfo::getMacAddress());

    const auto socketBefore = monitor.managerFor("lo");
    advance(30.0);  // 80 s after the start, 30 s after the echo
    monitor.checkNetWorkStatus();
    EXPECT_EQ(monitor.managerFor("lo"), socketBefore);
}

// A rebuild closes the socket at once and opens the new one when the pause has passed, on
// the loop and without holding up the check; the new socket announces the PC straight away.
// A check during the pause does not rebuild again, and an adapter removed meanwhile stays
// removed.
TEST_F(AdapterMonitor, RebuildPauseIsATimerAndTheReopenedSocketAnnounces) {
    env.config().ssdpRebuildPause = 1s;
    network({{"Ethernet", "lo", ""}});
    std::mutex m;
    std::condition_variable cv;
    int announcements = 0;
    KesuAdapterManager monitor(loop, devices, [&](std::string_view data, const std::string&, std::uint16_t) {
        if (!std::string(data).starts_with("RESPONSE * HTTP/1.1")) return;
        std::lock_guard<std::mutex> l(m);
        ++announcements;
        cv.notify_all();
    });
    const auto before = monitor.managerFor("lo");

    network({{"Ethernet", "lo", "127.0.0.1"}});
    monitor.checkNetWorkStatus();  // returns during the pause
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetConnectEvent"}));
    EXPECT_FALSE(before->socket());
    EXPECT_EQ(monitor.managerFor("lo"), before);  // still closed
    monitor.checkNetWorkStatus();
    EXPECT_TRUE(events->take().empty());
    {
        std::unique_lock<std::mutex> l(m);
        ASSERT_TRUE(cv.wait_for(l, 10s, [&] { return announcements > 0; }));
    }
    ASSERT_NE(monitor.managerFor("lo"), before);
    EXPECT_TRUE(monitor.managerFor("lo")->socket()->isReceiving());

    // Readdressed and then removed within one pause: nothing reopens once the pause is over
    // (a timer armed after the rebuild's fires after it).
    network({{"Ethernet", "lo", "127.0.0.2"}});
    monitor.checkNetWorkStatus();
    network({});
    monitor.checkNetWorkStatus();
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetDisconnectEvent", "WiredNetConnectEvent",
                                      "NetworkChangeEvent", "WiredNetDisconnectEvent"}));
    std::promise<void> pauseOver;
    asio::steady_timer later(loop.context(), 1500ms);
    later.async_wait([&](const asio::error_code&) { pauseOver.set_value(); });
    ASSERT_EQ(pauseOver.get_future().wait_for(10s), std::future_status::ready);
    EXPECT_TRUE(monitor.socketInterfaces().empty());
    std::lock_guard<std::mutex> l(m);
    EXPECT_EQ(announcements, 1);
}

// The start-up: its first pass runs at once, and stop() ends it during a long period and a
// long rebuild pause; a new start opens the sockets again from scratch.
TEST_F(AdapterMonitor, ServiceWorkerStopsAtOnceAndStartsAfresh) {
    env.config().ssdpAnnouncePeriod = std::chrono::hours(1);
    env.config().ssdpRebuildPause = std::chrono::hours(1);
    env.config().ssdpSelfEchoTimeout = 0ms;  // every check rebuilds...
    struct TickingClock : SteadyClock {       // ...as each reading of the clock is a second later
        time_point now() const override { return time_point(std::chrono::seconds(++ticks)); }
        mutable std::atomic<int> ticks{0};
    } ticking;
    SsdpDeviceManager table(64, 30.0, ticking);
    fake->setWifiPowerOn(true);
    network({kEth});

    ServiceWorker worker(loop, table);
    for (int round = 0; round < 2; ++round) {
        worker.start();
        EXPECT_TRUE(worker.isRunning());
        ASSERT_TRUE(worker.adapters());
        EXPECT_TRUE(worker.adapters()->isActive());
        ASSERT_TRUE(events->waitFor("WifiOpenEvent", 1, 10s));  // the check has begun
        worker.stop();
        EXPECT_FALSE(worker.isRunning());
        EXPECT_FALSE(worker.adapters());
        EXPECT_EQ(events->take(), (Events{"WifiOpenEvent"}));
    }
    worker.stop();  // a second stop is harmless
}

// A new address in a network namespace reaches the running discovery through the kernel's
// change notification: announced on it long before the (here one hour) announce period.
TEST_F(AdapterMonitor, KernelChangeNotificationTriggersACheckAtOnce) {
    if (!test::NetNsLab::available()) GTEST_SKIP() << "network namespaces need root";
    test::NetNsLab lab("lc" + std::to_string(::getpid()), false);
    const std::string ns = lab.addNode("pc", 1).ns;  // loopback only
    ASSERT_TRUE(lab.ok()) << lab.error();
    env.config().ssdpAnnouncePeriod = std::chrono::hours(1);
    fake->setWifiPowerOn(true);
    network({});

    ServiceWorker worker(loop, devices);
    // The worker's sockets and listener open in the namespace.
    ASSERT_TRUE(test::NetNsLab::runIn(ns, [&] { worker.start(); }));
    ASSERT_TRUE(worker.isRunning());
    ASSERT_TRUE(events->waitFor("WifiOpenEvent", 1, 10s));  // the first pass is over
    ASSERT_TRUE(worker.adapters()->socketInterfaces().empty());

    // The fake platform reports the adapter; the kernel's notification says when to look.
    network({{"Ethernet", "kf-lc0", "10.77.9.1"}});
    ASSERT_TRUE(test::NetNsLab::ip("-n " + ns + " link add kf-lc0 type veth peer name kf-lc1"));
    ASSERT_TRUE(events->waitFor("WiredNetConnectEvent", 1, 10s));
    EXPECT_EQ(worker.adapters()->socketInterfaces(), (Names{"kf-lc0"}));
    worker.stop();
}

}  // namespace
}  // namespace kesu
