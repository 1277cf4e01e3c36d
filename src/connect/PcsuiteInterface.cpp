#include "connect/PcsuiteInterface.h"

#include <asio/co_spawn.hpp>

#include <future>

#include "core/ConnectCodes.h"
#include "connect/ConnectMessage.h"
#include "connect/SocketClient.h"
#include "connect/Step.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"
#include "discovery/SsdpDeviceManager.h"

namespace kesu {

CancelFlag& CancelFlag::operator=(bool cancel) {
    std::lock_guard<std::mutex> lock(mutex_);
    flag_.store(cancel);
    // Shutting the link wakes the attempt wherever it waits (connect, send or answer).
    if (cancel && running_ && loop_) loop_->post([running = running_] { running->disConnectServer(); });
    return *this;
}

bool CancelFlag::attach(std::shared_ptr<SocketClient> client, EventLoop& loop) {
    std::lock_guard<std::mutex> lock(mutex_);
    running_ = std::move(client);
    loop_ = &loop;
    return flag_.load();
}

void CancelFlag::detach() {
    std::lock_guard<std::mutex> lock(mutex_);
    running_.reset();
    loop_ = nullptr;
}

CancelFlag& SSDPcancel() {
    static auto* flag = new CancelFlag();
    return *flag;
}

namespace {

std::atomic<EventLoop*> attemptLoop{nullptr};

// Held for the whole of one attempt (and of a fallback's fresh link, which shares the port).
std::timed_mutex& attemptMutex() {
    static auto* mutex = new std::timed_mutex();
    return *mutex;
}

// Runs the exchange of `work` with ip's phone on `loop` and waits for its outcome on the
// calling thread. The deadline bounds the exchange itself, the margin only a loop that ends
// meanwhile.
ClientWorkAct::Outcome runExchange(EventLoop& loop, const std::shared_ptr<ClientWorkAct>& work, const std::string& ip,
                                   SocketClient::Clock::time_point deadline, std::function<bool()> stopRequested) {
    // Shared with the exchange on the loop, which may outlive this call when the loop stalls.
    auto result = std::make_shared<std::promise<ClientWorkAct::Outcome>>();
    auto future = result->get_future();
    asio::co_spawn(loop.executor(),
                   work->ClientReqServer(static_cast<std::uint16_t>(Config::current().phoneTcpPort), ip, deadline,
                                         std::move(stopRequested)),
                   [result, work](std::exception_ptr failure, ClientWorkAct::Outcome outcome) {
                       if (failure) outcome = ClientWorkAct::Outcome::NoAnswer;
                       result->set_value(outcome);
                   });
    try {
        if (future.wait_until(deadline + std::chrono::seconds(5)) == std::future_status::ready) return future.get();
    } catch (const std::future_error&) {
        // The loop ended with the exchange unfinished.
    }
    return ClientWorkAct::Outcome::Stopped;
}

std::string busyReply() {
    const Step& step = sharedStep();
    return json::compact(Json{{"error", rawValue(ErrorCode::STATE_BUSY)},
                              {"error_message", "STATE_BUSY"},
                              {"connection_steps", step.getConnectCode(step.WLAN_GET_CONNECT_STATE) +
                                                       step.getConnectResult(step.WLAN_GET_CONNECT_STATE,
                                                                             Result::FAILED)}});
}

}  // namespace

void PcsuiteInterface::setLoop(EventLoop* loop) { attemptLoop.store(loop); }

std::string PcsuiteInterface::ActiveConnect(const std::string& stringId) {
    std::unique_lock<std::timed_mutex> oneAttempt(attemptMutex(), std::try_to_lock);
    if (!oneAttempt.owns_lock()) {
        Log::mPrintlog("[ActiveConnect] another connection is in progress, " + stringId + " is answered busy \n");
        return busyReply();
    }

    const Step& step = sharedStep();
    const Config& config = Config::current();
    ConnectionState::setWlanConnState(false);
    SSDPcancel() = false;
    const auto deadline = SocketClient::Clock::now() + config.activeConnectTimeout;
    Json reply = {{"error", 0}, {"error_message", ""}, {"connection_steps", ""}};
    std::string steps = step.getConnectCode(step.WLAN_GET_CONNECT_STATE) +
                        step.getConnectResult(step.WLAN_GET_CONNECT_STATE, Result::OK) +
                        step.getConnectCode(step.WLAN_FIND_DEVICES);
    auto finish = [&](int error, const std::string& key, const std::string& message) {
        reply["error"] = error;
        reply[key] = message;
        reply["connection_steps"] = steps;
        return json::compact(reply);
    };

    SsdpDevicePtr device;
    if (!SsdpDeviceManager::instance().ssdpDeviceMap.lookup(stringId, device) || !device) {
        const std::string text = "[ActiveConnect] address_ " + stringId + " find ssdp device error not find";
        Log::mPrintlog("[ActiveConnect] Error occur as: " + text + "\n");
        steps += step.getConnectResult(step.WLAN_FIND_DEVICES, Result::FAILED);
        return finish(rawValue(ErrorCode::NOT_FOUND), "errir_message", text);
    }
    if (device->ip.empty() || device->ip.front().empty()) {
        // Known from an announcement that carried no usable sender address: nothing to dial.
        const std::string text = "[ActiveConnect] address_ " + stringId + " ssdp device has no address";
        Log::mPrintlog("[ActiveConnect] Error occur as: " + text + "\n");
        steps += step.getConnectResult(step.WLAN_FIND_DEVICES, Result::FAILED);
        return finish(rawValue(ErrorCode::NOT_FOUND), "error_message", text);
    }
    ConnectionState::setConnectingDeviceType(device->deviceType);

    // The attempt's link is reachable by a cancel request until the attempt returns.
    struct AttachGuard {
        ~AttachGuard() { SSDPcancel().detach(); }
    };
    EventLoop* const loop = attemptLoop.load();
    if (loop == nullptr || !loop->running()) {
        Log::mPrintlog("[ActiveConnect] the service's event loop is not running, no link can be made \n");
        steps += step.getConnectResult(step.WLAN_FIND_DEVICES, Result::OK) + step.getConnectCode(step.WLAN_CONNECT_SERVER) +
                 step.getConnectResult(step.WLAN_CONNECT_SERVER, Result::FAILED);
        return finish(rawValue(ErrorCode::TIMEOUT), "error_message",
                      "[SSDP search] connect timeout or phone wake up pcsuite failed.");
    }
    const auto work = std::make_shared<ClientWorkAct>(std::make_shared<SocketClient>(loop->executor()));
    AttachGuard attached;
    if (SSDPcancel().attach(work->ClientShared, *loop)) {
        Log::mPrintlog("[ActiveConnect] cancel before initTcp \n");
        steps += step.getConnectResult(step.WLAN_FIND_DEVICES, Result::CANCEL);
        return finish(rawValue(ErrorCode::CANCEL), "errir_message", "CANCEL");
    }
    steps += step.getConnectResult(step.WLAN_FIND_DEVICES, Result::OK) + step.getConnectCode(step.WLAN_CONNECT_SERVER);

    const std::string& ip = device->ip.front();
    Log::mPrintlog("[ActiveConnect] Enter the accept event waiting! \n");
    const auto outcome = runExchange(*loop, work, ip, deadline, [] { return SSDPcancel().load(); });
    const auto disconnect = [&] { loop->call([work] { work->ClientDisConnServer(); }); };
    const bool cancelled = SSDPcancel().load();
    Log::mPrintlog(outcome == ClientWorkAct::Outcome::Answered || cancelled
                         ? "[ActiveConnect]accept event success \n"
                         : "[ActiveConnect]accept event timedOut \n");
    Log::mPrintlog("[ActiveConnect] Leave the accept event waiting! \n");

    if (outcome == ClientWorkAct::Outcome::ConnectFailed && !cancelled) {
        // The phone's port could not be reached: no answer can come, and the connect step
        // is reported as failed.
        disconnect();
        steps += step.getConnectResult(step.WLAN_CONNECT_SERVER, Result::FAILED);
        Log::mPrintlog("[ActiveConnect] return_code_ " + std::to_string(rawValue(ConnectTag::TIMEOUT)) +
                         " , timeout \n");
        return finish(rawValue(ErrorCode::TIMEOUT), "error_message",
                      "[SSDP search] connect timeout or phone wake up pcsuite failed.");
    }
    steps += step.getConnectResult(step.WLAN_CONNECT_SERVER, Result::OK) + step.getConnectCode(step.WLAN_RECV_RESPONSE);

    if (cancelled) {
        Log::mPrintlog("[ActiveConnect] cancel before return code \n");
        disconnect();
        steps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::CANCEL);
        return finish(rawValue(ErrorCode::CANCEL), "errir_message", "CANCEL");
    }

    const std::string text = work->ClientShared->ServerMessageReceive();
    Log::mPrintlog("[TCP Positive Conn] " + text);
    const ConnectTag answer = classifyPhoneAnswer(text);
    const std::string code = std::to_string(rawValue(answer));
    disconnect();

    switch (answer) {
    case ConnectTag::PHONEAGREE:
        Log::mPrintlog("[ActiveConnect] phone is accepted the request, phone ip is : " + describeList(device->ip));
        steps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::OK);
        reply["data"] = ip;
        {
            const std::string result = finish(0, "error_message", "");
            Log::mPrintlog("connect success : " + result);
            return result;
        }
    case ConnectTag::BUSY:
        Log::mPrintlog("[ActiveConnect] return_code_ " + code + " , phone is busy \n");
        steps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::BUSY);
        return finish(rawValue(ErrorCode::STATE_BUSY), "error_message", "[SSDP search] phone is busy.");
    case ConnectTag::PHONEREJECT:
        Log::mPrintlog("[ActiveConnect] return_code_ " + code + " \n");
        steps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::REJECT);
        return finish(rawValue(ErrorCode::REJECT), "error_message", "[SSDP search] phone reject the connect.");
    default:
        Log::mPrintlog("[ActiveConnect] return_code_ " + code + " , timeout \n");
        steps += step.getConnectResult(step.WLAN_RECV_RESPONSE, Result::TIMEOUT);
        return finish(rawValue(ErrorCode::TIMEOUT), "error_message",
                      "[SSDP search] connect timeout or phone wake up pcsuite failed.");
    }
}

PcsuiteInterface::FreshRequest PcsuiteInterface::requestOnFreshLink(const std::string& ip,
                                                                    SocketClient::Clock::time_point deadline,
                                                                    std::function<bool()> stopRequested) {
    FreshRequest request;
    std::unique_lock<std::timed_mutex> oneAttempt(attemptMutex(), std::defer_lock);
    if (!oneAttempt.try_lock_until(deadline)) {
        Log::mPrintlog("[PcsuiteInterface::requestOnFreshLink] another connection kept the phone port until the deadline \n");
        return request;
    }
    EventLoop* const loop = attemptLoop.load();
    if (loop == nullptr || !loop->running() || ip.empty()) return request;
    const auto work = std::make_shared<ClientWorkAct>(std::make_shared<SocketClient>(loop->executor()));
    request.outcome = runExchange(*loop, work, ip, deadline, std::move(stopRequested));
    request.answer = work->ClientShared->ServerMessageReceive();
    loop->call([work] { work->ClientDisConnServer(); });
    return request;
}

}  // namespace kesu
