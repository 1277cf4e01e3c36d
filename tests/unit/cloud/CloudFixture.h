// The signed-in account the cloud clients sign with, a stub connect center and PC suite on
// loopback; whatever a test did, the account's tokens never reach the log in clear.
#pragma once

#include <gtest/gtest.h>

#include "account/DataInstance.h"
#include "core/Endpoints.h"
#include "core/Log.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"
#include "unit/UnitHelpers.h"

namespace kesu::test {

inline constexpr char kToken[] = "tok-7f3a9c21e8d4b6";
inline constexpr char kLastToken[] = "old-5e2b8d17c9a0f4";

class CloudAccountTest : public ::testing::Test {
protected:
    void SetUp() override {
        Log::closeLog();  // the day's file is opened again below this test's home
        pcsuite.pointPcsuiteHere(env.config());
        Endpoints::setConnectCenterServerUrl(center.baseUrl());
        saved = dataInstance().get();
        dataInstance().update([](databaseParam& p) {
            p = databaseParam{};
            p.openid = "open-1";
            p.token = kToken;
            p.lastOpenId = "open-0";
            p.lastToken = kLastToken;
            p.pcDeviceId = "pc-1";
            p.version = "1.2.3";
        });
    }
    void TearDown() override {
        const std::string log = todaysLog();
        EXPECT_EQ(log.find(kToken), std::string::npos);
        EXPECT_EQ(log.find(kLastToken), std::string::npos);
        dataInstance().update([this](databaseParam& p) { p = saved; });
        Endpoints::setConnectCenterServerUrl("");
        Log::closeLog();
    }

    HermeticEnv env;
    StubPcSuite center;
    StubPcSuite pcsuite;
    databaseParam saved;
};

}  // namespace kesu::test
