#include "preconnect/ConnectFlow.h"

#include <asio/co_spawn.hpp>
#include <asio/use_future.hpp>

#include "connect/ConnectMessage.h"
#include "connect/PcsuiteInterface.h"
#include "connect/PhoneFrame.h"
#include "connect/Step.h"
#include "core/Config.h"
#include "core/ConnectCodes.h"
#include "core/EventLoop.h"
#include "core/Log.h"
#include "discovery/StateCheck.h"
#include "preconnect/DeviceWaitForPreConnect.h"
#include "preconnect/FarawayDevice.h"

namespace kesu {

namespace {

void speedMarker(const std::string& method, int node, const std::string& id) {
    Log::mPrintlog("[ConnectFlow::" + method + "] $$[Statistical][connectionspeed][wlan][node" + std::to_string(node) +
                   "][" + id + "]$$");
}

bool cancelRequested() { return StateCheck::instance().checkPrimaryConnectCancel(); }

}  // namespace

ConnectFlow::ConnectFlow(DeviceTypeKnown deviceTypeKnown, DeviceWaitForPreConnectManager& registry)
    : deviceTypeKnown_(std::move(deviceTypeKnown)), registry_(registry) {}

std::string ConnectFlow::buildResult(int error, const std::string& errorMsg, const std::string& connectSteps,
                                     const std::string& data) {
    return json::compact(
        Json{{"error", error}, {"error_message", errorMsg}, {"data", data}, {"connection_steps", connectSteps}});
}

std::string ConnectFlow::cancelled(const std::string& connectSteps) const {
    Log::mPrintlog("[ConnectFlow::start] the connection was cancelled");
    return buildResult(rawValue(ErrorCode::CANCEL), "CANCEL", connectSteps);
}

bool ConnectFlow::findPreconnectDevice(const std::string& id, std::string& connectSteps) {
    const Step& step = sharedStep();
    Log::mPrintlog("[ConnectFlow::findPreconnectDevice] Find preconnect device by deviceId: " + id);
    DeviceWaitForPreConnectManager::Entry device;
    const bool found = registry_.lookupDevices(id, device) && device;
    connectSteps += step.getConnectCode(step.OS4_WLAN_FIND_DEVICES);
    if (!found) {
        Log::mPrintlog("[ConnectFlow::findPreconnectDevice] Preconnect device not find!");
        connectSteps += step.getConnectResult(step.OS4_WLAN_FIND_DEVICES, Result::FAILED);
        return false;
    }
    if (!device->getIsConnected()) {
        Log::mPrintlog("[ConnectFlow::findPreconnectDevice] device is not preconnect!");
        connectSteps += step.getConnectResult(step.OS4_WLAN_FIND_DEVICES, Result::FAILED);
        return false;
    }
    pDeviceWaitForPreConnect = device;
    connectSteps += step.getConnectResult(step.OS4_WLAN_FIND_DEVICES, Result::OK);
    Log::mPrintlog("[ConnectFlow::findPreconnectDevice] preconnect device find, deviceId is: " +
                   device->getDeviceId());
    return true;
}

bool ConnectFlow::wlanBuildSendData(Bytes& bufSend, const std::string& autoConnectType) const {
    try {
        Json request = connectRequestBody();
        request["extra_info"] = json::compact(Json{{"isAutoConnect", autoConnectType}});
        const std::string text = request.dump();
        bufSend = buildPhoneFrame(text);
        Log::mPrintlog("[ConnectFlow::wlanBuildSendData] [INTERACTION][CONNSERVER_TO_MOBILEPHONE] ConnectFlow wlan send "
                       "connect data, vaildJson count: " +
                       std::to_string(text.size()) + ", vaildJson: " + text + " \n");
        return true;
    } catch (const std::exception& e) {
        Log::mPrintlog(std::string("[ConnectFlow::wlanBuildSendData] Error occur as: ") + e.what());
        return false;
    }
}

bool ConnectFlow::wlanSendConnectMsg(double time, const Bytes& data, std::string& connectSteps) {
    const Step& step = sharedStep();
    connectSteps += step.getConnectCode(step.OS4_WLAN_SEND_REQUEST);
    const auto device = pDeviceWaitForPreConnect ? pDeviceWaitForPreConnect->getFarawayDevice() : nullptr;
    EventLoop* const loop = registry_.eventLoop();
    bool sent = false;
    if (device && loop && loop->running()) {
        // The write runs on the loop, which owns the link; this thread waits for its outcome.
        // The margin only covers a loop that stalls or ends meanwhile.
        auto outcome = asio::co_spawn(loop->executor(), device->sendMsg(time, data), asio::use_future);
        const auto wait = std::chrono::duration<double>(time) + std::chrono::seconds(1);
        try {
            sent = outcome.wait_for(wait) == std::future_status::ready && outcome.get();
        } catch (const std::exception& e) {
            Log::mPrintlog(std::string("[ConnectFlow::wlanSendConnectMsg] send failed: ") + e.what());
        }
    }
    if (!sent) {
        if (pDeviceWaitForPreConnect) pDeviceWaitForPreConnect->setIsDisconnectNow(true);
        connectSteps += step.getConnectResult(step.OS4_WLAN_SEND_REQUEST, Result::FAILED);
        return false;
    }
    connectSteps += step.getConnectResult(step.OS4_WLAN_SEND_REQUEST, Result::OK);
    return true;
}

bool ConnectFlow::wlanRecvConnectMsg(std::chrono::milliseconds time, Bytes& data, std::string& connectSteps) {
    const Step& step = sharedStep();
    connectSteps += step.getConnectCode(step.OS4_WLAN_RECV_RESPONSE);
    const auto deadline = std::chrono::steady_clock::now() + time;
    if (pDeviceWaitForPreConnect && pDeviceWaitForPreConnect->waitQueueMessage(data, deadline)) {
        connectSteps += step.getConnectResult(step.OS4_WLAN_RECV_RESPONSE, Result::OK);
        return true;
    }
    // A link that stays silent this long is no longer trusted: the pre-connection is ended
    // and made anew.
    if (pDeviceWaitForPreConnect && pDeviceWaitForPreConnect->getIsConnected())
        pDeviceWaitForPreConnect->setIsDisconnectNow(true);
    connectSteps += step.getConnectResult(step.OS4_WLAN_RECV_RESPONSE, Result::FAILED);
    return false;
}

int ConnectFlow::wlanDataParser(const Bytes& data) {
    if (data.size() <= kPhoneFrameHeaderSize) return -1;
    const auto text = phoneAnswerText(data);
    if (!text) return -1;
    Log::mPrintlog("[ConnectFlow::wlanDataParser] wlan recv from phone server: " + *text);
    for (const int tag : {11, 1, 2})
        if (DeviceWaitForPreConnect::isKind(*text, tag)) return tag;
    return -1;
}

int ConnectFlow::retryWlanConnect(std::string& connectSteps) {
    const Step& step = sharedStep();
    const auto deadline = SocketClient::Clock::now() + Config::current().connectFlowFallbackTimeout;
    const std::string ip = pDeviceWaitForPreConnect ? pDeviceWaitForPreConnect->getWlanDeviceIp() : std::string();
    Log::mPrintlog("[ConnectFlow::retryWlanConnect] Enter the accept event waiting! \n");
    const auto fresh = PcsuiteInterface::requestOnFreshLink(ip, deadline, cancelRequested);
    Log::mPrintlog(fresh.outcome == ClientWorkAct::Outcome::Answered ? "[ConnectFlow::retryWlanConnect]accept event success \n"
                                                                       : "[ConnectFlow::retryWlanConnect]accept event timedOut \n");
    Log::mPrintlog("[ConnectFlow::retryWlanConnect] Leave the accept event waiting! \n");
    // A phone port that could not be reached is a failed step, not a made link.
    const bool linked = fresh.outcome != ClientWorkAct::Outcome::ConnectFailed;
    connectSteps += step.getConnectCode(step.WLAN_CONNECT_SERVER) +
                    step.getConnectResult(step.WLAN_CONNECT_SERVER, linked ? Result::OK : Result::FAILED) +
                    step.getConnectCode(step.WLAN_RECV_RESPONSE);
    Log::mPrintlog("[ConnectFlow::retryWlanConnect] " + fresh.answer);
    const ConnectTag answer = classifyPhoneAnswer(fresh.answer);
    const int code = answer == ConnectTag::TIMEOUT ? -1 : rawValue(answer);
    Log::mPrintlog("[ConnectFlow::retryWlanConnect] retry wlan connect, return code is " + std::to_string(code) +
                   ", 1 is success, other is failed\n");
    return code;
}

std::string ConnectFlow::fallback(std::string& connectSteps) {
    const Step& step = sharedStep();
    if (cancelRequested()) return cancelled(connectSteps);  // no fresh link for a cancelled request
    Log::mPrintlog("[ConnectFlow::start] retry wlan connect ...");
    const int code = retryWlanConnect(connectSteps);
    switch (code) {
    case 11:
        connectSteps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::BUSY);
        return buildResult(rawValue(ErrorCode::STATE_BUSY), "phone is busy", connectSteps);
    case 2:
        connectSteps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::REJECT);
        return buildResult(rawValue(ErrorCode::REJECT), "phone is rejected", connectSteps, "3");
    case 1:
        connectSteps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::OK);
        return buildResult(0, "", connectSteps, pDeviceWaitForPreConnect->getWlanDeviceIp());
    default:
        connectSteps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::TIMEOUT);
        return buildResult(rawValue(ErrorCode::UNKNOWN), "parser phone data failed", connectSteps);
    }
}

std::string ConnectFlow::start(const std::string& id, std::string& deviceType, const std::string& autoConnectType) {
    const Step& step = sharedStep();
    const Config& config = Config::current();
    std::string steps;
    StateCheck::instance().setPrimaryConnectCancel(false);
    speedMarker("start", 0, id);
    if (!findPreconnectDevice(id, steps))
        return buildResult(rawValue(ErrorCode::NOT_FOUND), "Preconnect device not find", steps);

    speedMarker("start", 1, id);
    const auto& entry = pDeviceWaitForPreConnect;
    if (const auto device = entry->getFarawayDevice()) {
        deviceType = device->info().type;
        if (deviceTypeKnown_) deviceTypeKnown_(deviceType);
    }
    const std::string connectType = entry->getConnectType();
    entry->clearQueueMessage();
    if (cancelRequested()) return cancelled(steps);
    if (connectType != FarawayDevice::kWlan)
        return buildResult(rawValue(ErrorCode::UNKNOWN), "Preconnect type is unkonw", steps);

    Bytes request;
    const double sendSeconds = std::chrono::duration<double>(config.connectFlowSendTimeout).count();
    if (!wlanBuildSendData(request, autoConnectType) || !wlanSendConnectMsg(sendSeconds, request, steps)) {
        Log::mPrintlog("[ConnectFlow::start] Wlan send connect message failed...");
        return fallback(steps);
    }

    speedMarker("start", 2, id);
    if (cancelRequested()) return cancelled(steps);
    Bytes answer;
    if (!wlanRecvConnectMsg(config.connectFlowAnswerTimeout, answer, steps)) {
        Log::mPrintlog("[ConnectFlow::start] Wlan recv connect message failed...");
        return fallback(steps);
    }

    speedMarker("start", 3, id);
    if (cancelRequested()) return cancelled(steps);
    const int code = wlanDataParser(answer);
    steps += step.getConnectCode(step.OS4_WLAN_PARSER_RESPONSE);
    switch (code) {
    case 11:
        steps += step.getConnectResult(step.OS4_WLAN_PARSER_RESPONSE, Result::BUSY);
        return buildResult(rawValue(ErrorCode::STATE_BUSY), "phone is busy", steps);
    case 2:
        steps += step.getConnectResult(step.OS4_WLAN_PARSER_RESPONSE, Result::REJECT);
        return buildResult(rawValue(ErrorCode::REJECT), "phone is rejected", steps, "3");
    case 1: {
        steps += step.getConnectResult(step.OS4_WLAN_PARSER_RESPONSE, Result::OK);
        const std::string ip = entry->getWlanDeviceIp();
        if (ip.empty()) return buildResult(rawValue(ErrorCode::REJECT), "Wlan ip is null", steps);
        speedMarker("start", 4, id);
        return buildResult(0, "", steps, ip);
    }
    default:
        steps += step.getConnectResult(step.OS4_WLAN_PARSER_RESPONSE, Result::FAILED);
        return buildResult(rawValue(ErrorCode::UNKNOWN), "parser phone data failed", steps);
    }
}

}  // namespace kesu
