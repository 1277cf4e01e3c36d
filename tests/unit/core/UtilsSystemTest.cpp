// The system side of Utils over the fake platform: connect-center override, masking, MAC
// selection, network snapshots, firewall and ping rules, flags, counters and conversions.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <nlohmann/json.hpp>
#include <thread>
#include <vector>

#include "core/Utils.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

class UtilsSystem : public ::testing::Test {
protected:
    void SetUp() override { Utils::resetStateForTest(); }
    void TearDown() override {
        Utils::resetStateForTest();
        Utils::closeLog();
    }

    // Writes the host override file where the service looks for it.
    void writeSwitchHost(const std::string& content) {
        env.dir().write("root" + env.config().switchHostIni, content);
    }
    std::string todaysLog() const { return test::readAll(Utils::logFilePath(Utils::now())); }

    test::HermeticEnv env;
    ScopedFakePlatform fake;
};

TEST_F(UtilsSystem, ConnectCenterOverride) {
    const std::string builtIn = env.config().defaultConnectCenterUrl;

    Utils::getConnectCenterUrl();  // no file
    EXPECT_EQ(Utils::connectCenterServerUrl(), builtIn);

    writeSwitchHost("[host]\nConnectionCenterHost=\n");
    Utils::getConnectCenterUrl();
    EXPECT_EQ(Utils::connectCenterServerUrl(), builtIn);

    writeSwitchHost("[host]\nOtherHost=https://other.test/\n");
    Utils::getConnectCenterUrl();
    EXPECT_EQ(Utils::connectCenterServerUrl(), builtIn);

    // A URL holding "=" survives whole; a Windows line end is not part of it.
    writeSwitchHost("[host]\r\nConnectionCenterHost=https://cc.test/base?region=eu\r\nnext=1\r\n");
    Utils::getConnectCenterUrl();
    EXPECT_EQ(Utils::connectCenterServerUrl(), "https://cc.test/base?region=eu");
    const std::string log = todaysLog();
    EXPECT_NE(log.find("[Utils::getConnectCenterUrl] ConnectCenterUrl: ConnectionCenterHost=https://cc.test/base?region=eu"),
              std::string::npos);
    EXPECT_NE(log.find("[Utils::getConnectCenterUrl] connectCenterServerUrl: https://cc.test/base?region=eu"),
              std::string::npos);

    // An empty override later does not wipe the one in use; an empty setter means the default.
    writeSwitchHost("ConnectionCenterHost=");
    Utils::getConnectCenterUrl();
    EXPECT_EQ(Utils::connectCenterServerUrl(), "https://cc.test/base?region=eu");
    Utils::setConnectCenterServerUrl("");
    EXPECT_EQ(Utils::connectCenterServerUrl(), builtIn);

    // A huge one-line file neither crashes the matcher nor changes anything.
    writeSwitchHost("ConnectionCenterHost=" + std::string(200000, 'x'));
    Utils::getConnectCenterUrl();
    EXPECT_EQ(Utils::connectCenterServerUrl(), builtIn);

    // Invalid UTF-8 is not read at all.
    writeSwitchHost("ConnectionCenterHost=https://bad.test/\xff\n");
    Utils::getConnectCenterUrl();
    EXPECT_EQ(Utils::connectCenterServerUrl(), builtIn);
}

TEST_F(UtilsSystem, ReadFileAndExistence) {
    std::string content;
    Utils::readFile(env.dir().str() + "/missing.txt", content);
    EXPECT_EQ(content, "");
    EXPECT_FALSE(Utils::isFileExist(env.dir().str() + "/missing.txt"));

    const std::string good = env.dir().write("good.txt", "h\xC3\xA9llo");
    EXPECT_TRUE(Utils::isFileExist(good));
    Utils::readFile(good, content);
    EXPECT_EQ(content, "h\xC3\xA9llo");

    const std::string bad = env.dir().write("bad.txt", "\xff\xfe");
    std::string kept = "kept";
    Utils::readFile(bad, kept);
    EXPECT_EQ(kept, "kept");

    const std::string log = todaysLog();
    EXPECT_NE(log.find("[Utils::isFileExist] config " + env.dir().str() + "/missing.txt is not exist ..."),
              std::string::npos);
    EXPECT_NE(log.find("[Utils::readFile] file is not exist ..."), std::string::npos);
    EXPECT_NE(log.find("[Utils::readFile] config file exist and content is: h\xC3\xA9llo"), std::string::npos);
    EXPECT_NE(log.find("[Utils::readFile] config file exist but read fail"), std::string::npos);
}

TEST_F(UtilsSystem, MaskCountsUserPerceivedCharacters) {
    EXPECT_EQ(Utils::paramAddMask(""), "");
    EXPECT_EQ(Utils::paramAddMask("abcdef"), "abcdef");
    EXPECT_EQ(Utils::paramAddMask("abcdefg"), "abc****efg");
    EXPECT_EQ(Utils::paramAddMask("abcdefghij"), "abc****hij");
    // Seven CJK characters (three bytes each): the middle one is hidden.
    EXPECT_EQ(Utils::paramAddMask("名字是七个字符"), "名字是****个字符");
    // A family emoji joined by zero-width joiners and a toned thumb are one character each.
    const std::string family = "\xF0\x9F\x91\xA8\xE2\x80\x8D\xF0\x9F\x91\xA9\xE2\x80\x8D\xF0\x9F\x91\xA7";
    const std::string thumb = "\xF0\x9F\x91\x8D\xF0\x9F\x8F\xBD";
    EXPECT_EQ(Utils::paramAddMask(thumb + "abcde"), thumb + "abcde");
    EXPECT_EQ(Utils::paramAddMask("ab" + family + "cdef"), "ab" + family + "****def");
    // "e" + combining acute accent is one character.
    EXPECT_EQ(Utils::paramAddMask("ne\xCC\x81nuphar"), "ne\xCC\x81n****har");

    fake->setLocalizedHostName("Office-Desktop");
    EXPECT_EQ(Utils::getFullLocalName(), "Office-Desktop");
    EXPECT_EQ(Utils::getLocalName(), "Off****top");
    fake->setLocalizedHostName("");
    EXPECT_EQ(Utils::getLocalName(), "");
}

TEST_F(UtilsSystem, MacAddressPrefersFirstWifiElseLastEthernet) {
    EXPECT_EQ(Utils::getMacAddress(), "");
    fake->addAdapter("Ethernet", "eth0", "aa:00:00:00:00:01");
    fake->addAdapter("Ethernet", "eth1", "aa:00:00:00:00:02");
    EXPECT_EQ(Utils::getMacAddress(), "aa0000000002");
    EXPECT_EQ(Utils::getMacAddress2(), "aa:00:00:00:00:02");
    fake->addAdapter("Wi-Fi", "wlan0", "bb:00:00:00:00:01");
    fake->addAdapter("Wi-Fi", "wlan1", "bb:00:00:00:00:02");
    fake->addAdapter("Ethernet", "eth2", "aa:00:00:00:00:03");
    EXPECT_EQ(Utils::getMacAddress(), "bb0000000001");
    EXPECT_EQ(Utils::getMacAddress2(), "bb:00:00:00:00:01");

    EXPECT_TRUE(Utils::MacWifiNetworkAvailability());
    EXPECT_TRUE(Utils::MacEthernetNetworkAvailability());
    fake->setNetworkServices({{"Wi-Fi", "wlan0", ""}});
    EXPECT_FALSE(Utils::MacWifiNetworkAvailability());
    EXPECT_FALSE(Utils::MacEthernetNetworkAvailability());

    fake->setBluetoothAddress("11:22:33:44:55:66");
    EXPECT_EQ(Utils::getBluetoothMacAddress(), "11:22:33:44:55:66");
}

TEST_F(UtilsSystem, NetworkSnapshotAndInterfaceNames) {
    EXPECT_EQ(Utils::GetWifiName(), "en1");
    EXPECT_EQ(Utils::GetEthernetName(), "en0");
    EXPECT_TRUE(Utils::getNetworkCorrespondAddress().empty());

    fake->addAdapter("Ethernet", "eth0", "aa:00:00:00:00:01");  // no address
    fake->addAdapter("Ethernet", "eth1", "aa:00:00:00:00:02", "10.1.0.5", "255.255.0.0");
    fake->addAdapter("Wi-Fi", "wlan0", "bb:00:00:00:00:01");    // no address
    fake->setWifiSsid("Caf\xC3\xA9");
    const auto snapshot = Utils::getNetworkCorrespondAddress();
    EXPECT_EQ(snapshot, (std::map<std::string, std::string>{{"Ethernet", "10.1.0.5"}, {"Wi-Fi", ""}}));
    EXPECT_EQ(Utils::GetEthernetName(), "eth1");
    EXPECT_EQ(Utils::GetWifiName(), "wlan0");

    fake->addAdapter("Wi-Fi", "wlan1", "bb:00:00:00:00:02", "192.168.7.9");
    const auto list = Utils::GetNetworkInfoList();
    ASSERT_EQ(list.size(), 2u);
    EXPECT_EQ(list[0], (std::map<std::string, std::string>{
                           {"name", "Ethernet"}, {"bsdName", "eth1"}, {"ip", "10.1.0.5"}, {"netmask", "255.255.0.0"}}));
    EXPECT_EQ(list[1], (std::map<std::string, std::string>{{"name", "Wi-Fi"},
                                                           {"bsdName", "wlan1"},
                                                           {"ip", "192.168.7.9"},
                                                           {"netmask", "255.255.255.0"},
                                                           {"ssid", "Caf\xC3\xA9"}}));
    EXPECT_EQ(Utils::getNetworkCorrespondAddress().at("Wi-Fi"), "192.168.7.9");
    EXPECT_EQ(Utils::GetWifiName(), "wlan1");

    // The address list cannot be read: nothing, and the names stay as they were.
    fake->setInterfaceAddresses(std::nullopt);
    EXPECT_TRUE(Utils::getNetworkCorrespondAddress().empty());
    EXPECT_TRUE(Utils::GetNetworkInfoList().empty());
    EXPECT_EQ(Utils::GetWifiName(), "wlan1");
    EXPECT_NE(todaysLog().find("[GetNetworkInfoList] err: "), std::string::npos);
}

TEST_F(UtilsSystem, WifiVpnFirewallAndScreenState) {
    EXPECT_FALSE(Utils::SsidWifiCondition());
    fake->setWifiPowerOn(true);
    EXPECT_TRUE(Utils::SsidWifiCondition());

    fake->setVpnScopedInterfaces({"eth0", "docker0"});
    EXPECT_FALSE(Utils::isVpnOn());
    for (const char* name : {"utun3", "tap1", "ppp0", "ipsec0", "wg0"}) {
        fake->setVpnScopedInterfaces({"eth0", name});
        EXPECT_TRUE(Utils::isVpnOn()) << name;
    }

    EXPECT_EQ(Utils::getFirewallState(), std::nullopt);
    fake->setFirewallGlobalState("0\n");
    EXPECT_EQ(Utils::getFirewallState(), false);
    fake->setFirewallGlobalState(" 1 ");
    EXPECT_EQ(Utils::getFirewallState(), true);
    fake->setFirewallGlobalState("2");
    EXPECT_EQ(Utils::getFirewallState(), true);
    fake->setFirewallGlobalState("\xff");
    EXPECT_EQ(Utils::getFirewallState(), std::nullopt);
    fake->setFirewallGlobalState("\n");  // nothing read is not "on"
    EXPECT_EQ(Utils::getFirewallState(), std::nullopt);

    EXPECT_TRUE(Utils::isScreenUnlocked());  // unknown counts as unlocked
    fake->setScreenLocked(true);
    EXPECT_FALSE(Utils::isScreenUnlocked());
    fake->setScreenLocked(false);
    EXPECT_TRUE(Utils::isScreenUnlocked());

    fake->setCpuVendor(std::nullopt);
    fake->setHardwareModel("");
    EXPECT_EQ(Utils::GetPcSystemInfo(), (std::map<std::string, std::string>{{"model", ""}, {"vendor", "apple"}}));
    fake->setCpuVendor("GenuineIntel");
    fake->setHardwareModel("X1 Carbon");
    EXPECT_EQ(Utils::GetPcSystemInfo(),
              (std::map<std::string, std::string>{{"model", "X1 Carbon"}, {"vendor", "GenuineIntel"}}));
    EXPECT_NE(todaysLog().find("[GetPcSystemInfo] model: X1 Carbon vendor: GenuineIntel\n"), std::string::npos);
}

TEST_F(UtilsSystem, AppRunningCountRule) {
    const std::string app = "kesu办公套件";
    EXPECT_TRUE(Utils::isAppRunning(app));  // none
    fake->setRunningApplicationNames({app, "bash"});
    EXPECT_TRUE(Utils::isAppRunning(app));
    fake->setRunningApplicationNames({app, "bash", app});
    EXPECT_FALSE(Utils::isAppRunning(app));  // exactly two
    fake->setRunningApplicationNames({app, app, app});
    EXPECT_TRUE(Utils::isAppRunning(app));
}

TEST_F(UtilsSystem, PingOnlyTakesIpv4Literals) {
    for (const char* bad : {"8.8.8.8; rm -rf /", "localhost", "", "-c 9 127.0.0.1", "127.0.0.1 ", "::1", "1.2.3"}) {
        EXPECT_FALSE(Utils::pingAddress(bad, 1)) << bad;
    }
    EXPECT_EQ(fake->pingCalls(), 0);
    EXPECT_NE(todaysLog().find("8.8.8.8; rm -rf /"), std::string::npos);

    EXPECT_TRUE(Utils::pingAddress("127.0.0.1", 1));
    EXPECT_EQ(fake->lastPingAddress(), "127.0.0.1");
    fake->setPingResult(false);
    EXPECT_FALSE(Utils::pingAddress("127.0.0.1", 0));
    EXPECT_EQ(fake->pingCalls(), 2);
}

TEST_F(UtilsSystem, ActionsAnswerAndLog) {
    fake->setSwitchWifiOnResult(true);
    EXPECT_TRUE(Utils::openWifi());
    EXPECT_TRUE(Utils::SsidWifiCondition());
    fake->setSwitchWifiOnResult(false, "radio blocked");
    EXPECT_FALSE(Utils::openWifi());
    EXPECT_EQ(fake->switchWifiOnCalls(), 2);
    const std::string log = todaysLog();
    EXPECT_NE(log.find("[Utils::openWifi] Wi-Fi turned on"), std::string::npos);
    EXPECT_NE(log.find("[Utils::openWifi] Error turning on Wi-Fi: radio blocked"), std::string::npos);

    EXPECT_EQ(Utils::openWlanSetting(), "{\n  \"error\": 0,\n  \"error_message\": \"open success\"\n}");
    fake->setOpenNetworkSettingsResult(false);
    EXPECT_EQ(Utils::openWlanSetting(), "{\n  \"error\": -1,\n  \"error_message\": \"open fail\"\n}");
    EXPECT_EQ(fake->openNetworkSettingsCalls(), 2);
}

TEST_F(UtilsSystem, CommandsAndDetachedPrograms) {
    // The command runs to its end; its exit status does not matter.
    const std::string out = env.dir().str() + "/out.txt";
    EXPECT_TRUE(Utils::useCommandLine("printf 'done' > '" + out + "'; exit 3"));
    EXPECT_EQ(test::readAll(out), "done");

    int exitCode = 5;
    EXPECT_FALSE(Utils::startProcess(env.dir().str() + "/no-such-program", {}, exitCode));
    EXPECT_EQ(exitCode, -1);
    EXPECT_NE(todaysLog().find("[startProcess] something went wrong, error: "), std::string::npos);

    // A started program runs on its own: it reports through a FIFO that it did run.
    const std::string fifo = env.dir().str() + "/fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    const int reader = ::open(fifo.c_str(), O_RDONLY | O_NONBLOCK);
    ASSERT_GE(reader, 0);
    EXPECT_TRUE(Utils::startProcess("/bin/sh", {"-c", "printf started > \"$0\"", fifo}, exitCode));
    EXPECT_EQ(exitCode, 0);
    std::string got;
    while (got.size() < 7) {
        pollfd p{reader, POLLIN, 0};
        if (::poll(&p, 1, 10000) <= 0) break;
        char buffer[16];
        const ssize_t n = ::read(reader, buffer, sizeof buffer);
        if (n > 0) got.append(buffer, static_cast<std::size_t>(n));
        else if (n == 0 && (p.revents & POLLHUP) != 0 && !got.empty()) break;
    }
    ::close(reader);
    EXPECT_EQ(got, "started");
}

TEST_F(UtilsSystem, SequenceNumbersAreUniqueUnderConcurrency) {
    EXPECT_EQ(Utils::getNfcLanConnectSeqNo(), 0);
    EXPECT_EQ(Utils::getNfcLanConnectSeqNo(), 1);
    Utils::resetStateForTest();

    constexpr int threads = 8;
    constexpr int perThread = 2000;
    std::vector<std::vector<long long>> seen(threads);
    std::vector<std::thread> workers;
    for (int t = 0; t < threads; ++t)
        workers.emplace_back([&, t] {
            for (int i = 0; i < perThread; ++i) seen[t].push_back(Utils::getNfcLanConnectSeqNo());
        });
    for (auto& w : workers) w.join();
    std::vector<long long> all;
    for (auto& s : seen) all.insert(all.end(), s.begin(), s.end());
    std::sort(all.begin(), all.end());
    ASSERT_EQ(all.size(), static_cast<std::size_t>(threads * perThread));
    for (std::size_t i = 0; i < all.size(); ++i) ASSERT_EQ(all[i], static_cast<long long>(i));
}

TEST_F(UtilsSystem, ClaimsFlagsAndUrls) {
    // Of many threads racing for the connection slot, exactly one gets it.
    std::atomic<int> winners{0};
    std::vector<std::thread> racers;
    for (int t = 0; t < 8; ++t)
        racers.emplace_back([&] {
            if (Utils::tryClaimConnectDevice()) ++winners;
            Utils::setConnectingDeviceType("phone");
            (void)Utils::getConnectingDeviceType();
        });
    for (auto& r : racers) r.join();
    EXPECT_EQ(winners.load(), 1);
    EXPECT_FALSE(Utils::getIsCanConnectDevice());
    EXPECT_FALSE(Utils::tryClaimConnectDevice());
    Utils::setIsCanConnectDevice(true);
    EXPECT_TRUE(Utils::tryClaimConnectDevice());

    EXPECT_TRUE(Utils::tryClaimPrimaryConnectDevice());
    EXPECT_FALSE(Utils::tryClaimPrimaryConnectDevice());

    Utils::setIsAllowWindow(true);
    Utils::setThisPhoneAutoConnect(true);
    Utils::setPrimaryConnectDeviceType("pad");
    Utils::setWlanConnState(true);
    Utils::setSsdpDetectedLastTime(12.5);
    Utils::setConnectCenterServerUrl("https://override.test/");
    (void)Utils::getNfcLanConnectSeqNo();
    Utils::resetStateForTest();
    EXPECT_FALSE(Utils::getIsAllowWindow());
    EXPECT_FALSE(Utils::getThisPhoneAutoConnect());
    EXPECT_TRUE(Utils::getIsCanConnectDevice());
    EXPECT_TRUE(Utils::getIsCanPrimaryConnectDevice());
    EXPECT_EQ(Utils::getConnectingDeviceType(), "");
    EXPECT_EQ(Utils::getPrimaryConnectDeviceType(), "");
    EXPECT_FALSE(Utils::getWlanConnState());
    EXPECT_EQ(Utils::getSsdpDetectedLastTime(), 0.0);
    EXPECT_EQ(Utils::connectCenterServerUrl(), env.config().defaultConnectCenterUrl);
    EXPECT_EQ(Utils::getNfcLanConnectSeqNo(), 0);

    EXPECT_EQ(Utils::pcsuiteHttpServerUrl(), "http://127.0.0.1:9199/");
    EXPECT_EQ(Utils::kesuConnHttpServerUrl(), "http://127.0.0.1:9197/");
    EXPECT_EQ(Utils::pcsuiteHttpServerSSDPQuerryAllUrl(), "http://127.0.0.1:9199/SSDPQueryAll");
    EXPECT_EQ(Utils::pcsuiteHttpServerPushGattClientListUrl(), "http://127.0.0.1:9199/RH2RF_PUSH_GATT_CLIENT_LIST");
    EXPECT_EQ(Utils::pcsuiteHttpIsConnectBusyUrl(), "http://127.0.0.1:9199/isConnectBusy?deviceType=");
    EXPECT_EQ(Utils::pcsuiteHttpServerNotifySystemEventUrl(), "http://127.0.0.1:9199/notifySystemEvent");
    env.config().pcsuitePort = 40001;
    env.config().controlPort = 40002;
    EXPECT_EQ(Utils::pcsuiteHttpServerSSDPQuerryAllUrl(), "http://127.0.0.1:40001/SSDPQueryAll");
    EXPECT_EQ(Utils::kesuConnHttpServerUrl(), "http://127.0.0.1:40002/");
}

TEST_F(UtilsSystem, TextConversions) {
    EXPECT_EQ(Utils::uintToHexString(""), "");
    EXPECT_EQ(Utils::uintToHexString("A\n\xC3\xA9\xFF"), "410ac3a9ff");
    EXPECT_EQ(Utils::asciiToString({}), "");
    EXPECT_EQ(Utils::asciiToString({0x41, 0x00, 0x7F, 0xE9, 0xFF}), std::string("A\0\x7F\xC3\xA9\xC3\xBF", 7));
}

}  // namespace
}  // namespace kesu
