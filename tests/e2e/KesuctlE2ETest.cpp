// kesuctl against the real service in the lab (readable and JSON output, a connection with a
// simulated phone, an error answer), and its exit codes against peers that misbehave.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "e2e/E2EFixture.h"

using namespace std::chrono_literals;
using namespace kesu::test;
using nlohmann::json;

namespace {

struct CtlRun {
    int code = -1;
    std::string output;
};

CtlRun kesuctl(const std::vector<std::string>& args, const std::string& ns = "") {
    ServiceProcess p(std::string(KESU_TOOLS_DIR) + "/kesuctl", args, {{"KESUCTL_HOST", ""}, {"KESUCTL_PORT", ""}},
                     ns);
    const auto code = p.waitExit(90s);
    // The exit can be seen before the last output is read; this returns once the pipe closed.
    p.waitForOutput(std::string(1, '\0'), 5s);
    return {code.value_or(-1), p.output()};
}

using KesuctlE2E = LabTest;

TEST_F(KesuctlE2E, TalksToTheServiceAndConnectsAPhone) {
    writeAccount("pc-open", "13912345678");
    auto service = startService();
    auto sim = startSimulator(phone.ns, {"--iface-ip", phone.ip, "--announce-every", "1", "--tcp-port", "10191",
                                         "--answer", "accept", "--duration", "60"});
    ASSERT_TRUE(service->waitForOutput("Insert ssdp device, deviceId: 53494d50", 10s)) << service->output();

    CtlRun r = kesuctl({"heartbeat"}, pc.ns);
    EXPECT_EQ(r.code, 0) << r.output;
    EXPECT_EQ(r.output, "the service at 127.0.0.1:9197 is alive\n");

    r = kesuctl({"devices"}, pc.ns);
    EXPECT_EQ(r.code, 0) << r.output;
    EXPECT_NE(r.output.find("ID        NAME        IP         KIND\n"), std::string::npos) << r.output;
    EXPECT_NE(r.output.find("53494d50  Sim****one  " + phone.ip + "  phone\n"), std::string::npos) << r.output;

    r = kesuctl({"--json", "devices"}, pc.ns);
    EXPECT_EQ(r.code, 0) << r.output;
    const json answer = json::parse(r.output, nullptr, false);
    ASSERT_TRUE(answer.is_object()) << r.output;
    EXPECT_EQ(answer["error"], 0);
    ASSERT_EQ(answer["data"].size(), 1u) << answer;
    EXPECT_EQ(answer["data"][0]["deviceId"], "53494d50");

    r = kesuctl({"connect", "53494d50"}, pc.ns);
    EXPECT_EQ(r.code, 0) << r.output << service->output();
    EXPECT_EQ(r.output, "connected to 53494d50 at " + phone.ip + " (steps _WI:0_WF:0_TF:0_WO:0)\n");
    EXPECT_TRUE(sim->waitForOutput("SIM TCP_ANSWERED", 5s)) << sim->output();

    // An error answer: exit 4, the code and message shown; --json still prints the answer.
    r = kesuctl({"connect", "00000000"}, pc.ns);
    EXPECT_EQ(r.code, 4) << r.output;
    EXPECT_NE(r.output.find("connect failed: error -10002: [ActiveConnect] address_ 00000000 find ssdp device "
                            "error not find (steps _WI:0_WF:-1)"),
              std::string::npos)
        << r.output;
    r = kesuctl({"call", "connectSSDP", "[\"00000000\"]", "--json"}, pc.ns);
    EXPECT_EQ(r.code, 4) << r.output;
    EXPECT_EQ(json::parse(r.output.substr(0, r.output.find('\n')), nullptr, false).value("error", 0), -10002)
        << r.output;

    // Events that answer nothing by design succeed; a request the service cannot use does not.
    EXPECT_EQ(kesuctl({"scan", "stop"}, pc.ns).code, 0);
    r = kesuctl({"call", "connectSSDP"}, pc.ns);
    EXPECT_EQ(r.code, 5) << r.output;
    EXPECT_NE(r.output.find("empty answer"), std::string::npos) << r.output;
}

// A listener that takes connections into its backlog but never answers.
class SilentListener {
public:
    SilentListener() {
        fd_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof addr;
        if (::bind(fd_, reinterpret_cast<sockaddr*>(&addr), len) == 0 && ::listen(fd_, 8) == 0 &&
            ::getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len) == 0)
            port_ = ntohs(addr.sin_port);
    }
    ~SilentListener() { ::close(fd_); }
    int port() const { return port_; }

private:
    int fd_ = -1;
    int port_ = 0;
};

TEST(KesuctlExitCodes, TellWhatWentWrong) {
    // Usage errors: 1, with a message, before anything is sent.
    for (const auto& args : std::vector<std::vector<std::string>>{
             {}, {"frobnicate"}, {"connect"}, {"scan"}, {"--timeout", "soon", "heartbeat"}, {"--port", "70000",
             "heartbeat"}, {"call", "heartbeat"}, {"call", "HeartBeat", "[0"}, {"agree", "maybe"},
             {"center", "report", "[1]"}}) {
        const CtlRun r = kesuctl(args);
        EXPECT_EQ(r.code, 1) << ::testing::PrintToString(args) << r.output;
        EXPECT_NE(r.output.find("kesuctl"), std::string::npos) << r.output;
    }
    const CtlRun help = kesuctl({"--help"});
    EXPECT_EQ(help.code, 0);
    EXPECT_NE(help.output.find("preconnect pick ID"), std::string::npos) << help.output;

    // Nothing listens: 2.
    const int freePort = freeTcpPort();
    CtlRun r = kesuctl({"--port", std::to_string(freePort), "heartbeat"});
    EXPECT_EQ(r.code, 2) << r.output;
    EXPECT_NE(r.output.find("not running"), std::string::npos) << r.output;

    // Connected but never answered: 3 at the time-out.
    SilentListener silent;
    ASSERT_GT(silent.port(), 0);
    r = kesuctl({"--timeout", "0.5", "--port", std::to_string(silent.port()), "heartbeat"});
    EXPECT_EQ(r.code, 3) << r.output;
    EXPECT_NE(r.output.find("no answer"), std::string::npos) << r.output;

    // Answers that are not "N#json" with N the character count: 5.
    StubPcSuite stub;
    for (const char* body : {"hello", "3#{\"error\":0}", "#{\"error\":0}", "2#[]", "12#{\"error\":0"}) {
        stub.setDefaultAnswer({200, body, "text/plain"});
        r = kesuctl({"--port", std::to_string(stub.port()), "heartbeat"});
        EXPECT_EQ(r.code, 5) << body << "\n" << r.output;
    }
    stub.setDefaultAnswer({500, "", "text/plain"});
    EXPECT_EQ(kesuctl({"--port", std::to_string(stub.port()), "heartbeat"}).code, 5);
    // A well-formed answer of a peer is shown, with terminal control characters defused.
    stub.setDefaultAnswer({200, "43#{\"error\":0,\"data\":\"\\u001b[2Jx\\u0007\",\"a\":1}", "text/plain"});
    r = kesuctl({"--port", std::to_string(stub.port()), "call", "open"});
    EXPECT_EQ(r.code, 0) << r.output;
    EXPECT_EQ(r.output, "?[2Jx?\n");
}

}  // namespace
