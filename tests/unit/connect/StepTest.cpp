// The steps catalogue behind the "connection_steps" strings (the PC-initiated ones are checked
// end to end in ActiveConnectTest).
#include "connect/Step.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "core/ConnectCodes.h"
#include "connect/StepsConfig.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

TEST(StepCatalogue, PreConnectionStepsAndTheSharedCatalogueIsBuiltOnce) {
    test::HermeticEnv env;
    const Step& s = sharedStep();
    ASSERT_TRUE(s.getIsParserConfigSucc());
    // The pre-connection steps come from the second catalogue, keys without "OS4_".
    EXPECT_EQ(s.getConnectCode(s.OS4_WLAN_FIND_DEVICES) + s.getConnectResult(s.OS4_WLAN_FIND_DEVICES, "PRECONNECT_ERROR"),
              "_WFD:-10");
    // A result the step does not have adds nothing rather than a malformed ":".
    EXPECT_EQ(s.getConnectResult(s.WLAN_CONNECT_SERVER, Result::BUSY), "");

    std::vector<const Step*> seen(4);
    std::vector<std::thread> threads;
    for (auto& p : seen) threads.emplace_back([&p] { p = &sharedStep(); });
    for (auto& t : threads) t.join();
    for (const Step* p : seen) EXPECT_EQ(p, &s);
}

TEST(StepCatalogue, MissingOrBrokenCatalogue) {
    test::HermeticEnv env;
    const Step missing("", os4StepsConfig);
    EXPECT_FALSE(missing.getIsParserConfigSucc());
    EXPECT_EQ(missing.getConnectCode(missing.WLAN_FIND_DEVICES), "");
    EXPECT_EQ(missing.getConnectResult(missing.WLAN_FIND_DEVICES, Result::OK), "");

    // Text that does not parse leaves its fields empty but counts as parsed.
    const Step broken("{\"WLAN_FIND_DEVICES\":", os4StepsConfig);
    EXPECT_TRUE(broken.getIsParserConfigSucc());
    EXPECT_EQ(broken.getConnectCode(broken.WLAN_FIND_DEVICES), "_");
    EXPECT_EQ(broken.getConnectResult(broken.WLAN_FIND_DEVICES, Result::OK), "");
    EXPECT_EQ(broken.getConnectCode(broken.OS4_WLAN_FIND_DEVICES), "_WFD");

    // A numeric first element is printed as a number too.
    const Step numeric(R"({"WLAN_CONNECT_SERVER":{"code":"TF","result":{"OK":[0,"x"]}}})", "");
    EXPECT_EQ(numeric.getConnectResult(numeric.WLAN_CONNECT_SERVER, Result::OK), ":0");
}

}  // namespace
}  // namespace kesu
