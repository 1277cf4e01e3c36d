#include "connect/LaunchService.h"

#include "account/DataInstance.h"
#include "connect/AllowWindow.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"
#include "core/Process.h"
#include "pcsuite/PcsuiteClient.h"
#include "pcsuite/BuryPoint.h"
#include "pcsuite/RequestBase.h"

namespace kesu {

namespace {

const std::string kConnectionMode = "WLAN";

std::string accountOpenId() { return dataInstance().get(&databaseParam::openid); }

// "http://ip:port" for an address literal (IPv6 in brackets).
std::string httpUrl(const std::string& host, int port) {
    const std::string literal = host.find(':') != std::string::npos ? "[" + host + "]" : host;
    return "http://" + literal + ":" + std::to_string(port);
}

}  // namespace

std::vector<std::string> LaunchService::allowWindowArguments(AppSource appSource, const std::string& deviceName,
                                                             const std::string& deviceId, const std::string& account,
                                                             const std::string& sameAccount,
                                                             const std::string& deviceType) {
    return {std::to_string(rawValue(appSource)), deviceName, deviceId, account, sameAccount, deviceType};
}

std::vector<std::string> LaunchService::pcSuiteArguments(const std::string& ip, const std::string& deviceName,
                                                         long long seqNo, const std::string& connectionMode,
                                                         const std::string& deviceId, bool autoConnect,
                                                         const std::string& account, const std::string& deviceType,
                                                         const std::string& sameAccount) {
    return {"--h=" + ip,
            "--n=\"" + deviceName + "\"",
            "--seq=" + std::to_string(seqNo),
            "--m=" + connectionMode,
            "--i=" + deviceId,
            std::string("--a=") + (autoConnect ? "true" : "false"),
            "--account=" + account,
            "--dt=" + deviceType,
            "--as=" + sameAccount};
}

asio::awaitable<void> LaunchService::launchService(std::string ip, std::string localIp, AppSource appSource,
                                                   PhoneConnectRequest request, SendTcp sendTcp) {
    Log::mPrintlog("[launchService] mac receive LAN connection \n");
    const bool forPcsuite = appSource == AppSource::pcsuite;
    if (forPcsuite) {
        // The answer of this request's allow window starts unknown. (A sharing request has no
        // window and leaves a running PC suite request's answer alone.)
        ConnectionState::setIsAllowWindow(false);
        ConnectionState::setThisPhoneAutoConnect(false);

        struct Busy {
            bool connectable = false;
            std::string respondDeviceType;
            std::string connectStatus;
        };
        auto askPcSuite = [&request] {
            Busy answer;
            answer.connectable =
                PcsuiteClient::isDeviceConnectable(request.deviceType, answer.respondDeviceType, answer.connectStatus);
            return answer;
        };
        const Busy busy = co_await loop_.runBlocking(std::move(askPcSuite));
        if (!busy.connectable) {
            if (busy.respondDeviceType == request.deviceType) {
                Log::mPrintlog("[launchService] PC has connected other device, same deviceType busy!\n");
                co_await sendTcp(ConnectTag::BUSY, serviceId::pcsuiteId);
            } else {
                Log::mPrintlog("[launchService] PC has connected other device, different deviceType busy!\n");
                co_await sendTcp(ConnectTag::DIFFDEVICEBUSY, serviceId::pcsuiteId);
                Log::mPrintlog("[launchService] Final finished\n");
            }
            co_return;
        }
    }

    const BuryPoint::Record record = BuryPoint::listRecord("W688|10159", Json::object(), Json{{"finish", 1}});
    const std::string buryPointStr = BuryPoint::listText(record, true);
    Log::mPrintlog("[launchService] sendBuryPoint buryPointStr is: " + buryPointStr);
    auto sendBuryPoint = [&buryPointStr] {
        if (PcsuiteClient::sendBuryPoint(buryPointStr)) Log::mPrintlog("[launchService] sendBuryPoint success \n");
    };
    co_await loop_.runBlocking(std::move(sendBuryPoint));

    // The sharing application has no window: nothing to wait for.
    const int exitCode = !forPcsuite ? 0
                                     : co_await startAllowedWindow(appSource, request.deviceName, request.deviceId,
                                                                   request.account, request.openId,
                                                                   request.deviceType);
    Log::mPrintlog("[launchService] startAllowedWindow exitCode is " + std::to_string(exitCode));
    if (exitCode != 0) Log::mPrintlog("[launchService] reject for exitCode " + std::to_string(exitCode));

    // A sequence number is used up only by a hand-over that happens, so the receiver sees
    // 0, 1, 2, ... with no gap for a refused request.
    if (forPcsuite) {
        Log::mPrintlog("[launchService] launch service is pcsuite \n");
        if (exitCode != 0 || !ConnectionState::getIsAllowWindow()) {
            Log::mPrintlog("[launchService] send tcp reject data to phone \n");
            co_await sendTcp(ConnectTag::REJECT, serviceId::pcsuiteId);
            co_return;
        }
        Log::mPrintlog("[launchService] send tcp agree data to phone \n");
        co_await sendTcp(ConnectTag::AGREE, serviceId::pcsuiteId);

        const long long seqNo = ConnectionState::getNfcLanConnectSeqNo();
        const bool autoConnect = ConnectionState::getThisPhoneAutoConnect();
        auto handOver = [this, &localIp, &ip, &request, seqNo, autoConnect] {
            if (sendPhoneInfoToPcsuite(localIp, ip, request.deviceName, kConnectionMode, request.deviceId, seqNo,
                                       autoConnect, request.account, request.deviceType, request.openId)) {
                Log::mPrintlog(
                    "[launchService] success to send phone info to pcsuite, by http request(9199), phone ip is: " + ip);
            } else {
                Log::mPrintlog(
                    "[launchService] failed to send phone info to pcsuite by http request(9199), start pcsuite.exe \n");
                startPcSuite(ip, request.deviceName, seqNo, kConnectionMode, request.deviceId, autoConnect,
                             request.account, request.openId, request.deviceType);
            }
        };
        co_await loop_.runBlocking(std::move(handOver));
    } else {
        Log::mPrintlog("[launchService] launch service is kesushare \n");
        Log::mPrintlog("[launchService] send tcp agree data to phone \n");
        co_await sendTcp(ConnectTag::AGREE, serviceId::shareId);
        Log::mPrintlog("[launchService] start to launch kesu share allowed window \n");
        const long long seqNo = ConnectionState::getNfcLanConnectSeqNo();
        auto showShareWindow = [this, &ip, &request, seqNo] {
            startKesuShareAllowedWindow(request.deviceName, request.deviceId, ip, request.openId, seqNo, request.port);
        };
        co_await loop_.runBlocking(std::move(showShareWindow));
    }
    Log::mPrintlog(
        "[launchService] waiting for pcsuite/kesushare connecting websocket result by [reportNFCConnectResult] \n");
}

asio::awaitable<int> LaunchService::startAllowedWindow(AppSource appSource, std::string deviceName,
                                                      std::string deviceId, std::string account, std::string openId,
                                                      std::string deviceType) {
    if (appSource == AppSource::kesuShare) co_return 0;
    const Config& config = Config::current();
    const std::string path = rootedPath(config.connectStatusExecutable);
    const auto arguments = allowWindowArguments(appSource, deviceName, deviceId, account,
                                                sameAccountFlag(openId, accountOpenId()), deviceType);
    const auto timeout = config.allowWindowTimeout;

    // Answers left over from an earlier window do not count for this one.
    allowWindowAnswers().drain();
    {
        std::lock_guard<std::mutex> lock(waitMutex_);
        if (stopped_) co_return -1;
    }
    Log::mPrintlog("[startAllowedWindow] launchPath is: " + path + ", arguments is: " + describeList(arguments) +
                     " \n");
    struct Launch {
        bool started = false;
        int exitCode = 0;
    };
    auto launch = [&path, &arguments] {
        Launch result;
        result.started = process::startProcess(path, arguments, result.exitCode);
        return result;
    };
    const Launch launched = co_await loop_.runBlocking(std::move(launch));
    Log::mPrintlog("[startAllowedWindow] exitCode is: " + std::to_string(launched.exitCode) + "\n");
    if (!launched.started) co_return -1;
    Log::mPrintlog("[startAllowedWindow] Enter the allow window event waiting! \n");
    // On the loop: the answer (or stopWaits) wakes this coroutine; no thread waits for it.
    const bool answered = co_await allowWindowAnswers().wait(timeout);
    bool stopped = false;
    {
        std::lock_guard<std::mutex> lock(waitMutex_);
        stopped = stopped_;
    }
    Log::mPrintlog(answered ? "[startAllowedWindow]allow window event success \n"
                              : "[startAllowedWindow]allow window event timedOut \n");
    Log::mPrintlog("[startAllowedWindow] Leave the allow window event waiting! \n");

    if (!stopped && ConnectionState::getIsAllowWindow()) {
        Log::mPrintlog("[startAllowedWindow] you have agree the allowed window! \n");
        co_return 0;
    }
    Log::mPrintlog("[startAllowedWindow] you have refuse the allowed window! \n");
    co_return -1;
}

bool LaunchService::sendPhoneInfoToPcsuite(const std::string& localIp, const std::string& ip,
                                           const std::string& deviceName, const std::string& connectionMode,
                                           const std::string& deviceId, long long seqNo, bool autoConnect,
                                           const std::string& account, const std::string& deviceType,
                                           const std::string& openId) {
    const Json args = Json::array({ip, deviceName, connectionMode, deviceId, std::to_string(seqNo),
                                   autoConnect ? "true" : "false", account, deviceType,
                                   sameAccountFlag(openId, accountOpenId())});
    const Json jsonPostHttp = {{"event", "nfcConection"}, {"args", args}};
    // The PC suite has always been sent the byte count of the pretty-printed text in front of
    // the compact text.
    const std::string PosStr = std::to_string(json::pretty(jsonPostHttp).size()) + "#" + json::compact(jsonPostHttp);
    Log::mPrintlog("[SocketServer::sendPhoneInfoToPcsuite] PosStr to pcsuite is: " + PosStr);
    if (localIp.empty()) return false;
    return RequestBase::urlSessionPost(PosStr, httpUrl(localIp, Config::current().pcsuitePort));
}

bool LaunchService::startPcSuite(const std::string& ip, const std::string& deviceName, long long seqNo,
                                 const std::string& connectionMode, const std::string& deviceId, bool autoConnect,
                                 const std::string& account, const std::string& openId,
                                 const std::string& deviceType) {
    const std::string path = rootedPath(Config::current().pcsuiteExecutable);
    const auto arguments = pcSuiteArguments(ip, deviceName, seqNo, connectionMode, deviceId, autoConnect, account,
                                            deviceType, sameAccountFlag(openId, accountOpenId()));
    Log::mPrintlog("[startPcSuite] launchPath is: " + path + ", arguments is: " + describeList(arguments) + " \n");
    int exitCode = 0;
    if (!process::startProcess(path, arguments, exitCode)) {
        Log::mPrintlog("[startPcSuite] exitCode is: " + std::to_string(exitCode) + "\n");
        Log::mPrintlog("[startPcSuite] start pcsuite failed \n");
        return false;
    }
    return true;
}

std::pair<std::string, std::string> LaunchService::receiveFolders() {
    const std::string accountFolder = dataInstance().get(&databaseParam::storageDir);
    std::lock_guard<std::mutex> lock(folderMutex_);
    if (!folderKnown_) {
        folderKnown_ = true;
        currentFolder_ = previousFolder_ = accountFolder;
    } else if (accountFolder != currentFolder_) {
        previousFolder_ = currentFolder_;
        currentFolder_ = accountFolder;
    }
    const std::string fallback = rootedPath(Config::current().shareReceiveFolder);
    return {currentFolder_.empty() ? fallback : currentFolder_, previousFolder_.empty() ? fallback : previousFolder_};
}

bool LaunchService::startKesuShareAllowedWindow(const std::string& deviceName, const std::string& deviceId,
                                                const std::string& ip, const std::string& openId, long long seqNo,
                                                const std::string& port) {
    const std::string address = port.empty() ? ip : ip + ":" + port;
    const auto [current, previous] = receiveFolders();
    const std::string path = rootedPath(Config::current().connectStatusExecutable);
    const std::vector<std::string> arguments = {"2",     deviceName, deviceId, address, sameAccountFlag(openId, accountOpenId()),
                                                current, std::to_string(seqNo), previous};
    Log::mPrintlog("[startKesuShareAllowedWindow] launchPath is: " + path +
                     ", arguments is: " + describeList(arguments) + " \n");
    int exitCode = 0;
    const bool started = process::startProcess(path, arguments, exitCode);
    Log::mPrintlog("[startKesuShareAllowedWindow] exitCode is: " + std::to_string(exitCode) + "\n");
    Log::mPrintlog(started ? "[startKesuShareAllowedWindow] kesushare allowedWindow open success! \n"
                             : "[startKesuShareAllowedWindow] kesushare allowedWindow open failed! \n");
    return started;
}

void LaunchService::stopWaits() {
    std::lock_guard<std::mutex> lock(waitMutex_);
    stopped_ = true;
    allowWindowAnswers().close();
}

void LaunchService::resume() {
    std::lock_guard<std::mutex> lock(waitMutex_);
    stopped_ = false;
    allowWindowAnswers().reopen();
}

}  // namespace kesu
