// Decoding of control request bodies and the framing of answers.
#include <gtest/gtest.h>

#include "control/HttpService.h"
#include "control/RequestHandle.h"
#include "control/ResponseHandler.h"
#include "core/Text.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

requestObj decode(const std::string& body) { return RequestHandle().format(body); }

TEST(Envelope, LengthPrefixIsOptionalAndIgnored) {
    const std::string envelope = R"({"event":"queryAdapter","args":{"k":"v"},"app":"pcsuite"})";
    for (const std::string& body : {envelope, "57#" + envelope, "1#" + envelope, "#" + envelope}) {
        const requestObj r = decode(body);
        EXPECT_EQ(r.event, RequestEvent::queryAdapter) << body;
        EXPECT_EQ(r.params, Json({{"k", "v"}})) << body;
        EXPECT_EQ(r.source, std::optional<std::string>("pcsuite")) << body;
    }
    // Without a prefix, a "#" inside the JSON cuts it: only the part after it is parsed.
    EXPECT_EQ(decode(R"({"event":"HeartBeat","args":["a#b"]})").event, RequestEvent::unknown);
    EXPECT_EQ(decode(R"(9#{"event":"HeartBeat","args":["a#b"]})").event, RequestEvent::HeartBeat);
    // Only a number: nothing to decode.
    EXPECT_EQ(decode("57#").event, RequestEvent::unknown);
    EXPECT_EQ(decode("###").event, RequestEvent::unknown);
}

TEST(Envelope, CmdFormParamsByJsonTypeAndAppOnlyWhenString) {
    const requestObj a = decode(R"({"cmd":"queryAdapter","param":{}})");
    EXPECT_EQ(a.event, RequestEvent::queryAdapter);
    EXPECT_TRUE(a.params.is_object());
    // "cmd" takes "param", never "args".
    const requestObj c = decode(R"({"event":"","cmd":"HeartBeat","args":{"x":1}})");
    EXPECT_EQ(c.event, RequestEvent::HeartBeat);
    EXPECT_EQ(c.params, Json::array());

    EXPECT_EQ(decode(R"({"event":"kpush","args":"text"})").params, Json("text"));
    EXPECT_EQ(decode(R"({"event":"kpush","args":5})").params, Json::array());
    EXPECT_EQ(decode(R"({"event":"kpush","args":null})").params, Json::array());
    EXPECT_FALSE(decode(R"({"event":"kpush","app":7})").source.has_value());
}

TEST(Envelope, EventNamesMatchExactly) {
    EXPECT_EQ(decode(R"({"event":"preconnect_preconnect-connect"})").event,
              RequestEvent::preconnect_preconnect_connect);
    for (const char* other : {R"({"event":"preconnect_preconnect_connect"})", R"({"event":"heartbeat"})",
                              R"({"event":" HeartBeat"})", R"({"event":42})"})
        EXPECT_EQ(decode(other).event, RequestEvent::unknown) << other;
}

// Text that is no JSON at all is sent to the real service in ServiceE2E.SurvivesHostileBodies.
TEST(Envelope, HostileTextDecodesAsUnknown) {
    EXPECT_EQ(decode("[1,2]").event, RequestEvent::unknown);
    for (const int depth : {20, 5000})  // nesting beyond the parser's bound is refused, not recursed into
        EXPECT_EQ(decode("{\"event\":\"HeartBeat\",\"args\":" + std::string(depth, '[') + std::string(depth, ']') + "}").event,
                  depth == 20 ? RequestEvent::HeartBeat : RequestEvent::unknown);
}

TEST(Envelope, BodyBytesDropFFAndRejectInvalidUtf8) {
    EXPECT_EQ(ResponseHandler::switchUint8ArrToString("\xff{\"ev\xff\xff" "ent\":1}\xff"), "{\"event\":1}");
    EXPECT_EQ(ResponseHandler::switchUint8ArrToString("\xc3\x28"), "");
    EXPECT_EQ(ResponseHandler::switchUint8ArrToString("\xe4\xbd\xa0\xe5\xa5\xbd"), "\xe4\xbd\xa0\xe5\xa5\xbd");
    // 0xFF inside an otherwise valid body disappears before decoding.
    EXPECT_EQ(HttpService::handleBody("\xff#{\"event\":\"Heart\xff" "Beat\"}").empty(), false);
}

TEST(Envelope, AnswersAreCountedInUserPerceivedCharacters) {
    EXPECT_EQ(text::lengthPrefixed(""), "");
    // 你好 is 2 characters in 6 bytes; a family emoji joined by ZWJ is one character.
    EXPECT_EQ(text::lengthPrefixed("\xe4\xbd\xa0\xe5\xa5\xbd"), "2#\xe4\xbd\xa0\xe5\xa5\xbd");
    const std::string family = "\xf0\x9f\x91\xa8\xe2\x80\x8d\xf0\x9f\x91\xa9\xe2\x80\x8d\xf0\x9f\x91\xa7";
    EXPECT_EQ(text::lengthPrefixed("{" + family + "}"), "3#{" + family + "}");
    EXPECT_EQ(text::graphemeCount("e\xcc\x81"), 1u);  // "e" + combining acute accent
}

TEST(ControlServer, StopRightAfterStartDoesNotHang) {
    test::HermeticEnv env;
    env.config().controlPort = 0;
    for (int i = 0; i < 20; ++i) {
        HttpService service;
        ASSERT_TRUE(service.startHttpService());
        EXPECT_GT(service.port(), 0);
        service.stop();
        EXPECT_FALSE(service.isRunning());
    }
}

}  // namespace
}  // namespace kesu
