// Shared set-up of the discovery tests: a hermetic home for the log, the fake platform with
// a known host name, a clock the test moves by hand, and the signed-in account's open id.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <string>

#include "account/DataInstance.h"
#include "core/Utils.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"

namespace kesu::test {

class DiscoveryTest : public ::testing::Test {
protected:
    static constexpr double kStart = 1714550400.0;  // the clock's reading when the test starts

    void SetUp() override {
        Utils::resetStateForTest();
        fake->setLocalizedHostName("Office-Desk-PC");  // announced as "Off****-PC"
        savedOpenId_ = dataInstance().get(&databaseParam::openid);
        dataInstance().set(&databaseParam::openid, "openid-of-this-pc");
        Utils::setClock([this] {
            return Utils::Clock::time_point(std::chrono::duration_cast<Utils::Clock::duration>(
                std::chrono::duration<double>(seconds_.load())));
        });
    }
    void TearDown() override {
        Utils::setClock({});
        dataInstance().set(&databaseParam::openid, savedOpenId_);
        Utils::resetStateForTest();
        Utils::closeLog();
    }

    void advance(double s) { seconds_.store(seconds_.load() + s); }
    double now() const { return seconds_.load(); }
    std::string todaysLog() const { return readAll(Utils::logFilePath(Utils::now())); }

    HermeticEnv env;
    ScopedFakePlatform fake;

private:
    std::atomic<double> seconds_{kStart};
    std::string savedOpenId_;
};

}  // namespace kesu::test
