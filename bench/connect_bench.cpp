// Connections to a phone against the real binary, across a veth link between two network
// namespaces (the service on one node, an in-process phone on the other):
//  - connectSSDP round trip with a phone that accepts at once, next to a raw TCP exchange on
//    the same link (connect, send a request-sized frame, read the echo, close) and the
//    control API's HeartBeat, measured in the same run;
//  - the time from a phone's announcement leaving the phone to its appearance in the answer
//    of SSDPQueryAll, next to the SSDPQueryAll round trip itself (the resolution).
//
//   build-bench/bench/connect_bench [connects=300] [announcements=100]      (root)
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"
#include "connect/PhoneFrame.h"
#include "discovery/SsdpMessage.h"
#include "phonesim/PhoneSimulator.h"

namespace {

using namespace kesu::bench;
using kesu::Json;

using kesu::test::NetNsLab;

constexpr int kEchoPort = 10192;
std::string phoneIp;  // the phone node's address

// Raw baseline: a new TCP link to the phone, one request-sized frame out and back, close.
double rawExchange(const kesu::Bytes& frame) {
    const auto t0 = Clock::now();
    std::string error, echoed;
    if (auto link = kesu::phonesim::Link::dial(phoneIp, kEchoPort, error); link && link->send(frame))
        link->read(echoed, std::chrono::seconds(5));
    return micros(Clock::now() - t0);
}

void report(const char* what, const std::vector<double>& v) {
    std::printf("%-58s p50 %9.1f us  p99 %9.1f us  (n=%zu)\n", what, percentile(v, 0.5), percentile(v, 0.99),
                v.size());
}

void ratio(const char* what, const std::vector<double>& a, const std::vector<double>& b) {
    std::printf("%-58s p50 %8.2fx   p99 %8.2fx\n", what, percentile(a, 0.5) / percentile(b, 0.5),
                percentile(a, 0.99) / percentile(b, 0.99));
}


int measure(const NetNsLab::Node& pc, const NetNsLab::Node& phoneNode, int connects, int announcements) {
    phoneIp = phoneNode.ip;
    // The phone: accepts every connection request on 10191, echoes frames on the baseline port.
    std::unique_ptr<kesu::phonesim::Listener> phone, echo;
    int udp = -1;
    NetNsLab::runIn(phoneNode.ns, [&] {
        kesu::phonesim::Listener::Options options;
        options.host = phoneIp;
        options.port = 10191;
        options.maxLinks = 64;
        phone = std::make_unique<kesu::phonesim::Listener>(options);
        options.port = kEchoPort;
        options.answer = kesu::phonesim::Answer::Echo;
        echo = std::make_unique<kesu::phonesim::Listener>(options);
        udp = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        in_addr iface{};
        ::inet_pton(AF_INET, phoneIp.c_str(), &iface);
        ::setsockopt(udp, IPPROTO_IP, IP_MULTICAST_IF, &iface, sizeof iface);
    });
    if (!phone || !echo || !phone->ok() || !echo->ok() || udp < 0) {
        std::fprintf(stderr, "phone sockets could not be set up\n");
        return 1;
    }

    int status = 1;
    {
        BenchService service(pc.ns);
        if (!service.waitUntilUp()) {
            std::fprintf(stderr, "service did not answer\n");
        } else {
            sockaddr_in group{};
            group.sin_family = AF_INET;
            group.sin_port = htons(2200);
            ::inet_pton(AF_INET, "239.255.255.250", &group.sin_addr);
            const auto announce = [&](const std::string& id) {
                const std::string datagram = phoneAnnouncement(id);
                ::sendto(udp, datagram.data(), datagram.size(), 0, reinterpret_cast<sockaddr*>(&group), sizeof group);
            };
            // Announces `id` and waits (at most 5 s) until SSDPQueryAll lists it; each query's
            // round trip goes to `query`.
            std::vector<double> query;
            const auto announceAndAwait = [&](const std::string& id) {
                return announceUntilListed(service, [&] { announce(id); }, id, std::chrono::seconds(5), &query).micros;
            };

            // Announcement to table: a new id each round.
            std::vector<double> appear;
            for (int i = 0; i < announcements; ++i) {
                char id[32];
                std::snprintf(id, sizeof id, "Q%03d-BENCH", i);
                appear.push_back(announceAndAwait(id));
            }

            // connectSSDP to a phone that accepts at once.
            const std::string phoneId = "CONNECT-BENCH";
            const std::string connectBody =
                controlBody("connectSSDP", Json::array({kesu::SsdpMessage::deviceIdentifier(phoneId)}));
            const kesu::Bytes requestSized = kesu::buildPhoneFrameFromJson(
                Json{{"bytes", {0}}, {"deviceName", "bench-pc"}, {"channel", 0}, {"id", 87654321},
                     {"open_Id", "5f2c9e7a1d3b4c6e8f0a2b4c6d8e0f12"}, {"service_id", "com.kesu.pcsuite.SERVICE"},
                     {"target_id", "02:42:ac:11:00:02"}, {"account", "138****5678"}, {"type", 1}});
            std::vector<double> connect, raw, heartbeat;
            int failures = 0;
            for (int i = 0; i < connects; ++i) {
                if (i % 50 == 0) {  // keep the phone well inside the 30 s expiry
                    const std::size_t queries = query.size();
                    announceAndAwait(phoneId);
                    query.resize(queries);  // those queries are not part of the appearance figure
                }
                const auto t0 = Clock::now();
                const auto answer = service.control(connectBody);
                connect.push_back(micros(Clock::now() - t0));
                if (!answer || answer->find("\"error\":0") == std::string::npos) ++failures;
                raw.push_back(rawExchange(requestSized));
                const auto h0 = Clock::now();
                service.control(controlBody("HeartBeat"));
                heartbeat.push_back(micros(Clock::now() - h0));
            }

            report("connectSSDP round trip (phone accepts at once)", connect);
            report("raw TCP: connect + frame out and back + close (same link)", raw);
            report("HeartBeat round trip (control API floor)", heartbeat);
            ratio("ratio connectSSDP / raw TCP exchange", connect, raw);
            std::vector<double> floor;
            for (std::size_t i = 0; i < raw.size(); ++i) floor.push_back(raw[i] + heartbeat[i]);
            ratio("ratio connectSSDP / (raw TCP exchange + HeartBeat)", connect, floor);
            std::printf("connectSSDP failures: %d of %d\n", failures, connects);
            report("announcement sent -> present in SSDPQueryAll", appear);
            report("SSDPQueryAll round trip (resolution of the above)", query);
            ratio("ratio appearance / SSDPQueryAll round trip", appear, query);
            status = failures == 0 ? 0 : 2;
        }
    }
    phone.reset();
    echo.reset();
    ::close(udp);
    return status;
}

}  // namespace

int main(int argc, char** argv) {
    const int connects = argc > 1 ? std::atoi(argv[1]) : 300;
    const int announcements = argc > 2 ? std::atoi(argv[2]) : 100;
    return runInLab("connect_bench", {{"pc", 1}, {"phone", 2}},
                    [&](const auto& nodes) { return measure(nodes[0], nodes[1], connects, announcements); });
}
