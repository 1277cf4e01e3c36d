// Control API benchmark against the real binary: HeartBeat round trips over HTTP next to a
// raw TCP echo round trip on loopback measured in the same run, on one kept-alive connection
// and on a new connection per request (where the service checks who is at the other end);
// the cost of that check itself (socket-table look-ups against getpeername calls); then the
// idle CPU and RSS of the service over a quiet period.
//
//   build/bench/control_bench [requests=2000] [idle_seconds=30]
#include <arpa/inet.h>
#include <httplib.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"
#include "platform/PeerOwner.h"


namespace {

using namespace kesu::bench;

// A listening socket on an ephemeral loopback port; its address in `addr`.
int loopbackListener(sockaddr_in& addr, int backlog) {
    int listener = ::socket(AF_INET, SOCK_STREAM, 0);
    addr = sockaddr_in{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    socklen_t len = sizeof addr;
    ::getsockname(listener, reinterpret_cast<sockaddr*>(&addr), &len);
    ::listen(listener, backlog);
    return listener;
}

// Writes `msg` on `s` and reads as many bytes back into `buf`.
void sendAndReadEcho(int s, const std::string& msg, std::vector<char>& buf) {
    ::write(s, msg.data(), msg.size());
    size_t got = 0;
    while (got < msg.size()) {
        ssize_t n = ::read(s, buf.data() + got, msg.size() - got);
        if (n <= 0) break;
        got += static_cast<size_t>(n);
    }
}

// A raw TCP echo on loopback: the floor for any request/answer exchange on this machine.
std::vector<double> echoRoundTrips(int count, size_t payload) {
    sockaddr_in addr{};
    const int listener = loopbackListener(addr, 1);
    std::thread server([listener] {
        int c = ::accept(listener, nullptr, nullptr);
        int one = 1;
        setsockopt(c, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
        char buf[4096];
        ssize_t n;
        while ((n = ::read(c, buf, sizeof buf)) > 0) ::write(c, buf, static_cast<size_t>(n));
        ::close(c);
    });
    int s = ::socket(AF_INET, SOCK_STREAM, 0);
    int one = 1;
    setsockopt(s, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    ::connect(s, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    std::string msg(payload, 'x');
    std::vector<char> buf(payload);
    std::vector<double> out;
    for (int i = 0; i < count; ++i) {
        auto t0 = Clock::now();
        sendAndReadEcho(s, msg, buf);
        out.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
    }
    ::close(s);
    server.join();
    ::close(listener);
    return out;
}

// A raw TCP echo on loopback with a new connection per round trip: connect, send, read the
// echo, close. The floor for a request on a fresh connection.
std::vector<double> connectEchoRoundTrips(int count, size_t payload) {
    sockaddr_in addr{};
    const int listener = loopbackListener(addr, 64);
    std::thread server([listener, count] {
        char buf[4096];
        for (int i = 0; i < count; ++i) {
            int c = ::accept(listener, nullptr, nullptr);
            if (c < 0) break;
            int one = 1;
            setsockopt(c, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
            ssize_t n;
            while ((n = ::read(c, buf, sizeof buf)) > 0) ::write(c, buf, static_cast<size_t>(n));
            ::close(c);
        }
    });
    std::string msg(payload, 'x');
    std::vector<char> buf(payload);
    std::vector<double> out;
    for (int i = 0; i < count; ++i) {
        auto t0 = Clock::now();
        int s = ::socket(AF_INET, SOCK_STREAM, 0);
        int one = 1;
        setsockopt(s, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
        ::connect(s, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
        sendAndReadEcho(s, msg, buf);
        ::close(s);
        out.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
    }
    server.join();
    ::close(listener);
    return out;
}

// The connection check's own cost: `count` owner look-ups of a loopback connection's far end
// against `count` getpeername calls on the same socket (the floor of any per-connection
// work); both totals in microseconds.
std::pair<double, double> lookupCost(int count) {
    sockaddr_in addr{};
    const int listener = loopbackListener(addr, 1);
    int client = ::socket(AF_INET, SOCK_STREAM, 0);
    ::connect(client, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    int served = ::accept(listener, nullptr, nullptr);
    int found = 0;
    auto t0 = Clock::now();
    for (int i = 0; i < count; ++i) found += kesu::peer::connectedPeerOwner(served).has_value();
    const double lookups = micros(Clock::now() - t0);
    sockaddr_storage peer{};
    t0 = Clock::now();
    for (int i = 0; i < count; ++i) {
        socklen_t peerLen = sizeof peer;
        found += ::getpeername(served, reinterpret_cast<sockaddr*>(&peer), &peerLen) == 0;
    }
    const double peernames = micros(Clock::now() - t0);
    if (found != 2 * count) std::fprintf(stderr, "look-ups failed: %d of %d\n", 2 * count - found, 2 * count);
    ::close(served);
    ::close(client);
    ::close(listener);
    return {lookups, peernames};
}

long ticksOf(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string all((std::istreambuf_iterator<char>(in)), {});
    auto close = all.rfind(')');
    std::istringstream rest(all.substr(close + 2));
    std::string field;
    long utime = 0, stime = 0;
    for (int i = 3; rest >> field; ++i) {
        if (i == 14) utime = std::stol(field);
        if (i == 15) {
            stime = std::stol(field);
            break;
        }
    }
    return utime + stime;
}

long rssKiB(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
    return -1;
}

}  // namespace

int measure(const std::string& netns, int requests, int idleSeconds) {
    BenchService service(netns);
    if (!service.waitUntilUp()) {
        std::fprintf(stderr, "service did not answer\n");
        return 1;
    }
    const pid_t pid = service.pid();
    const std::string body = controlBody("HeartBeat");

    std::vector<double> http;
    for (int i = 0; i < requests; ++i) {
        auto t0 = Clock::now();
        const bool answered = service.control(body).has_value();
        http.push_back(micros(Clock::now() - t0));
        if (!answered) {
            std::fprintf(stderr, "request %d failed\n", i);
            break;
        }
    }
    const auto echo = echoRoundTrips(requests, body.size() + 120);

    // A new connection per request: the service checks each connection's owner once.
    httplib::Client fresh("127.0.0.1", 9197);
    fresh.set_keep_alive(false);
    fresh.set_tcp_nodelay(true);
    std::vector<double> httpFresh;
    for (int i = 0; i < requests; ++i) {
        auto t0 = Clock::now();
        auto res = fresh.Post("/", body, "text/plain");
        httpFresh.push_back(micros(Clock::now() - t0));
        if (!res || res->status != 200) {
            std::fprintf(stderr, "request %d on a new connection failed\n", i);
            break;
        }
    }
    const auto connectEcho = connectEchoRoundTrips(requests, body.size() + 120);
    const auto [lookupMicros, peernameMicros] = lookupCost(requests * 5);

    const double hp50 = percentile(http, 0.5), hp99 = percentile(http, 0.99);
    const double ep50 = percentile(echo, 0.5), ep99 = percentile(echo, 0.99);
    std::printf("HeartBeat round trip (keep-alive, %d requests): p50 %.1f us  p99 %.1f us\n", requests, hp50, hp99);
    std::printf("raw TCP echo round trip (same run):          p50 %.1f us  p99 %.1f us\n", ep50, ep99);
    std::printf("ratio HeartBeat / echo:                       p50 %.2fx  p99 %.2fx\n", hp50 / ep50, hp99 / ep99);
    const double fp50 = percentile(httpFresh, 0.5), fp99 = percentile(httpFresh, 0.99);
    const double cp50 = percentile(connectEcho, 0.5), cp99 = percentile(connectEcho, 0.99);
    std::printf("HeartBeat, new connection each (checked):    p50 %.1f us  p99 %.1f us\n", fp50, fp99);
    std::printf("raw TCP connect+echo+close (same run):       p50 %.1f us  p99 %.1f us\n", cp50, cp99);
    std::printf("ratio HeartBeat new conn / connect+echo:     p50 %.2fx  p99 %.2fx\n", fp50 / cp50, fp99 / cp99);
    std::printf("owner look-up vs getpeername (%d each):   %.2f us vs %.2f us per call, ratio %.1fx\n",
                requests * 5, lookupMicros / (requests * 5), peernameMicros / (requests * 5),
                lookupMicros / peernameMicros);

    const long hz = sysconf(_SC_CLK_TCK);
    const long t0 = ticksOf(pid);
    const long rss0 = rssKiB(pid);
    std::this_thread::sleep_for(std::chrono::seconds(idleSeconds));
    const long t1 = ticksOf(pid);
    const long rss1 = rssKiB(pid);
    std::printf("idle over %d s: CPU %.3f %%  RSS %ld KiB -> %ld KiB\n", idleSeconds,
                100.0 * static_cast<double>(t1 - t0) / static_cast<double>(hz) / idleSeconds, rss0, rss1);

    return 0;
}

int main(int argc, char** argv) {
    const int requests = argc > 1 ? std::atoi(argv[1]) : 2000;
    const int idleSeconds = argc > 2 ? std::atoi(argv[2]) : 30;
    // The service announces itself on every adapter: run it in a network namespace of its
    // own (loopback only) so that nothing leaves the machine.
    return runInLab("control_bench", {{"pc", 1}}, [&](const auto& nodes) { return measure(nodes[0].ns, requests, idleSeconds); });
}
