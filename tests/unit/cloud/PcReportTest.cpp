// The PC's report to the connect center, gathered from the account record and a fake system.
#include <gtest/gtest.h>

#include "account/DataInstance.h"
#include "cloud/PcReport.h"
#include "core/Log.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

TEST(PcReportTest, DescribesThePcFromTheAccountAndTheSystem) {
    test::HermeticEnv env;
    ScopedFakePlatform fake;
    test::resetSharedStateForTest();  // no host name an earlier test had read stays cached
    fake->addAdapter("Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:01", "10.0.0.5", "255.255.255.0");
    fake->addAdapter("Ethernet", "eth0", "aa:bb:cc:dd:ee:02", "192.168.1.9", "255.255.0.0");
    fake->setWifiSsid("home");
    fake->setWifiPowerOn(true);
    fake->setLocalizedHostName("Desk PC");
    fake->setHardwareModel("Model X");
    fake->setCpuVendor("GenuineIntel");
    const databaseParam saved = dataInstance().get();
    dataInstance().update([](databaseParam& p) {
        p = databaseParam{};
        p.openid = "open-1";
        p.pcDeviceId = "pc-1";
        p.clientId = "push-9";
    });

    const Json report = PcReport::build(PcReport::gather());
    dataInstance().update([&](databaseParam& p) { p = saved; });

    const Json expected = Json::parse(R"({
        "userId": "open-1", "deviceId": "pc-1", "type": 3, "name": "Desk PC",
        "bluetooth": "aabbccddee01",
        "inets": [
            {"inet": "10.0.0.5", "localInet": "10.0.0.5", "netmark": "255.255.255.0", "ssid": "home"},
            {"inet": "192.168.1.9", "localInet": "192.168.1.9", "netmark": "255.255.0.0", "ssid": ""}
        ],
        "bizInfo": {"office_suite": {"businessId": "aabbccddee01"}},
        "company": "GenuineIntel", "model": "Model X",
        "btSwitch": 0, "wifiSwitch": 1,
        "pushInfo": {"clientId": "push-9"},
        "ext": {"pc_pcsuite_version": ")" + Log::versionCode + R"("}
    })");
    EXPECT_EQ(report, expected) << report.dump(2);
    Log::closeLog();
}

}  // namespace
}  // namespace kesu
