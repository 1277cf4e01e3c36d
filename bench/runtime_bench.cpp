// Discovery on the event loop against the real binary: the time from an IPv4 address added
// to an adapter in the service's network namespace to the first announcement of the PC that
// a phone on that link hears from the new address. The service learns of the address from
// the kernel's change notification (a short debounce), rebuilds the adapter's socket (after
// its 1 s rebuild pause) and announces on the new socket at once. Printed beside the figure
// without the notification: the announce period of 5 s, after which the same rebuild follows.
//
//   build-bench/bench/runtime_bench [rounds=10]      (root; run under the e2e lock)
#include <arpa/inet.h>
#include <fcntl.h>
#include <net/if.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"

namespace {

using namespace kesu::bench;

using kesu::test::NetNsLab;

// The phone's listening socket in its namespace: the discovery port, joined to the group on
// its veth end.
int phoneListener(const std::string& phoneNs) {
    int fd = -1;
    NetNsLab::runIn(phoneNs, [&] {
        fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        const int one = 1;
        ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
        sockaddr_in any{};
        any.sin_family = AF_INET;
        any.sin_port = htons(2200);
        ip_mreqn group{};
        ::inet_pton(AF_INET, "239.255.255.250", &group.imr_multiaddr);
        group.imr_ifindex = static_cast<int>(if_nametoindex("veth0"));
        if (::bind(fd, reinterpret_cast<sockaddr*>(&any), sizeof any) != 0 ||
            ::setsockopt(fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &group, sizeof group) != 0) {
            ::close(fd);
            fd = -1;
        }
    });
    return fd;
}

// Waits (at most `limit`) for an announcement of the PC sent from `from`; the time it came.
std::optional<Clock::time_point> awaitAnnouncement(int fd, const std::string& from, Clock::duration limit) {
    const auto deadline = Clock::now() + limit;
    char buffer[65536];
    for (;;) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        if (left <= 0) return std::nullopt;
        pollfd p{fd, POLLIN, 0};
        if (::poll(&p, 1, static_cast<int>(left)) <= 0) continue;
        sockaddr_in sender{};
        socklen_t length = sizeof sender;
        const ssize_t n = ::recvfrom(fd, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&sender), &length);
        const auto at = Clock::now();
        char text[INET_ADDRSTRLEN] = {};
        ::inet_ntop(AF_INET, &sender.sin_addr, text, sizeof text);
        if (n > 0 && from == text && std::string(buffer, static_cast<std::size_t>(n)).starts_with("RESPONSE * HTTP/1.1"))
            return at;
    }
}


int measure(const std::string& pcNs, const std::string& phoneNs, int rounds) {
    // The PC's end is up without an address: the service knows the adapter from its start.
    if (!NetNsLab::ip("-n " + pcNs + " addr flush dev veth0")) {
        std::fprintf(stderr, "could not clear the PC's address\n");
        return 1;
    }
    const int phone = phoneListener(phoneNs);
    if (phone < 0) {
        std::fprintf(stderr, "the phone's socket could not be set up\n");
        return 1;
    }
    int status = 1;
    {
        BenchService service(pcNs);
        if (!service.waitUntilUp()) {
            std::fprintf(stderr, "service did not answer\n");
        } else {
            std::vector<double> latency;
            std::string previous;
            int missed = 0;
            for (int i = 0; i < rounds; ++i) {
                // A new address each round (the previous one goes in the same change).
                const std::string address = "10.77.0." + std::to_string(10 + i);
                std::string batch = "printf '";
                if (!previous.empty()) batch += "addr del " + previous + "/24 dev veth0\\n";
                batch += "addr add " + address + "/24 dev veth0\\n' | ip -n " + pcNs + " -batch - >/dev/null 2>&1";
                if (std::system(batch.c_str()) != 0) {
                    std::fprintf(stderr, "could not add %s\n", address.c_str());
                    break;
                }
                const auto added = Clock::now();
                previous = address;
                const auto heard = awaitAnnouncement(phone, address, std::chrono::seconds(15));
                if (!heard) {
                    ++missed;
                    continue;
                }
                latency.push_back(micros(*heard - added) / 1000.0);
            }
            double sum = 0;
            for (double v : latency) sum += v;
            const double mean = latency.empty() ? 0 : sum / static_cast<double>(latency.size());
            std::printf("address added -> first announcement from it (n=%zu, missed %d)\n", latency.size(), missed);
            std::printf("  on change notification:   p50 %7.1f ms  mean %7.1f ms  max %7.1f ms\n",
                        percentile(latency, 0.5), mean, percentile(latency, 1.0));
            std::printf("  of which the rebuild pause: 1000.0 ms (socket closed, reopened after it)\n");
            std::printf("  periodic check only (5 s announce period + pause): mean %7.1f ms  max %7.1f ms\n",
                        2500.0 + 1000.0, 5000.0 + 1000.0);
            status = missed == 0 && !latency.empty() ? 0 : 2;
        }
    }
    ::close(phone);
    return status;
}

}  // namespace

int main(int argc, char** argv) {
    const int rounds = argc > 1 ? std::atoi(argv[1]) : 10;
    return runInLab("runtime_bench", {{"pc", 1}, {"phone", 2}},
                    [&](const auto& nodes) { return measure(nodes[0].ns, nodes[1].ns, rounds); });
}
