#include "discovery/SsdpSocket.h"

#include <net/if.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <asio/ip/address_v4.hpp>
#include <asio/ip/udp.hpp>
#include <asio/post.hpp>
#include <atomic>
#include <cerrno>
#include <exception>
#include <vector>

#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Text.h"
#include "core/Log.h"
#include "discovery/SsdpMessage.h"

namespace kesu {

namespace {

// A run of failed receives this long means the socket is broken: it stops receiving (the
// adapter monitor rebuilds a socket that no longer hears the group).
constexpr int kMaxReceiveErrors = 64;

asio::error_code lastSystemError() { return asio::error_code(errno, asio::error::get_system_category()); }

}  // namespace

struct SsdpSocket::State : std::enable_shared_from_this<State> {
    State(asio::io_context& io, const std::string& card, Receiver r)
        : socket(io), netCard(card), receiver(std::move(r)) {}

    // Loop only from here on.
    void receive() {
        // MSG_TRUNC makes the kernel report a datagram's real length, so that one longer than
        // the buffer is recognised and dropped rather than handled cut short.
        socket.async_receive_from(asio::buffer(buffer), sender, MSG_TRUNC,
                                  [self = shared_from_this()](const asio::error_code& error, std::size_t bytes) {
                                      self->onReceive(error, bytes);
                                  });
    }

    void onReceive(const asio::error_code& error, std::size_t bytes) {
        if (closed.load() || error == asio::error::operation_aborted || error == asio::error::bad_descriptor) return;
        if (error) {
            Log::mPrintlog("[SsdpSocket::udpSocket] receive failed: " + error.message());
            if (++receiveErrors >= kMaxReceiveErrors) {
                Log::mPrintlog("[SsdpSocket::udpSocket] too many receive failures, receiving stops on " + netCard);
                receiving.store(false);
                return;
            }
        } else {
            receiveErrors = 0;
            if (bytes > buffer.size()) {
                Log::mPrintlog("[SsdpSocket::udpSocket] datagram of " + std::to_string(bytes) +
                                 " bytes is longer than " + std::to_string(buffer.size()) + ", dropped");
            } else {
                // 0.0.0.0 as sender comes only from this machine (a loopback interface without
                // a usable source address); the kernel drops it from outside.
                const std::string host = sender.address().to_string();
                try {
                    receiver(std::string_view(buffer.data(), bytes), host, sender.port());
                } catch (const std::exception& e) {
                    Log::mPrintlog(std::string("[SsdpSocket::udpSocket] datagram handling failed: ") + e.what());
                }
            }
        }
        // The receiver may have closed the socket.
        if (!closed.load()) receive();
    }

    void send(const std::string& data) {
        if (!socket.is_open()) return;
        asio::error_code ignored;  // a full send buffer drops the datagram (non-blocking socket)
        socket.send_to(asio::buffer(data), group, 0, ignored);
    }

    void shut() {
        asio::error_code ignored;
        socket.close(ignored);
        receiver = nullptr;  // let go of what it holds
    }

    asio::ip::udp::socket socket;
    const std::string netCard;
    Receiver receiver;
    asio::ip::udp::endpoint group;
    unsigned interfaceIndex = 0;
    std::vector<char> buffer;        // one datagram, loop only
    asio::ip::udp::endpoint sender;  // loop only
    int receiveErrors = 0;           // consecutive receive failures, loop only

    std::atomic<bool> started{false};  // the socket was opened and takes sends
    std::atomic<bool> closed{false};
    std::atomic<bool> receiving{false};
    std::atomic<bool> boundToDevice{false};
    std::atomic<bool> multicastIfSet{false};  // datagrams leave through netCard
    std::atomic<std::uint16_t> localPort{0};
};

SsdpSocket::SsdpSocket(EventLoop& loop, std::string inNetCard, Receiver receiver)
    : netCard(std::move(inNetCard)), loop_(loop) {
    if (!receiver) {
        receiver = [](std::string_view data, const std::string& host, std::uint16_t) {
            SsdpMessage::handleDatagram(data, host);
        };
    }
    state_ = std::make_shared<State>(loop.context(), netCard, std::move(receiver));
    State& s = *state_;

    // The six set-up steps in their order; the first one that fails ends the sequence.
    const Config& config = Config::current();
    s.buffer.resize(config.ssdpMaxDatagram);
    const auto port = static_cast<std::uint16_t>(config.ssdpPort);
    asio::error_code groupError;
    const asio::ip::address_v4 group = asio::ip::make_address_v4(config.ssdpGroup, groupError);
    if (!groupError && !group.is_multicast()) groupError = asio::error::invalid_argument;
    if (!groupError) s.group = asio::ip::udp::endpoint(group, port);
    s.interfaceIndex = if_nametoindex(netCard.c_str());
    asio::error_code ec;

    // 1. Create the socket. From its first datagram on it sends through netCard, so that no
    // datagram of this adapter leaves through another one (and sending works without a
    // multicast route). A socket without that never sends: its interface is missing, and the
    // system would pick another adapter. Sends never block the loop: a datagram that finds
    // the send buffer full is dropped.
    s.socket.open(asio::ip::udp::v4(), ec);
    const int fd = ec ? -1 : s.socket.native_handle();
    if (!ec) {
        asio::error_code ignored;
        s.socket.non_blocking(true, ignored);
        ip_mreqn request{};
        request.imr_ifindex = static_cast<int>(s.interfaceIndex);
        s.multicastIfSet.store(s.interfaceIndex != 0 &&
                               setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &request, sizeof request) == 0);
    }

    // 2. Port reuse, so that the sockets of all adapters (and the old and new socket of a
    // rebuild) bind the discovery port together.
    if (!ec) s.socket.set_option(asio::socket_base::reuse_address(true), ec);
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
            s.boundToDevice.store(true);
        } else {
            Log::mPrintlog("[SsdpSocket::initSocket] bind to device " + netCard +
                             " failed: " + lastSystemError().message());
        }
    }

    // 3. Bind the discovery port on all local addresses.
    if (!ec) s.socket.bind(asio::ip::udp::endpoint(asio::ip::address_v4::any(), port), ec);
    if (!ec) {
        asio::error_code ignored;
        s.localPort.store(s.socket.local_endpoint(ignored).port());
        Log::mPrintlog("[SsdpSocket::initSocket] bind success");
    }

    // 4. Broadcast.
    if (!ec) s.socket.set_option(asio::socket_base::broadcast(true), ec);

    // 5. Join the group on the named interface (by index, so that an adapter without an
    // address joins too).
    if (!ec) ec = groupError;
    if (!ec && s.interfaceIndex == 0) ec = asio::error::no_such_device;
    if (!ec) {
        ip_mreqn request{};
        request.imr_multiaddr.s_addr = htonl(group.to_uint());
        request.imr_address.s_addr = htonl(INADDR_ANY);
        request.imr_ifindex = static_cast<int>(s.interfaceIndex);
        if (setsockopt(fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &request, sizeof request) != 0) ec = lastSystemError();
    }

    // 6. Continuous receiving, on the loop.
    if (ec) {
        Log::mPrintlog("[SsdpSocket::initSocket] Error occur as:" + ec.message());
    } else {
        s.receiving.store(true);
        asio::post(loop.context(), [state = state_] {
            if (!state->closed.load()) state->receive();
        });
        Log::mPrintlog("[SsdpSocket::initSocket] beginReceiving success");
    }
    s.started.store(s.socket.is_open());
}

SsdpSocket::~SsdpSocket() {
    Log::mPrintlog("[SsdpSocket::deinit] close and delete a ssdp socket");
    close();
}

bool SsdpSocket::sendMsg(const std::string& message) {
    if (!text::isValidUtf8(message)) {
        Log::mPrintlog("[SsdpSocket::senMsg]data format error");
        return false;
    }
    return queueSend(std::make_shared<const std::string>(message));
}

bool SsdpSocket::sendMsg(double /*time*/, const Bytes& data) {
    return queueSend(std::make_shared<const std::string>(data.begin(), data.end()));
}

// Every socket operation after set-up runs on the loop, so sends are handed over to it; they
// go out in the order queued and before a later close.
bool SsdpSocket::queueSend(std::shared_ptr<const std::string> data) {
    State& s = *state_;
    if (!s.started.load() || s.closed.load() || !s.multicastIfSet.load() || s.group.port() == 0) return false;
    asio::post(loop_.context(), [state = state_, data = std::move(data)] { state->send(*data); });
    return true;
}

bool SsdpSocket::initial(std::uint16_t /*port*/, const std::string& ip, int /*timeout*/) {
    Log::mPrintlog("[SsdpSocket::initial] a discovery socket sends to the group only, not to " + ip);
    return false;
}

bool SsdpSocket::close() {
    if (state_->closed.exchange(true)) return true;
    state_->receiving.store(false);
    if (loop_.inLoop()) {
        // After the sends already queued (possibly by the receiver that closes it).
        asio::post(loop_.context(), [state = state_] { state->shut(); });
    } else {
        // Queued behind the sends and any datagram being handled; when it has run, the
        // receiver is not called any more.
        loop_.call([state = state_] { state->shut(); });
    }
    return true;
}

bool SsdpSocket::isSocketNull() { return state_->closed.load() || !state_->started.load(); }

bool SsdpSocket::isReceiving() const { return state_->receiving.load(); }

bool SsdpSocket::isBoundToDevice() const { return state_->boundToDevice.load(); }

std::uint16_t SsdpSocket::localPort() const { return state_->localPort.load(); }

}  // namespace kesu
