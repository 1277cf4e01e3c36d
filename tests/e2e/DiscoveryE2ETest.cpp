// Discovery across network namespaces: the real service in one namespace with a veth adapter,
// the phone simulator in another, joined by a bridge namespace. Needs root and `ip netns`;
// skipped (loudly) otherwise.
#include <gtest/gtest.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <set>

#include "support/NetNs.h"
#include "support/ServiceProcess.h"
#include "support/TestSupport.h"

using namespace std::chrono_literals;
using kesu::test::NetNsLab;
using kesu::test::ServiceProcess;
using kesu::test::TempDir;

namespace {

const std::string kSimulator = std::string(KESU_TOOLS_DIR) + "/phone_simulator";

// The text after `marker` on the first line of `output` that holds it.
std::string lineAfter(const std::string& output, const std::string& marker) {
    auto at = output.find(marker);
    if (at == std::string::npos) return {};
    at += marker.size();
    return output.substr(at, output.find('\n', at) - at);
}

// Posts one control request from inside `ns` (the control API listens on that namespace's
// loopback) and returns the JSON after the length prefix of the answer.
nlohmann::json control(const std::string& ns, const std::string& event) {
    const std::string body = nlohmann::json{{"event", event}, {"args", nlohmann::json::array()}}.dump();
    ServiceProcess curl("/usr/bin/curl",
                        {"-s", "-m", "5", "--data-binary", std::to_string(body.size()) + "#" + body,
                         "-H", "Content-Type: text/plain", "http://127.0.0.1:9197/"},
                        {}, ns);
    curl.waitExit(10s);
    std::string out = curl.output();
    auto hash = out.find('#');
    if (hash == std::string::npos) return nullptr;
    return nlohmann::json::parse(out.substr(hash + 1), nullptr, false);
}

class DiscoveryE2E : public ::testing::Test {
protected:
    void SetUp() override {
        std::string why;
        if (!NetNsLab::available(&why)) GTEST_SKIP() << "*** NETWORK NAMESPACES UNAVAILABLE: " << why << " ***";
        lab = std::make_unique<NetNsLab>("e2e", true);
        pc = lab->addNode("pc", 1);
        phone = lab->addNode("phone", 2);
        ASSERT_TRUE(lab->ok()) << lab->error();
        std::filesystem::create_directories(home);
        std::filesystem::create_directories(root);
    }
    std::unique_ptr<ServiceProcess> startService() {
        auto p = std::make_unique<ServiceProcess>(KESU_BINARY, std::vector<std::string>{},
                                                  std::map<std::string, std::string>{{"HOME", home}, {"KESU_ROOT", root}},
                                                  pc.ns);
        EXPECT_TRUE(p->waitForOutput("[httpService]Run succ", 20s)) << p->output();
        return p;
    }

    std::unique_ptr<NetNsLab> lab;
    NetNsLab::Node pc, phone;
    TempDir dir;
    std::string home = dir.str() + "/home";
    std::string root = dir.str() + "/root";
};

TEST_F(DiscoveryE2E, PhoneHearsThePcAnnouncement) {
    auto service = startService();
    ServiceProcess sim(kSimulator, {"--iface-ip", phone.ip, "--listen", "--duration", "20"}, {}, phone.ns);
    ASSERT_TRUE(sim.waitForOutput("SIM PC_ANNOUNCE {", 8s)) << sim.output() << "\n--- service:\n" << service->output();
    EXPECT_EQ(sim.output().find("UDP_BAD_ENVELOPE"), std::string::npos) << sim.output();
    EXPECT_EQ(lineAfter(sim.output(), "SIM PC_ANNOUNCE_FROM "), pc.ip);

    auto j = nlohmann::json::parse(lineAfter(sim.output(), "SIM PC_ANNOUNCE "), nullptr, false);
    ASSERT_TRUE(j.is_object());
    std::set<std::string> keys;
    for (auto& [k, v] : j.items()) keys.insert(k);
    EXPECT_EQ(keys, (std::set<std::string>{"deviceName", "deviceId", "openId", "serviceRecord", "port", "account",
                                           "deviceType", "extra"}));
    EXPECT_EQ(j["serviceRecord"], "com.kesu.pcsuite.SERVICE--com.kesu.share.CONNECT_PC");
    EXPECT_EQ(j["port"], 10191);
    EXPECT_EQ(j["deviceType"], "pc");
    EXPECT_EQ(j["extra"], "null");
    EXPECT_TRUE(j["deviceName"].is_string() && j["deviceId"].is_string() && j["openId"].is_string() &&
                j["account"].is_string());
}

TEST_F(DiscoveryE2E, PhoneAnnouncementsLandInTheDeviceTable) {
    auto service = startService();
    // One phone in the current format, one pad in the old format; both repeat every second
    // until the service has them.
    ServiceProcess current(kSimulator, {"--iface-ip", phone.ip, "--announce-every", "1", "--duration", "20",
                                        "--name", "kesu Sim Phone", "--id", "SIMPHONE01", "--account",
                                        "13800000000", "--openid", "open-1"},
                           {}, phone.ns);
    ServiceProcess old(kSimulator, {"--iface-ip", phone.ip, "--announce-every", "1", "--duration", "20",
                                    "--format", "old", "--type", "pad", "--name", "Tab", "--id", "ab",
                                    "--account", "acc", "--openid", "open-2", "--guide", "7x"},
                       {}, phone.ns);
    ASSERT_TRUE(current.waitForOutput("SIM ANNOUNCED", 5s)) << current.output();
    ASSERT_TRUE(old.waitForOutput("SIM ANNOUNCED", 5s)) << old.output();
    // The service logs each insertion; wait for both before asking.
    ASSERT_TRUE(service->waitForOutput("Insert ssdp device, deviceId: 53494d50", 10s)) << service->output();
    ASSERT_TRUE(service->waitForOutput("Insert ssdp device, deviceId: 6162", 10s)) << service->output();

    auto answer = control(pc.ns, "SSDPQueryAll");
    ASSERT_TRUE(answer.is_object()) << answer;
    ASSERT_TRUE(answer.contains("data") && answer["data"].is_array()) << answer;
    nlohmann::json phoneRec, padRec;
    for (auto& d : answer["data"]) {
        if (d.value("deviceId", "") == "53494d50") phoneRec = d;
        if (d.value("deviceId", "") == "6162") padRec = d;
    }
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

}  // namespace
