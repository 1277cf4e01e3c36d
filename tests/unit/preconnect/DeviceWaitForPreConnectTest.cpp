// The pre-connect handshake and the held link, against the simulated phone on loopback.
#include "PreconnectFixture.h"

#include <cstdio>
#include <fstream>
#include <sstream>

#include "connect/PhoneLink.h"
#include "connect/Step.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using test::PreconnectTest;
using Mode = phonesim::PreconnectReply::Mode;

phonesim::PreconnectReply modeReply(Mode mode) {
    phonesim::PreconnectReply reply;
    reply.mode = mode;
    return reply;
}
// A reply whose `field` is `value`.
phonesim::PreconnectReply replyWith(std::string phonesim::PreconnectReply::*field, const std::string& value) {
    phonesim::PreconnectReply reply;
    reply.*field = value;
    return reply;
}

std::string stepEntry(const StepStruct& step, Result result) {
    return sharedStep().getConnectCodeV2(step) + sharedStep().getConnectResult(step, result);
}

TEST(FarawayDeviceTest, CloudRecordBecomesTheRecordAndItsLocalForm) {
    FarawayDevice device;
    device.setAllInfo({{"type", 4},
                       {"btSwitch", 1},
                       {"ext", {{"k", {1, 2}}}},
                       {"bizInfo", {{"conn_base", {{"businessId", "abcdef"}}}}},
                       {"inets", {{{"localInet", ""}}, {{"localInet", "10.0.0.9"}, {"ssid", "Home"}}, {{"inet", "x"}}}}});
    const Json local = device.getLocalInfo();
    EXPECT_EQ(device.getDeviceId(), "61626364");  // only the first four characters count
    EXPECT_EQ(local["type"], "unknowed");
    EXPECT_EQ(local["wifiSwitch"], 0);  // a missing key reads as 0
    EXPECT_EQ(local["ext"], Json({{"k", {1, 2}}}));
    ASSERT_EQ(local["inets"].size(), 3u);
    EXPECT_EQ(local["inets"][1], Json({{"inet", ""}, {"localInet", "10.0.0.9"}, {"netmark", ""}, {"ssid", "Home"}}));
    EXPECT_TRUE(device.isWlanConnectSupport());

    FarawayDevice bare;
    bare.setAllInfo({{"bizInfo", {{"conn_base", {{"businessId", "ab"}}}}}, {"inets", {{{"localInet", ""}}}}});
    EXPECT_EQ(bare.getDeviceId(), "6162");
    EXPECT_FALSE(bare.isWlanConnectSupport());
    FarawayDevice none;
    none.setAllInfo(Json::object());
    EXPECT_EQ(none.getDeviceId(), "");
    EXPECT_FALSE(none.getLocalInfo().contains("inets"));
}

TEST(FarawayDeviceTest, ClientGenerations) {
    EventLoop loop;
    FarawayDevice device;
    EXPECT_TRUE(device.destroyClient());  // nothing to close
    device.createClient("", loop.executor());
    EXPECT_EQ(device.getCommunicationChannel(), nullptr);
    device.createClient(FarawayDevice::kWlan, loop.executor());
    const auto first = device.getCommunicationChannel();
    device.createClient(FarawayDevice::kWlan, loop.executor());
    EXPECT_EQ(device.getCommunicationChannel(), first);
    EXPECT_EQ(device.getClientId(), 1);
    device.destroyClient();
    EXPECT_EQ(device.getCommunicationChannel(), nullptr);
}

// The kernel's keep-alive timer ("tr" 2 in /proc/net/tcp) of the PC's end of links to `port`,
// in seconds; nullopt when there is no such link or its timer is another.
std::optional<long> keepAliveSeconds(int port) {
    std::ifstream table("/proc/net/tcp");
    std::string line;
    char remote[16];
    std::snprintf(remote, sizeof remote, ":%04X ", port);
    while (std::getline(table, line)) {
        std::istringstream fields(line);
        std::string slot, local, peer, state, queues, timer;
        fields >> slot >> local >> peer >> state >> queues >> timer;
        if ((peer + " ").find(remote) == std::string::npos || state != "01") continue;
        if (timer.rfind("02:", 0) != 0) return std::nullopt;
        return std::stol(timer.substr(3), nullptr, 16) / 100;  // jiffies as USER_HZ
    }
    return std::nullopt;
}

// The phone's request to connect over the held link, and the PC suite's outcome going back to
// it, are checked in PreconnectE2ETest and (with the PC suite down) below.
TEST_F(PreconnectTest, AcceptedHandshakeHoldsTheLinkAndQueuesThePhonesFrames) {
    phonesim::Listener phone(phoneOptions());
    ASSERT_TRUE(phone.ok());
    const auto entry = entryFor(phone.port());

    ASSERT_EQ(handshake(entry), true);
    // Only the ping outcome is traced for an attempt that succeeded.
    EXPECT_EQ(entry->getPreConnectStep(), stepEntry(sharedStep().OS4_WLAN_PING_ADDRESS, Result::FAILED));
    EXPECT_EQ(entry->getWlanDeviceIp(), "127.0.0.1");
    EXPECT_TRUE(entry->getIsOpenIdSame());
    const auto keepAlive = keepAliveSeconds(phone.port());  // the held link has keep-alive
    ASSERT_TRUE(keepAlive);
    EXPECT_GT(*keepAlive, 20);
    EXPECT_LE(*keepAlive, 30);
    const Json request = Json::parse(nextOfTag(phone, 22));
    EXPECT_EQ(request, Json({{"bytes", {22}}, {"deviceName", "Off****-PC"}, {"channel", 0}, {"id", 87654321},
                             {"open_Id", "openid-of-pc"}, {"service_id", "com.kesu.pcsuite.SERVICE"},
                             {"target_id", "aabbccddeeff"}, {"account", "138****5678"}, {"type", 1}}));

    // Frames that are not requests stay queued, oldest first.
    ASSERT_TRUE(phone.sendToAll(R"({"bytes":[30],"n":1})"));
    ASSERT_TRUE(phone.sendToAll(R"({"bytes":[31],"n":2})"));
    ASSERT_TRUE(phone.sendToAll(R"({"bytes":[24]})"));  // answered, not queued
    ASSERT_FALSE(nextOfTag(phone, 27).empty());
    Bytes frame;
    ASSERT_TRUE(entry->getQueueMessage(frame));
    EXPECT_EQ(phoneFrameBody(frame), R"({"bytes":[30],"n":1})");
    ASSERT_TRUE(entry->getQueueMessage(frame));
    EXPECT_EQ(phoneFrameBody(frame), R"({"bytes":[31],"n":2})");
    EXPECT_FALSE(entry->getQueueMessage(frame));

    // The phone goes: exactly one abnormal notice for the device.
    phone.closeAll(true);
    ASSERT_TRUE(notices->waitFor(1, 5s));
    EXPECT_EQ(notices->ids(), std::vector<std::string>{entry->getDeviceId()});
}

// A flood of frames is bounded, a request behind it is still answered, and with the PC suite
// down the phone still gets an (empty) result.
TEST_F(PreconnectTest, FloodIsBoundedAndPcSuiteDownStillGivesAnEmptyResult) {
    env.config().pcsuitePort = test::freeTcpPort();
    env.config().preconnectQueueMaxFrames = 8;
    phonesim::Listener phone(phoneOptions());
    const auto entry = entryFor(phone.port());
    ASSERT_EQ(handshake(entry), true);
    ASSERT_TRUE(phone.sendToAll(R"({"bytes":[30],"pad":")" + std::string(1000, 'x') + "\"}", 3000));
    ASSERT_TRUE(phone.sendToAll(R"({"bytes":[24]})"));
    const std::string ack = nextOfTag(phone, 25);
    ASSERT_FALSE(ack.empty());
    EXPECT_EQ(Json::parse(ack)["extra_info"], "");
    const std::string result = nextOfTag(phone, 27);
    ASSERT_FALSE(result.empty());
    EXPECT_EQ(Json::parse(result)["extra_info"], "{}");
    EXPECT_EQ(loop.call([&] { return entry->queuedMessages(); }), std::optional<std::size_t>(8));
}

// Every way a phone can fail the handshake ends the attempt within the time-outs, names the
// failed step, and leaves no descriptor behind once the link is destroyed.
TEST_F(PreconnectTest, RefusedHandshakes) {
    const auto& step = sharedStep();
    const std::string pingFailed = stepEntry(step.OS4_WLAN_PING_ADDRESS, Result::FAILED) + "_";
    struct Case {
        const char* name;
        phonesim::PreconnectReply reply;
        const StepStruct& failed;
        bool openIdSame = true;
    };
    const std::string blank = R"({"bytes": [23],"open_Id":"openid-of-pc","target_id":"SIMPHONE01"})";
    const std::string wrongKind = R"({"bytes":[1],"open_Id":"openid-of-pc","target_id":"SIMPHONE01"})";
    const Case cases[] = {
        {"other account", replyWith(&phonesim::PreconnectReply::openId, "someone-else"), step.OS4_WLAN_PARSER_DEVICE_INFO, false},
        {"other device", replyWith(&phonesim::PreconnectReply::targetId, "OTHERPHONE"), step.OS4_WLAN_PARSER_DEVICE_INFO},
        {"blank in the kind", replyWith(&phonesim::PreconnectReply::body, blank), step.OS4_WLAN_PARSER_DEVICE_INFO},
        {"wrong kind", replyWith(&phonesim::PreconnectReply::body, wrongKind), step.OS4_WLAN_PARSER_DEVICE_INFO},
        {"silent", modeReply(Mode::Silent), step.OS4_WLAN_RECV_DEVICE_INFO},
        {"garbage", modeReply(Mode::Garbage), step.OS4_WLAN_RECV_DEVICE_INFO},
        {"half frame", modeReply(Mode::HalfFrame), step.OS4_WLAN_RECV_DEVICE_INFO},
        {"1 MiB frame", modeReply(Mode::Huge), step.OS4_WLAN_RECV_DEVICE_INFO},
        {"hang-up", modeReply(Mode::HangUp), step.OS4_WLAN_RECV_DEVICE_INFO},
    };
    // One attempt first: what lives for the whole process (the pool, the log file) is set up.
    {
        phonesim::Listener phone(phoneOptions(modeReply(Mode::HangUp)));
        EXPECT_EQ(handshake(entryFor(phone.port())), false);
    }
    loop.call([] {});
    const std::size_t descriptors = test::openDescriptors();
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        phonesim::Listener phone(phoneOptions(c.reply));
        ASSERT_TRUE(phone.ok());
        const auto entry = entryFor(phone.port());
        EXPECT_EQ(handshake(entry), false);
        EXPECT_EQ(entry->getPreConnectStep(), pingFailed + stepEntry(c.failed, Result::FAILED));
        EXPECT_EQ(entry->getIsOpenIdSame(), c.openIdSame);
        entry->getFarawayDevice()->destroyClient();
    }
    loop.call([] {});  // the links' closes have run
    EXPECT_EQ(test::openDescriptors(), descriptors);
    EXPECT_TRUE(notices->ids().empty());
}

TEST_F(PreconnectTest, NoListenerFailsAtTheConnectStep) {
    const auto entry = entryFor(test::freeTcpPort());
    EXPECT_EQ(handshake(entry), false);
    EXPECT_EQ(entry->getPreConnectStep(),
              stepEntry(sharedStep().OS4_WLAN_PING_ADDRESS, Result::FAILED) + "_" +
                  stepEntry(sharedStep().OS4_WLAN_CONNECT_ADDRESS, Result::FAILED));

    // Nothing happens for an entry that is not selected for FARAWAYWLAN.
    entry->setConnectType("");
    entry->setPreConnectStep("");
    EXPECT_EQ(handshake(entry), false);
    EXPECT_EQ(entry->getPreConnectStep(), "");
    entry->addConnectCount();
    EXPECT_EQ(entry->getFarawayWlanConnectCount(), 0);
}

// A disconnect request ends the held link with a notice; a newer link of the record ends it
// without one.
TEST_F(PreconnectTest, HeldLinkEndsWithANoticeOnlyWhenAskedTo) {
    phonesim::Listener phone(phoneOptions());
    auto entry = entryFor(phone.port());
    ASSERT_EQ(handshake(entry), true);
    const auto record = entry->getFarawayDevice();
    loop.call([&] {
        record->destroyClient();
        record->createClient(FarawayDevice::kWlan, loop.executor());
    });
    EXPECT_TRUE(phone.pcClosed(5s));
    loop.call([] {});
    EXPECT_TRUE(notices->ids().empty());
    EXPECT_EQ(record->getClientId(), 2);

    phonesim::Listener second(phoneOptions());
    entry = entryFor(second.port());
    ASSERT_EQ(handshake(entry), true);
    entry->setIsDisconnectNow(true);
    ASSERT_TRUE(notices->waitFor(1, 5s));
    EXPECT_TRUE(second.pcClosed(5s));

    DeviceWaitForPreConnect orphan(loop);
    orphan.setConnectType(FarawayDevice::kWlan);
    orphan.setIsConnected(true);
    orphan.disconnectPreConnect();
    EXPECT_FALSE(orphan.getIsConnected());
    EXPECT_EQ(orphan.getConnectType(), "");
}

}  // namespace
}  // namespace kesu
