// The adapter monitor over the fake platform: events and socket rebuilds, the silent-network
// rebuild, the rebuild pause and the discovery start-up's stop. Announcing on each adapter is
// checked across namespaces (SsdpSocketTest).
#include <unistd.h>

#include <asio/steady_timer.hpp>
#include <future>

#include "DiscoveryFixture.h"
#include "core/EventLoop.h"
#include "discovery/KesuAdapterManager.h"
#include "discovery/ServiceWorker.h"
#include "support/NetNs.h"
#include "unit/events/EventRecorder.h"

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
        // The kf-* interfaces do not exist: their sockets bind but never join nor send.
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

// One monitor through adapters plugged, unplugged, readdressed, moved and Wi-Fi powered off/on:
// the events of each check, the sockets kept, and the sockets rebuilt (the old one closed).
TEST_F(AdapterMonitor, AdapterChangesGiveTheirEventsAndRebuildOnlyTheirSockets) {
    fake->setWifiPowerOn(true);
    network({kWlan, kEth});
    KesuAdapterManager monitor(loop, devices);
    EXPECT_TRUE(events->take().empty());  // start opens a socket per adapter silently
    EXPECT_EQ(devices.lastOwnEcho(), clock.now());
    // Announcing through sockets whose interface is missing sends nothing anywhere.
    EXPECT_FALSE(monitor.managerFor("kf-wlan0")->sendResponseData("n", "id", "acc", "open", "svc"));
    monitor.sendSsdp();

    const Adapter wlan9{"Wi-Fi", "kf-wlan0", "192.168.5.9"}, wlanNoIp{"Wi-Fi", "kf-wlan0", ""};
    const Adapter eth1{"Ethernet", "kf-eth1", "10.1.1.7"}, eth2{"Ethernet", "kf-eth2", "10.1.1.7"};
    struct Step {
        std::vector<Adapter> net;
        bool wifi;
        Events events;
        Names sockets, rebuilt, kept;
    };
    const std::string change = "NetworkChangeEvent", wiredOff = "WiredNetDisconnectEvent",
                      wiredOn = "WiredNetConnectEvent", wlanOff = "WlanNetDisconnectEvent", wlanOn = "WlanNetConnectEvent";
    const Names both{"kf-eth0", "kf-wlan0"}, wlanOnly{"kf-wlan0"}, ethOnly{"kf-eth0"};
    const std::vector<Step> steps = {
        {{kWlan, kEth}, true, {"WifiOpenEvent"}, both, {}, both},
        {{kWlan, kEth}, true, {}, both, {}, both},
        {{kWlan}, true, {change, wiredOff}, wlanOnly, ethOnly, {}},
        {{kWlan, kEth}, true, {change, wiredOn}, both, {}, {}},
        {{wlan9, kEth}, true, {change, wlanOff, wlanOn}, both, wlanOnly, ethOnly},
        // Losing the address keeps the adapter and a socket on it; getting one back connects.
        {{wlan9, {"Ethernet", "kf-eth0", ""}}, true, {change, wiredOff}, both, {}, {}},
        {{wlan9, kEth}, true, {change, wiredOn}, both, {}, {}},
        // The radio goes off, the interface stays without its address; then it disappears too.
        {{wlanNoIp, kEth}, false, {"WifiCloseEvent", change, wlanOff}, both, {}, {}},
        {{kEth}, false, {change, wlanOff}, ethOnly, {}, {}},
        {{kWlan, kEth}, true, {"WifiOpenEvent", change, wlanOn}, both, {}, {}},
        {{kEth}, false, {"WifiCloseEvent", change, wlanOff}, ethOnly, {}, {}},  // power and interface at once
        {{kWlan, kEth}, true, {"WifiOpenEvent", change, wlanOn}, both, {}, {}},
        // The socket follows its adapter to another interface; with the same address no event.
        {{kWlan, eth1}, true, {change, wiredOff, wiredOn}, {"kf-eth1", "kf-wlan0"}, ethOnly, wlanOnly},
        {{kWlan, eth2}, true, {}, {"kf-eth2", "kf-wlan0"}, {}, {}},
        {{kWlan}, true, {change, wiredOff}, wlanOnly, {}, {}},
    };
    for (std::size_t i = 0; i < steps.size(); ++i) {
        SCOPED_TRACE("step " + std::to_string(i));
        const Step& s = steps[i];
        std::map<std::string, std::shared_ptr<SsdpSocketManager>> before;
        for (const std::string& name : monitor.socketInterfaces()) before[name] = monitor.managerFor(name);
        fake->setWifiPowerOn(s.wifi);
        network(s.net);
        monitor.checkNetWorkStatus();
        EXPECT_EQ(events->take(), s.events);
        EXPECT_EQ(monitor.socketInterfaces(), s.sockets);
        for (const std::string& name : monitor.socketInterfaces()) EXPECT_TRUE(monitor.managerFor(name)->socket());
        for (const std::string& name : s.rebuilt) {
            EXPECT_FALSE(before.at(name)->socket()) << name;  // closed, not just forgotten
            EXPECT_NE(monitor.managerFor(name), before.at(name)) << name;
        }
        for (const std::string& name : s.kept) EXPECT_EQ(monitor.managerFor(name), before.at(name)) << name;
        const auto status = monitor.networkStatus();
        for (const Adapter& a : s.net) EXPECT_EQ(status.at(a.kind), a.ip) << a.kind;
    }
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
    EXPECT_FALSE(eth->socket());
    EXPECT_EQ(devices.lastOwnEcho(), clock.now());  // reset once for the whole check

    wlan = monitor.managerFor("kf-wlan0");
    eth = monitor.managerFor("kf-eth0");
    monitor.checkNetWorkStatus();  // the next check does not rebuild again
    EXPECT_EQ(monitor.managerFor("kf-wlan0"), wlan);

    // An own echo 30 s ago keeps every socket, although the last rebuild is 70 s old.
    advance(40.0);
    devices.markOwnEcho();
    advance(30.0);
    monitor.checkNetWorkStatus();
    EXPECT_EQ(monitor.managerFor("kf-wlan0"), wlan);
    EXPECT_EQ(monitor.managerFor("kf-eth0"), eth);
}

// A rebuild closes at once and reopens on the loop after the pause, announcing straight away;
// a check during the pause does not rebuild again; an adapter removed meanwhile stays removed.
TEST_F(AdapterMonitor, RebuildPauseIsATimerAndTheReopenedSocketAnnounces) {
    env.config().ssdpRebuildPause = 1s;
    network({{"Ethernet", "lo", ""}});
    test::Recorder heard;
    const std::string announcement = "RESPONSE * HTTP/1.1";
    KesuAdapterManager monitor(loop, devices, heard.receiver());
    const auto before = monitor.managerFor("lo");

    network({{"Ethernet", "lo", "127.0.0.1"}});
    monitor.checkNetWorkStatus();  // returns during the pause
    EXPECT_EQ(events->take(), (Events{"NetworkChangeEvent", "WiredNetConnectEvent"}));
    EXPECT_FALSE(before->socket());
    EXPECT_EQ(monitor.managerFor("lo"), before);  // still closed
    monitor.checkNetWorkStatus();
    EXPECT_TRUE(events->take().empty());
    ASSERT_EQ(heard.waitFor(1, "", announcement).size(), 1u);
    ASSERT_NE(monitor.managerFor("lo"), before);
    EXPECT_TRUE(monitor.managerFor("lo")->socket()->isReceiving());

    // Readdressed then removed within one pause: nothing reopens (this timer fires after it).
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
    EXPECT_EQ(heard.waitFor(0, "", announcement).size(), 1u);
}

// The first pass runs at once; stop() ends a long period and rebuild pause; restart is fresh.
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

// The kernel's link notification triggers a check long before the (one hour) period.
TEST_F(AdapterMonitor, KernelChangeNotificationTriggersACheckAtOnce) {
    if (!test::NetNsLab::available()) GTEST_SKIP() << "network namespaces need root";
    test::NetNsLab lab("lc" + std::to_string(::getpid()), false);
    const std::string ns = lab.addNode("pc", 1).ns;  // loopback only
    ASSERT_TRUE(lab.ok()) << lab.error();
    env.config().ssdpAnnouncePeriod = std::chrono::hours(1);
    fake->setWifiPowerOn(true);
    network({});

    ServiceWorker worker(loop, devices);
    ASSERT_TRUE(test::NetNsLab::runIn(ns, [&] { worker.start(); }));
    ASSERT_TRUE(worker.isRunning());
    ASSERT_TRUE(events->waitFor("WifiOpenEvent", 1, 10s));  // the first pass is over
    ASSERT_TRUE(worker.adapters()->socketInterfaces().empty());

    network({{"Ethernet", "kf-lc0", "10.77.9.1"}});
    ASSERT_TRUE(test::NetNsLab::ip("-n " + ns + " link add kf-lc0 type veth peer name kf-lc1"));
    ASSERT_TRUE(events->waitFor("WiredNetConnectEvent", 1, 10s));
    EXPECT_EQ(worker.adapters()->socketInterfaces(), (Names{"kf-lc0"}));
    worker.stop();
}

}  // namespace
}  // namespace kesu
