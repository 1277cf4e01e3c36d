// The connection messages: the PC's request and answer bodies, the classification of a
// phone's answer and the reading of a phone's request (both untrusted input).
#include "connect/ConnectMessage.h"

#include <gtest/gtest.h>

#include "unit/connect/ConnectFixture.h"

namespace kesu {
namespace {

using ConnectMessages = test::PcIdentityTest;

// The PC's bodies themselves are checked on the wire (ActiveConnectTest, SocketServerTest).
TEST_F(ConnectMessages, SameAccountFlagAndAnswerClassification) {
    EXPECT_EQ(sameAccountFlag("oid", "oid"), "1");
    EXPECT_EQ(sameAccountFlag("", ""), "0");  // nobody signed in is nobody's same account

    EXPECT_EQ(classifyPhoneAnswer(R"({"bytes":[11]})"), ConnectTag::BUSY);
    // [1] before [2] before [11], wherever they stand in the text.
    EXPECT_EQ(classifyPhoneAnswer(R"({"x":{"bytes":[11]},"y":{"bytes":[2]},"bytes":[1]})"), ConnectTag::PHONEAGREE);
    EXPECT_EQ(classifyPhoneAnswer(R"({"x":{"bytes":[11]},"bytes":[2]})"), ConnectTag::PHONEREJECT);
    // Only the literal compact substrings count.
    for (const char* other : {R"({"bytes": [1]})", R"({"bytes":[12]})", R"({"bytes":[1,2]})", "error parse", ""})
        EXPECT_EQ(classifyPhoneAnswer(other), ConnectTag::TIMEOUT) << other;

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

}  // namespace
}  // namespace kesu
