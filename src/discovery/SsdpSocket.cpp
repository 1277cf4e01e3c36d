#include "discovery/SsdpSocket.h"

#include <net/if.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <asio/ip/address_v4.hpp>
#include <asio/post.hpp>
#include <cerrno>
#include <exception>

#include "core/Config.h"
#include "core/Text.h"
#include "core/Utils.h"
#include "discovery/SsdpMessage.h"

namespace kesu {

namespace {

// A run of failed receives this long means the socket is broken: it stops receiving (the
// adapter monitor rebuilds a socket that no longer hears the group).
constexpr int kMaxReceiveErrors = 64;

asio::error_code lastSystemError() { return asio::error_code(errno, asio::error::get_system_category()); }

}  // namespace

SsdpSocket::SsdpSocket(std::string inNetCard, Receiver receiver)
    : netCard(std::move(inNetCard)), receiver_(std::move(receiver)) {
    if (!receiver_) {
        receiver_ = [](std::string_view data, const std::string& host, std::uint16_t) {
            SsdpMessage::handleDatagram(data, host);
        };
    }
    initSocket();
}

SsdpSocket::~SsdpSocket() {
    Utils::mPrintlog("[SsdpSocket::deinit] close and delete a ssdp socket");
    close();
}

// The six set-up steps in their order; the first one that fails ends the sequence. The
// receive thread is started whenever a socket was opened, so that a socket that got only
// part of the way can still send.
void SsdpSocket::initSocket() {
    const Config& config = Config::current();
    buffer_.resize(config.ssdpMaxDatagram);
    const auto port = static_cast<std::uint16_t>(config.ssdpPort);
    asio::error_code groupError;
    const asio::ip::address_v4 group = asio::ip::make_address_v4(config.ssdpGroup, groupError);
    if (!groupError && !group.is_multicast()) groupError = asio::error::invalid_argument;
    if (!groupError) group_ = asio::ip::udp::endpoint(group, port);
    interfaceIndex_ = if_nametoindex(netCard.c_str());
    asio::error_code ec;

    // 1. Create the socket. From its first datagram on it sends through netCard, so that no
    // datagram of this adapter leaves through another one (and sending works without a
    // multicast route). A socket without that never sends: its interface is missing, and the
    // system would pick another adapter.
    initClientSocket();
    socket->open(asio::ip::udp::v4(), ec);
    const int fd = ec ? -1 : socket->native_handle();
    if (!ec) multicastIfSet_.store(setMulticastInterface());

    // 2. Port reuse, so that the sockets of all adapters (and the old and new socket of a
    // rebuild) bind the discovery port together.
    if (!ec) socket->set_option(asio::socket_base::reuse_address(true), ec);
    if (!ec) {
        const int on = 1;
        if (setsockopt(fd, SOL_SOCKET, SO_REUSEPORT, &on, sizeof on) != 0) ec = lastSystemError();
    }
    // Exact per-adapter delivery: without the device binding every socket on the port hears
    // the group from every adapter. Not fatal when refused: the socket then also hears the
    // other adapters, which only repeats announcements.
    if (!ec) {
        if (setsockopt(fd, SOL_SOCKET, SO_BINDTODEVICE, netCard.c_str(), static_cast<socklen_t>(netCard.size())) ==
            0) {
            boundToDevice_.store(true);
        } else {
            Utils::mPrintlog("[SsdpSocket::initSocket] bind to device " + netCard +
                             " failed: " + lastSystemError().message());
        }
    }

    // 3. Bind the discovery port on all local addresses.
    if (!ec) socket->bind(asio::ip::udp::endpoint(asio::ip::address_v4::any(), port), ec);
    if (!ec) {
        asio::error_code ignored;
        localPort_.store(socket->local_endpoint(ignored).port());
        Utils::mPrintlog("[SsdpSocket::initSocket] bind success");
    }

    // 4. Broadcast.
    if (!ec) socket->set_option(asio::socket_base::broadcast(true), ec);

    // 5. Join the group on the named interface (by index, so that an adapter without an
    // address joins too).
    if (!ec) ec = groupError;
    if (!ec && interfaceIndex_ == 0) ec = asio::error::no_such_device;
    if (!ec) {
        ip_mreqn request{};
        request.imr_multiaddr.s_addr = htonl(group.to_uint());
        request.imr_address.s_addr = htonl(INADDR_ANY);
        request.imr_ifindex = static_cast<int>(interfaceIndex_);
        if (setsockopt(fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &request, sizeof request) != 0) ec = lastSystemError();
    }

    // 6. Continuous receiving.
    if (!ec) startReceive();

    if (ec) {
        Utils::mPrintlog("[SsdpSocket::initSocket] Error occur as:" + ec.message());
    } else {
        receiving_.store(true);
        Utils::mPrintlog("[SsdpSocket::initSocket] beginReceiving success");
    }
    if (socket->is_open()) {
        work_.emplace(asio::make_work_guard(io_));
        started_.store(true);
        ioThread_ = std::thread([this] { io_.run(); });
    }
}

bool SsdpSocket::setMulticastInterface() {
    if (interfaceIndex_ == 0 || !socket || !socket->is_open()) return false;
    ip_mreqn request{};
    request.imr_ifindex = static_cast<int>(interfaceIndex_);
    return setsockopt(socket->native_handle(), IPPROTO_IP, IP_MULTICAST_IF, &request, sizeof request) == 0;
}

void SsdpSocket::startReceive() {
    // MSG_TRUNC makes the kernel report a datagram's real length, so that one longer than
    // the buffer is recognised and dropped rather than handled cut short.
    socket->async_receive_from(asio::buffer(buffer_), sender_, MSG_TRUNC,
                               [this](const asio::error_code& error, std::size_t bytes) { onReceive(error, bytes); });
}

void SsdpSocket::onReceive(const asio::error_code& error, std::size_t bytes) {
    if (closed_.load() || error == asio::error::operation_aborted || error == asio::error::bad_descriptor) return;
    if (error) {
        Utils::mPrintlog("[SsdpSocket::udpSocket] receive failed: " + error.message());
        if (receiveErrors_.fetch_add(1) + 1 >= kMaxReceiveErrors) {
            Utils::mPrintlog("[SsdpSocket::udpSocket] too many receive failures, receiving stops on " + netCard);
            receiving_.store(false);
            return;
        }
    } else {
        receiveErrors_.store(0);
        if (bytes > buffer_.size()) {
            Utils::mPrintlog("[SsdpSocket::udpSocket] datagram of " + std::to_string(bytes) +
                             " bytes is longer than " + std::to_string(buffer_.size()) + ", dropped");
        } else {
            // 0.0.0.0 as sender comes only from this machine (a loopback interface without a
            // usable source address); the kernel drops it from outside.
            const std::string host = sender_.address().to_string();
            try {
                receiver_(std::string_view(buffer_.data(), bytes), host, sender_.port());
            } catch (const std::exception& e) {
                Utils::mPrintlog(std::string("[SsdpSocket::udpSocket] datagram handling failed: ") + e.what());
            }
        }
    }
    startReceive();
}

bool SsdpSocket::sendMsg(const std::string& message) {
    if (!text::isValidUtf8(message)) {
        Utils::mPrintlog("[SsdpSocket::senMsg]data format error");
        return false;
    }
    return queueSend(std::make_shared<const std::string>(message));
}

bool SsdpSocket::sendMsg(double /*time*/, const Bytes& data) {
    return queueSend(std::make_shared<const std::string>(data.begin(), data.end()));
}

// Every socket operation after set-up runs on the receive thread, so sends are handed over
// to it; they go out in the order queued and before a later close.
bool SsdpSocket::queueSend(std::shared_ptr<const std::string> data) {
    if (!started_.load() || closed_.load() || !multicastIfSet_.load() || group_.port() == 0) return false;
    asio::post(io_, [this, data = std::move(data)] {
        if (!socket->is_open()) return;
        socket->async_send_to(asio::buffer(*data), group_, [data](const asio::error_code&, std::size_t) {});
    });
    return true;
}

bool SsdpSocket::initial(std::uint16_t /*port*/, const std::string& ip, int /*timeout*/) {
    Utils::mPrintlog("[SsdpSocket::initial] a discovery socket sends to the group only, not to " + ip);
    return false;
}

bool SsdpSocket::close() {
    std::unique_lock<std::mutex> guard(mutex_);
    if (!closed_.exchange(true)) {
        receiving_.store(false);
        if (started_.load()) {
            asio::post(io_, [this] {
                asio::error_code ignored;
                socket->close(ignored);
            });
            work_.reset();
        } else if (socket && socket->is_open()) {
            asio::error_code ignored;
            socket->close(ignored);
        }
    }
    if (ioThread_.joinable() && ioThread_.get_id() != std::this_thread::get_id()) ioThread_.join();
    return true;
}

bool SsdpSocket::isSocketNull() { return closed_.load() || !started_.load(); }

}  // namespace kesu
