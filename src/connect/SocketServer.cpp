#include "connect/SocketServer.h"

#include <system_error>

#include "connect/ConnectMessage.h"
#include "connect/PhoneFrame.h"
#include "core/Config.h"
#include "core/Json.h"
#include "core/Text.h"
#include "core/Utils.h"

namespace kesu {

namespace {

using namespace std::chrono_literals;

// Frees the connection slot however the hand-over ends.
class ConnectSlot {
public:
    ~ConnectSlot() { Utils::setIsCanConnectDevice(true); }
};

}  // namespace

struct SocketServer::Session {
    std::shared_ptr<PhoneLink> link;
    std::thread thread;
    bool finished = false;  // guarded by sessionsMutex_
};

SocketServer& SocketServer::singleton() {
    static auto* server = new SocketServer();
    return *server;
}

SocketServer::SocketServer() = default;

SocketServer::~SocketServer() { stop(); }

bool SocketServer::ConnectStatusGet() {
    std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
    if (listening_) return true;
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
        Utils::mPrintlog("[ConnectStatusGet] Error! Server failed to connect as an error get: " + ec.message());
        asio::error_code ignored;
        acceptor_.close(ignored);
        port_ = 0;
        return false;
    }
    Utils::mPrintlog("[ConnectStatusGet] Server Socket is open and wait client's connect request");
    listening_ = true;
    launch_.resume();
    io_.restart();
    startAccept();
    ioThread_ = std::thread([this] { io_.run(); });
    return true;
}

void SocketServer::stop() {
    std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
    if (!listening_) return;
    listening_ = false;
    io_.stop();
    if (ioThread_.joinable()) ioThread_.join();
    asio::error_code ignored;
    acceptor_.close(ignored);
    retryTimer_.cancel();
    port_ = 0;

    // No new link can arrive now; end the open ones wherever they wait.
    launch_.stopWaits();
    std::list<std::unique_ptr<Session>> sessions;
    {
        std::lock_guard<std::mutex> lock(sessionsMutex_);
        for (const auto& session : sessions_) session->link->shut();
        sessions.swap(sessions_);
    }
    for (const auto& session : sessions)
        if (session->thread.joinable()) session->thread.join();
    Utils::mPrintlog("[SocketServer] stopped listening for phones");
}

int SocketServer::port() const { return port_.load(); }

std::size_t SocketServer::linkCount() const {
    std::lock_guard<std::mutex> lock(sessionsMutex_);
    return openLinks_;
}

bool SocketServer::waitForNoLinks(std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(sessionsMutex_);
    return sessionsChanged_.wait_for(lock, timeout, [this] { return openLinks_ == 0; });
}

void SocketServer::startAccept() {
    acceptor_.async_accept([this](const asio::error_code& ec, asio::ip::tcp::socket socket) {
        if (ec == asio::error::operation_aborted || !acceptor_.is_open()) return;
        if (ec) {
            // Out of descriptors and the like: try again shortly instead of spinning.
            Utils::mPrintlog("[SocketServer] accept failed: " + ec.message());
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

void SocketServer::reapFinishedLocked() {
    for (auto it = sessions_.begin(); it != sessions_.end();) {
        if (!(*it)->finished) {
            ++it;
            continue;
        }
        if ((*it)->thread.joinable()) (*it)->thread.join();
        it = sessions_.erase(it);
    }
}

void SocketServer::onAccept(asio::ip::tcp::socket socket) {
    asio::error_code ec;
    const int fd = socket.release(ec);
    if (ec) {
        Utils::mPrintlog("[SocketServer] accepted link unusable: " + ec.message());
        return;
    }
    auto link = std::make_shared<PhoneLink>(fd);
    Utils::mPrintlog("[SocketServer]Request Conn Comming,Client " + link->peerAddress() + ": " +
                     std::to_string(link->peerPort()) + " success connect: " + link->localAddress() + ": " +
                     std::to_string(link->localPort()) + " \n");

    std::lock_guard<std::mutex> lock(sessionsMutex_);
    reapFinishedLocked();
    const std::size_t maxLinks = Config::current().phoneServerMaxLinks;
    if (openLinks_ >= maxLinks) {
        Utils::mPrintlog("[SocketServer] " + link->peerAddress() + " refused: " + std::to_string(openLinks_) +
                         " links are open already");
        return;  // the link closes with its last owner
    }
    auto session = std::make_unique<Session>();
    session->link = std::move(link);
    Session& started = *session;
    try {
        session->thread = std::thread([this, &started] { handleLink(started); });
    } catch (const std::system_error& e) {
        Utils::mPrintlog(std::string("[SocketServer] no thread for the link: ") + e.what());
        return;
    }
    sessions_.push_back(std::move(session));
    ++openLinks_;
}

void SocketServer::handleLink(Session& session) {
    PhoneLink& link = *session.link;
    const auto readTimeout = Config::current().phoneLinkReadTimeout;
    Bytes frame;
    switch (link.readFrame(frame, PhoneLink::Clock::now() + readTimeout)) {
    case PhoneLink::Read::Frame: {
        const std::string body = phoneFrameBody(frame);
        if (!text::isValidUtf8(body)) {
            Utils::mPrintlog("[SocketServer] didRead delegate, message from " + link.peerAddress() +
                             " is not UTF-8, dropped");
        } else {
            Utils::mPrintlog("[SocketServer] didRead delegate,Recv message from phone: " + body);
            if (const auto request = PhoneConnectRequest::parse(body)) {
                handleRequest(link, *request);
            } else {
                Utils::mPrintlog("[SocketServer] message from " + link.peerAddress() +
                                 " is not a connection request, dropped");
            }
        }
        break;
    }
    case PhoneLink::Read::TimedOut:
        Utils::mPrintlog("[SocketServer] " + link.peerAddress() + " sent no request within " +
                         std::to_string(readTimeout.count()) + " ms, link closed");
        break;
    case PhoneLink::Read::Closed:
        Utils::mPrintlog("[SocketServer] " + link.peerAddress() + " closed the link without a request");
        break;
    case PhoneLink::Read::Shut:
        break;
    }
    link.shut();
    {
        std::lock_guard<std::mutex> lock(sessionsMutex_);
        session.finished = true;
        --openLinks_;
    }
    sessionsChanged_.notify_all();
}

void SocketServer::handleRequest(PhoneLink& link, const PhoneConnectRequest& request) {
    const LaunchService::SendTcp send = [&link](ConnectTag tag, serviceId id) { return sendTcp(link, tag, id); };
    const std::string ip = link.peerAddress();
    const std::string localIp = link.localAddress();
    if (request.serviceId == rawValue(serviceId::pcsuiteId)) {
        if (!Utils::tryClaimConnectDevice()) {
            const ConnectTag tag = busyAnswerFor(Utils::getConnectingDeviceType(), request.deviceType);
            if (tag == ConnectTag::DIFFDEVICEBUSY) {
                Utils::mPrintlog(
                    "[SocketServer] now connecting another different type device, send different device busy");
            } else {
                Utils::mPrintlog("[SocketServer] now connecting another same type device, notify remote busy");
            }
            sendTcp(link, tag, serviceId::pcsuiteId);
            return;
        }
        ConnectSlot slot;
        Utils::setConnectingDeviceType(request.deviceType);
        launch_.launchService(ip, localIp, AppSource::pcsuite, request, send);
    } else if (request.serviceId == rawValue(serviceId::shareId)) {
        launch_.launchService(ip, localIp, AppSource::kesuShare, request, send);
    } else {
        Utils::mPrintlog("[SocketServer] unknown service_id \"" + request.serviceId + "\" from " + ip +
                         ", request dropped");
    }
}

bool SocketServer::sendTcp(PhoneLink& link, ConnectTag tag, serviceId id) {
    const std::string text = json::pretty(connectAnswerBody(tag, id));
    Utils::mPrintlog("[SendTCP] the message to send is : " + text);
    std::string error;
    if (!link.writeAll(buildPhoneFrame(text), PhoneLink::Clock::now() + Config::current().phoneAnswerWriteTimeout,
                       error)) {
        Utils::mPrintlog("[SendTCP] the answer could not be sent to " + link.peerAddress() + ": " + error);
        return false;
    }
    return true;
}

}  // namespace kesu
