#include "connect/SocketServer.h"

#include <asio/co_spawn.hpp>

#include "connect/ConnectMessage.h"
#include "connect/PhoneFrame.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "core/Text.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"

namespace kesu {

namespace {

using namespace std::chrono_literals;

// Frees the connection slot however the hand-over ends.
class ConnectSlot {
public:
    ~ConnectSlot() { ConnectionState::setIsCanConnectDevice(true); }
};

// How long stop() waits for the links' handlers to notice: they end at once unless a request
// to the PC suite is under way, which its own time-out bounds.
constexpr auto kStopWait = 60s;

}  // namespace

SocketServer::SocketServer(EventLoop& loop)
    : loop_(loop), launch_(loop), acceptor_(loop.context()), retryTimer_(loop.context()) {}

SocketServer::~SocketServer() { stop(); }

bool SocketServer::ConnectStatusGet() {
    std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
    if (listening_) return true;
    const bool opened = loop_.call([this] {
        const Config& config = Config::current();
        asio::error_code ec;
        asio::ip::tcp::endpoint endpoint;
        if (config.phoneServerPort < 0 || config.phoneServerPort > 65535) {
            ec = asio::error::invalid_argument;
        } else {
            endpoint = {asio::ip::make_address(config.phoneServerHost, ec),
                        static_cast<unsigned short>(config.phoneServerPort)};
        }
        if (!ec) acceptor_.open(endpoint.protocol(), ec);
        if (!ec) acceptor_.set_option(asio::socket_base::reuse_address(true), ec);
        if (!ec) acceptor_.bind(endpoint, ec);
        if (!ec) acceptor_.listen(asio::socket_base::max_listen_connections, ec);
        if (!ec) port_ = acceptor_.local_endpoint(ec).port();
        if (ec) {
            Log::mPrintlog("[ConnectStatusGet] Error! Server failed to connect as an error get: " + ec.message());
            asio::error_code ignored;
            acceptor_.close(ignored);
            port_ = 0;
            return false;
        }
        Log::mPrintlog("[ConnectStatusGet] Server Socket is open and wait client's connect request");
        launch_.resume();
        startAccept();
        return true;
    }).value_or(false);
    listening_ = opened;
    return opened;
}

void SocketServer::stop() {
    std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
    if (!listening_) return;
    listening_ = false;
    loop_.call([this] {
        asio::error_code ignored;
        acceptor_.close(ignored);
        retryTimer_.cancel();
        port_ = 0;
        // No new link can arrive now; end the open ones wherever they wait.
        for (const auto& link : links_) link->shut();
    });
    launch_.stopWaits();
    // The handlers finish on the loop; there is nothing to wait for when it does not run.
    if (loop_.running() && !loop_.inLoop() && !waitForNoLinks(kStopWait))
        Log::mPrintlog("[SocketServer] " + std::to_string(linkCount()) + " links still ending after stop");
    Log::mPrintlog("[SocketServer] stopped listening for phones");
}

std::size_t SocketServer::linkCount() const {
    std::lock_guard<std::mutex> lock(countMutex_);
    return openLinks_;
}

bool SocketServer::waitForNoLinks(std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(countMutex_);
    return countChanged_.wait_for(lock, timeout, [this] { return openLinks_ == 0; });
}

void SocketServer::startAccept() {
    acceptor_.async_accept([this](const asio::error_code& ec, asio::ip::tcp::socket socket) {
        if (ec == asio::error::operation_aborted || !acceptor_.is_open()) return;
        if (ec) {
            // Out of descriptors and the like: try again shortly instead of spinning.
            Log::mPrintlog("[SocketServer] accept failed: " + ec.message());
            retryTimer_.expires_after(100ms);
            retryTimer_.async_wait([this](const asio::error_code& waitError) {
                if (!waitError && acceptor_.is_open()) startAccept();
            });
            return;
        }
        onAccept(std::move(socket));
        startAccept();
    });
}

void SocketServer::onAccept(asio::ip::tcp::socket socket) {
    auto link = std::make_shared<PhoneLink>(std::move(socket));
    Log::mPrintlog("[SocketServer]Request Conn Comming,Client " + link->peerAddress() + ": " +
                     std::to_string(link->peerPort()) + " success connect: " + link->localAddress() + ": " +
                     std::to_string(link->localPort()) + " \n");
    const std::size_t maxLinks = Config::current().phoneServerMaxLinks;
    if (links_.size() >= maxLinks) {
        Log::mPrintlog("[SocketServer] " + link->peerAddress() + " refused: " + std::to_string(links_.size()) +
                         " links are open already");
        link->shut();
        return;
    }
    links_.insert(link);
    {
        std::lock_guard<std::mutex> lock(countMutex_);
        openLinks_ = links_.size();
    }
    asio::co_spawn(loop_.executor(), handleLink(link), [this, link](std::exception_ptr failure) {
        if (failure) {
            try {
                std::rethrow_exception(failure);
            } catch (const std::exception& e) {
                Log::mPrintlog(std::string("[SocketServer] link handler failed: ") + e.what());
            }
        }
        linkEnded(link);
    });
}

void SocketServer::linkEnded(const std::shared_ptr<PhoneLink>& link) {
    link->shut();
    links_.erase(link);
    // Notified under the lock: a stop() waiting for this may destroy the server right after.
    std::lock_guard<std::mutex> lock(countMutex_);
    openLinks_ = links_.size();
    countChanged_.notify_all();
}

asio::awaitable<void> SocketServer::handleLink(std::shared_ptr<PhoneLink> link) {
    const auto readTimeout = Config::current().phoneLinkReadTimeout;
    Bytes frame;
    switch (co_await link->readFrame(frame, PhoneLink::Clock::now() + readTimeout)) {
    case PhoneLink::Read::Frame: {
        const std::string body = phoneFrameBody(frame);
        if (!text::isValidUtf8(body)) {
            Log::mPrintlog("[SocketServer] didRead delegate, message from " + link->peerAddress() +
                             " is not UTF-8, dropped");
        } else {
            Log::mPrintlog("[SocketServer] didRead delegate,Recv message from phone: " + body);
            if (auto request = PhoneConnectRequest::parse(body)) {
                co_await handleRequest(*link, std::move(*request));
            } else {
                Log::mPrintlog("[SocketServer] message from " + link->peerAddress() +
                                 " is not a connection request, dropped");
            }
        }
        break;
    }
    case PhoneLink::Read::TimedOut:
        Log::mPrintlog("[SocketServer] " + link->peerAddress() + " sent no request within " +
                         std::to_string(readTimeout.count()) + " ms, link closed");
        break;
    case PhoneLink::Read::Closed:
        Log::mPrintlog("[SocketServer] " + link->peerAddress() + " closed the link without a request");
        break;
    case PhoneLink::Read::Shut:
        break;
    }
}

asio::awaitable<void> SocketServer::handleRequest(PhoneLink& link, PhoneConnectRequest request) {
    const LaunchService::SendTcp send = [&link](ConnectTag tag, serviceId id) { return sendTcp(link, tag, id); };
    const std::string ip = link.peerAddress();
    const std::string localIp = link.localAddress();
    if (request.serviceId == rawValue(serviceId::pcsuiteId)) {
        if (!ConnectionState::tryClaimConnectDevice()) {
            const ConnectTag tag = busyAnswerFor(ConnectionState::getConnectingDeviceType(), request.deviceType);
            if (tag == ConnectTag::DIFFDEVICEBUSY) {
                Log::mPrintlog(
                    "[SocketServer] now connecting another different type device, send different device busy");
            } else {
                Log::mPrintlog("[SocketServer] now connecting another same type device, notify remote busy");
            }
            co_await sendTcp(link, tag, serviceId::pcsuiteId);
            co_return;
        }
        ConnectSlot slot;
        ConnectionState::setConnectingDeviceType(request.deviceType);
        co_await launch_.launchService(ip, localIp, AppSource::pcsuite, std::move(request), send);
    } else if (request.serviceId == rawValue(serviceId::shareId)) {
        co_await launch_.launchService(ip, localIp, AppSource::kesuShare, std::move(request), send);
    } else {
        Log::mPrintlog("[SocketServer] unknown service_id \"" + request.serviceId + "\" from " + ip +
                         ", request dropped");
    }
}

asio::awaitable<bool> SocketServer::sendTcp(PhoneLink& link, ConnectTag tag, serviceId id) {
    const std::string text = json::pretty(connectAnswerBody(tag, id));
    Log::mPrintlog("[SendTCP] the message to send is : " + text);
    std::string error;
    if (!co_await link.writeAll(buildPhoneFrame(text), PhoneLink::Clock::now() + Config::current().phoneAnswerWriteTimeout,
                                error)) {
        Log::mPrintlog("[SendTCP] the answer could not be sent to " + link.peerAddress() + ": " + error);
        co_return false;
    }
    co_return true;
}

}  // namespace kesu
