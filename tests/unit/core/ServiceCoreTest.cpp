// Single-instance rule, the seven-day restart rule and the control-server watchdog.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "control/HttpService.h"
#include "core/EventLoop.h"
#include "app/HttpAliveCheck.h"
#include "app/RestartServiceSubscriber.h"
#include "app/SingleInstance.h"
#include "core/Json.h"
#include "core/TimeUtil.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "pcsuite/PcsuiteClient.h"
#include "support/ServiceProcess.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

TEST(SingleInstance, CountsExactlyTwoMatchingLines) {
    const std::string header = "    PID TTY          TIME CMD\n      1 ?        00:00:01 init\n";
    const std::string self = "   4242 ?        00:00:00 KesuConnService\n";
    const std::string other = "   1234 ?        00:00:09 KesuConnService\n";
    const std::string grep = "   5555 pts/0    00:00:00 grep KesuConnService\n";
    EXPECT_EQ(countProcessLines(header + self + other + grep, "KesuConnService"), 2);  // grep itself is not one
    // Last line without a newline still counts.
    EXPECT_EQ(countProcessLines("1 ? 0 KesuConnService", "KesuConnService"), 1);
}

class RestartRule : public ::testing::Test {
protected:
    void SetUp() override { test::resetSharedStateForTest(); }
    void TearDown() override {
        WallClock::setClock({});
        test::resetSharedStateForTest();
        Log::closeLog();
    }
    void writeVersion(const std::string& content) {
        const std::string path = rootedPath(Config::current().versionFile);
        std::filesystem::create_directories(std::filesystem::path(path).parent_path());
        std::ofstream(path) << content;
    }
    void versionUpdated(const std::string& updateTime) {
        writeVersion(Json({{"version", "3.6.1.0"}, {"updateTime", updateTime}}).dump(2));
    }
    void now(const std::string& localTime) {
        const auto t = *timeutil::parseLocal(localTime);
        WallClock::setClock([t] { return t; });
    }
    static std::string logSoFar() {
        Log::closeLog();
        return test::readAll(Log::logFilePath(WallClock::now()));
    }
    test::HermeticEnv env;
};

TEST_F(RestartRule, RestartsAfterMoreThanSevenWholeDaysOfAUsableVersionFile) {
    EventLoop loop;
    RestartServiceSubscriber subscriber(loop);
    versionUpdated("2026-11-26 10:00:00.000");
    // Exactly 7 days, 7 days and almost 24 hours, 8 days, a version file from the future.
    for (const auto& [time, outOfDate] : {std::pair{"2026-12-03 10:00:00.000", false}, {"2026-12-04 09:59:59.999", false},
                                          {"2026-12-04 10:00:00.000", true}, {"2026-11-01 10:00:00.000", false}}) {
        now(time);
        EXPECT_EQ(subscriber.connServiceRunOutOfDate(), outOfDate) << time;
    }

    // A missing or unusable version file counts as current.
    now("2026-12-04 10:00:00.000");
    std::filesystem::remove(rootedPath(Config::current().versionFile));
    EXPECT_FALSE(subscriber.connServiceRunOutOfDate());
    for (const char* content : {"", "not json", R"({"version":"3.6.1.0"})", R"({"updateTime":"2020-01-01"})",
                                R"({"updateTime":12345})", R"(["2020-01-01 00:00:00.000"])"}) {
        writeVersion(content);
        EXPECT_FALSE(subscriber.connServiceRunOutOfDate()) << content;
    }
}

TEST_F(RestartRule, OnlyLogOnWithoutConnectionTriggersTheCheck) {
    // Out of date, but the restart target cannot run: a restart attempt would only be logged.
    versionUpdated("2026-11-01 10:00:00.000");
    now("2026-12-04 10:00:00.000");
    Config::current().serviceExecutable = "/nonexistent/KesuConnService";
    EventLoop loop;
    loop.start();
    auto subscriber = std::make_shared<RestartServiceSubscriber>(loop);

    for (ServiceEvent other : {ServiceEvent::LogOut, ServiceEvent::WifiOpen, ServiceEvent::Pcsuite})
        subscriber->notify(other);
    ASSERT_TRUE(subscriber->waitIdle(5s));
    EXPECT_EQ(logSoFar().find("Now connservice run"), std::string::npos) << logSoFar();

    ConnectionState::setIsCanConnectDevice(false);  // a connection in progress: no check
    subscriber->notify(ServiceEvent::LogOn);
    ASSERT_TRUE(subscriber->waitIdle(5s));
    EXPECT_EQ(logSoFar().find("restart KesuConnService"), std::string::npos) << logSoFar();
}

// The restart replaces the process image in place (same pid, so no predecessor is listed).
TEST(SelfRestart, ReplacesTheProcessImageInPlace) {
    test::TempDir dir;
    const std::string root = dir.str() + "/root", marker = dir.str() + "/restarted";
    const std::string exe = "/Applications/pcsuite.app/Contents/Resources/kesuesService/KesuConnService/KesuConnService";
    dir.write("root" + exe, "#!/bin/sh\necho $$ > '" + marker + "'\n");
    std::filesystem::permissions(root + exe, std::filesystem::perms::owner_all);

    test::ServiceProcess probe(KESU_RESTART_PROBE, {}, {{"HOME", dir.str()}, {"KESU_ROOT", root}});
    EXPECT_EQ(probe.waitExit(20s), 0) << probe.output();
    EXPECT_EQ(test::readAll(marker), std::to_string(probe.pid()) + "\n");
}

TEST(Watchdog, RestartsAServerThatStoppedAnswering) {
    test::HermeticEnv env;
    Config::current().controlPort = test::freeTcpPort();
    Config::current().httpWatchdogPeriod = 100ms;
    Config::current().httpRestartPause = 10ms;
    Config::current().httpAliveTimeout = 2s;
    HttpService server;
    ASSERT_TRUE(server.startHttpService());
    EXPECT_TRUE(PcsuiteClient::isHttpAlive());

    EventLoop loop;
    loop.start();
    HttpAliveCheck watchdog(loop, server);  // the real probe: a HeartBeat to our own server
    server.stop();
    EXPECT_FALSE(PcsuiteClient::isHttpAlive());
    ASSERT_TRUE(watchdog.waitForRestarts(1, 10s));
    EXPECT_TRUE(PcsuiteClient::isHttpAlive());
    watchdog.stop();
    HttpAliveCheck quiet(loop, server);
    EXPECT_FALSE(quiet.waitForRestarts(1, 500ms));  // a healthy server is left alone
    quiet.stop();
    server.stop();
    Log::closeLog();
}

}  // namespace
}  // namespace kesu
