// The connection messages: the PC's request and answers, the classification of a phone's
// answer, the reading of a phone's request, the busy answer, and the launched programs'
// argument lists.
#include "connect/ConnectMessage.h"

#include <gtest/gtest.h>

#include "account/DataInstance.h"
#include "connect/LaunchService.h"
#include "connect/PhoneFrame.h"
#include "core/Utils.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

class ConnectMessages : public ::testing::Test {
protected:
    void SetUp() override {
        fake->setLocalizedHostName("Office-Desk-PC");
        fake->addAdapter("Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:ff", "192.168.1.2");
        dataInstance().update([](databaseParam& p) {
            p = databaseParam();
            p.openid = "openid-of-pc";
            p.Phone = "138****5678";
        });
    }
    void TearDown() override {
        dataInstance().update([](databaseParam& p) { p = databaseParam(); });
        Utils::closeLog();
    }
    test::HermeticEnv env;
    ScopedFakePlatform fake;
};

TEST_F(ConnectMessages, RequestAndAnswerBodies) {
    const Json request = connectRequestBody();
    const Json expected = {{"bytes", {0}},
                           {"deviceName", "Off****-PC"},
                           {"channel", 0},
                           {"id", 87654321},
                           {"open_Id", "openid-of-pc"},
                           {"service_id", "com.kesu.pcsuite.SERVICE"},
                           {"target_id", "aabbccddeeff"},
                           {"account", "138****5678"},
                           {"type", 1}};
    EXPECT_EQ(request, expected);

    // Answers: the same identity, the tag, the given service and "type" as a string.
    Json agree = expected;
    agree["bytes"] = {3};
    agree["service_id"] = "com.kesu.share.CONNECT_PC";
    agree["type"] = "1";
    EXPECT_EQ(connectAnswerBody(ConnectTag::AGREE, serviceId::shareId), agree);
    EXPECT_EQ(connectAnswerBody(ConnectTag::DIFFDEVICEBUSY, serviceId::pcsuiteId)["bytes"], Json::array({12}));
    EXPECT_EQ(connectAnswerBody(ConnectTag::REJECT, serviceId::pcsuiteId)["service_id"], "com.kesu.pcsuite.SERVICE");
}

TEST_F(ConnectMessages, AnswerClassificationOrder) {
    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes":[1]})"), ConnectTag::PHONEAGREE);
    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes":[2]})"), ConnectTag::PHONEREJECT);
    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes":[11]})"), ConnectTag::BUSY);
    // [1] before [2] before [11], wherever they stand in the text.
    EXPECT_EQ(classifyPhoneAnswer(R"({"x":{"bytes":[11]},"y":{"bytes":[2]},"bytes":[1]})"), ConnectTag::PHONEAGREE);
    EXPECT_EQ(classifyPhoneAnswer(R"({"x":{"bytes":[11]},"bytes":[2]})"), ConnectTag::PHONEREJECT);
    // Only the literal compact substrings count.
    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes": [1]})"), ConnectTag::TIMEOUT);
    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes":[12]})"), ConnectTag::TIMEOUT);
    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes":[1,2]})"), ConnectTag::TIMEOUT);
    EXPECT_EQ(classifyPhoneAnswer("error parse"), ConnectTag::TIMEOUT);
    EXPECT_EQ(classifyPhoneAnswer(""), ConnectTag::TIMEOUT);

    // The answer's text: the body after the 14-byte header, when it is UTF-8.
    EXPECT_EQ(phoneAnswerText(buildPhoneFrame(R"({"bytes":[1]})")), R"({"bytes":[1]})");
    EXPECT_EQ(phoneAnswerText(buildPhoneFrame("")), "");
    EXPECT_EQ(phoneAnswerText(buildPhoneFrame("{\"a\":\"\xff\xfe\"}")), std::nullopt);
}

TEST_F(ConnectMessages, PhoneRequestFields) {
    const auto pad = PhoneConnectRequest::parse(
        R"({"bytes":[0],"target_id":"ABCDEFGH","account":"13812345678","deviceName":"My Pad",)"
        R"("open_Id":"oid","service_id":"com.kesu.pcsuite.SERVICE","extra_info":"{\"deviceType\":1,\"port\":\"7000\"}"})");
    ASSERT_TRUE(pad);
    EXPECT_EQ(pad->deviceId, "41424344");  // "ABCD", two lower-case hex digits per byte
    EXPECT_EQ(pad->account, "138****678");
    EXPECT_EQ(pad->deviceType, "pad");
    EXPECT_EQ(pad->port, "7000");
    EXPECT_EQ(pad->deviceName, "My Pad");
    EXPECT_EQ(pad->openId, "oid");
    EXPECT_EQ(pad->serviceId, "com.kesu.pcsuite.SERVICE");

    // Characters, not bytes: the first 4 characters of a non-ASCII id.
    const auto wide = PhoneConnectRequest::parse(R"({"bytes":[0],"target_id":"\u00e9tude"})");
    ASSERT_TRUE(wide);
    EXPECT_EQ(wide->deviceId, "c3a9747564");
    // Defaults without (or with unusable) extra information.
    for (const char* body : {R"({"bytes":[0]})", R"({"bytes":[0],"extra_info":"not json"})",
                             R"({"bytes":[0],"extra_info":"{\"deviceType\":0}"})", R"({"bytes":[0],"extra_info":"[1]"})"}) {
        const auto request = PhoneConnectRequest::parse(body);
        ASSERT_TRUE(request) << body;
        EXPECT_EQ(request->deviceType, "phone") << body;
        EXPECT_EQ(request->port, "") << body;
    }
    // Only a JSON object whose "bytes" is exactly [0] is a request.
    for (const char* body : {"", "{}", "[0]", "not json", R"({"bytes":[1]})", R"({"bytes":[0,0]})", R"({"bytes":"0"})",
                             R"({"bytes":["0"]})", R"({"bytes":0})"}) {
        EXPECT_FALSE(PhoneConnectRequest::parse(body)) << body;
    }
}

TEST_F(ConnectMessages, BusyAnswersAndSameAccount) {
    EXPECT_EQ(busyAnswerFor("phone", "phone"), ConnectTag::BUSY);
    EXPECT_EQ(busyAnswerFor("pad", "pad"), ConnectTag::BUSY);
    EXPECT_EQ(busyAnswerFor("phone", "pad"), ConnectTag::DIFFDEVICEBUSY);
    EXPECT_EQ(busyAnswerFor("pad", "phone"), ConnectTag::DIFFDEVICEBUSY);

    EXPECT_EQ(sameAccountFlag("oid", "oid"), "1");
    EXPECT_EQ(sameAccountFlag("oid", "other"), "0");
    EXPECT_EQ(sameAccountFlag("", ""), "0");  // nobody signed in is nobody's same account
    EXPECT_EQ(sameAccountFlag("oid", ""), "0");
}

TEST_F(ConnectMessages, LaunchArgumentLists) {
    EXPECT_EQ(LaunchService::allowWindowArguments(AppSource::pcsuite, "My Phone", "41424344", "138****678", "1", "phone"),
              (std::vector<std::string>{"1", "My Phone", "41424344", "138****678", "1", "phone"}));
    EXPECT_EQ(LaunchService::pcSuiteArguments("10.0.0.7", "My Phone", 12, "WLAN", "41424344", true, "138****678", "pad", "0"),
              (std::vector<std::string>{"--h=10.0.0.7", "--n=\"My Phone\"", "--seq=12", "--m=WLAN", "--i=41424344", "--a=true",
                                        "--account=138****678", "--dt=pad", "--as=0"}));
    EXPECT_EQ(describeList({"a", "b \"c\""}), R"(["a", "b \"c\""])");
}

}  // namespace
}  // namespace kesu
