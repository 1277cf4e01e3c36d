// The connection of a held (pre-connected) phone against the real binary: the round trip of
// preconnect_connect over the control API, for a phone that accepts at once on its held link,
// next to these, measured in the same run and interleaved:
//  - a raw TCP round trip on the same veth: a frame the size of the connection request out to
//    a simulated phone on a link held open, echoed back by the phone's serving thread (the
//    same code path that answers the request on the held link);
//  - connectSSDP to a discovered phone that accepts at once (a fresh connection), next to a
//    raw exchange on a fresh link (connect, frame out and back, close);
//  - the control API's own round trip (HeartBeat).
// It prints the verdict on the target "preconnect_connect under 2 x raw round trip + one
// HeartBeat", at p50 and p90.
//
//   build-bench/bench/connectflow_bench [--trips=N]   (300; KESU_BENCH_QUICK=1: 40)
// Needs root (it exits 0 with a note otherwise). The service runs signed in, in a network
// namespace; a stand-in HTTP server beside it plays the connect center, whose device list
// names the held phone, and the PC suite. The phones live in the peer namespace: the held one
// on an extra address, the discovered one and the echoing one on the node's own address.
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "BenchSupport.h"
#include "connect/PhoneFrame.h"
#include "core/Config.h"
#include "phonesim/PhoneSimulator.h"
#include "preconnect/FarawayDevice.h"

namespace {

using namespace kesu::bench;
using namespace std::chrono_literals;
using kesu::Json;
namespace phonesim = kesu::phonesim;
namespace test = kesu::test;

const std::string kOpenId = "bench0openid0000000000000000002";
const std::string kHeldBusinessId = "CFLOWPHONE";
const std::string kDiscoveredId = "CONNECTFLOW-BENCH";
constexpr int kEchoPort = 10192;
// A discovered phone is dropped 30 s after its last announcement.
constexpr auto kReannounce = 10s;

// The same /24 as `ip`, host `host`.
std::string sameSubnet(const std::string& ip, int host) { return ip.substr(0, ip.rfind('.') + 1) + std::to_string(host); }

// A frame the size of the connection request the service sends on a held link.
kesu::Bytes requestSizedFrame() {
    return kesu::buildPhoneFrameFromJson(Json{{"bytes", {0}},
                                              {"deviceName", "bench-pc"},
                                              {"channel", 0},
                                              {"id", 87654321},
                                              {"open_Id", kOpenId},
                                              {"service_id", "com.kesu.pcsuite.SERVICE"},
                                              {"target_id", "02:42:ac:11:00:02"},
                                              {"account", "138****5678"},
                                              {"type", 1},
                                              {"extra_info", R"({"isAutoConnect":""})"}});
}

void row(const char* what, const std::vector<double>& v) {
    const Spread s = spread(v);
    std::printf("   %-58s %9.1f %9.1f %9.1f %9.1f\n", what, s.p50, s.p90, s.p99, s.max);
}

void ratioRow(const char* what, const std::vector<double>& a, const std::vector<double>& b) {
    const Spread x = spread(a), y = spread(b);
    std::printf("   %-58s %8.2fx %8.2fx %8.2fx %8.2fx\n", what, ratio(x.p50, y.p50), ratio(x.p90, y.p90),
                ratio(x.p99, y.p99), ratio(x.max, y.max));
}

// `judged` is false when some connections did not go over the held link: their times say
// nothing about it.
void verdict(const char* at, double connect, double raw, double heartbeat, bool judged) {
    const double target = 2 * raw + heartbeat;
    std::printf("verdict (%s): preconnect_connect %.1f us %s target 2 x raw %.1f us + HeartBeat %.1f us = %.1f us "
                "(%.2fx the target): %s\n",
                at, connect, connect < target ? "<" : ">=", raw, heartbeat, target, ratio(connect, target),
                !judged ? "NOT JUDGED, not every connection went over the held link" : connect < target ? "MET" : "MISSED");
}

// What the service answered a connection request: whether it connected, and whether over the
// held link (the fallback to a fresh connection reports its own steps).
struct Outcome {
    int connected = 0, overHeldLink = 0, failed = 0;
    std::string firstFailure;
    void add(const std::optional<std::string>& answer, const char* fastPathSteps) {
        const auto reply = answer ? controlAnswerJson(*answer) : std::nullopt;
        if (!reply || !reply->is_object() || !reply->contains("error") || !(*reply)["error"].is_number() ||
            kesu::json::integer(*reply, "error") != 0) {
            ++failed;
            if (firstFailure.empty()) firstFailure = answer ? *answer : "(no answer)";
            return;
        }
        ++connected;
        if (fastPathSteps && kesu::json::str(*reply, "connection_steps").find(fastPathSteps) != std::string::npos)
            ++overHeldLink;
    }
};

int run(const test::NetNsLab::Node& pc, const test::NetNsLab::Node& phoneNode, int trips) {
    const int phonePort = kesu::Config().phoneTcpPort;
    const std::string heldIp = sameSubnet(phoneNode.ip, 101);
    if (!test::NetNsLab::ip("-n " + phoneNode.ns + " addr add " + heldIp + "/24 dev " + phoneNode.ifname)) {
        std::fprintf(stderr, "could not add %s to the phone namespace\n", heldIp.c_str());
        return 1;
    }
    std::unique_ptr<phonesim::Listener> held, discovered, echo;
    std::unique_ptr<phonesim::Announcer> announcer;
    test::NetNsLab::runIn(phoneNode.ns, [&] {
        phonesim::Listener::Options options;
        options.host = heldIp;
        options.port = phonePort;
        options.preconnect = phonesim::PreconnectReply{phonesim::PreconnectReply::Mode::Answer, kOpenId, kHeldBusinessId, ""};
        options.heldAnswer = phonesim::Answer::Accept;
        held = std::make_unique<phonesim::Listener>(options);

        // The echoing phone: on a held link it sends back every request, on a fresh one its first.
        options.host = phoneNode.ip;
        options.port = kEchoPort;
        options.answer = phonesim::Answer::Echo;
        options.heldAnswer = phonesim::Answer::Echo;
        options.maxLinks = 64;
        echo = std::make_unique<phonesim::Listener>(options);

        phonesim::Listener::Options fresh;
        fresh.host = phoneNode.ip;
        fresh.port = phonePort;
        fresh.maxLinks = 64;
        discovered = std::make_unique<phonesim::Listener>(fresh);
        announcer = std::make_unique<phonesim::Announcer>(phoneNode.ip, false);
    });
    for (const auto* listener : {held.get(), echo.get(), discovered.get()})
        if (!listener || !listener->ok()) {
            std::fprintf(stderr, "a simulated phone could not listen: %s\n", listener ? listener->error().c_str() : "");
            return 1;
        }
    if (!announcer || !announcer->ok()) {
        std::fprintf(stderr, "the discovered phone cannot announce itself: %s\n", announcer ? announcer->error().c_str() : "");
        return 1;
    }

    SignedInService signedIn(pc.ns, kOpenId);
    if (!signedIn.ok()) {
        std::fprintf(stderr, "%s\n", signedIn.error().c_str());
        return 1;
    }
    BenchService& service = signedIn.service();

    // The held phone: listed by the cloud, then pre-connected by the service.
    const std::string deviceKey = kesu::deviceKeyOf(kHeldBusinessId);
    const auto heldFrom = Clock::now();
    if (!signedIn.list({{heldIp, kHeldBusinessId}}) ||
        !service.process()->waitForOutput(SignedInService::heldMarker(deviceKey), 30s)) {
        std::fprintf(stderr, "the listed phone %s (%s) was not held in time\n", deviceKey.c_str(), heldIp.c_str());
        return 1;
    }
    const double heldAfterMs = micros(Clock::now() - heldFrom) / 1000.0;

    // The raw baseline's link, held open like the pre-connection: pre-connected the same way.
    std::string error, body;
    auto rawLink = phonesim::Link::dial(phoneNode.ip, kEchoPort, error);
    if (!rawLink || !rawLink->sendFrame(R"({"bytes":[22]})") || rawLink->read(body, 5s) != phonesim::Link::Got::Frame) {
        std::fprintf(stderr, "the raw baseline's link could not be opened: %s\n", error.c_str());
        return 1;
    }

    // The discovered phone.
    phonesim::Identity identity;
    identity.id = kDiscoveredId;
    const auto announce = [&] {
        if (const std::string why = announcer->announce(identity, false); !why.empty())
            std::fprintf(stderr, "announcement not sent: %s\n", why.c_str());
    };
    if (!announceUntilListed(service, announce, kDiscoveredId, 5s).listed) return 1;
    auto announcedAt = Clock::now();

    std::printf("connect-flow bench: held phone %s (key %s, held %.0f ms after the list was asked for), "
                "discovered phone %s, %d trips each\n",
                heldIp.c_str(), deviceKey.c_str(), heldAfterMs, phoneNode.ip.c_str(), trips);
    std::fflush(stdout);

    const std::string connectHeld = controlBody("preconnect_connect", Json::array({deviceKey, "", "0"}));
    const std::string connectDiscovered =
        controlBody("connectSSDP", Json::array({kesu::SsdpMessage::deviceIdentifier(kDiscoveredId)}));
    const std::string heartbeat = controlBody("HeartBeat");
    const kesu::Bytes frame = requestSizedFrame();

    std::vector<double> overHeld, rawHeld, overFresh, rawFresh, beats;
    Outcome heldOutcome, freshOutcome;
    int rawLost = 0;
    for (int k = 0; k < trips; ++k) {
        auto t0 = Clock::now();
        const auto heldAnswer = service.control(connectHeld);
        overHeld.push_back(micros(Clock::now() - t0));
        heldOutcome.add(heldAnswer, "_WPR:0");

        t0 = Clock::now();
        if (!rawLink->send(frame) || rawLink->read(body, 5s) != phonesim::Link::Got::Frame) ++rawLost;
        rawHeld.push_back(micros(Clock::now() - t0));

        if (Clock::now() - announcedAt > kReannounce) {
            announceUntilListed(service, announce, kDiscoveredId, 5s);
            announcedAt = Clock::now();
        }
        t0 = Clock::now();
        const auto freshAnswer = service.control(connectDiscovered);
        overFresh.push_back(micros(Clock::now() - t0));
        freshOutcome.add(freshAnswer, nullptr);

        t0 = Clock::now();
        if (auto link = phonesim::Link::dial(phoneNode.ip, kEchoPort, error); !link || !link->send(frame) ||
                                                                             link->read(body, 5s) != phonesim::Link::Got::Frame)
            ++rawLost;
        rawFresh.push_back(micros(Clock::now() - t0));

        t0 = Clock::now();
        if (!service.control(heartbeat)) ++rawLost;
        beats.push_back(micros(Clock::now() - t0));
    }
    const std::size_t stillHeld = held->links();

    std::printf("\nround trips, us, %d each, interleaved                              p50       p90       p99       max\n",
                trips);
    row("preconnect_connect (held phone accepts at once)", overHeld);
    row("raw TCP round trip on a held link, same veth (baseline)", rawHeld);
    row("connectSSDP (discovered phone accepts at once)", overFresh);
    row("raw TCP on a fresh link: connect + frame back + close", rawFresh);
    row("HeartBeat (control API floor)", beats);
    ratioRow("ratio preconnect_connect / raw held round trip", overHeld, rawHeld);
    ratioRow("ratio preconnect_connect / HeartBeat", overHeld, beats);
    ratioRow("ratio preconnect_connect / connectSSDP", overHeld, overFresh);
    ratioRow("ratio connectSSDP / raw fresh exchange", overFresh, rawFresh);
    std::printf("preconnect_connect: %d connected (%d over the held link), %d failed; held links open after: %zu\n",
                heldOutcome.connected, heldOutcome.overHeldLink, heldOutcome.failed, stillHeld);
    std::printf("connectSSDP: %d connected, %d failed; raw round trips or HeartBeats lost: %d\n", freshOutcome.connected,
                freshOutcome.failed, rawLost);
    if (!heldOutcome.firstFailure.empty())
        std::printf("first failed preconnect_connect answer: %s\n", heldOutcome.firstFailure.c_str());
    if (!freshOutcome.firstFailure.empty())
        std::printf("first failed connectSSDP answer: %s\n", freshOutcome.firstFailure.c_str());

    const bool judged = heldOutcome.overHeldLink == trips;
    const Spread c = spread(overHeld), r = spread(rawHeld), h = spread(beats);
    verdict("p50", c.p50, r.p50, h.p50, judged);
    verdict("p90", c.p90, r.p90, h.p90, judged);
    return judged && freshOutcome.connected == trips && rawLost == 0 ? 0 : 2;
}

}  // namespace

int main(int argc, char** argv) {
    if (::geteuid() != 0) {
        std::printf("connectflow_bench: skipped, it needs root (network namespaces for the service and the phones)\n");
        return 0;
    }
    const int trips = std::max(1, option(argc, argv, "trips", 300, 40));
    return runInLab("connectflow_bench", {{"pc", 1}, {"phone", 2}},
                    [&](const auto& nodes) { return run(nodes[0], nodes[1], trips); });
}
