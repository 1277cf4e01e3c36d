// The discovered-device table: map operations, the strict 30-second expiry, the bound with
// eviction of the oldest entry, the query answer, and concurrent use.
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "DiscoveryFixture.h"
#include "core/Json.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpSafemap.h"

namespace kesu {
namespace {

SsdpDevicePtr device(const std::string& id, double lastUpdate, const std::string& name = "Phone") {
    auto d = std::make_shared<SsdpDevice>();
    d->deviceId = id;
    d->deviceName = name;
    d->lastUpdate = lastUpdate;
    d->ip = {"10.0.0.1"};
    return d;
}

using SsdpDeviceTableTest = test::DiscoveryTest;

TEST_F(SsdpDeviceTableTest, MapOperations) {
    SsdpSafemap map(16, 30.0);
    SsdpDevicePtr out = device("keep", 1.0);
    EXPECT_FALSE(map.lookup("a", out));
    EXPECT_EQ(out->deviceId, "keep");  // untouched
    EXPECT_FALSE(map.update("a", device("a", 1.0)));
    EXPECT_EQ(map.size(), 0u);

    EXPECT_TRUE(map.insert("a", device("a", 1.0, "first")));
    EXPECT_TRUE(map.insert("a", device("a", 3.0, "third"), true));  // replaces
    ASSERT_TRUE(map.lookup("a", out));
    const SsdpDevicePtr held = out;
    EXPECT_TRUE(map.update("a", device("a", 4.0, "fourth")));
    ASSERT_TRUE(map.lookup("a", out));
    EXPECT_EQ(out->deviceName, "fourth");
    EXPECT_EQ(held->deviceName, "third");  // a holder keeps its snapshot
    EXPECT_FALSE(map.insert("b", nullptr));
    EXPECT_EQ(map.size(), 1u);
}

TEST_F(SsdpDeviceTableTest, ExpiryIsStrictlyGreater) {
    SsdpSafemap map(16, 30.0);
    map.insert("old", device("old", 100.0, "Old Phone"));
    map.insert("new", device("new", 110.0));
    map.insert("zero", device("zero", 0.0));  // never stamped
    EXPECT_TRUE(map.eraseTimeOut(130.0));      // only "zero" goes; "old" is exactly 30 s old
    EXPECT_EQ(map.size(), 2u);
    EXPECT_TRUE(map.eraseTimeOut(130.001));
    EXPECT_EQ(map.size(), 1u);
    EXPECT_FALSE(map.eraseTimeOut(130.002));   // reported once
    // A refresh moves the entry's age forward.
    map.update("new", device("new", 135.0));
    EXPECT_FALSE(map.eraseTimeOut(150.0));
    EXPECT_TRUE(map.eraseTimeOut(165.5));
    EXPECT_EQ(map.size(), 0u);
}

TEST_F(SsdpDeviceTableTest, BoundEvictsTheOldest) {
    SsdpSafemap map(4, 30.0);
    for (int i = 0; i < 4; ++i) map.insert("d" + std::to_string(i), device("d" + std::to_string(i), 10.0 + i));
    map.update("d0", device("d0", 20.0));  // d1 is now the one heard longest ago
    map.insert("d2", device("d2", 21.0));  // a present key never evicts
    EXPECT_EQ(map.evictedCount(), 0u);
    map.insert("n", device("n", 22.0));
    SsdpDevicePtr out;
    EXPECT_FALSE(map.lookup("d1", out));
    EXPECT_TRUE(map.lookup("d0", out));
    EXPECT_EQ(map.size(), 4u);

    // A flood of distinct ids churns the table without growing it and logs once.
    for (int i = 0; i < 5000; ++i) map.insert("f" + std::to_string(i), device("f", 30.0 + i * 0.001));
    EXPECT_EQ(map.size(), 4u);
    EXPECT_EQ(map.evictedCount(), 5001u);
    EXPECT_TRUE(map.lookup("f4999", out));
    const std::string log = test::todaysLog();
    const std::string line = "[SsdpSafemap::insert] device table full (4 devices)";
    EXPECT_NE(log.find(line), std::string::npos);
    EXPECT_EQ(log.find(line, log.find(line) + 1), std::string::npos);
}

TEST_F(SsdpDeviceTableTest, QueryAllSweepsFirst) {
    SsdpDeviceManager manager(16, 30.0);
    std::string res;
    ASSERT_TRUE(manager.getQueryAll(res));
    EXPECT_EQ(Json::parse(res), Json::parse(R"({"error":0,"error_message":"","data":[]})"));
    EXPECT_NE(res.find('\n'), std::string::npos);  // pretty-printed

    manager.ssdpDeviceMap.insert("stale", device("stale", now() - 31.0));
    manager.ssdpDeviceMap.insert("fresh", device("fresh", now() - 29.0, "Tab"));
    ASSERT_TRUE(manager.getQueryAll(res));
    const Json answer = Json::parse(res);
    ASSERT_EQ(answer["data"].size(), 1u);
    EXPECT_EQ(answer["data"][0], (Json{{"deviceName", "Tab"}, {"deviceId", "fresh"}, {"account", ""},
                                       {"openId", ""}, {"isOpenIdSame", false}, {"isDeviceNameFull", true},
                                       {"isAccountFull", true}, {"guide", ""}, {"ip", {"10.0.0.1"}},
                                       {"deviceType", "phone"}}));
    EXPECT_EQ(manager.getAllDevices().size(), 1u);
}

// Writers, the sweep and readers at once, as the adapter sockets, the expiry loop and the
// control API do. Run under TSan; the bound must hold throughout.
TEST_F(SsdpDeviceTableTest, ConcurrentUse) {
    SsdpDeviceManager manager(32, 30.0);
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
                auto d = device(std::to_string(t) + "-" + std::to_string(i % 50), static_cast<double>(i));
                manager.notifyChange(*d);
                manager.ssdpDeviceMap.insert(d->deviceId, d);
            }
        });
    }
    threads.emplace_back([&] {
        std::string res;
        for (int i = 0; i < 200; ++i) {
            manager.ssdpDeviceMap.eraseTimeOut(200.0 + i);
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
