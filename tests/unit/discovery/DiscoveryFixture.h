// Shared set-up of the discovery tests: a hermetic home for the log, the fake platform with
// a known host name and settable adapters, a wall clock and a monotonic clock the test moves
// by hand, the signed-in account's open id, and phones' announcements.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <string>
#include <vector>

#include "account/DataInstance.h"
#include "core/Json.h"
#include "core/SteadyClock.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "discovery/Base64.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"
#include "unit/UnitHelpers.h"

namespace kesu::test {

// A phone's announcement body (current format) as phones send it.
inline Json phoneBody(const std::string& id, const std::string& account = "138****0000",
                      const std::string& name = "kesu X1 Pro") {
    return Json{{"deviceName", name},    {"deviceId", id},          {"openId", "openid-of-this-pc"},
                {"account", account},    {"deviceType", "mobile"},  {"pcCustomizedData", "G1"},
                {"serviceRecord", "com.kesu.pcsuite.SERVICE--com.kesu.share.CONNECT_PC"}};
}

// The datagram around an announcement body.
inline std::string announce(const Json& body) {
    return "RESPONSE * HTTP/1.1\r\nDATE:2024-05-01 10:00:00.000\r\ncompatGsonStr:" +
           base64::encode(json::compact(body)) + "\r\n";
}

// One adapter of the fake machine; an empty ip is an adapter without an address.
struct Adapter {
    std::string kind;
    std::string name;
    std::string ip;
    std::string netmask = "255.255.255.0";
};

class DiscoveryTest : public ::testing::Test {
protected:
    static constexpr double kStart = 1714550400.0;  // the clock's reading when the test starts

    void SetUp() override {
        resetSharedStateForTest();
        fake->setLocalizedHostName("Office-Desk-PC");  // announced as "Off****-PC"
        savedOpenId_ = dataInstance().get(&databaseParam::openid);
        dataInstance().set(&databaseParam::openid, "openid-of-this-pc");
        WallClock::setClock([this] {
            return WallClock::Clock::time_point(std::chrono::duration_cast<WallClock::Clock::duration>(
                std::chrono::duration<double>(seconds_.load())));
        });
    }
    void TearDown() override {
        WallClock::setClock({});
        dataInstance().set(&databaseParam::openid, savedOpenId_);
        resetSharedStateForTest();
        Log::closeLog();
    }

    // Time passes: both clocks move.
    void advance(double s) {
        stepWallClock(s);
        clock.advance(std::chrono::duration_cast<SteadyClock::duration>(std::chrono::duration<double>(s)));
    }
    // The wall clock alone is set forward or back (NTP, a user's change).
    void stepWallClock(double s) { seconds_.store(seconds_.load() + s); }
    // The wall clock's reading, seconds.
    double now() const { return seconds_.load(); }

    // Replaces the fake machine's adapters and their addresses.
    void network(const std::vector<Adapter>& adapters) {
        std::vector<NetworkService> services;
        std::vector<InterfaceAddress> addresses;
        for (const Adapter& a : adapters) {
            services.push_back({a.kind, a.name, "02:00:00:00:00:0" + std::to_string(services.size())});
            if (!a.ip.empty()) addresses.push_back({a.name, a.ip, a.netmask, true});
        }
        fake->setNetworkServices(services);
        fake->setInterfaceAddresses(addresses);
    }

    HermeticEnv env;
    ScopedFakePlatform fake;
    ManualClock clock;  // the clock of durations

private:
    std::atomic<double> seconds_{kStart};
    std::string savedOpenId_;
};

}  // namespace kesu::test
