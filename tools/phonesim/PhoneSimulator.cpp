#include "PhoneSimulator.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "core/WallClock.h"
#include "discovery/Base64.h"

namespace kesu::phonesim {

namespace {

constexpr const char* kGroup = "239.255.255.250";
constexpr int kSsdpPort = 2200;
constexpr const char* kPcsuiteService = "com.kesu.pcsuite.SERVICE";

std::string errnoText() { return std::strerror(errno); }

bool writeAll(int fd, const Bytes& bytes) {
    for (std::size_t off = 0; off < bytes.size();) {
        const ssize_t n = ::send(fd, bytes.data() + off, bytes.size() - off, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        off += static_cast<std::size_t>(n);
    }
    return true;
}

int tagOf(Answer answer) {
    switch (answer) {
    case Answer::Accept: return 1;
    case Answer::Reject: return 2;
    case Answer::Busy: return 11;
    default: return 0;
    }
}

}  // namespace

nlohmann::json connectRequest(const Identity& phone, const std::string& service) {
    const nlohmann::json extra{{"port", "10191"}, {"deviceType", phone.type == "pad" ? 1 : 0}};
    return {{"bytes", {0}},          {"target_id", phone.id},    {"account", phone.account},
            {"extra_info", extra.dump()}, {"service_id", service}, {"deviceName", phone.name},
            {"open_Id", phone.openId}};
}

std::string announcement(const Identity& phone, bool oldFormat) {
    if (oldFormat) {
        // Field order matters to the reader: each value is cut out up to the next field's name.
        return "RESPONSE * HTTP/1.1\r\ndeviceId:" + phone.id + "\r\nopenId:" + phone.openId + "\r\nserviceRecord:" +
               kPcsuiteService + "\r\ndeviceName:" + phone.name + "\r\naccount:" + phone.account +
               "\r\ndeviceType:" + phone.type + "\r\npcCustomizedData:" + phone.guide + "\r\n";
    }
    const nlohmann::json j{{"deviceName", phone.name},
                           {"deviceId", phone.id},
                           {"account", phone.account},
                           {"openId", phone.openId},
                           {"serviceRecord", std::string(kPcsuiteService) + "--com.kesu.share.CONNECT_PC"},
                           {"port", 10191},
                           {"deviceType", phone.type},
                           {"pcCustomizedData", phone.guide}};
    return "RESPONSE * HTTP/1.1\r\nDATE:" + WallClock::getNowTime() + "\r\ncompatGsonStr:" + base64::encode(j.dump()) +
           "\r\n";
}

// ---- Announcer

Announcer::Announcer(const std::string& ifaceIp, bool listen) {
    in_addr iface{};
    if (::inet_pton(AF_INET, ifaceIp.c_str(), &iface) != 1) {
        error_ = "not an IPv4 address: " + ifaceIp;
        return;
    }
    const int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        error_ = errnoText();
        return;
    }
    int one = 1;
    ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    ::setsockopt(fd, SOL_SOCKET, SO_REUSEPORT, &one, sizeof one);
    ::setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &iface, sizeof iface);
    unsigned char loop = 0, ttl = 1;
    ::setsockopt(fd, IPPROTO_IP, IP_MULTICAST_LOOP, &loop, sizeof loop);
    ::setsockopt(fd, IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof ttl);
    if (listen) {
        sockaddr_in any{};
        any.sin_family = AF_INET;
        any.sin_port = htons(kSsdpPort);
        any.sin_addr.s_addr = htonl(INADDR_ANY);
        ip_mreq membership{};
        ::inet_pton(AF_INET, kGroup, &membership.imr_multiaddr);
        membership.imr_interface = iface;
        if (::bind(fd, reinterpret_cast<sockaddr*>(&any), sizeof any) != 0 ||
            ::setsockopt(fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership) != 0) {
            error_ = errnoText();
            ::close(fd);
            return;
        }
    }
    fd_ = fd;
}

Announcer::~Announcer() {
    if (fd_ >= 0) ::close(fd_);
}

std::string Announcer::announce(const Identity& phone, bool oldFormat) {
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(kSsdpPort);
    ::inet_pton(AF_INET, kGroup, &to.sin_addr);
    const std::string message = announcement(phone, oldFormat);
    const ssize_t n = ::sendto(fd_, message.data(), message.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to);
    if (n == static_cast<ssize_t>(message.size())) return "";
    return n < 0 ? errnoText() : "short send";
}

std::vector<std::string> Announcer::receive() {
    char buffer[65536];
    sockaddr_in from{};
    socklen_t length = sizeof from;
    const ssize_t n = ::recvfrom(fd_, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&from), &length);
    if (n <= 0) return {};
    const std::string text(buffer, static_cast<std::size_t>(n));
    char host[INET_ADDRSTRLEN] = {};
    ::inet_ntop(AF_INET, &from.sin_addr, host, sizeof host);
    const auto at = text.find("compatGsonStr:");
    if (text.rfind("RESPONSE * HTTP/1.1\r\nDATE:", 0) != 0 || at == std::string::npos)
        return {"UDP_OTHER " + std::string(host)};
    std::string payload = text.substr(at + 14);
    const bool crlfEnd = payload.size() >= 2 && payload.compare(payload.size() - 2, 2, "\r\n") == 0;
    if (crlfEnd) payload.resize(payload.size() - 2);
    const auto decoded = base64::decodeStrict(payload);
    if (!crlfEnd || !decoded) return {"UDP_BAD_ENVELOPE " + std::string(host)};
    const auto j = nlohmann::json::parse(*decoded, nullptr, false);
    if (j.is_discarded() || !j.is_object() || j.value("deviceType", "") != "pc") return {};
    return {"PC_ANNOUNCE_FROM " + std::string(host), "PC_ANNOUNCE " + j.dump()};
}

// ---- Link

Link::Link(int fd) : fd_(fd) {}

Link::~Link() {
    if (fd_ >= 0) ::close(fd_);
}

std::unique_ptr<Link> Link::dial(const std::string& ip, int port, std::string& error) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<std::uint16_t>(port));
    if (port <= 0 || port > 65535 || ::inet_pton(AF_INET, ip.c_str(), &address.sin_addr) != 1) {
        error = "bad target";
        return nullptr;
    }
    const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        error = errnoText();
        if (fd >= 0) ::close(fd);
        return nullptr;
    }
    const int one = 1;
    ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    return std::make_unique<Link>(fd);
}

bool Link::send(const Bytes& bytes) { return writeAll(fd_, bytes); }

Link::Got Link::read(std::string& body, std::chrono::milliseconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        if (auto frame = cutter_.next()) {
            body = phoneFrameBody(*frame);
            return Got::Frame;
        }
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        pollfd waiting{fd_, POLLIN, 0};
        const int ready = ::poll(&waiting, 1, static_cast<int>(std::max<long long>(left.count(), 0)));
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) return Got::TimedOut;
        char buffer[16384];
        const ssize_t n = ::recv(fd_, buffer, sizeof buffer, 0);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return Got::Closed;
        cutter_.feed(std::string_view(buffer, static_cast<std::size_t>(n)));
    }
}

bool Link::closedByPeer(std::chrono::milliseconds timeout) {
    std::string body;
    return read(body, timeout) == Got::Closed;
}

// ---- Pre-connect replies

std::optional<PreconnectReply::Mode> preconnectModeNamed(const std::string& name) {
    using Mode = PreconnectReply::Mode;
    static const std::pair<const char*, Mode> names[] = {{"answer", Mode::Answer},       {"silent", Mode::Silent},
                                                         {"garbage", Mode::Garbage},     {"half", Mode::HalfFrame},
                                                         {"huge", Mode::Huge},           {"hangup", Mode::HangUp}};
    for (const auto& [text, mode] : names)
        if (name == text) return mode;
    return std::nullopt;
}

nlohmann::json preconnectReplyBody(const PreconnectReply& reply) {
    return {{"bytes", {23}},   {"open_Id", reply.openId}, {"target_id", reply.targetId},
            {"deviceName", "kesu Sim Phone"}, {"service_id", kPcsuiteService}, {"type", 1}};
}

// ---- Listener

std::optional<Answer> answerNamed(const std::string& name) {
    if (name == "accept") return Answer::Accept;
    if (name == "reject") return Answer::Reject;
    if (name == "busy") return Answer::Busy;
    if (name == "silent") return Answer::Silent;
    return std::nullopt;
}

struct Listener::Peer {
    int fd;
    FrameCutter cutter{1 << 20};
    bool requested = false;
    bool answered = false;
    bool held = false;  // the PC's pre-connect request was answered on this link
};

Listener::Listener(Options options, std::function<void(const Event&)> onEvent)
    : options_(std::move(options)), onEvent_(std::move(onEvent)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<std::uint16_t>(options_.port));
    if (::inet_pton(AF_INET, options_.host.c_str(), &address.sin_addr) != 1) {
        error_ = "not an IPv4 address: " + options_.host;
        return;
    }
    const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const int one = 1;
    if (fd >= 0) ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || ::listen(fd, 16) != 0) {
        error_ = errnoText();
        if (fd >= 0) ::close(fd);
        return;
    }
    socklen_t length = sizeof address;
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    port_ = ntohs(address.sin_port);
    stopFd_ = ::eventfd(0, EFD_CLOEXEC);
    commandFd_ = ::eventfd(0, EFD_CLOEXEC);
    listenFd_ = fd;
    thread_ = std::thread([this] { serve(); });
}

Listener::~Listener() {
    if (thread_.joinable()) {
        const std::uint64_t one = 1;
        [[maybe_unused]] const auto written = ::write(stopFd_, &one, sizeof one);
        thread_.join();
    }
    if (listenFd_ >= 0) ::close(listenFd_);
    if (stopFd_ >= 0) ::close(stopFd_);
    if (commandFd_ >= 0) ::close(commandFd_);
}

bool Listener::run(Command command) {
    auto done = std::make_shared<std::promise<void>>();
    auto finished = done->get_future();
    {
        std::lock_guard<std::mutex> lock(mutex_);
        commands_.emplace_back(std::move(command), done);
    }
    const std::uint64_t one = 1;
    [[maybe_unused]] const auto written = ::write(commandFd_, &one, sizeof one);
    return finished.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
}

std::size_t Listener::links() {
    std::lock_guard<std::mutex> lock(mutex_);
    return linkCount_;
}

bool Listener::sendToAll(const std::string& body, int times) {
    auto taken = std::make_shared<bool>(false);
    const Bytes frame = buildPhoneFrame(body);
    const bool ran = run([&frame, times, taken](std::vector<Peer>& peers) {
        for (Peer& peer : peers)
            for (int i = 0; i < times; ++i) *taken = writeAll(peer.fd, frame) || *taken;
    });
    return ran && *taken;
}

void Listener::closeAll(bool reset) {
    run([reset](std::vector<Peer>& peers) {
        for (const Peer& peer : peers) {
            if (reset) {
                const linger abort{1, 0};
                ::setsockopt(peer.fd, SOL_SOCKET, SO_LINGER, &abort, sizeof abort);
            }
            ::close(peer.fd);
        }
        peers.clear();
    });
}

void Listener::answerPreconnect(Peer& peer) {
    using Mode = PreconnectReply::Mode;
    const PreconnectReply& reply = *options_.preconnect;
    Bytes out;
    switch (reply.mode) {
    case Mode::Answer:
        out = reply.body.empty() ? buildPhoneFrameFromJson(preconnectReplyBody(reply)) : buildPhoneFrame(reply.body);
        break;
    case Mode::Silent:
    case Mode::HangUp:
        return;
    case Mode::Garbage: {
        const std::string junk = "HTTP/1.1 200 OK\r\n\r\nnot a frame at all";
        out.assign(junk.begin(), junk.end());
        break;
    }
    case Mode::HalfFrame:
    case Mode::Huge: {
        const std::size_t announced = reply.mode == Mode::Huge ? (std::size_t{1} << 20) + 1 : 200;
        out.assign(kPhoneFrameTag.begin(), kPhoneFrameTag.end());
        const auto length = lenTo4Bytes(announced);
        out.insert(out.end(), length.begin(), length.end());
        out.resize(out.size() + (reply.mode == Mode::Huge ? announced : 20), '{');
        break;
    }
    }
    peer.answered = writeAll(peer.fd, out);
    report({Event::Kind::Answered, "", 23, false});
}

void Listener::report(const Event& event) {
    if (onEvent_) onEvent_(event);
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (event.kind == Event::Kind::Request) requests_.push_back(event.body);
        if (event.kind == Event::Kind::Closed) closes_.push_back(event.byPc);
    }
    changed_.notify_all();
}

std::optional<std::string> Listener::request(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (!changed_.wait_for(lock, timeout, [this] { return !requests_.empty(); })) return std::nullopt;
    std::string body = std::move(requests_.front());
    requests_.pop_front();
    return body;
}

bool Listener::pcClosed(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (!changed_.wait_for(lock, timeout, [this] { return !closes_.empty(); })) return false;
    const bool byPc = closes_.front();
    closes_.pop_front();
    return byPc;
}

// False when the link is done (closed by the PC, or hung up by the phone).
bool Listener::answerRequest(Peer& peer, Answer how, const Bytes& request) {
    if (how == Answer::Silent) return true;
    if (how == Answer::HangUp) {
        report({Event::Kind::Closed, "", 0, false});
        return false;
    }
    const int tag = options_.answerBody.empty() ? tagOf(how) : 0;
    const Bytes answer = how == Answer::Echo              ? request
                         : options_.answerBody.empty() ? buildPhoneFrameFromJson(nlohmann::json{{"bytes", {tag}}})
                                                       : buildPhoneFrame(options_.answerBody);
    peer.answered = writeAll(peer.fd, answer);
    report({Event::Kind::Answered, "", tag, false});
    return true;
}

bool Listener::onData(Peer& peer) {
    char buffer[16384];
    const ssize_t n = ::recv(peer.fd, buffer, sizeof buffer, 0);
    if (n <= 0) {
        report({Event::Kind::Closed, "", 0, true});
        return false;
    }
    peer.cutter.feed(std::string_view(buffer, static_cast<std::size_t>(n)));
    while (auto frame = peer.cutter.next()) {
        peer.requested = true;
        const std::string body = phoneFrameBody(*frame);
        report({Event::Kind::Request, body, 0, false});
        if (options_.preconnect && phoneFrameTag(body) == 22) {
            if (options_.preconnect->mode == PreconnectReply::Mode::HangUp) {
                report({Event::Kind::Closed, "", 0, false});
                return false;
            }
            answerPreconnect(peer);
            peer.held = true;
            continue;
        }
        if (peer.held) {
            // On a held link only a connection request ([0]) is answered, each one.
            if (phoneFrameTag(body) != 0 || !options_.heldAnswer) continue;
            if (!answerRequest(peer, *options_.heldAnswer, *frame)) return false;
            continue;
        }
        if (peer.answered) continue;
        if (!answerRequest(peer, options_.answer, *frame)) return false;
    }
    return true;
}

void Listener::serve() {
    std::vector<Peer> peers;
    for (;;) {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            linkCount_ = peers.size();
        }
        std::vector<pollfd> fds{{stopFd_, POLLIN, 0}, {listenFd_, POLLIN, 0}, {commandFd_, POLLIN, 0}};
        for (const Peer& peer : peers) fds.push_back({peer.fd, POLLIN, 0});
        if (::poll(fds.data(), fds.size(), -1) < 0) {
            if (errno == EINTR) continue;
            break;
        }
        if (fds[0].revents != 0) break;
        if (fds[2].revents != 0) {
            std::uint64_t count = 0;
            [[maybe_unused]] const auto got = ::read(commandFd_, &count, sizeof count);
            std::deque<std::pair<Command, std::shared_ptr<std::promise<void>>>> commands;
            {
                std::lock_guard<std::mutex> lock(mutex_);
                commands.swap(commands_);
            }
            for (auto& [command, done] : commands) {
                command(peers);
                done->set_value();
            }
            continue;  // the set of links may have changed
        }
        // Links first: a new link's descriptor is not in this round's set.
        std::vector<Peer> kept;
        for (std::size_t i = 0; i < peers.size(); ++i) {
            if ((fds[i + 3].revents & (POLLIN | POLLHUP | POLLERR)) && !onData(peers[i])) {
                ::close(peers[i].fd);
                continue;
            }
            kept.push_back(std::move(peers[i]));
        }
        peers = std::move(kept);
        if (fds[1].revents & POLLIN) {
            const int fd = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
            if (fd >= 0 && peers.size() < options_.maxLinks) {
                const int one = 1;
                ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
                peers.push_back(Peer{fd});
                report({Event::Kind::Accepted, "", 0, false});
            } else if (fd >= 0) {
                ::close(fd);
            }
        }
    }
    for (const Peer& peer : peers) ::close(peer.fd);
}

}  // namespace kesu::phonesim
