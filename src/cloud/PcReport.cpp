#include "cloud/PcReport.h"

#include "account/DataGet.h"
#include "account/DataInstance.h"
#include "core/Log.h"
#include "platform/SystemInfo.h"

namespace kesu {

namespace {

// A DeviceType of the connect center: this service always reports a PC.
constexpr int kPcDeviceType = 3;

std::string valueOf(const std::map<std::string, std::string>& entry, const std::string& key) {
    const auto it = entry.find(key);
    return it == entry.end() ? std::string() : it->second;
}

}  // namespace

Json PcReport::build(const PcReportFacts& facts) {
    // The address sets use the keys phones use for theirs, so each side reads the other's the
    // same way; the mask travels under "netmark".
    Json inets = Json::array();
    for (const auto& network : facts.networks) {
        inets.push_back({{"inet", valueOf(network, "ip")},
                         {"localInet", valueOf(network, "ip")},
                         {"netmark", valueOf(network, "netmask")},
                         {"ssid", valueOf(network, "ssid")}});
    }
    return Json{{"userId", facts.userId},
                {"deviceId", facts.deviceId},
                {"type", kPcDeviceType},
                {"name", facts.name},
                {"bluetooth", facts.macAddress},
                {"inets", std::move(inets)},
                {"bizInfo", {{"office_suite", {{"businessId", facts.macAddress}}}}},
                {"company", valueOf(facts.systemInfo, "vendor")},
                {"model", valueOf(facts.systemInfo, "model")},
                {"btSwitch", 0},
                {"wifiSwitch", facts.wifiOn ? 1 : 0},
                {"pushInfo", {{"clientId", facts.clientId}}},
                {"ext", {{"pc_pcsuite_version", facts.version}}}};
}

PcReportFacts PcReport::gather() {
    PcReportFacts facts;
    const databaseParam account = dataInstance().get();
    facts.deviceId = account.pcDeviceId.empty() ? getPcsuiteDeviceInfo() : account.pcDeviceId;
    // getPcsuiteDeviceInfo may have refreshed the version too.
    facts.version = dataInstance().get(&databaseParam::version);
    if (facts.version.empty()) facts.version = Log::versionCode;
    facts.userId = account.openid;
    facts.clientId = account.clientId;
    facts.name = SystemInfo::getFullLocalName();
    facts.macAddress = SystemInfo::getMacAddress();
    facts.networks = SystemInfo::GetNetworkInfoList();
    facts.systemInfo = SystemInfo::GetPcSystemInfo();
    facts.wifiOn = SystemInfo::SsidWifiCondition();
    return facts;
}

}  // namespace kesu
