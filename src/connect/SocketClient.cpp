#include "connect/SocketClient.h"

#include "connect/ConnectMessage.h"
#include "connect/PhoneFrame.h"
#include "core/Json.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"

namespace kesu {

asio::awaitable<bool> SocketClient::connect(std::uint16_t ConnectServerPort, std::string host,
                                            Clock::time_point deadline) {
    std::string error;
    if (!co_await link_.connect(std::move(host), ConnectServerPort, deadline, error)) {
        Log::mPrintlog("[TCP Positive Conn]Error occur during connect as: " + error);
        co_return false;
    }
    Log::mPrintlog("[TCP Positive Conn] success, host: " + link_.localAddress() +
                     ", port: " + std::to_string(link_.localPort()));
    co_return true;
}

void SocketClient::disConnectServer() {
    const bool wasConnected = link_.isConnected();
    link_.shut();
    if (wasConnected) Log::mPrintlog("[TCP Positive Conn] An unknown error, Execute down! disconenct now \n");
}

asio::awaitable<bool> SocketClient::C2SsendMessage(const Bytes& message, Clock::time_point deadline) {
    std::string error;
    if (!co_await link_.writeAll(message, deadline, error)) {
        Log::mPrintlog("[TCP Positive Conn] An error, Execute down! error code: " + error + ", disconenct now \n");
        co_return false;
    }
    Log::mPrintlog("[TCP Positive Conn] Client write tag 0 done \n");
    co_return true;
}

asio::awaitable<bool> SocketClient::CFrSpullMessage(Clock::time_point deadline) {
    Bytes frame;
    switch (co_await link_.readFrame(frame, deadline)) {
    case PhoneLink::Read::Frame:
        break;
    case PhoneLink::Read::Closed:
        Log::mPrintlog("[TCP Positive Conn] An error, Execute down! error code: closed by the phone, disconenct now \n");
        co_return false;
    case PhoneLink::Read::TimedOut:
    case PhoneLink::Read::Shut:
        co_return false;
    }
    Log::mPrintlog("[TCP Positive Conn] Client read tag 0 done \n");
    const auto text = phoneAnswerText(frame);
    std::lock_guard<std::mutex> lock(mutex_);
    if (!text) {
        serverMessageReceive_ = "error parse";
        Log::mPrintlog("[TCP Positive Conn] data parser result failed \n");
        co_return true;
    }
    serverMessageReceive_ = *text;
    Log::mPrintlog("[TCP Positive Conn] Receive data is: " + *text);
    co_return true;
}

std::string SocketClient::ServerMessageReceive() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return serverMessageReceive_;
}

void SocketClient::clearServerMessageReceive() {
    std::lock_guard<std::mutex> lock(mutex_);
    serverMessageReceive_.clear();
}

asio::awaitable<ClientWorkAct::Outcome> ClientWorkAct::ClientReqServer(std::uint16_t Port, std::string ip,
                                                                       Clock::time_point deadline,
                                                                       std::function<bool()> stopRequested) {
    auto stopped = [&] { return ClientShared->isDisconnected() || (stopRequested && stopRequested()); };
    if (!co_await ClientShared->connect(Port, std::move(ip), deadline)) {
        ConnectionState::setWlanConnState(false);
        if (stopped()) co_return Outcome::Stopped;
        Log::mPrintlog("[ClientReqServer] connect phone tcp server failed ...");
        co_return Outcome::ConnectFailed;
    }
    ConnectionState::setWlanConnState(true);
    if (stopped()) co_return Outcome::Stopped;

    const std::string vaildJson = json::compact(connectRequestBody());
    Log::mPrintlog("[ClientReqServer] Send connect message to phone, vaildJson count: " +
                     std::to_string(vaildJson.size()) + ", vaildJson: " + vaildJson + " \n");
    const bool sent = co_await ClientShared->C2SsendMessage(buildPhoneFrame(vaildJson), deadline);
    if (stopped()) co_return Outcome::Stopped;
    if (!sent) co_return Outcome::NoAnswer;

    if (co_await ClientShared->CFrSpullMessage(deadline)) co_return Outcome::Answered;
    co_return stopped() ? Outcome::Stopped : Outcome::NoAnswer;
}

void ClientWorkAct::ClientDisConnServer() {
    ClientShared->clearServerMessageReceive();
    ClientShared->disConnectServer();
}

}  // namespace kesu
