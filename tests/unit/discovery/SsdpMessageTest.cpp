// Discovery datagrams: wire texts, strict base64, masking and ids, both parsers,
// classification of received datagrams and insertion into the table.

#include <tuple>

#include "DiscoveryFixture.h"
#include "core/Text.h"
#include "platform/SystemInfo.h"

namespace kesu {
namespace {

using Handling = SsdpMessage::Handling;

using test::announce;

Json phone(const std::string& id, const std::string& type = "mobile") {
    Json body = test::phoneBody(id);
    body["deviceType"] = type;
    return body;
}

const std::string kOld =
    "deviceId:AB12XYZ\r\nopenId:old-open\r\nserviceRecord:com.kesu.pcsuite.SERVICE\r\n"
    "deviceName:Living Room Tab\r\naccount:user\r\ndeviceType:pad\r\npcCustomizedData:7xyz\r\n";

using SsdpMessageTest = test::DiscoveryTest;

TEST_F(SsdpMessageTest, AnnouncementAndSearchWireFormat) {
    const std::string msg = SsdpMessage::responseMessage("Off****-PC", "a1b2c3d4e5f6", "138****0000", "oid",
                                                         SsdpMessage::pcServiceRecord());
    const std::string head = "RESPONSE * HTTP/1.1\r\nDATE:" + WallClock::getNowTime() + "\r\ncompatGsonStr:";
    ASSERT_EQ(msg.substr(0, head.size()), head);
    ASSERT_EQ(msg.substr(msg.size() - 2), "\r\n");
    const std::string b64 = msg.substr(head.size(), msg.size() - head.size() - 2);
    const auto body = base64::decodeStrict(b64);
    ASSERT_TRUE(body.has_value());
    EXPECT_EQ(body->find_first_of(" \n"), std::string::npos);  // compact
    const Json j = Json::parse(*body);
    EXPECT_EQ(j, (Json{{"deviceName", "Off****-PC"}, {"deviceId", "a1b2c3d4e5f6"}, {"openId", "oid"},
                       {"serviceRecord", "com.kesu.pcsuite.SERVICE--com.kesu.share.CONNECT_PC"},
                       {"port", 10191}, {"account", "138****0000"}, {"deviceType", "pc"}, {"extra", "null"}}));

    EXPECT_EQ(SsdpMessage::searchMessage("dev", "oid", "svc"),
              "M-SEARCH * HTTP/1.1\nHost:239.255.255.250:2200\nMan:\"ssdp:discover\"\nMX:5\nST:kesu_connect\n"
              "deviceId:dev\nopenId:oid\nService:svc\r\n");
}

TEST(SsdpBase64, StrictDecoding) {
    for (const std::string& bytes : {std::string(), std::string("A"), std::string("AB"), std::string("ABC"),
                                    std::string("\0\xff\x10\x80", 4)}) {
        EXPECT_EQ(base64::decodeStrict(base64::encode(bytes)), bytes);
    }
    EXPECT_EQ(base64::encode("kesu"), "a2VzdQ==");
    for (const char* bad : {"a2VzdQ", "a2VzdQ=", "a2Vz dQ==", "a2V=zdQ=", "A===", "====", "a2Vz\r\ndQ==",
                            "a2-_dQ==", "a2VzdQ==a2Vz"}) {
        EXPECT_FALSE(base64::decodeStrict(bad).has_value()) << bad;
    }
}

TEST_F(SsdpMessageTest, MaskingAndIdentifierRules) {
    bool full = false;
    EXPECT_EQ(SsdpMessage::maskValue("ABCDEF", full), "ABCDEF");
    EXPECT_TRUE(full);
    EXPECT_EQ(SsdpMessage::maskValue("ABCDEFG", full), "ABC****EFG");  // 7 is the first masked length
    EXPECT_FALSE(full);

    EXPECT_EQ(SsdpMessage::deviceIdentifier("abc"), "616263");
    EXPECT_EQ(SsdpMessage::deviceIdentifier("\xE8\xAE\xBE\xE5\xA4\x87" "12ZZ"), "e8aebee5a4873132");
}

TEST_F(SsdpMessageTest, CurrentFormatParse) {
    SsdpDevice p;
    ASSERT_TRUE(SsdpMessage::parserResponseData(
        json::compact(Json{{"deviceName", "kesuABCDEFG"}, {"deviceType", "pad"}, {"account", 42}, {"deviceId", "x"}}), p));
    EXPECT_EQ(p.deviceName, "ABC****EFG");
    EXPECT_FALSE(p.isDeviceNameFull);
    EXPECT_EQ(p.deviceType, "pad");
    EXPECT_EQ(p.account, "");  // not a string
    EXPECT_TRUE(p.isAccountFull);

    SsdpDevice other;
    ASSERT_TRUE(SsdpMessage::parserResponseData(R"({"deviceType":"watch","deviceId":"w"})", other));
    EXPECT_EQ(other.deviceType, "phone");
    SsdpDevice broken;
    EXPECT_TRUE(SsdpMessage::parserResponseData("{not json", broken));
    EXPECT_EQ(broken.deviceId, "");
    EXPECT_FALSE(SsdpMessage::parserResponseData("", broken));
}

TEST_F(SsdpMessageTest, OldFormatParse) {
    SsdpDevice d;
    ASSERT_TRUE(SsdpMessage::parserOldResponseData(kOld, d));
    EXPECT_EQ(d.deviceName, "Liv****Tab");  // the other fields are checked end to end (DiscoveryE2E)
    EXPECT_EQ(d.deviceId, "41423132");

    auto replaced = [](std::string s, const std::string& from, const std::string& to) {
        return s.replace(s.find(from), from.size(), to);
    };
    SsdpDevice f;
    EXPECT_FALSE(SsdpMessage::parserOldResponseData(replaced(kOld, "\r\nopenId", "\r\nOPENID"), f));
    EXPECT_FALSE(SsdpMessage::parserOldResponseData(replaced(kOld, "pcCustomizedData:7xyz\r\n", "pcCustomizedData:"), f));
    // The account's closing marker before its opening marker.
    EXPECT_FALSE(SsdpMessage::parserOldResponseData(
        "deviceId:a\r\nopenId:o\r\nserviceRecord:s\r\ndeviceName:n\r\naccount\r\ndeviceType:mobile\r\naccount:x\r\n"
        "pcCustomizedData:1", f));
    EXPECT_FALSE(SsdpMessage::parserOldResponseData("", f));
}

TEST_F(SsdpMessageTest, DatagramClassification) {
    SsdpDeviceManager table(64, 30.0, clock);
    const std::string host = "10.77.0.5";

    EXPECT_EQ(SsdpMessage::handleDatagram(announce(phone("ph01")), host, table), Handling::currentFormat);
    EXPECT_EQ(table.ssdpDeviceMap.size(), 1u);
    EXPECT_EQ(table.lastOwnEcho(), SteadyClock::time_point());

    // The PC's own announcement looped back: not stored, but it proves the socket hears.
    const std::string own = SsdpMessage::responseMessage(SystemInfo::getLocalName(), "a1b2c3", "", "oid",
                                                         SsdpMessage::pcServiceRecord());
    EXPECT_EQ(SsdpMessage::handleDatagram(own, host, table), Handling::ignored);
    EXPECT_EQ(table.lastOwnEcho(), clock.now());
    // So does a phone announcement that merely holds the PC's name somewhere.
    advance(5);
    Json naming = phone("ph02");
    naming["pcCustomizedData"] = "for Off****-PC";
    EXPECT_EQ(SsdpMessage::handleDatagram(announce(naming), host, table), Handling::currentFormat);
    EXPECT_EQ(table.lastOwnEcho(), clock.now());

    // Old-format markers win over the current format.
    EXPECT_EQ(SsdpMessage::handleDatagram(kOld + "compatGsonStr:" + base64::encode("{}") + "\r\n", host, table),
              Handling::oldFormat);
    // A base64 payload broken over lines is joined again.
    std::string split = announce(phone("ph03"));
    split.insert(split.find("compatGsonStr:") + 20, "\r\n");
    EXPECT_EQ(SsdpMessage::handleDatagram(split, host, table), Handling::currentFormat);
    EXPECT_EQ(table.ssdpDeviceMap.size(), 4u);

    Json foreign = phone("zz03");
    foreign["serviceRecord"] = "com.other.SERVICE";
    for (const auto& [datagram, from, handling] : std::vector<std::tuple<std::string, std::string, Handling>>{
             {announce(phone("zz01")) + "\r\n", host, Handling::ignored},
             {announce(phone("zz02", "pc")), host, Handling::ignored},
             {announce(foreign), host, Handling::ignored},
             {SsdpMessage::searchMessage("d", "o", "com.kesu.pcsuite.SERVICE"), host, Handling::ignored},
             {"", host, Handling::dropped},
             {announce(phone("zz04")), "", Handling::dropped},
             {"deviceType:mobile com.kesu.pcsuite.SERVICE \xff", host, Handling::dropped},
             {"RESPONSE * HTTP/1.1\r\ncompatGsonStr:\r\n", host, Handling::dropped},
             {"RESPONSE * HTTP/1.1\r\ncompatGsonStr:e30*\r\n", host, Handling::dropped},
             {"compatGsonStr:" + base64::encode("{\"a\":\"\xc3\"}"), host, Handling::dropped}}) {
        EXPECT_EQ(SsdpMessage::handleDatagram(datagram, from, table), handling) << datagram;
    }
    EXPECT_EQ(table.ssdpDeviceMap.size(), 4u);
}

TEST_F(SsdpMessageTest, InsertionObserverAndRefresh) {
    SsdpDeviceManager table(64, 30.0);
    std::vector<std::string> seen;  // what the observer found in the table, per call
    const auto token = table.addChangeObserver([&](const SsdpDevice& d) {
        SsdpDevicePtr stored;
        seen.push_back(table.ssdpDeviceMap.lookup(d.deviceId, stored) ? stored->ip.front() : "absent");
    });

    SsdpMessage::insertResponseDevice(json::compact(phone("abcd-1")), "10.0.0.1", "openid-of-this-pc", true, table);
    advance(4);
    SsdpMessage::insertResponseDevice(json::compact(phone("abcd-2")), "10.0.0.2", "openid-of-this-pc", true, table);
    EXPECT_EQ(seen, (std::vector<std::string>{"absent", "10.0.0.1"}));

    // Same first 4 characters: one key, the latest announcement in full.
    SsdpDevicePtr d;
    ASSERT_TRUE(table.ssdpDeviceMap.lookup("61626364", d));
    EXPECT_EQ(d->ip, std::vector<std::string>{"10.0.0.2"});
    EXPECT_EQ(d->lastUpdate, now());
    EXPECT_TRUE(d->isOpenIdSame);
    EXPECT_EQ(table.ssdpDeviceMap.size(), 1u);

    // The PC's open id must be set and equal for isOpenIdSame.
    SsdpMessage::insertResponseDevice(json::compact(phone("efgh")), "10.0.0.3", "", true, table);
    ASSERT_TRUE(table.ssdpDeviceMap.lookup("65666768", d));
    EXPECT_FALSE(d->isOpenIdSame);

    // Nothing to store: no sender, no id, failed parse.
    SsdpMessage::insertResponseDevice(json::compact(phone("ijkl")), "", "x", true, table);
    SsdpMessage::insertResponseDevice("{}", "10.0.0.4", "x", true, table);
    SsdpMessage::insertResponseDevice("deviceType:mobile", "10.0.0.4", "x", false, table);
    EXPECT_EQ(table.ssdpDeviceMap.size(), 2u);
    EXPECT_EQ(seen.size(), 3u);
    table.removeChangeObserver(token);
}

}  // namespace
}  // namespace kesu
