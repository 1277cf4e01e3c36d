// The control server answers only processes of the service's own user (root here): the
// same request from an account of its own (nobody) gets the connection closed unanswered
// and one log line however often it tries.
#include <gtest/gtest.h>
#include <unistd.h>

#include "control/HttpService.h"
#include "core/Process.h"
#include "unit/UnitHelpers.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

std::size_t count(const std::string& text, const std::string& part) {
    std::size_t n = 0;
    for (auto at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++n;
    return n;
}

// One HeartBeat by curl, run as `user` (empty: as this process).
process::RunResult heartBeatAs(const std::string& user, int port) {
    std::vector<std::string> args;
    if (!user.empty()) args = {"--reuid=" + user, "--regid=nogroup", "--clear-groups", "curl"};
    const std::string body = R"({"event":"HeartBeat","args":[0]})";
    args.insert(args.end(), {"-q", "-sS", "--max-time", "10", "--data-binary", std::to_string(body.size()) + "#" + body,
                             "http://127.0.0.1:" + std::to_string(port) + "/"});
    auto result = process::run(user.empty() ? "curl" : "setpriv", args, 20s);
    EXPECT_TRUE(result.has_value());
    return result.value_or(process::RunResult{});
}

TEST(ControlServer, AnswersItsOwnUserOnlyAndLogsRefusalsOncePerMinute) {
    if (::geteuid() != 0) GTEST_SKIP() << "SKIPPED: needs root to run a client as nobody";
    test::HermeticEnv env;
    env.config().controlPort = 0;
    HttpService service;
    ASSERT_TRUE(service.startHttpService());

    const auto own = heartBeatAs("", service.port());
    EXPECT_EQ(own.exitStatus, 0);
    EXPECT_NE(own.output.find("\"Alive\""), std::string::npos) << own.output;

    for (int i = 0; i < 3; ++i) {
        const auto other = heartBeatAs("nobody", service.port());
        EXPECT_NE(other.exitStatus, 0);  // empty reply or reset: closed unanswered
        EXPECT_EQ(other.output, "");
    }
    EXPECT_EQ(count(test::todaysLog(), "refused a control connection from uid 65534"), 1u);

    // Refusals do not disturb the service's own client.
    EXPECT_NE(heartBeatAs("", service.port()).output.find("\"Alive\""), std::string::npos);
    service.stop();
}

}  // namespace
}  // namespace kesu
