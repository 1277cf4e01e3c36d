// The discovered-device table: map operations, the strict 30-second expiry on the monotonic
// clock (wall-clock steps change nothing), the bound with eviction of the oldest entry, the
// query answer, and concurrent use.

#include <memory>
#include <thread>

#include "DiscoveryFixture.h"
#include "discovery/SsdpSafemap.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

SsdpDevicePtr device(const std::string& id, const std::string& name = "Phone") {
    auto d = std::make_shared<SsdpDevice>();
    d->deviceId = id;
    d->deviceName = name;
    d->ip = {"10.0.0.1"};
    return d;
}

using SsdpDeviceTableTest = test::DiscoveryTest;

TEST_F(SsdpDeviceTableTest, MapOperations) {
    SsdpSafemap map(16, 30.0, clock);
    SsdpDevicePtr out = device("keep");
    EXPECT_FALSE(map.lookup("a", out));
    EXPECT_EQ(out->deviceId, "keep");  // untouched
    EXPECT_FALSE(map.update("a", device("a")));
    EXPECT_EQ(map.size(), 0u);

    EXPECT_TRUE(map.insert("a", device("a", "first")));
    EXPECT_TRUE(map.insert("a", device("a", "third"), true));  // replaces
    ASSERT_TRUE(map.lookup("a", out));
    const SsdpDevicePtr held = out;
    EXPECT_TRUE(map.update("a", device("a", "fourth")));
    ASSERT_TRUE(map.lookup("a", out));
    EXPECT_EQ(out->deviceName, "fourth");
    EXPECT_EQ(held->deviceName, "third");  // a holder keeps its snapshot
    EXPECT_FALSE(map.insert("b", nullptr));
    EXPECT_EQ(map.size(), 1u);
}

// Expiry is strictly after 30 s on the monotonic clock: wall-clock steps (-1 h, +2 h) keep a
// phone announcing every 5 s and expire a silent one; the record keeps the wall-clock time.
TEST_F(SsdpDeviceTableTest, WallClockStepsNeitherExpireLiveDevicesNorKeepSilentOnes) {
    SsdpDeviceManager table(16, 30.0, clock);
    const auto hear = [&](const std::string& id) {
        SsdpMessage::insertResponseDevice(json::compact(test::phoneBody(id)), "10.0.0.9", "", true, table);
    };
    SsdpDevicePtr live;
    const auto present = [&](const std::string& key) { return table.ssdpDeviceMap.lookup(key, live); };
    hear("live");
    hear("gone");
    for (int round = 1; round <= 6; ++round) {  // 30 s: "gone" is exactly at its expiry
        advance(5);
        if (round == 2) stepWallClock(-3600);
        if (round == 4) stepWallClock(+7200);
        hear("live");
        EXPECT_FALSE(table.deleteDevices()) << "round " << round;
    }
    EXPECT_TRUE(present("676f6e65"));
    advance(0.001);
    EXPECT_TRUE(table.deleteDevices());
    EXPECT_FALSE(table.deleteDevices());  // reported once
    EXPECT_FALSE(present("676f6e65"));
    ASSERT_TRUE(present("6c697665"));
    EXPECT_DOUBLE_EQ(live->lastUpdate, kStart + 3600 + 30);  // shown as the wall clock read it
}

TEST_F(SsdpDeviceTableTest, BoundEvictsTheOldest) {
    SsdpSafemap map(4, 30.0, clock);
    for (int i = 0; i < 4; ++i) {
        map.insert("d" + std::to_string(i), device("d" + std::to_string(i)));
        clock.advance(1s);
    }
    map.update("d0", device("d0"));  // d1 is now the one heard longest ago
    clock.advance(1s);
    map.insert("d2", device("d2"));  // a present key never evicts
    EXPECT_EQ(map.evictedCount(), 0u);
    clock.advance(1s);
    map.insert("n", device("n"));
    SsdpDevicePtr out;
    EXPECT_FALSE(map.lookup("d1", out));
    EXPECT_TRUE(map.lookup("d0", out));
    EXPECT_EQ(map.size(), 4u);

    // A flood of distinct ids churns the table without growing it and logs once.
    for (int i = 0; i < 5000; ++i) {
        clock.advance(1ms);
        map.insert("f" + std::to_string(i), device("f"));
    }
    EXPECT_EQ(map.size(), 4u);
    EXPECT_EQ(map.evictedCount(), 5001u);
    EXPECT_TRUE(map.lookup("f4999", out));
    const std::string log = test::todaysLog();
    const std::string line = "[SsdpSafemap::insert] device table full (4 devices)";
    EXPECT_NE(log.find(line), std::string::npos);
    EXPECT_EQ(log.find(line, log.find(line) + 1), std::string::npos);
}

TEST_F(SsdpDeviceTableTest, QueryAllSweepsFirst) {
    SsdpDeviceManager manager(16, 30.0, clock);
    std::string res;
    ASSERT_TRUE(manager.getQueryAll(res));
    EXPECT_EQ(Json::parse(res), Json::parse(R"({"error":0,"error_message":"","data":[]})"));
    EXPECT_NE(res.find('\n'), std::string::npos);  // pretty-printed

    manager.ssdpDeviceMap.insert("stale", device("stale"));
    clock.advance(2s);
    manager.ssdpDeviceMap.insert("fresh", device("fresh", "Tab"));
    clock.advance(29s);
    ASSERT_TRUE(manager.getQueryAll(res));
    const Json answer = Json::parse(res);
    ASSERT_EQ(answer["data"].size(), 1u);
    EXPECT_EQ(answer["data"][0], (Json{{"deviceName", "Tab"}, {"deviceId", "fresh"}, {"account", ""},
                                       {"openId", ""}, {"isOpenIdSame", false}, {"isDeviceNameFull", true},
                                       {"isAccountFull", true}, {"guide", ""}, {"ip", {"10.0.0.1"}},
                                       {"deviceType", "phone"}}));
}

// Writers, the sweep and readers at once, as the adapter sockets, the expiry loop and the
// control API do. Run under TSan; the bound must hold throughout.
TEST_F(SsdpDeviceTableTest, ConcurrentUse) {
    SsdpDeviceManager manager(32, 30.0, clock);
    std::atomic<int> observed{0};
    manager.addChangeObserver([&](const SsdpDevice& d) {
        SsdpDevicePtr stored;
        manager.ssdpDeviceMap.lookup(d.deviceId, stored);
        ++observed;
    });
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 400; ++i) {
                auto d = device(std::to_string(t) + "-" + std::to_string(i % 50));
                manager.notifyChange(*d);
                manager.ssdpDeviceMap.insert(d->deviceId, d);
            }
        });
    }
    threads.emplace_back([&] {
        std::string res;
        for (int i = 0; i < 200; ++i) {
            clock.advance(1s);
            manager.ssdpDeviceMap.eraseTimeOut();
            manager.getQueryAll(res);
            EXPECT_LE(manager.ssdpDeviceMap.size(), 32u);
        }
    });
    for (auto& t : threads) t.join();
    EXPECT_EQ(observed.load(), 1200);
    EXPECT_LE(manager.ssdpDeviceMap.size(), 32u);
}

}  // namespace
}  // namespace kesu
