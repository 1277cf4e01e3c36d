// The real service binary, started with HOME and KESU_ROOT in a temporary folder, in a PID
// namespace of its own.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <ifaddrs.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <sstream>
#include <thread>

#include "core/TimeUtil.h"
#include "e2e/PrivateNetwork.h"
#include "support/NetNs.h"
#include "support/ServiceProcess.h"
#include "support/TestSupport.h"

using namespace std::chrono_literals;
using kesu::test::ServiceProcess;
using kesu::test::TempDir;

namespace {

constexpr int kControlPort = 9197;

// Sanitizer builds keep shadow memory and quarantines: resident size says nothing there.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kMeasureMemory = false;
#else
constexpr bool kMeasureMemory = true;
#endif

struct Daemon {
    bool skip = !kesu::test::inPrivateNetwork();
    TempDir dir;
    std::string home = dir.str() + "/home";
    std::string root = dir.str() + "/root";

    Daemon() {
        std::filesystem::create_directories(home);
        std::filesystem::create_directories(root);
    }
    std::map<std::string, std::string> env() const { return {{"HOME", home}, {"KESU_ROOT", root}}; }
    std::unique_ptr<ServiceProcess> start() const {
        if (skip) return nullptr;
        auto p = std::make_unique<ServiceProcess>(KESU_BINARY, std::vector<std::string>{}, env(), "",
                                                  ServiceProcess::Pids::own);
        EXPECT_TRUE(p->waitForOutput("[httpService]Run succ", 20s)) << p->output();
        return p;
    }
    std::string logDir() const { return home + "/Library/Application Support/pcsuite/log/KesuConnService_log"; }
};

httplib::Result post(const std::string& body, const std::string& host = "127.0.0.1") {
    httplib::Client client(host, kControlPort);
    client.set_connection_timeout(3s);
    client.set_read_timeout(10s);
    return client.Post("/", body, "text/plain");
}

std::string heartbeat() {
    auto res = post(R"(32#{"event":"HeartBeat","args":[]})");
    return res ? res->body : std::string("<no answer>");
}

bool isAlive(const std::string& answer) {
    auto hash = answer.find('#');
    if (hash == std::string::npos) return false;
    auto j = nlohmann::json::parse(answer.substr(hash + 1), nullptr, false);
    return !j.is_discarded() && j.value("data", "") == "Alive" && j.value("error", -1) == 0;
}

long rssKiB(pid_t pid) {
    std::istringstream status(kesu::test::readAll("/proc/" + std::to_string(pid) + "/status"));
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
    return -1;
}

std::string firstNonLoopbackIpv4() {
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return {};
    std::string found;
    for (ifaddrs* a = list; a != nullptr && found.empty(); a = a->ifa_next) {
        if (a->ifa_addr == nullptr || a->ifa_addr->sa_family != AF_INET) continue;
        auto* in = reinterpret_cast<sockaddr_in*>(a->ifa_addr);
        if ((ntohl(in->sin_addr.s_addr) >> 24) == 127) continue;
        char buf[INET_ADDRSTRLEN];
        inet_ntop(AF_INET, &in->sin_addr, buf, sizeof buf);
        found = buf;
    }
    freeifaddrs(list);
    return found;
}

}  // namespace

TEST(ServiceE2E, AnswersHeartbeatWritesVersionAndLogAndStopsCleanly) {
    Daemon daemon;
    if (daemon.skip) GTEST_SKIP() << "*** no private network namespace (needs root): not starting the service ***";
    auto service = daemon.start();

    const std::string answer = heartbeat();
    EXPECT_TRUE(isAlive(answer)) << answer;
    // The length prefix counts the JSON text that follows it.
    const auto hash = answer.find('#');
    ASSERT_NE(hash, std::string::npos);
    EXPECT_EQ(std::to_string(answer.size() - hash - 1), answer.substr(0, hash));

    // Version file with the service version and a start time of a moment ago.
    const std::string versionPath =
        daemon.root + "/Applications/pcsuite.app/Contents/Resources/kesuesService/config/version.txt";
    auto version = nlohmann::json::parse(kesu::test::readAll(versionPath), nullptr, false);
    ASSERT_FALSE(version.is_discarded());
    EXPECT_EQ(version.value("version", ""), "3.6.1.0");
    auto updated = kesu::timeutil::parseLocal(version.value("updateTime", ""));
    ASSERT_TRUE(updated.has_value());
    EXPECT_LT(std::chrono::abs(std::chrono::system_clock::now() - *updated), 60s);

    EXPECT_EQ(service->stop(SIGTERM, 10s), 0);
    // The day's log file (named by the GMT date) holds the whole session, flushed.
    const std::string logPath = daemon.logDir() + "/KesuConnService_" +
                                kesu::timeutil::formatGmtDate(std::chrono::system_clock::now()) + ".log";
    const std::string log = kesu::test::readAll(logPath);
    EXPECT_NE(log.find("][logLoop] [服务启动] 服务未存在，拉起服务"), std::string::npos) << log;
    EXPECT_NE(log.find("][logLoop] http HeartBeat"), std::string::npos);
    EXPECT_NE(log.find("[服务启动] stopped"), std::string::npos);
}

TEST(ServiceE2E, SecondInstanceLeavesTheFirstRunning) {
    Daemon daemon;
    if (daemon.skip) GTEST_SKIP() << "*** no private network namespace (needs root): not starting the service ***";
    auto first = daemon.start();

    // The second copy joins the first one's PID namespace and /proc, so each sees the other.
    ServiceProcess second("/usr/bin/nsenter",
                          {"--target", std::to_string(first->pid()), "--pid", "--mount", "--", KESU_BINARY},
                          daemon.env());
    EXPECT_EQ(second.waitExit(20s), 0);
    EXPECT_NE(second.output().find("[服务启动] 服务已存在，终止操作"), std::string::npos) << second.output();
    EXPECT_TRUE(first->running());
    EXPECT_TRUE(isAlive(heartbeat()));
    EXPECT_EQ(first->stop(SIGINT, 10s), 0);
}

// A copy already running on the machine (here in a network namespace of its own, among the
// machine's processes) does not stop the one under test, which sees only its own namespace.
TEST(ServiceE2E, StartsBesideACopyRunningOnTheMachine) {
    Daemon daemon;
    if (daemon.skip) GTEST_SKIP() << "*** no private network namespace (needs root): not starting the service ***";
    kesu::test::NetNsLab lab("own", false);
    const auto node = lab.addNode("pc", 1);
    ASSERT_TRUE(lab.ok()) << lab.error();
    Daemon machineWide;
    ServiceProcess other(KESU_BINARY, {}, machineWide.env(), node.ns);
    // Where the machine runs a copy already, this one stands down, which serves as well.
    const bool otherUp = other.waitForOutput("[httpService]Run succ", 20s);
    ASSERT_TRUE(otherUp || other.output().find("服务已存在") != std::string::npos) << other.output();

    auto service = daemon.start();
    EXPECT_TRUE(isAlive(heartbeat()));
    EXPECT_EQ(service->stop(SIGTERM, 10s), 0);
    if (otherUp) {
        EXPECT_EQ(other.stop(SIGTERM, 10s), 0);
    }
}

TEST(ServiceE2E, ControlPortIsLoopbackOnly) {
    const std::string address = firstNonLoopbackIpv4();
    if (address.empty()) GTEST_SKIP() << "this machine has no non-loopback IPv4 address";
    Daemon daemon;
    if (daemon.skip) GTEST_SKIP() << "*** no private network namespace (needs root): not starting the service ***";
    auto service = daemon.start();
    EXPECT_FALSE(post(R"({"event":"HeartBeat"})", address)) << "reachable on " << address;
    EXPECT_TRUE(isAlive(heartbeat()));
}

TEST(ServiceE2E, SurvivesHostileBodies) {
    Daemon daemon;
    if (daemon.skip) GTEST_SKIP() << "*** no private network namespace (needs root): not starting the service ***";
    auto service = daemon.start();

    const std::string deep(100000, '[');
    const std::vector<std::string> bodies = {
        "",
        std::string("\x00\x01\x02\xfe\xff", 5),
        "\xc3\x28{\"event\":\"HeartBeat\"}",  // invalid UTF-8
        "not json at all",
        deep,
        "99999999999999999999999#{\"event\":\"queryAll\"}",
        "{\"event\":[1,2,3],\"args\":{\"a\":" + std::string(50000, '{'),
    };
    for (const auto& body : bodies) {
        auto res = post(body);
        ASSERT_TRUE(res) << "no answer for a body of " << body.size() << " bytes";
        EXPECT_EQ(res->status, 200);
        EXPECT_EQ(res->body, "");
    }
    // A body over the limit is refused without being read whole.
    auto big = post(std::string(8 << 20, 'x'));
    ASSERT_TRUE(big);
    EXPECT_EQ(big->status, 413);

    // Junk in a row does not make the service grow: after a warm-up round (which fills each
    // worker thread's buffers), a second round as long leaves the resident size where it was.
    const std::string nearLimit = "{\"event\":\"kpush\",\"args\":\"" + std::string(900000, 'a') + "\"}";
    auto junkRound = [&](int n) {
        for (int i = 0; i < n; ++i) {
            ASSERT_TRUE(post(i % 50 == 0 ? nearLimit : "#{\"event\":\"nope\",\"args\":[" + std::to_string(i) + "]}"));
        }
    };
    const int rounds = kMeasureMemory ? 1000 : 100;
    // Every worker thread (16) has to have held a near-limit body once before the first
    // measurement, or the allocator's per-thread arenas still grow in the second round.
    for (int i = 0; i < 48; ++i) ASSERT_TRUE(post(nearLimit));
    junkRound(rounds);
    const long before = rssKiB(service->pid());
    junkRound(rounds);
    const long after = rssKiB(service->pid());
    if (kMeasureMemory) {
        EXPECT_LT(after - before, 8 * 1024) << before << " KiB -> " << after << " KiB";
    }
    EXPECT_TRUE(isAlive(heartbeat()));
    EXPECT_TRUE(service->running());
}
