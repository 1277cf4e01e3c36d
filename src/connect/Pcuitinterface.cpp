#include "connect/Pcuitinterface.h"

#include "connect/ConnectCodes.h"
#include "connect/Step.h"
#include "core/Json.h"
#include "core/Utils.h"

namespace kesu {

std::atomic<bool>& SSDPcancel() {
    static std::atomic<bool> flag{false};
    return flag;
}

std::string Pcuitinterface::ActiveConnect(const std::string& stringId) {
    const Step& step = sharedStep();
    Utils::setWlanConnState(false);
    SSDPcancel() = false;
    Json reply = {{"error", 0}, {"error_message", ""}, {"connection_steps", ""}};
    std::string steps = step.getConnectCode(step.WLAN_GET_CONNECT_STATE) +
                        step.getConnectResult(step.WLAN_GET_CONNECT_STATE, Result::OK) +
                        step.getConnectCode(step.WLAN_FIND_DEVICES);
    // Phones are connected once LAN discovery fills the device table; until then no id is
    // known.
    const std::string text = "[ActiveConnect] address_ " + stringId + " find ssdp device error not find";
    Utils::mPrintlog("[ActiveConnect] Error occur as: " + text + "\n");
    reply["error"] = rawValue(ErrorCode::NOT_FOUND);
    reply["errir_message"] = text;
    steps += step.getConnectResult(step.WLAN_FIND_DEVICES, Result::FAILED);
    reply["connection_steps"] = steps;
    return json::compact(reply);
}

}  // namespace kesu
