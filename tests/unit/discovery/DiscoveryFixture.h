// Shared set-up of the discovery tests: a hermetic home for the log, the fake platform with
// a known host name and settable adapters, a wall clock and a monotonic clock the test moves
// by hand, the signed-in account's open id, and phones' announcements.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <vector>

#include "account/DataInstance.h"
#include "core/Json.h"
#include "core/SteadyClock.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "discovery/Base64.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpMessage.h"
#include "discovery/SsdpSocket.h"
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

// Keeps what a socket hears (classified into `table` when given); waits for the n-th datagram.
class Recorder {
public:
    struct Heard {
        std::string data, host;
    };
    explicit Recorder(SsdpDeviceManager* table = nullptr) : table_(table) {}
    SsdpSocket::Receiver receiver() {
        return [this](std::string_view data, const std::string& host, std::uint16_t) {
            if (table_) SsdpMessage::handleDatagram(data, host, *table_);
            std::lock_guard<std::mutex> l(m_);
            heard_.push_back({std::string(data), host});
            cv_.notify_all();
        };
    }
    // Waits (10 s at most) for `count` datagrams starting with `prefix` from senders other
    // than `except`; returns those heard.
    std::vector<Heard> waitFor(std::size_t count, const std::string& except = "", const std::string& prefix = "") {
        std::unique_lock<std::mutex> l(m_);
        std::vector<Heard> picked;
        cv_.wait_for(l, std::chrono::seconds(10), [&] {
            picked.clear();
            for (const Heard& h : heard_)
                if (h.host != except && h.data.starts_with(prefix)) picked.push_back(h);
            return picked.size() >= count;
        });
        return picked;
    }

private:
    SsdpDeviceManager* const table_;
    std::mutex m_;
    std::condition_variable cv_;
    std::vector<Heard> heard_;
};

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
