// What the service tells about the PC over the fake platform: connect-center override, masking,
// MAC and network snapshots, firewall/VPN/ping rules, the connection slot and sequence numbers.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <thread>
#include <vector>

#include "connect/ConnectionState.h"
#include "core/Endpoints.h"
#include "core/Log.h"
#include "core/Process.h"
#include "core/Text.h"
#include "platform/SystemInfo.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

class SystemInfoTest : public ::testing::Test {
protected:
    void SetUp() override { test::resetSharedStateForTest(); }
    void TearDown() override {
        test::resetSharedStateForTest();
        Log::closeLog();
    }
    // Writes the host override file where the service looks for it and reads it.
    std::string connectCenterFrom(const std::string& content) {
        env.dir().write("root" + env.config().switchHostIni, content);
        Endpoints::getConnectCenterUrl();
        return Endpoints::connectCenterServerUrl();
    }

    test::HermeticEnv env;
    ScopedFakePlatform fake;
};

TEST_F(SystemInfoTest, ConnectCenterOverrideFile) {
    const std::string builtIn = env.config().defaultConnectCenterUrl;
    Endpoints::getConnectCenterUrl();  // no file
    EXPECT_EQ(Endpoints::connectCenterServerUrl(), builtIn);
    EXPECT_EQ(connectCenterFrom("[host]\nOtherHost=https://other.test/\n"), builtIn);

    // A URL holding "=" survives whole; a Windows line end is not part of it; an empty
    // override later does not wipe the one in use.
    const std::string url = "https://cc.test/base?region=eu";
    EXPECT_EQ(connectCenterFrom("[host]\r\nConnectionCenterHost=" + url + "\r\nnext=1\r\n"), url);
    EXPECT_EQ(connectCenterFrom("ConnectionCenterHost="), url);
    Endpoints::setConnectCenterServerUrl("");
    EXPECT_EQ(Endpoints::connectCenterServerUrl(), builtIn);

    // A huge one-line file and invalid UTF-8 change nothing.
    EXPECT_EQ(connectCenterFrom("ConnectionCenterHost=" + std::string(200000, 'x')), builtIn);
    EXPECT_EQ(connectCenterFrom("ConnectionCenterHost=https://bad.test/\xff\n"), builtIn);
}

TEST_F(SystemInfoTest, MaskCountsUserPerceivedCharacters) {
    // A family emoji joined by zero-width joiners, a toned thumb and "e" + combining accent
    // are one character each.
    const std::string family = "\xF0\x9F\x91\xA8\xE2\x80\x8D\xF0\x9F\x91\xA9\xE2\x80\x8D\xF0\x9F\x91\xA7";
    const std::string thumb = "\xF0\x9F\x91\x8D\xF0\x9F\x8F\xBD";
    for (const auto& [in, out] : std::vector<std::pair<std::string, std::string>>{
             {"", ""}, {"abcdef", "abcdef"}, {"abcdefghij", "abc****hij"}, {"名字是七个字符", "名字是****个字符"},
             {thumb + "abcde", thumb + "abcde"}, {"ab" + family + "cdef", "ab" + family + "****def"},
             {"ne\xCC\x81nuphar", "ne\xCC\x81n****har"}})
        EXPECT_EQ(text::paramAddMask(in), out) << in;
    EXPECT_EQ(text::asciiToString({0x41, 0x00, 0x7F, 0xE9, 0xFF}), std::string("A\0\x7F\xC3\xA9\xC3\xBF", 7));
}

TEST_F(SystemInfoTest, MacAddressAndNetworkSnapshot) {
    // The first Wi-Fi adapter, else the last Ethernet one; read anew once the last read is
    // older than the cache's lifetime.
    env.config().identityCacheLifetime = std::chrono::hours(1);
    fake->setLocalizedHostName("Desk");
    EXPECT_EQ(SystemInfo::getFullLocalName(), "Desk");
    EXPECT_EQ(SystemInfo::getMacAddress(), "");
    fake->setLocalizedHostName("Other");
    fake->addAdapter("Ethernet", "eth9", "aa:00:00:00:00:09");
    EXPECT_EQ(SystemInfo::getFullLocalName(), "Desk");
    EXPECT_EQ(SystemInfo::getMacAddress(), "");
    env.config().identityCacheLifetime = std::chrono::milliseconds(0);
    EXPECT_EQ(SystemInfo::getFullLocalName(), "Other");
    fake->setNetworkServices({});
    EXPECT_EQ(SystemInfo::getMacAddress(), "");
    fake->addAdapter("Ethernet", "eth0", "aa:00:00:00:00:01");
    fake->addAdapter("Ethernet", "eth1", "aa:00:00:00:00:02", "10.1.0.5", "255.255.0.0");
    EXPECT_EQ(SystemInfo::getMacAddress(), "aa0000000002");
    fake->addAdapter("Wi-Fi", "wlan0", "bb:00:00:00:00:01");
    EXPECT_EQ(SystemInfo::getMacAddress(), "bb0000000001");

    fake->setWifiSsid("Caf\xC3\xA9");
    EXPECT_EQ(SystemInfo::getNetworkCorrespondAddress(),
              (std::map<std::string, std::string>{{"Ethernet", "10.1.0.5"}, {"Wi-Fi", ""}}));
    EXPECT_EQ(SystemInfo::GetEthernetName(), "eth1");
    fake->addAdapter("Wi-Fi", "wlan1", "bb:00:00:00:00:02", "192.168.7.9");
    const auto list = SystemInfo::GetNetworkInfoList();
    ASSERT_EQ(list.size(), 2u);
    EXPECT_EQ(list[1], (std::map<std::string, std::string>{{"name", "Wi-Fi"}, {"bsdName", "wlan1"},
                                                           {"ip", "192.168.7.9"}, {"netmask", "255.255.255.0"},
                                                           {"ssid", "Caf\xC3\xA9"}}));
    EXPECT_EQ(SystemInfo::getNetworkCorrespondAddress().at("Wi-Fi"), "192.168.7.9");
    EXPECT_EQ(SystemInfo::GetWifiName(), "wlan1");

    // The address list cannot be read: nothing, and the names stay as they were.
    fake->setInterfaceAddresses(std::nullopt);
    EXPECT_TRUE(SystemInfo::getNetworkCorrespondAddress().empty());
    EXPECT_TRUE(SystemInfo::GetNetworkInfoList().empty());
    EXPECT_EQ(SystemInfo::GetWifiName(), "wlan1");

    fake->setNetworkServices({{"Wi-Fi", "wlan0", ""}});
    EXPECT_FALSE(SystemInfo::MacWifiNetworkAvailability());
    EXPECT_FALSE(SystemInfo::MacEthernetNetworkAvailability());
}

TEST_F(SystemInfoTest, VpnFirewallScreenAndAppRules) {
    fake->setVpnScopedInterfaces({"eth0", "docker0"});
    EXPECT_FALSE(SystemInfo::isVpnOn());
    for (const char* name : {"utun3", "tap1", "ppp0", "ipsec0", "wg0"}) {
        fake->setVpnScopedInterfaces({"eth0", name});
        EXPECT_TRUE(SystemInfo::isVpnOn()) << name;
    }

    // The firewall state is read from tool output: unreadable or empty output is unknown.
    EXPECT_EQ(SystemInfo::getFirewallState(), std::nullopt);
    for (const auto& [text, state] : std::vector<std::pair<std::string, std::optional<bool>>>{
             {"0\n", false}, {" 1 ", true}, {"2", true}, {"\xff", std::nullopt}, {"\n", std::nullopt}}) {
        fake->setFirewallGlobalState(text);
        EXPECT_EQ(SystemInfo::getFirewallState(), state) << text;
    }

    EXPECT_TRUE(SystemInfo::isScreenUnlocked());  // unknown counts as unlocked
    fake->setScreenLocked(true);
    EXPECT_FALSE(SystemInfo::isScreenUnlocked());
    fake->setCpuVendor(std::nullopt);
    EXPECT_EQ(SystemInfo::GetPcSystemInfo().at("vendor"), "apple");

    // Exactly two copies is the one count read as "not running".
    const std::string app = "kesu办公套件";
    EXPECT_TRUE(SystemInfo::isAppRunning(app));
    fake->setRunningApplicationNames({app, "bash", app});
    EXPECT_FALSE(SystemInfo::isAppRunning(app));
    fake->setRunningApplicationNames({app, app, app});
    EXPECT_TRUE(SystemInfo::isAppRunning(app));
}

TEST_F(SystemInfoTest, PingTakesOnlyIpv4LiteralsAndCommandsRunToTheirEnd) {
    for (const char* bad : {"8.8.8.8; rm -rf /", "localhost", "", "-c 9 127.0.0.1", "127.0.0.1 ", "::1", "1.2.3"}) {
        EXPECT_FALSE(SystemInfo::pingAddress(bad, 1)) << bad;
    }
    EXPECT_EQ(fake->pingCalls(), 0);
    EXPECT_TRUE(SystemInfo::pingAddress("127.0.0.1", 1));
    EXPECT_EQ(fake->lastPingAddress(), "127.0.0.1");
    fake->setPingResult(false);
    EXPECT_FALSE(SystemInfo::pingAddress("127.0.0.1", 0));

    // A program that cannot start is -1.
    int exitCode = 5;
    EXPECT_FALSE(process::startProcess(env.dir().str() + "/no-such-program", {}, exitCode));
    EXPECT_EQ(exitCode, -1);
}

TEST_F(SystemInfoTest, SlotAndSequenceNumbersUnderConcurrency) {
    // Of many threads racing for the connection slot, exactly one gets it.
    std::atomic<int> winners{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t)
        threads.emplace_back([&] {
            if (ConnectionState::tryClaimConnectDevice()) ++winners;
            ConnectionState::setConnectingDeviceType("phone");
            (void)ConnectionState::getConnectingDeviceType();
        });
    for (auto& t : threads) t.join();
    EXPECT_EQ(winners.load(), 1);
    EXPECT_FALSE(ConnectionState::tryClaimConnectDevice());
    ConnectionState::setIsCanConnectDevice(true);
    EXPECT_TRUE(ConnectionState::tryClaimConnectDevice());
    EXPECT_TRUE(ConnectionState::tryClaimPrimaryConnectDevice());
    EXPECT_FALSE(ConnectionState::tryClaimPrimaryConnectDevice());

    // Sequence numbers: unique and without gaps across threads.
    constexpr int kThreads = 8, kEach = 2000;
    std::vector<std::vector<long long>> seen(kThreads);
    threads.clear();
    for (int t = 0; t < kThreads; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < kEach; ++i) seen[t].push_back(ConnectionState::getNfcLanConnectSeqNo());
        });
    for (auto& t : threads) t.join();
    std::vector<long long> all;
    for (auto& s : seen) all.insert(all.end(), s.begin(), s.end());
    std::sort(all.begin(), all.end());
    ASSERT_EQ(all.size(), static_cast<std::size_t>(kThreads * kEach));
    for (std::size_t i = 0; i < all.size(); ++i) ASSERT_EQ(all[i], static_cast<long long>(i));
}

}  // namespace
}  // namespace kesu
