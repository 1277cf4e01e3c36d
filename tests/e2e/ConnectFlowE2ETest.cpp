// Connecting a phone of the account over its held pre-connection (with a fresh connection as
// the fallback), and the pre-connection a push message from the cloud asks for: the real
// service across network namespaces, the account's phones simulated in their own nodes, the
// PC suite and the connect center stand-ins. Needs root and `ip netns`.
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "e2e/E2EFixture.h"

using namespace std::chrono_literals;
using namespace kesu::test;
using nlohmann::json;

namespace {

const std::string kSuccess = "[PreConnectionThread::run] preConnect result is success, id ";
const std::string kAbnormal = "PreConnectionAbnormalNotify, connection appear abnormal id is: ";
// Business ids and the registry keys made of them (the hex of the first four characters).
const std::string kAccepting = "ACC1", kAcceptingKey = "41434331";
const std::string kRejecting = "REJ2", kRejectingKey = "52454a32";
const std::string kBusy = "BSY3", kBusyKey = "42535933";
const std::string kSilent = "SIL4", kSilentKey = "53494c34";
const std::string kGone = "GON6", kGoneKey = "474f4e36";
const std::string kPushed = "PSH5";

json reply(int error, const std::string& message, const std::string& data, const std::string& steps) {
    return {{"error", error}, {"error_message", message}, {"data", data}, {"connection_steps", steps}};
}

// The connection requests ([0]) a phone received, in order.
std::vector<json> connectRequests(ServiceProcess& sim) {
    std::vector<json> requests;
    for (json& body : receivedBodies(sim))
        if (body.is_object() && body.value("bytes", json()) == json::array({0})) requests.push_back(std::move(body));
    return requests;
}

std::size_t linksAccepted(const ServiceProcess& sim) {
    const std::string out = sim.output();
    std::size_t n = 0;
    for (auto at = out.find("SIM TCP_ACCEPTED"); at != std::string::npos; at = out.find("SIM TCP_ACCEPTED", at + 1)) ++n;
    return n;
}

class ConnectFlowE2E : public CloudLabTest {};

// One held phone per answer, one service: the request travels over the held link and the
// phone's answer there makes the reply; a phone silent on its link is connected afresh; an id
// that is not listed, or listed but not held, is not found.
TEST_F(ConnectFlowE2E, HeldPhonesAnswerOverTheirLinkOrAFreshOne) {
    const auto rejecting = addPhone("phone2", 3);
    const auto busy = addPhone("phone3", 4);
    const auto silent = addPhone("phone4", 5);
    listPhones({listed(phone, kAccepting, "2026-12-06 10:00:00.000"), listed(rejecting, kRejecting, "2026-12-06 10:00:01.000"),
                listed(busy, kBusy, "2026-12-06 10:00:02.000"), listed(silent, kSilent, "2026-12-06 10:00:03.000"),
                // Nobody at that address; reported first, so it is tried last.
                listed({"", "", "10.77.0.9"}, kGone, "2026-12-06 09:00:00.000")});
    auto accepts = phoneSim(phone, kAccepting, "answer", {"--held-answer", "accept"});
    auto rejects = phoneSim(rejecting, kRejecting, "answer", {"--held-answer", "reject"});
    auto busies = phoneSim(busy, kBusy, "answer", {"--held-answer", "busy"});
    auto falls = phoneSim(silent, kSilent, "answer", {"--held-answer", "silent", "--answer", "accept"});
    auto service = startService();
    writeAccount(kOpenId, "13912345678");
    for (const std::string& key : {kAcceptingKey, kRejectingKey, kBusyKey, kSilentKey})
        ASSERT_TRUE(service->waitForOutput(kSuccess + key, 20s)) << key << "\n" << service->output();

    for (const std::string& key : {std::string("00000000"), kGoneKey})
        EXPECT_EQ(control(pc.ns, "preconnect_connect", {key, "", "1"}),
                  reply(-10002, "Preconnect device not find", "", "_WFD:-1"))
            << key;

    EXPECT_EQ(control(pc.ns, "preconnect_connect", {kAcceptingKey, "", "1"}),
              reply(0, "", phone.ip, "_WFD:0_WSR:0_WRR:0_WPR:0"))
        << service->output();
    // The phone printed its request before it answered; the output may just be on its way.
    ASSERT_TRUE(accepts->waitForOutput("SIM TCP_ANSWERED 1", 2s)) << accepts->output();
    const auto requests = connectRequests(*accepts);
    ASSERT_EQ(requests.size(), 1u) << accepts->output();
    json request = requests[0];
    for (const char* key : {"deviceName", "channel", "id", "open_Id", "service_id", "target_id", "account", "type"})
        EXPECT_TRUE(request.contains(key)) << key << " missing in " << request;
    EXPECT_EQ(request["open_Id"], kOpenId);
    // A string holding the JSON text.
    EXPECT_EQ(json::parse(request.value("extra_info", ""), nullptr, false), (json{{"isAutoConnect", "1"}})) << request;
    EXPECT_EQ(linksAccepted(*accepts), 1u) << accepts->output();

    EXPECT_EQ(control(pc.ns, "preconnect_connect", {kRejectingKey, "", "0"}),
              reply(-10004, "phone is rejected", "3", "_WFD:0_WSR:0_WRR:0_WPR:-3"))
        << service->output();
    EXPECT_EQ(control(pc.ns, "preconnect_connect", {kBusyKey, "", "0"}),
              reply(-10001, "phone is busy", "", "_WFD:0_WSR:0_WRR:0_WPR:-2"))
        << service->output();

    EXPECT_EQ(control(pc.ns, "preconnect_connect", {kSilentKey, "", "0"}),
              reply(0, "", silent.ip, "_WFD:0_WSR:0_WRR:-1_TF:0_WO:0"))
        << service->output() << falls->output();
    ASSERT_TRUE(falls->waitForOutput("SIM TCP_ANSWERED 1", 2s)) << falls->output();
    const auto tries = connectRequests(*falls);
    ASSERT_EQ(tries.size(), 2u) << falls->output();
    EXPECT_TRUE(tries[0].contains("extra_info")) << tries[0];
    EXPECT_FALSE(tries[1].contains("extra_info")) << tries[1];
    EXPECT_GE(linksAccepted(*falls), 2u) << falls->output();
    // The link that failed to answer is given up.
    EXPECT_TRUE(service->waitForOutput(kAbnormal + kSilentKey, 5s)) << service->output();
}

// A phone asks through the cloud to be pre-connected: the push message makes the service
// pre-connect it at once, though the scheduler had given up on it, and the outcome goes to the
// connect center as the event's report.
TEST_F(ConnectFlowE2E, PushedPreconnectRequestPreconnectsAndReportsTheEvent) {
    auto service = startServiceGivenUpOn(phone, kPushed);
    if (HasFailure()) return;
    auto sim = phoneSim(phone, kPushed, "answer");

    const json notice{{"data",
                       {{"cmd", "MQTT_SUBSCRIBE_MSG_ARRIVED"},
                        {"exdata",
                         {{"type", 4},
                          {"eventId", "ev-1"},
                          {"ext", {{"businessId", kPushed}, {"connectType", "PreConnect"}}}}}}}};
    EXPECT_EQ(control(pc.ns, "kpush", notice), (json{{"error", 0}, {"error_message", "kpush success"}}))
        << service->output();
    EXPECT_TRUE(sim->waitForOutput("SIM TCP_ANSWERED 23", 1s)) << sim->output();
    const auto report =
        center->waitForRequest([](const RecordedRequest& r) { return r.path == "/event/report"; }, 5s);
    ASSERT_TRUE(report) << service->output();
    EXPECT_EQ(report->method, "POST");
    EXPECT_EQ(json::parse(report->body, nullptr, false),
              (json{{"userId", kOpenId},
                    {"ext", {{"eventId", "ev-1"}}},
                    {"eventId", "ev-1"},
                    {"status", 1},
                    {"retCode", 0},
                    {"retMsg", ""}}))
        << report->body;

    EXPECT_EQ(control(pc.ns, "kpush", "not an object"), (json{{"error", -10000}, {"error_message", "kpush data nil"}}));
}

}  // namespace
