// Pre-connection against the real binary: what holding 20 pre-connected phones costs the idle
// service (CPU, RSS, threads, context switches, next to the same service holding none), how
// long a listed phone takes to be held, and the [24] -> [25] round trip on a held link next to
// a raw TCP echo round trip over the same veth, measured in the same run.
//
//   build/bench/preconnect_bench [--seconds=N] [--settle=N] [--trips=N]
//   (60 s windows after 10 s of settling, 300 round trips; KESU_BENCH_QUICK=1: 10 s, 3 s, 50)
// Needs root (it exits 0 with a note otherwise): the service runs in a network namespace
// whose veth peer holds 20 extra addresses, one simulated phone listening on each; a stand-in
// HTTP server in the service's namespace plays the connect center (named by switch_host.ini)
// and the PC suite. The service starts signed in; each time the account database is written
// anew it fetches the device list, empty at first, then naming the 20 phones.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"
#include "connect/PhoneFrame.h"
#include "core/Config.h"
#include "phonesim/PhoneSimulator.h"
#include "preconnect/FarawayDevice.h"
#include "support/StubPcSuite.h"

namespace {

using namespace kesu::bench;
using namespace std::chrono_literals;
namespace phonesim = kesu::phonesim;
namespace test = kesu::test;

constexpr int kPhones = 20;
const std::string kOpenId = "bench0openid0000000000000000001";
const std::string kAsk = R"({"bytes":[24]})";

std::string phoneIp(int i) { return "10.77.0." + std::to_string(101 + i); }
// Distinct in their first 4 characters, which make the device key.
std::string businessId(int i) {
    char id[16];
    std::snprintf(id, sizeof id, "B%03dPHONE", i);
    return id;
}

// What one simulated phone saw, stamped as it happened on the phone's serving thread.
class PhoneLog {
public:
    void onEvent(const phonesim::Listener::Event& event) {
        const auto now = Clock::now();
        std::lock_guard<std::mutex> lock(mutex_);
        if (event.kind == phonesim::Listener::Event::Kind::Accepted) ++accepted_;
        if (event.kind == phonesim::Listener::Event::Kind::Answered && event.tag == 23) answered_ = now;
        if (event.kind == phonesim::Listener::Event::Kind::Request)
            frames_.emplace_back(kesu::phoneFrameTag(event.body).value_or(-1), now);
        changed_.notify_all();
    }
    // When the phone answered the pre-connect request, if it did.
    std::optional<Clock::time_point> answered() {
        std::lock_guard<std::mutex> lock(mutex_);
        return answered_;
    }
    // Whether the phone has taken a link in, waiting up to `timeout` for it.
    bool accepted(std::chrono::milliseconds timeout) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, timeout, [&] { return accepted_ > 0; });
    }
    // When the next frame tagged `tag` arrived (frames before it are dropped); nullopt when
    // none came in time.
    std::optional<Clock::time_point> next(int tag, std::chrono::milliseconds timeout) {
        std::unique_lock<std::mutex> lock(mutex_);
        std::optional<Clock::time_point> at;
        changed_.wait_for(lock, timeout, [&] {
            while (!frames_.empty() && !at) {
                if (frames_.front().first == tag) at = frames_.front().second;
                frames_.pop_front();
            }
            return at.has_value();
        });
        return at;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    int accepted_ = 0;
    std::optional<Clock::time_point> answered_;
    std::deque<std::pair<int, Clock::time_point>> frames_;
};

// The PC's end of the raw baseline: a plain socket that dials the phone and sends every byte
// back as it arrives, on a thread of its own.
class RawEcho {
public:
    RawEcho(const std::string& ip, int port) {
        fd_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in to{};
        to.sin_family = AF_INET;
        to.sin_port = htons(static_cast<std::uint16_t>(port));
        ::inet_pton(AF_INET, ip.c_str(), &to.sin_addr);
        const int one = 1;
        if (fd_ < 0 || ::setsockopt(fd_, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one) != 0 ||
            ::connect(fd_, reinterpret_cast<sockaddr*>(&to), sizeof to) != 0) {
            if (fd_ >= 0) ::close(fd_);
            fd_ = -1;
            return;
        }
        thread_ = std::thread([this] {
            char buffer[4096];
            for (ssize_t n; (n = ::recv(fd_, buffer, sizeof buffer, 0)) > 0;)
                for (ssize_t sent = 0, w; sent < n; sent += w)
                    if ((w = ::send(fd_, buffer + sent, static_cast<std::size_t>(n - sent), MSG_NOSIGNAL)) <= 0) return;
        });
    }
    ~RawEcho() {
        if (fd_ < 0) return;
        ::shutdown(fd_, SHUT_RDWR);  // ends the thread's recv
        thread_.join();
        ::close(fd_);
    }
    bool ok() const { return fd_ >= 0; }

private:
    int fd_ = -1;
    std::thread thread_;
};

void printIdle(const proc::Rates& none, const proc::Rates& held) {
    std::printf("\n1. idle service, %.1f s windows           0 links    20 links     ratio   target\n", held.seconds);
    std::printf("   CPU seconds / s                    %10.5f  %10.5f  %8.2f   within noise of 0 links\n",
                none.cpuPerSecond, held.cpuPerSecond, ratio(held.cpuPerSecond, none.cpuPerSecond));
    std::printf("   RSS MiB                            %10.1f  %10.1f  %8.2f   under 16 MiB\n", none.rssMiB, held.rssMiB,
                ratio(held.rssMiB, none.rssMiB));
    std::printf("   threads                            %10lld  %10lld  %8.2f   the same\n", none.threads, held.threads,
                ratio(static_cast<double>(held.threads), static_cast<double>(none.threads)));
    std::printf("   context switches / s               %10.2f  %10.2f  %8.2f\n", none.switchesPerSecond,
                held.switchesPerSecond, ratio(held.switchesPerSecond, none.switchesPerSecond));
    std::printf("   threads by name with 20 links:");
    for (const auto& [name, count] : held.names) std::printf(" %s x%d;", name.c_str(), count);
    std::printf("\n");
}

struct Phones {
    std::vector<std::unique_ptr<PhoneLog>> logs;
    std::vector<std::unique_ptr<phonesim::Listener>> listeners;
};

int run(const test::NetNsLab::Node& pc, const test::NetNsLab::Node& phone, int seconds, int settle, int trips) {
    // The phones: one listener per address, on the port the service dials.
    const int phonePort = kesu::Config().phoneTcpPort;
    for (int i = 0; i < kPhones; ++i)
        if (!test::NetNsLab::ip("-n " + phone.ns + " addr add " + phoneIp(i) + "/24 dev " + phone.ifname)) {
            std::fprintf(stderr, "could not add %s to the phone namespace\n", phoneIp(i).c_str());
            return 1;
        }
    Phones phones;
    PhoneLog echoLog;
    std::unique_ptr<phonesim::Listener> echoPhone;  // the baseline's phone: answers nothing after [22]
    test::NetNsLab::runIn(phone.ns, [&] {
        for (int i = 0; i < kPhones; ++i) {
            phonesim::Listener::Options options;
            options.host = phoneIp(i);
            options.port = phonePort;
            options.preconnect = phonesim::PreconnectReply{phonesim::PreconnectReply::Mode::Answer, kOpenId, businessId(i), ""};
            auto log = std::make_unique<PhoneLog>();
            auto* sink = log.get();
            phones.listeners.push_back(std::make_unique<phonesim::Listener>(options, [sink](const auto& e) { sink->onEvent(e); }));
            phones.logs.push_back(std::move(log));
        }
        phonesim::Listener::Options options;
        options.host = phone.ip;
        options.preconnect = phonesim::PreconnectReply{};
        options.answer = phonesim::Answer::Silent;
        echoPhone = std::make_unique<phonesim::Listener>(options, [&echoLog](const auto& e) { echoLog.onEvent(e); });
    });
    for (const auto& listener : phones.listeners)
        if (!listener->ok()) {
            std::fprintf(stderr, "a simulated phone could not listen: %s\n", listener->error().c_str());
            return 1;
        }
    if (!echoPhone || !echoPhone->ok()) {
        std::fprintf(stderr, "the baseline's phone could not listen\n");
        return 1;
    }

    // The connect center and the PC suite, at the PC suite's address in the service's namespace.
    SignedInService signedIn(pc.ns, kOpenId);
    if (!signedIn.ok()) {
        std::fprintf(stderr, "%s\n", signedIn.error().c_str());
        return 1;
    }
    BenchService& service = signedIn.service();
    const kesu::Config defaults;
    const pid_t pid = proc::serviceProcess(service.pid());
    std::printf("pre-connect bench: service pid %d, %d phones at %s..%s port %d, windows of %d s after %d s settling\n",
                pid, kPhones, phoneIp(0).c_str(), phoneIp(kPhones - 1).c_str(), phonePort, seconds, settle);
    std::fflush(stdout);

    // 0 links.
    std::this_thread::sleep_for(std::chrono::seconds(settle));
    proc::Usage first = proc::usage(pid);
    std::this_thread::sleep_for(std::chrono::seconds(seconds));
    const proc::Rates none = proc::between(first, proc::usage(pid));

    // The list names the phones; the account written anew has the service fetch it.
    std::vector<CloudPhone> listedPhones;
    for (int i = 0; i < kPhones; ++i) listedPhones.push_back({phoneIp(i), businessId(i)});
    const auto listed = signedIn.list(listedPhones);
    if (!listed) {
        std::fprintf(stderr, "the service did not fetch the device list again\n");
        return 1;
    }

    // Held: the service's log line for each device, stamped when it was printed.
    const std::string marker = SignedInService::heldMarker();
    std::map<std::string, Clock::time_point> held;
    std::size_t from = 0;
    const auto heldBy = Clock::now() + std::chrono::seconds(kPhones * 4 + 30);
    while (static_cast<int>(held.size()) < kPhones && Clock::now() < heldBy) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(heldBy - Clock::now());
        if (!service.process()->waitForOutput(marker, left, from)) break;
        const auto now = Clock::now();
        const std::string out = service.process()->output();
        for (auto at = out.find(marker, from); at != std::string::npos; at = out.find(marker, from)) {
            const auto start = at + marker.size();
            const auto end = out.find_first_of(" \r\n", start);
            if (end == std::string::npos) {  // the line is not whole yet
                service.process()->waitForOutput("\n", 5s, start);
                break;
            }
            held.emplace(out.substr(start, end - start), now);
            from = end;
        }
    }
    std::vector<double> toHeld, toAnswered;
    int linked = 0;
    for (int i = 0; i < kPhones; ++i) {
        const auto at = held.find(kesu::deviceKeyOf(businessId(i)));
        if (at != held.end()) toHeld.push_back(micros(at->second - listed->receivedAt) / 1000.0);
        if (const auto answered = phones.logs[i]->answered()) toAnswered.push_back(micros(*answered - listed->receivedAt) / 1000.0);
        linked += static_cast<int>(phones.listeners[i]->links());
    }
    if (static_cast<int>(toHeld.size()) < kPhones) {
        std::fprintf(stderr, "only %zu of %d phones were held in time (links open: %d)\n", toHeld.size(), kPhones, linked);
        return 1;
    }

    // 20 links.
    std::this_thread::sleep_for(std::chrono::seconds(settle));
    first = proc::usage(pid);
    std::this_thread::sleep_for(std::chrono::seconds(seconds));
    const proc::Rates withLinks = proc::between(first, proc::usage(pid));
    int stillLinked = 0;
    for (const auto& listener : phones.listeners) stillLinked += static_cast<int>(listener->links());

    // Round trips, interleaved: the raw echo's, then a held link's (the phones in turn).
    RawEcho echo(phone.ip, echoPhone->port());
    if (!echo.ok() || !echoLog.accepted(5s)) {
        std::fprintf(stderr, "the raw echo could not dial the baseline's phone\n");
        return 1;
    }
    std::vector<double> raw, ask, result;
    for (int k = 0; k < trips; ++k) {
        auto t0 = Clock::now();
        if (!echoPhone->sendToAll(kAsk)) break;
        const auto back = echoLog.next(24, 5s);
        if (!back) break;
        raw.push_back(micros(*back - t0));

        const int i = k % kPhones;
        t0 = Clock::now();
        if (!phones.listeners[i]->sendToAll(kAsk)) break;
        const auto ack = phones.logs[i]->next(25, 5s);
        const auto outcome = phones.logs[i]->next(27, 5s);
        if (!ack || !outcome) break;
        ask.push_back(micros(*ack - t0));
        result.push_back(micros(*outcome - t0));
    }

    printIdle(none, withLinks);
    std::printf("   links open (phone side): %d after the hand-shakes, %d after the window\n", linked, stillLinked);

    const Spread h = spread(toHeld), a = spread(toAnswered);
    std::printf("\n2. listing (the center's list answered) -> held, ms over %d phones; the scheduler takes one per %lld ms\n",
                kPhones, static_cast<long long>(defaults.preconnectPeriod.count()));
    std::printf("   %-40s first %8.1f  p50 %8.1f  p90 %8.1f  last %8.1f\n", "service log: pre-connect success",
                *std::min_element(toHeld.begin(), toHeld.end()), h.p50, h.p90, h.max);
    if (!toAnswered.empty())
        std::printf("   %-40s first %8.1f  p50 %8.1f  p90 %8.1f  last %8.1f\n", "phone: [22] answered with [23]",
                    *std::min_element(toAnswered.begin(), toAnswered.end()), a.p50, a.p90, a.max);

    const Spread r = spread(raw), q = spread(ask), o = spread(result);
    std::printf("\n3. round trips, us, %zu each (phone sends, waits for the PC's frame)     p50      p90      p99      max\n",
                ask.size());
    std::printf("   %-58s %8.1f %8.1f %8.1f %8.1f\n", "raw TCP echo, same veth (baseline)", r.p50, r.p90, r.p99, r.max);
    std::printf("   %-58s %8.1f %8.1f %8.1f %8.1f\n", "held link [24] -> [25]", q.p50, q.p90, q.p99, q.max);
    std::printf("   %-58s %8.2f %8.2f %8.2f %8.2f\n", "  ratio to the baseline", ratio(q.p50, r.p50), ratio(q.p90, r.p90),
                ratio(q.p99, r.p99), ratio(q.max, r.max));
    std::printf("   %-58s %8.1f %8.1f %8.1f %8.1f\n", "held link [24] -> [27] (PC suite asked over HTTP)", o.p50, o.p90,
                o.p99, o.max);

    if (static_cast<int>(ask.size()) < trips || static_cast<int>(raw.size()) < trips) {
        std::fprintf(stderr, "round trips stopped after %zu raw / %zu held: a frame did not come back in time\n",
                     raw.size(), ask.size());
        return 1;
    }
    if (stillLinked != kPhones) {
        std::fprintf(stderr, "%d of %d links were still open after the window\n", stillLinked, kPhones);
        return 1;
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (::geteuid() != 0) {
        std::printf("preconnect_bench: skipped, it needs root (network namespaces for the service and the phones)\n");
        return 0;
    }
    const int seconds = std::max(1, option(argc, argv, "seconds", 60, 10));
    const int settle = std::max(0, option(argc, argv, "settle", 10, 3));
    const int trips = std::max(1, option(argc, argv, "trips", 300, 50));
    return runInLab("preconnect_bench", {{"pc", 1}, {"phone", 2}},
                    [&](const auto& nodes) { return run(nodes[0], nodes[1], seconds, settle, trips); });
}
