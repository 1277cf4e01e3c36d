// Discovery across network namespaces: the real service in one namespace with a veth adapter,
// the phone simulator in another, joined by a bridge namespace. Needs root and `ip netns`;
// skipped (loudly) otherwise.
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "e2e/E2EFixture.h"

using namespace std::chrono_literals;
using namespace kesu::test;

namespace {

using DiscoveryE2E = LabTest;

// The first PC announcement the simulator printed in whole that names `openId` (null when
// none came within the time-out).
nlohmann::json announcementFor(ServiceProcess& sim, const std::string& openId, std::chrono::milliseconds timeout) {
    const auto named = [&](const std::string& out) {
        for (const auto& j : bodiesIn(out, "SIM PC_ANNOUNCE "))
            if (j.is_object() && j.value("openId", "") == openId) return j;
        return nlohmann::json();
    };
    sim.waitForOutput([&](const std::string& out) { return !named(out).is_null(); }, timeout);
    return named(sim.output());
}

// The device with `id` in a posted device list (null when absent or not a list).
nlohmann::json deviceIn(const std::string& listText, const std::string& id) {
    const auto list = nlohmann::json::parse(listText, nullptr, false);
    if (!list.is_array()) return nullptr;
    for (const auto& d : list)
        if (d.is_object() && d.value("deviceId", "") == id) return d;
    return nullptr;
}

TEST_F(DiscoveryE2E, PhoneHearsThePcAnnouncement) {
    writeAccount("pc-open-1", "13912345678");
    auto service = startService();
    auto sim = startSimulator(phone.ns, {"--iface-ip", phone.ip, "--listen", "--duration", "20"});
    const auto j = announcementFor(*sim, "pc-open-1", 8s);
    ASSERT_TRUE(j.is_object()) << sim->output() << "\n--- service:\n" << service->output();
    EXPECT_EQ(sim->output().find("UDP_BAD_ENVELOPE"), std::string::npos) << sim->output();
    EXPECT_EQ(lineAfter(sim->output(), "SIM PC_ANNOUNCE_FROM "), pc.ip);

    // The body's fixed members are checked where it is built; here what comes from the
    // account file.
    EXPECT_EQ(j["deviceType"], "pc");
    EXPECT_EQ(j["account"], "139****678");  // the account's phone is kept masked
    EXPECT_TRUE(j["deviceName"].is_string() && j["deviceId"].is_string());

    // The announcement repeats: the next one arrives within about one more period.
    EXPECT_TRUE(sim->waitForOutput("SIM PC_ANNOUNCE_FROM", 8s, sim->output().size()));
}

TEST_F(DiscoveryE2E, PhoneAnnouncementsLandInTheDeviceTable) {
    auto service = startService();
    // One phone in the current format, one pad in the old format; both repeat every second
    // until the service has them.
    auto current = startSimulator(phone.ns, {"--iface-ip", phone.ip, "--announce-every", "1", "--duration", "20",
                                             "--name", "kesu Sim Phone", "--id", "SIMPHONE01", "--account",
                                             "13800000000", "--openid", "open-1"});
    auto old = startSimulator(phone.ns, {"--iface-ip", phone.ip, "--announce-every", "1", "--duration", "20",
                                         "--format", "old", "--type", "pad", "--name", "Tab", "--id", "ab",
                                         "--account", "acc", "--openid", "open-2", "--guide", "7x"});
    ASSERT_TRUE(current->waitForOutput("SIM ANNOUNCED", 5s)) << current->output();
    ASSERT_TRUE(old->waitForOutput("SIM ANNOUNCED", 5s)) << old->output();
    // The service logs each insertion; wait for both before asking.
    ASSERT_TRUE(service->waitForOutput("Insert ssdp device, deviceId: 53494d50", 10s)) << service->output();
    ASSERT_TRUE(service->waitForOutput("Insert ssdp device, deviceId: 6162", 10s)) << service->output();

    auto answer = control(pc.ns, "SSDPQueryAll");
    ASSERT_TRUE(answer.is_object()) << answer << "\n--- service:\n" << service->output();
    ASSERT_TRUE(answer.contains("data") && answer["data"].is_array()) << answer;
    const auto phoneRec = deviceIn(answer["data"].dump(), "53494d50");
    const auto padRec = deviceIn(answer["data"].dump(), "6162");
    ASSERT_TRUE(phoneRec.is_object()) << answer;
    EXPECT_EQ(phoneRec["deviceName"], "Sim****one");  // "kesu " stripped, 9 characters masked
    EXPECT_EQ(phoneRec["isDeviceNameFull"], false);
    EXPECT_EQ(phoneRec["account"], "138****000");
    EXPECT_EQ(phoneRec["isAccountFull"], false);
    EXPECT_EQ(phoneRec["openId"], "open-1");
    EXPECT_EQ(phoneRec["deviceType"], "phone");
    EXPECT_EQ(phoneRec["ip"], nlohmann::json::array({phone.ip}));
    ASSERT_TRUE(padRec.is_object()) << answer;
    EXPECT_EQ(padRec["deviceName"], "Tab");
    EXPECT_EQ(padRec["isDeviceNameFull"], true);
    EXPECT_EQ(padRec["account"], "acc");
    EXPECT_EQ(padRec["guide"], "7");  // old format: one character only
    EXPECT_EQ(padRec["deviceType"], "pad");
}

// The PC suite is told of a phone when it appears, and again when the phone has been silent
// for longer than the expiry (30 s) and the sweep has dropped it.
TEST_F(DiscoveryE2E, PcSuiteGetsTheListWhenAPhoneAppearsAndExpires) {
    auto pcsuite = startPcSuite();
    ASSERT_TRUE(pcsuite);
    auto service = startService();
    // The phone announces once: the service's discovery socket must be listening by then
    // (the control API comes up before discovery).
    ASSERT_TRUE(service->waitForOutput("[SsdpSocket::initSocket] beginReceiving success", 10s)) << service->output();
    auto sim = startSimulator(phone.ns, {"--iface-ip", phone.ip, "--announce-every", "0", "--duration", "60",
                                         "--id", "SIMPHONE01", "--account", "13800000000"});
    ASSERT_TRUE(sim->waitForOutput("SIM ANNOUNCED", 5s)) << sim->output();
    const auto silentSince = std::chrono::steady_clock::now();

    const auto appeared = pcsuite->waitForRequest(
        [](const RecordedRequest& r) {
            return r.method == "POST" && r.path == "/SSDPQueryAll" && deviceIn(r.body, "53494d50").is_object();
        },
        10s);
    ASSERT_TRUE(appeared) << service->output();
    const auto record = deviceIn(appeared->body, "53494d50");
    EXPECT_EQ(record["account"], "138****000");
    EXPECT_EQ(record["ip"], nlohmann::json::array({phone.ip}));

    const auto gone = pcsuite->waitForRequest(
        [&](const RecordedRequest& r) {
            return r.method == "POST" && r.path == "/SSDPQueryAll" && r.receivedAt > appeared->receivedAt &&
                   nlohmann::json::parse(r.body, nullptr, false).is_array() && deviceIn(r.body, "53494d50").is_null();
        },
        45s);
    ASSERT_TRUE(gone) << service->output();
    const auto silence = std::chrono::duration_cast<std::chrono::milliseconds>(gone->receivedAt - silentSince);
    EXPECT_GT(silence, 30s) << "dropped before the expiry";
    EXPECT_LT(silence, 40s) << "the expiry sweep and the report lag far behind";
}

// A sign-in written by the PC suite into Config.db is noticed by the database monitor and
// goes out in the next announcement.
TEST_F(DiscoveryE2E, AccountChangeReachesTheNextAnnouncement) {
    writeAccount("first-open-id", "13900000001");
    auto service = startService();
    auto sim = startSimulator(phone.ns, {"--iface-ip", phone.ip, "--listen", "--duration", "60"});
    ASSERT_TRUE(announcementFor(*sim, "first-open-id", 10s).is_object()) << sim->output();

    const auto logMark = service->output().size();
    writeAccount("second-open-id", "13900000002");
    // The monitor polls every 3 s: the change is read within one period and a little.
    ASSERT_TRUE(service->waitForOutput("DataBase file changed recently", 5s, logMark)) << service->output();
    const auto j = announcementFor(*sim, "second-open-id", 8s);
    ASSERT_TRUE(j.is_object()) << sim->output();
    EXPECT_EQ(j["account"], "139****002");
}

}  // namespace
