// The registry: merging cloud device lists into entries, the candidate order, and the daily
// device-list record (its failure record is checked in HttpEventSubscriberTest).
#include "PreconnectFixture.h"

#include "preconnect/DeviceWaitForPreConnectManager.h"
#include "core/WallClock.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

// One cloud element: business id (its first 4 characters make the key), type, report
// time, first address, Bluetooth address and model.
Json device(const std::string& business, int type, const std::string& reportTime, const std::string& ip = "10.0.0.1",
            const std::string& bluetooth = "", const std::string& model = "M1") {
    return {{"type", type},
            {"reportTime", reportTime},
            {"bluetooth", bluetooth},
            {"model", model},
            {"bizInfo", {{"conn_base", {{"businessId", business}}}}},
            {"inets", {{{"localInet", ip}}}}};
}

class RegistryTest : public test::PreconnectTest {
protected:
    std::vector<std::string> keys(const std::vector<DeviceWaitForPreConnectManager::Entry>& entries) {
        std::vector<std::string> out;
        for (const auto& e : entries) out.push_back(e->getDeviceId());
        return out;
    }
    std::vector<std::string> merged(const Json& list) {
        registry.addFarawayDevices({{"data", list}});
        std::vector<std::string> out = keys(registry.getAllDevices());
        std::sort(out.begin(), out.end());
        return out;
    }
    static std::string key(const std::string& business) { return deviceKeyOf(business); }

    DeviceWaitForPreConnectManager registry{&loop};
};

TEST_F(RegistryTest, MergeKeepsOneEntryPerPhysicalDeviceAndNoPc) {
    struct Case {
        const char* name;
        Json list;
        std::vector<std::string> kept;
    };
    const Case cases[] = {
        {"a PC is never an entry", {device("AAAA", 3, "2026-12-06 10:00:00.000"), device("BBBB", 1, "")}, {key("BBBB")}},
        {"same Bluetooth and model: the newest report stays",
         {device("AAAA", 1, "2026-12-06 10:00:00.000", "10.0.0.1", "bt:1"),
          device("BBBB", 1, "2026-12-06 11:00:00.000", "10.0.0.2", "bt:1")},
         {key("BBBB")}},
        {"same Bluetooth, other model: both stay",
         {device("AAAA", 1, "2026-12-06 10:00:00.000", "10.0.0.1", "bt:1", "M1"),
          device("BBBB", 1, "2026-12-06 11:00:00.000", "10.0.0.2", "bt:1", "M2")},
         {key("AAAA"), key("BBBB")}},
        {"no Bluetooth: never merged",
         {device("AAAA", 1, "2026-12-06 10:00:00.000"), device("BBBB", 2, "2026-12-06 11:00:00.000")},
         {key("AAAA"), key("BBBB")}},
        {"no business id: dropped", {device("", 1, "2026-12-06 10:00:00.000")}, {}},
        {"an empty list removes every entry", Json::array(), {}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        registry.clearAllDevices();
        auto expected = c.kept;
        std::sort(expected.begin(), expected.end());
        EXPECT_EQ(merged(c.list), expected);
    }
}

TEST_F(RegistryTest, ConnectedDevicesThatMovedOrVanishedAreToldToDisconnect) {
    phonesim::Listener phone(phoneOptions());
    env.config().phoneTcpPort = phone.port();
    const std::string id = key("SIMPHONE01");
    registry.addFarawayDevices({{"data", {device("SIMP", 1, "2026-12-06 10:00:00.000", "127.0.0.1")}}});
    DeviceWaitForPreConnectManager::Entry entry;
    ASSERT_TRUE(registry.lookupDevices(id, entry));
    entry->setConnectType(FarawayDevice::kWlan);
    auto concrete = std::static_pointer_cast<DeviceWaitForPreConnect>(entry);
    ASSERT_EQ(handshake(concrete), true);

    // Same address: nothing happens.
    registry.addFarawayDevices({{"data", {device("SIMP", 1, "2026-12-06 10:00:00.000", "127.0.0.1")}}});
    EXPECT_FALSE(entry->getIsDisconnectNow());
    // The first address moved: the link is ended, the entry stays with the new data.
    registry.addFarawayDevices({{"data", {device("SIMP", 1, "2026-12-06 10:00:00.000", "127.0.0.9")}}});
    EXPECT_TRUE(entry->getIsDisconnectNow());
    EXPECT_TRUE(phone.pcClosed(5s));
    ASSERT_TRUE(registry.lookupDevices(id, entry));
    EXPECT_EQ(entry->getFarawayDevice()->info().iNets.front().localInet, "127.0.0.9");
    ASSERT_TRUE(notices->waitFor(1, 5s));

    // Gone from the list: no longer an entry.
    registry.addFarawayDevices({{"data", Json::array()}});
    EXPECT_FALSE(registry.lookupDevices(id, entry));
}

TEST_F(RegistryTest, NewerReportLiftsAnAccountMismatchOnce) {
    registry.addFarawayDevices({{"data", {device("AAAA", 1, "2026-12-06 10:00:00.000")}}});
    DeviceWaitForPreConnectManager::Entry entry;
    ASSERT_TRUE(registry.lookupDevices(key("AAAA"), entry));
    const auto record = entry->getFarawayDevice();
    entry->setIsOpenIdSame(false);
    registry.addFarawayDevices({{"data", {device("AAAA", 1, "2026-12-06 10:00:00.000", "10.0.0.5")}}});
    EXPECT_FALSE(entry->getIsOpenIdSame());
    EXPECT_EQ(entry->getFarawayDevice(), record);  // fresh data, same record and link
    EXPECT_EQ(record->info().iNets.front().localInet, "10.0.0.5");
    registry.addFarawayDevices({{"data", {device("AAAA", 1, "2026-12-06 12:00:00.000")}}});
    EXPECT_TRUE(entry->getIsOpenIdSame());
    entry->setIsOpenIdSame(false);
    registry.addFarawayDevices({{"data", {device("AAAA", 1, "2026-12-06 12:00:00.000")}}});
    EXPECT_FALSE(entry->getIsOpenIdSame());
}

TEST_F(RegistryTest, CandidatesStartWithTheLastPadAndPhoneThenNewestFirst) {
    registry.addFarawayDevices({{"data",
                                 {device("OLDS", 1, "2026-12-01 10:00:00.000"), device("NEWS", 1, "2026-12-06 10:00:00.000"),
                                  device("MIDS", 1, "2026-12-03 10:00:00.000"), device("PADS", 2, "2026-11-01 10:00:00.000"),
                                  device("PHON", 1, "2026-11-02 10:00:00.000"), device("BADT", 1, "yesterday")}}});
    struct Case {
        const char* name;
        std::string phone, pad;
        std::vector<std::string> order;
    };
    const Case cases[] = {
        {"by report time", "", "", {"NEWS", "MIDS", "OLDS", "PHON", "PADS", "BADT"}},
        {"pad, then phone", "PHON", "PADS", {"PADS", "PHON", "NEWS", "MIDS", "OLDS", "BADT"}},
        {"an unknown history id changes nothing", "GONE", "", {"NEWS", "MIDS", "OLDS", "PHON", "PADS", "BADT"}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        dataInstance().update([&](databaseParam& p) {
            p.historyPhoneId = c.phone == "GONE" ? "ffff" : key(c.phone);
            p.historyPadId = key(c.pad);
        });
        std::vector<std::string> expected;
        for (const auto& business : c.order) expected.push_back(key(business));
        EXPECT_EQ(keys(registry.getSortWaitForPreFarDevices()), expected);
    }
}

TEST_F(RegistryTest, DeviceListRecordAtMostDailyWhileSendsSucceed) {
    auto now = WallClock::Clock::now();
    WallClock::setClock([&] { return now; });
    DeviceWaitForPreConnectManager fresh(&loop);  // its reference day starts now
    const Json req{{"data", {device("AAAA", 1, ""), device("BBBB", 3, "", "", "", "PC-9"), device("CCCC", 7, "")}}};
    EXPECT_FALSE(fresh.sendDeviceListBuryPoint(req, 120));
    EXPECT_EQ(pcsuite.requestsTo("/buryPoint").size(), 0u);

    now += 25h;
    pcsuite.queueAnswer("/buryPoint", {200, R"({"code":"500"})"});
    EXPECT_FALSE(fresh.sendDeviceListBuryPoint(req, 120));
    EXPECT_TRUE(fresh.sendDeviceListBuryPoint(req, 120));  // a failed send is retried without the day check
    const auto posted = pcsuite.requestsTo("/buryPoint");
    ASSERT_EQ(posted.size(), 2u);
    EXPECT_EQ(Json::parse(posted[1].body),
              Json::array({{{"type", 1},
                            {"eventId", "W688|10269"},
                            {"duration", 120},
                            {"num", 3},
                            {"params", {{"type", "phone#pc#"}, {"device_model", "M1#PC-9#M1#"}}}}}));
    EXPECT_FALSE(fresh.sendDeviceListBuryPoint(req, 120));  // sent today
    WallClock::setClock({});
}

}  // namespace
}  // namespace kesu
