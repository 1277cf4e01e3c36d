// The outbound HTTP client against a real stub server.
#include <gtest/gtest.h>

#include <cstdlib>

#include "pcsuite/RequestBase.h"
#include "unit/pcsuite/StubFixture.h"
#include "core/Log.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using test::CannedAnswer;

const Json kTimeout{{"error", "timeout"}};

class RequestBaseTest : public test::StubPcsuiteTest {
protected:
    // A POST without body or headers to `path` on the stub.
    Json post(const std::string& path, int& status, std::string& msg) {
        return RequestBase::post(stub.baseUrl(), path, std::nullopt, {}, status, msg);
    }
};

TEST_F(RequestBaseTest, SendsMergedHeadersAndReadsCodeAndMsgOfTheAnswer) {
    stub.setAnswer("/device/list", {200, R"({"code":7,"msg":"fine","data":[1,2]})"});
    int status = -1;
    std::string msg = "caller";
    Json answer = RequestBase::post(stub.baseUrl(), "device/list", std::string(R"({"a":1})"),
                                    {{"token", "abcdefghijklmnop"}, {"X-Extra", "1"}}, status, msg);
    EXPECT_EQ(answer, Json::parse(R"({"code":7,"msg":"fine","data":[1,2]})"));
    EXPECT_EQ(status, 7);
    EXPECT_EQ(msg, "fine");
    auto requests = stub.requests();
    ASSERT_EQ(requests.size(), 1u);
    EXPECT_EQ(requests[0].body, R"({"a":1})");
    EXPECT_EQ(requests[0].header("Content-Type"), "application/json");
    EXPECT_EQ(requests[0].header("token"), "abcdefghijklmnop");
    EXPECT_EQ(requests[0].header("X-Extra"), "1");

    // A caller's Content-Type replaces the default (whatever its spelling); a GET keeps its
    // query; an answer without "code"/"msg" gives 0 and "".
    stub.setAnswer("/device/info", {200, R"({"data":{"x":1}})"});
    status = -1;
    msg = "caller";
    answer = RequestBase::get(stub.baseUrl(), "device/info?deviceId=ab12", std::nullopt,
                              {{"content-type", "application/x-www-form-urlencoded"}}, status, msg);
    EXPECT_EQ(json::object(answer, "data"), Json::parse(R"({"x":1})"));
    EXPECT_EQ(status, 0);
    EXPECT_EQ(msg, "");
    requests = stub.requestsTo("/device/info");
    ASSERT_EQ(requests.size(), 1u);
    EXPECT_EQ(requests[0].param("deviceId"), "ab12");
    EXPECT_EQ(requests[0].headers.count("Content-Type"), 1u);
    EXPECT_EQ(requests[0].header("Content-Type"), "application/x-www-form-urlencoded");
}

TEST_F(RequestBaseTest, RetriesThreeTimesOn429AndReturnsTheLastAnswer) {
    for (int i = 1; i <= 3; ++i) stub.queueAnswer("/busy", {429, R"({"code":429,"try":)" + std::to_string(i) + "}"});
    stub.setAnswer("/busy", {200, R"({"code":"000000"})"});
    int status = 0;
    std::string msg;
    const Json answer = post("busy", status, msg);
    EXPECT_EQ(json::integer(answer, "try"), 3);
    EXPECT_EQ(status, 429);
    const auto requests = stub.requests();
    ASSERT_EQ(requests.size(), 3u);  // no fourth attempt
    EXPECT_GE(requests[1].receivedAt - requests[0].receivedAt, env.config().http429Pause);  // pauses between
    EXPECT_GE(requests[2].receivedAt - requests[1].receivedAt, env.config().http429Pause);
    // One 429, then a normal answer: two requests, the normal answer comes back.
    stub.clearRequests();
    stub.queueAnswer("/busy", {429, "{}"});
    EXPECT_EQ(json::str(post("busy", status, msg), "code"), "000000");
    EXPECT_EQ(stub.requestCount(), 2u);
}

TEST_F(RequestBaseTest, EmptyOrNonJsonAnswersGiveTimeoutWithTheHttpStatus) {
    struct Case {
        CannedAnswer answer;
        std::string expectedMsg;
    };
    const std::vector<Case> cases{
        {{200, ""}, "caller"},                 // nothing to read: the caller's msg stays
        {{202, "not json", "text/plain"}, "not json"},
        {{200, "{}"}, "{}"},                   // an empty object is no answer either
        {{500, "\xff\xfe{", "text/plain"}, "caller"},  // not UTF-8: read as empty
    };
    for (const auto& c : cases) {
        stub.setAnswer("/x", c.answer);
        int status = -1;
        std::string msg = "caller";
        EXPECT_EQ(post("x", status, msg), kTimeout) << c.answer.body;
        EXPECT_EQ(status, c.answer.status) << c.answer.body;
        EXPECT_EQ(msg, c.expectedMsg) << c.answer.body;
    }
}

TEST_F(RequestBaseTest, NoResponseKeepsTheCallersStatusAndMsg) {
    int status = 77;
    std::string msg = "keep";
    const std::string closed = "http://127.0.0.1:" + std::to_string(test::freeTcpPort()) + "/";  // nobody listens
    EXPECT_EQ(RequestBase::post(closed, "pcDeviceInfo", std::nullopt, {}, status, msg), kTimeout);
    // An answer later than the request's limit: the time-out, not the (successful) late answer.
    env.config().httpRequestTimeout = 200ms;
    stub.setAnswer("/slow", {200, R"({"code":1})", "application/json", 30s});
    EXPECT_EQ(post("slow", status, msg), kTimeout);
    // An answer above the size limit is dropped, not kept in memory.
    env.config().httpRequestTimeout = 2s;
    env.config().httpMaxAnswerBody = 1024;
    stub.setAnswer("/big", {200, R"({"code":1,"pad":")" + std::string(4096, 'x') + "\"}"});
    EXPECT_EQ(post("big", status, msg), kTimeout);
    EXPECT_EQ(RequestBase::post("127.0.0.1:9/", "x", std::nullopt, {}, status, msg), kTimeout);  // malformed URL
    EXPECT_EQ(status, 77);
    EXPECT_EQ(msg, "keep");
}

TEST(RequestBaseMask, CredentialsAreMaskedForTheLog) {
    const std::string masked = RequestBase::maskForLog(R"({"userId":"u1","token":"abcdefghijklmnop","n":{"accessToken":"qrstuvwxyz123"}})");
    EXPECT_EQ(masked.find("abcdefghijklmnop"), std::string::npos);
    EXPECT_EQ(masked.find("qrstuvwxyz123"), std::string::npos);
    EXPECT_NE(masked.find("abc****nop"), std::string::npos);
    EXPECT_NE(masked.find("\"u1\""), std::string::npos);
    // Framed texts too; texts without credentials stay byte for byte.
    EXPECT_EQ(RequestBase::maskForLog(R"(40#{"event":"x","token":"abcdefghijklmnop"})").find("abcdefghijklmnop"),
              std::string::npos);
    EXPECT_EQ(RequestBase::maskForLog(R"({ "b":1, "a":2 })"), R"({ "b":1, "a":2 })");
    // A short credential is hidden whole; in a text that is not JSON, "name=value" and
    // "name: value" pairs are masked and the rest stays.
    EXPECT_EQ(RequestBase::maskForLog(R"({"token":"abc12"})"), R"({"token":"****"})");
    EXPECT_EQ(RequestBase::maskForLog("denied token=abcdefghijklmnop&x=1, Password: \"s3cr3t\" end"),
              "denied token=abc****nop&x=1, Password: \"****\" end");
}

// https against a server whose certificate comes from a CA made for the test.
TEST(RequestBaseHttps, VerifiesTheServerCertificate) {
    test::HermeticEnv env;
    env.config().httpRequestTimeout = 5s;
    const std::string dir = env.dir().str();
    const std::string cert = dir + "/cert.pem";
    const std::string key = dir + "/key.pem";
    const std::string command = "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -keyout '" +
                                key + "' -out '" + cert +
                                "' -days 2 -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 >/dev/null 2>&1";
    if (std::system(command.c_str()) != 0) GTEST_SKIP() << "openssl could not make a test certificate";

    test::StubPcSuite secure(cert, key);
    secure.setAnswer("/event/create", {200, R"({"code":0,"msg":"ok"})"});
    int status = -1;
    std::string msg;
    // Not trusted: the request never reaches the server.
    EXPECT_EQ(RequestBase::post(secure.baseUrl(), "event/create", std::string("{}"), {}, status, msg), kTimeout);
    EXPECT_EQ(secure.requestCount(), 0u);

    // Trusted through the configured CA file.
    env.config().caCertPath = cert;
    EXPECT_EQ(RequestBase::post(secure.baseUrl(), "event/create", std::string("{}"), {}, status, msg),
              Json::parse(R"({"code":0,"msg":"ok"})"));
    ASSERT_EQ(secure.requestCount(), 1u);
    EXPECT_EQ(secure.requests()[0].body, "{}");
    Log::closeLog();
}

}  // namespace
}  // namespace kesu
