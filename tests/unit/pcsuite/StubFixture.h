// Shared set-up of the outbound HTTP tests: a hermetic environment, short request limits and
// a stub PC suite on loopback that the configuration points at.
#pragma once

#include <gtest/gtest.h>

#include <chrono>

#include "core/Log.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"
#include "unit/UnitHelpers.h"

namespace kesu::test {

class StubPcsuiteTest : public ::testing::Test {
protected:
    void SetUp() override {
        using namespace std::chrono_literals;
        env.config().httpRequestTimeout = 2s;
        env.config().httpWaitTimeout = 2s;
        env.config().httpAliveTimeout = 2s;
        env.config().http429Pause = 50ms;
        stub.pointPcsuiteHere(env.config());
    }
    void TearDown() override { Log::closeLog(); }

    HermeticEnv env;
    StubPcSuite stub;
};

}  // namespace kesu::test
