// What the pre-connection tests share: the PC of the connection tests, a running event loop,
// a stub PC suite, cloud records that point at a simulated phone on loopback, and a way to
// run the handshake on the loop and wait for it.
#pragma once

#include <asio/co_spawn.hpp>
#include <asio/use_future.hpp>

#include <dirent.h>

#include <chrono>
#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "../connect/ConnectFixture.h"
#include "phonesim/PhoneSimulator.h"
#include "preconnect/DeviceWaitForPreConnect.h"
#include "preconnect/PreConnectionStatus.h"
#include "preconnect/PreConnectionThread.h"
#include "preconnect/StrategyDevicePreconnect.h"
#include "support/StubPcSuite.h"
#include "unit/UnitHelpers.h"

namespace kesu::test {

using namespace std::chrono_literals;

// Records the abnormal notices of held links.
class NoticeRecorder : public IPreConnectionSubscriber {
public:
    void notify(const std::string& data) override {
        std::lock_guard<std::mutex> lock(mutex_);
        ids_.push_back(data);
        changed_.notify_all();
    }
    // Waits until `count` notices came; false at the time-out.
    bool waitFor(std::size_t count, std::chrono::milliseconds timeout) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, timeout, [&] { return ids_.size() >= count; });
    }
    std::vector<std::string> ids() {
        std::lock_guard<std::mutex> lock(mutex_);
        return ids_;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::string> ids_;
};

inline std::size_t openDescriptors() {
    std::size_t n = 0;
    if (DIR* dir = ::opendir("/proc/self/fd")) {
        while (::readdir(dir)) ++n;
        ::closedir(dir);
    }
    return n;
}

class PreconnectTest : public PcIdentityTest {
protected:
    void SetUp() override {
        PcIdentityTest::SetUp();
        pcsuite.pointPcsuiteHere(env.config());
        env.config().preconnectHandshakeTimeout = 400ms;
        env.config().preconnectConnectTimeout = 400ms;
        env.config().httpWaitTimeout = 2s;
        env.config().httpRequestTimeout = 2s;
        fake->setPingResult(false);  // a ping's outcome does not race the connect
        loop.start();
        PreConnectionStatusChangePublisher::instance().addSubscriber(notices);
    }
    void TearDown() override {
        PreConnectionStatusChangePublisher::instance().removeSubscriber(notices);
        loop.stop();
        PcIdentityTest::TearDown();
    }

    // A cloud record of a phone with business id "SIMP..." (the simulator's default
    // identity) at the given addresses.
    static Json cloudRecord(const std::vector<std::string>& addresses, const std::string& businessId = "SIMPHONE01") {
        Json nets = Json::array();
        for (const auto& ip : addresses) nets.push_back({{"inet", ip}, {"localInet", ip}, {"netmark", "255.0.0.0"}, {"ssid", "Home"}});
        return {{"userId", "openid-of-pc"},
                {"name", "Sim Phone"},
                {"type", 1},
                {"model", "SIM-1"},
                {"reportTime", "2026-12-06 10:00:00.000"},
                {"deviceId", "cloud-1"},
                {"bizInfo", {{"conn_base", {{"businessId", businessId}, {"cloudConnectionSupported", true}}}}},
                {"inets", nets}};
    }

    // An entry for the phone listening on `port` of 127.0.0.1, selected for FARAWAYWLAN.
    std::shared_ptr<DeviceWaitForPreConnect> entryFor(int port) {
        env.config().phoneTcpPort = port;
        auto record = std::make_shared<FarawayDevice>();
        record->setAllInfo(cloudRecord({"", "127.0.0.1"}));
        auto entry = std::make_shared<DeviceWaitForPreConnect>(loop, record->getDeviceId(), record);
        entry->setConnectType(FarawayDevice::kWlan);
        return entry;
    }

    // The handshake on the loop; nullopt when it did not end in time.
    std::optional<bool> handshake(const std::shared_ptr<DeviceWaitForPreConnect>& entry) {
        auto done = asio::co_spawn(loop.executor(), entry->startPreConnect(), asio::use_future);
        if (done.wait_for(10s) != std::future_status::ready) return std::nullopt;
        const bool ok = done.get();
        if (ok) entry->setIsConnected(true);
        return ok;
    }

    // The phone's next received body whose tag is `tag` (others skipped); "" at the time-out.
    static std::string nextOfTag(phonesim::Listener& phone, int tag, std::chrono::milliseconds timeout = 5s) {
        const auto deadline = std::chrono::steady_clock::now() + timeout;
        while (std::chrono::steady_clock::now() < deadline) {
            const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
            auto body = phone.request(left);
            if (!body) return "";
            if (phoneFrameTag(*body) == tag) return *body;
        }
        return "";
    }

    static phonesim::Listener::Options phoneOptions(phonesim::PreconnectReply reply = {}) {
        phonesim::Listener::Options options;
        options.answer = phonesim::Answer::Silent;
        reply.openId = reply.openId == "sim-open-id" ? "openid-of-pc" : reply.openId;
        options.preconnect = reply;
        return options;
    }

    StubPcSuite pcsuite;
    std::shared_ptr<NoticeRecorder> notices = std::make_shared<NoticeRecorder>();
};

// The service's registry with the scheduler running on the loop: what a user's pick or a
// pushed request waits for.
class SchedulingTest : public PreconnectTest {
protected:
    void SetUp() override {
        PreconnectTest::SetUp();
        StrategyDevicePreconnect::clearUserPicks();
        env.config().preconnectPeriod = 20ms;
        env.config().telemetryUdpPort = freeUdpPort();
        DeviceWaitForPreConnectManager::instance().setEventLoop(&loop);
    }
    void TearDown() override {
        scheduler.stop();
        DeviceWaitForPreConnectManager::instance().clearAllDevices();
        DeviceWaitForPreConnectManager::instance().setEventLoop(nullptr);
        StrategyDevicePreconnect::clearUserPicks();
        PreconnectTest::TearDown();
    }

    PreConnectionThread scheduler{loop};
};

}  // namespace kesu::test
