// phone_simulator: plays a phone on the local network, by hand or from end-to-end tests.
//
// UDP side: announces itself on the multicast group 239.255.255.250:2200 through the interface
// that owns --iface-ip, in the current (base64 JSON) or old (plain fields) format, and can print
// the PC announcements it hears. TCP side: listens for a PC's connection request and answers
// it, or sends its own connection request to a PC and prints the answer.
//
// Flags:
//   --iface-ip IP        local IPv4 address of the interface to announce and listen on (required
//                        for the UDP side)
//   --name N --id I --account A --openid O --guide G
//                        announced values (defaults: "kesu Sim Phone", "SIMPHONE01",
//                        "13800000000", "sim-open-id", "1")
//   --type mobile|pad    announced device type (default mobile)
//   --format current|old announcement format (default current)
//   --announce-every S   seconds between announcements; 0 = announce once (default: no
//                        announcements)
//   --listen             print every PC announcement heard:  "SIM PC_ANNOUNCE <json>"
//   --tcp-port P         listen for connection requests on P (default: none; 10191 is usual)
//   --answer accept|reject|busy|silent
//                        answer to a PC's request (default accept); prints
//                        "SIM TCP_REQUEST <body>" and "SIM TCP_ANSWERED <tag>"
//   --connect HOST:PORT  send a connection request to a PC; prints "SIM TCP_ANSWER <body>"
//                        (bodies are printed on one line, JSON compacted)
//   --service S          service id of that request (default com.kesu.pcsuite.SERVICE)
//   --duration S         run for S seconds then exit (default 30, at most 3600)
//   --help
// Every line of output is flushed at once; "SIM READY" tells that the sockets are set up.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <algorithm>
#include <cstring>
#include <iostream>
#include <map>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "connect/PhoneFrame.h"
#include "core/Utils.h"
#include "discovery/Base64.h"

namespace {

using Clock = std::chrono::steady_clock;
constexpr const char* kGroup = "239.255.255.250";
constexpr int kSsdpPort = 2200;
constexpr const char* kPcsuiteService = "com.kesu.pcsuite.SERVICE";
constexpr std::size_t kMaxBody = 1 << 20;

struct Options {
    std::string ifaceIp;
    std::string name = "kesu Sim Phone";
    std::string id = "SIMPHONE01";
    std::string account = "13800000000";
    std::string openId = "sim-open-id";
    std::string guide = "1";
    std::string type = "mobile";
    std::string format = "current";
    int announceEvery = -1;
    bool listen = false;
    int tcpPort = 0;
    std::string answer = "accept";
    std::string connect;
    std::string service = kPcsuiteService;
    int duration = 30;
};

void say(const std::string& line) {
    std::cout << "SIM " << line << std::endl;
}

// A frame body on one line: JSON compacted (answers may come pretty-printed), other text as is.
std::string oneLine(const std::string& body) {
    auto j = nlohmann::json::parse(body, nullptr, false);
    if (!j.is_discarded()) return j.dump();
    std::string text = body;
    std::replace(text.begin(), text.end(), '\n', ' ');
    return text;
}

void usage() {
    std::cout << "phone_simulator [--iface-ip IP] [--name N] [--id I] [--account A] [--openid O]\n"
                 "  [--guide G] [--type mobile|pad] [--format current|old] [--announce-every S]\n"
                 "  [--listen] [--tcp-port P] [--answer accept|reject|busy|silent]\n"
                 "  [--connect HOST:PORT] [--service S] [--duration S] [--help]\n";
}

bool parse(int argc, char** argv, Options& o) {
    std::map<std::string, std::string*> text{{"--iface-ip", &o.ifaceIp}, {"--name", &o.name},
        {"--id", &o.id}, {"--account", &o.account}, {"--openid", &o.openId}, {"--guide", &o.guide},
        {"--type", &o.type}, {"--format", &o.format}, {"--answer", &o.answer},
        {"--connect", &o.connect}, {"--service", &o.service}};
    std::map<std::string, int*> number{{"--announce-every", &o.announceEvery}, {"--tcp-port", &o.tcpPort},
        {"--duration", &o.duration}};
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        if (a == "--help") return usage(), false;
        if (a == "--listen") { o.listen = true; continue; }
        if (i + 1 >= argc) { std::cerr << "missing value for " << a << "\n"; return false; }
        if (auto t = text.find(a); t != text.end()) { *t->second = argv[++i]; continue; }
        if (auto n = number.find(a); n != number.end()) {
            try { *n->second = std::stoi(argv[++i]); } catch (...) { std::cerr << "bad number for " << a << "\n"; return false; }
            continue;
        }
        std::cerr << "unknown flag " << a << "\n";
        usage();
        return false;
    }
    if (o.duration < 1 || o.duration > 3600) o.duration = 30;
    return true;
}

std::string announcement(const Options& o) {
    if (o.format == "old") {
        // Field order matters to the reader: each value is cut out up to the next field's name.
        return "RESPONSE * HTTP/1.1\r\ndeviceId:" + o.id + "\r\nopenId:" + o.openId + "\r\nserviceRecord:" +
               kPcsuiteService + "\r\ndeviceName:" + o.name + "\r\naccount:" + o.account + "\r\ndeviceType:" +
               o.type + "\r\npcCustomizedData:" + o.guide + "\r\n";
    }
    nlohmann::json j{{"deviceName", o.name}, {"deviceId", o.id}, {"account", o.account}, {"openId", o.openId},
        {"serviceRecord", std::string(kPcsuiteService) + "--com.kesu.share.CONNECT_PC"}, {"port", 10191},
        {"deviceType", o.type}, {"pcCustomizedData", o.guide}};
    return "RESPONSE * HTTP/1.1\r\nDATE:" + kesu::Utils::getNowTime() + "\r\ncompatGsonStr:" +
           kesu::base64::encode(j.dump()) + "\r\n";
}

int udpSocket(const Options& o) {
    int fd = ::socket(AF_INET, SOCK_DGRAM, 0);
    if (fd < 0) return -1;
    int one = 1;
    ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    ::setsockopt(fd, SOL_SOCKET, SO_REUSEPORT, &one, sizeof one);
    in_addr iface{};
    if (::inet_pton(AF_INET, o.ifaceIp.c_str(), &iface) != 1) { ::close(fd); return -1; }
    ::setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &iface, sizeof iface);
    unsigned char loop = 0, ttl = 1;
    ::setsockopt(fd, IPPROTO_IP, IP_MULTICAST_LOOP, &loop, sizeof loop);
    ::setsockopt(fd, IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof ttl);
    if (o.listen) {
        sockaddr_in any{};
        any.sin_family = AF_INET;
        any.sin_port = htons(kSsdpPort);
        any.sin_addr.s_addr = htonl(INADDR_ANY);
        if (::bind(fd, reinterpret_cast<sockaddr*>(&any), sizeof any) != 0) { ::close(fd); return -1; }
        ip_mreq m{};
        ::inet_pton(AF_INET, kGroup, &m.imr_multiaddr);
        m.imr_interface = iface;
        if (::setsockopt(fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &m, sizeof m) != 0) { ::close(fd); return -1; }
    }
    return fd;
}

void sendAnnouncement(int fd, const Options& o) {
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(kSsdpPort);
    ::inet_pton(AF_INET, kGroup, &to.sin_addr);
    std::string msg = announcement(o);
    ssize_t n = ::sendto(fd, msg.data(), msg.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to);
    say(n == static_cast<ssize_t>(msg.size()) ? "ANNOUNCED" : "ANNOUNCE_FAILED " + std::string(std::strerror(errno)));
}

void onDatagram(int fd) {
    char buf[65536];
    sockaddr_in from{};
    socklen_t len = sizeof from;
    ssize_t n = ::recvfrom(fd, buf, sizeof buf, 0, reinterpret_cast<sockaddr*>(&from), &len);
    if (n <= 0) return;
    std::string text(buf, static_cast<std::size_t>(n));
    char host[INET_ADDRSTRLEN] = {};
    ::inet_ntop(AF_INET, &from.sin_addr, host, sizeof host);
    auto at = text.find("compatGsonStr:");
    if (text.rfind("RESPONSE * HTTP/1.1\r\nDATE:", 0) != 0 || at == std::string::npos) {
        say("UDP_OTHER " + std::string(host));
        return;
    }
    std::string payload = text.substr(at + 14);
    bool crlfEnd = payload.size() >= 2 && payload.compare(payload.size() - 2, 2, "\r\n") == 0;
    if (crlfEnd) payload.resize(payload.size() - 2);
    auto decoded = kesu::base64::decodeStrict(payload);
    if (!crlfEnd || !decoded) { say("UDP_BAD_ENVELOPE " + std::string(host)); return; }
    auto j = nlohmann::json::parse(*decoded, nullptr, false);
    if (j.is_discarded() || !j.is_object() || j.value("deviceType", "") != "pc") return;
    say("PC_ANNOUNCE_FROM " + std::string(host));
    say("PC_ANNOUNCE " + j.dump());
}

int tcpListen(int port) {
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    int one = 1;
    ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<uint16_t>(port));
    a.sin_addr.s_addr = htonl(INADDR_ANY);
    if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 || ::listen(fd, 8) != 0) {
        ::close(fd);
        return -1;
    }
    return fd;
}

bool writeAll(int fd, const kesu::Bytes& bytes) {
    std::size_t off = 0;
    while (off < bytes.size()) {
        ssize_t n = ::send(fd, bytes.data() + off, bytes.size() - off, MSG_NOSIGNAL);
        if (n <= 0) return false;
        off += static_cast<std::size_t>(n);
    }
    return true;
}

struct Conn {
    int fd;
    kesu::FrameCutter cutter{kMaxBody};
    bool answered = false;
};

// Handles readable data on an accepted connection; false when the connection is done.
bool onConnData(Conn& c, const Options& o) {
    char buf[4096];
    ssize_t n = ::recv(c.fd, buf, sizeof buf, 0);
    if (n <= 0) { say("TCP_CLOSED"); return false; }
    c.cutter.feed(std::string_view(buf, static_cast<std::size_t>(n)));
    while (auto frame = c.cutter.next()) {
        std::string body = kesu::phoneFrameBody(*frame);
        say("TCP_REQUEST " + oneLine(body));
        if (c.answered || o.answer == "silent") continue;
        int tag = o.answer == "reject" ? 2 : o.answer == "busy" ? 11 : 1;
        c.answered = writeAll(c.fd, kesu::buildPhoneFrameFromJson(nlohmann::json{{"bytes", {tag}}}));
        say("TCP_ANSWERED " + std::to_string(tag));
    }
    return true;
}

// Sends our own connection request to the PC and prints the first answer frame (bounded wait).
void connectToPc(const Options& o, Clock::time_point deadline) {
    auto colon = o.connect.rfind(':');
    if (colon == std::string::npos) { say("CONNECT_BAD_TARGET"); return; }
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<uint16_t>(std::atoi(o.connect.c_str() + colon + 1)));
    if (::inet_pton(AF_INET, o.connect.substr(0, colon).c_str(), &a.sin_addr) != 1) { say("CONNECT_BAD_TARGET"); return; }
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) {
        say("CONNECT_FAILED " + std::string(std::strerror(errno)));
        ::close(fd);
        return;
    }
    nlohmann::json extra{{"port", "10191"}, {"deviceType", o.type == "pad" ? 1 : 0}};
    nlohmann::json req{{"bytes", {0}}, {"target_id", o.id}, {"account", o.account}, {"extra_info", extra.dump()},
        {"service_id", o.service}, {"deviceName", o.name}, {"open_Id", o.openId}};
    if (!writeAll(fd, kesu::buildPhoneFrameFromJson(req))) { say("CONNECT_FAILED write"); ::close(fd); return; }
    say("TCP_SENT " + req.dump());
    kesu::FrameCutter cutter{kMaxBody};
    for (int rounds = 0; rounds < 10000 && Clock::now() < deadline; ++rounds) {
        pollfd p{fd, POLLIN, 0};
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        if (::poll(&p, 1, static_cast<int>(std::max<long long>(left, 0))) <= 0) break;
        char buf[4096];
        ssize_t n = ::recv(fd, buf, sizeof buf, 0);
        if (n <= 0) { say("TCP_CLOSED"); break; }
        cutter.feed(std::string_view(buf, static_cast<std::size_t>(n)));
        if (auto frame = cutter.next()) {
            say("TCP_ANSWER " + oneLine(kesu::phoneFrameBody(*frame)));
            break;
        }
    }
    ::close(fd);
}

}  // namespace

int main(int argc, char** argv) {
    Options o;
    if (!parse(argc, argv, o)) return argc > 1 && std::string(argv[1]) == "--help" ? 0 : 2;
    const auto deadline = Clock::now() + std::chrono::seconds(o.duration);

    int udp = -1, listener = -1;
    if (!o.ifaceIp.empty() && (o.listen || o.announceEvery >= 0)) {
        udp = udpSocket(o);
        if (udp < 0) { say("UDP_SETUP_FAILED " + std::string(std::strerror(errno))); return 1; }
    }
    if (o.tcpPort > 0) {
        listener = tcpListen(o.tcpPort);
        if (listener < 0) { say("TCP_SETUP_FAILED " + std::string(std::strerror(errno))); return 1; }
    }
    say("READY");
    if (!o.connect.empty()) connectToPc(o, deadline);

    std::vector<Conn> conns;
    auto nextAnnounce = Clock::now();
    bool announcedOnce = false;
    while (Clock::now() < deadline) {
        if (udp >= 0 && o.announceEvery >= 0 && Clock::now() >= nextAnnounce && !(o.announceEvery == 0 && announcedOnce)) {
            sendAnnouncement(udp, o);
            announcedOnce = true;
            nextAnnounce = Clock::now() + std::chrono::seconds(std::max(o.announceEvery, 1));
        }
        std::vector<pollfd> fds;
        if (udp >= 0 && o.listen) fds.push_back({udp, POLLIN, 0});
        if (listener >= 0) fds.push_back({listener, POLLIN, 0});
        for (auto& c : conns) fds.push_back({c.fd, POLLIN, 0});
        auto wake = deadline;
        if (udp >= 0 && o.announceEvery > 0) wake = std::min(wake, nextAnnounce);
        auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(wake - Clock::now()).count();
        int r = ::poll(fds.data(), fds.size(), static_cast<int>(std::clamp<long long>(ms, 0, 1000)));
        if (r <= 0) continue;
        for (const auto& p : fds) {
            if (!(p.revents & (POLLIN | POLLHUP | POLLERR))) continue;
            if (p.fd == udp) {
                onDatagram(udp);
            } else if (p.fd == listener) {
                int c = ::accept(listener, nullptr, nullptr);
                if (c >= 0 && conns.size() < 16) {
                    conns.push_back(Conn{c});
                    say("TCP_ACCEPTED");
                } else if (c >= 0) {
                    ::close(c);
                }
            } else {
                for (auto it = conns.begin(); it != conns.end(); ++it) {
                    if (it->fd != p.fd) continue;
                    if (!onConnData(*it, o)) { ::close(it->fd); conns.erase(it); }
                    break;
                }
            }
        }
    }
    for (auto& c : conns) ::close(c.fd);
    if (udp >= 0) ::close(udp);
    if (listener >= 0) ::close(listener);
    say("DONE");
    return 0;
}
