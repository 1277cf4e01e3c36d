// Pre-connection against the real service across network namespaces: the account's device
// list comes from a stand-in connect center, the listed phones are simulated in their own
// nodes, and the PC suite is a stand-in too. Needs root and `ip netns`.
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <nlohmann/json.hpp>

#include "e2e/E2EFixture.h"

using namespace std::chrono_literals;
using namespace kesu::test;
using nlohmann::json;

namespace {

// The registry's key of a phone: the hex of the first four characters of its business id.
const std::string kAnswering = "PHA1", kAnsweringKey = "50484131";
const std::string kSilent = "SIL3", kSilentKey = "53494c33";
const std::string kStranger = "STR4", kStrangerKey = "53545234";
const std::string kSuccess = "[PreConnectionThread::run] preConnect result is success, id ";
const std::string kFailed = "[PreConnectionThread::run] preConnect result is failed, id ";
const std::string kAbnormal = "PreConnectionAbnormalNotify, connection appear abnormal id is: ";

std::size_t count(const std::string& text, const std::string& what) {
    std::size_t n = 0;
    for (auto at = text.find(what); at != std::string::npos; at = text.find(what, at + what.size())) ++n;
    return n;
}

// The entry of `key` in a preconnect_startScan answer (null when it is not listed).
json scanned(const json& scan, const std::string& key) {
    if (!scan.is_object() || !scan.contains("data")) return nullptr;
    for (const json& device : scan["data"])
        if (device.value("id", "") == key) return device;
    return nullptr;
}

class PreconnectE2E : public CloudLabTest {
protected:
    // The center got this PC's report, sent before the device list was asked for.
    void expectReportedBeforeList();
};

void PreconnectE2E::expectReportedBeforeList() {
    const auto requests = center->requests();
    const auto at = [&](const std::string& path) {
        return std::find_if(requests.begin(), requests.end(), [&](const RecordedRequest& r) { return r.path == path; });
    };
    const auto report = at("/device/report");
    ASSERT_NE(report, requests.end());
    EXPECT_LT(report, at("/device/list"));
    EXPECT_EQ(report->method, "POST");
    const json body = json::parse(report->body, nullptr, false);
    ASSERT_TRUE(body.is_array() && body.size() == 1 && body[0].is_object()) << report->body;
    json pcReport = body[0];
    EXPECT_EQ(pcReport["userId"], kOpenId);
    EXPECT_EQ(pcReport["deviceId"], "PC-E2E");
    EXPECT_EQ(pcReport["type"], 3);
    EXPECT_EQ(pcReport["ext"], (json{{"pc_pcsuite_version", "1.0"}}));
    // The phones find the PC by its business id and its addresses.
    EXPECT_FALSE(pcReport.value("bluetooth", "").empty()) << pcReport;
    EXPECT_EQ(pcReport["bizInfo"], (json{{"office_suite", {{"businessId", pcReport["bluetooth"]}}}}));
    const json& inets = pcReport["inets"];
    EXPECT_TRUE(inets.is_array() && std::any_of(inets.begin(), inets.end(), [&](const json& inet) {
                    return inet.value("inet", "") == pc.ip && inet.value("localInet", "") == pc.ip &&
                           inet.value("netmark", "") == "255.255.255.0";
                }))
        << pcReport;
}

// Signing in reports the PC to the connect center and fetches the account's list; its phone
// is pre-connected, the scan shows it held, and when the phone asks to be connected it is
// acknowledged, the PC suite is asked to connect it, and the outcome goes back to the phone.
TEST_F(PreconnectE2E, SignInPreconnectsTheListedPhoneWhichThenAsksToBeConnected) {
    listPhones({listed(phone, kAnswering, "2026-12-06 10:00:00.000")});
    auto sim = phoneSim(phone, kAnswering, "answer", {"--ask-connect-after", "15"});
    auto service = startService();
    writeAccount(kOpenId, "13912345678", "tok-e2e");

    const auto list = center->waitForRequest([](const RecordedRequest& r) { return r.path == "/device/list"; }, 15s);
    ASSERT_TRUE(list) << service->output();
    expectReportedBeforeList();
    EXPECT_EQ(list->method, "GET");
    EXPECT_EQ(list->header("userId"), kOpenId);
    EXPECT_EQ(list->header("token"), "tok-e2e");
    EXPECT_EQ(list->header("deviceId"), "PC-E2E");

    ASSERT_TRUE(service->waitForOutput(kSuccess + kAnsweringKey, 10s)) << service->output() << sim->output();
    const auto asked = receivedBodies(*sim, 1);
    ASSERT_FALSE(asked.empty());
    EXPECT_EQ(asked[0]["bytes"], json::array({22})) << asked[0];
    EXPECT_EQ(asked[0]["open_Id"], kOpenId);

    const json device = scanned(control(pc.ns, "preconnect_startScan"), kAnsweringKey);
    ASSERT_TRUE(device.is_object()) << service->output();
    EXPECT_EQ(device["isConnected"], true) << device;
    EXPECT_EQ(device["connectType"], "FARAWAYWLAN");
    EXPECT_EQ(device["discoveryType"], "faraway");
    EXPECT_EQ(device["openId"], kOpenId);

    ASSERT_TRUE(sim->waitForOutput("SIM PRECONNECT_ASKED", 20s)) << sim->output();
    const auto connect = pcsuite->waitForRequest([](const RecordedRequest& r) { return r.path == "/connectDevice"; }, 10s);
    ASSERT_TRUE(connect) << service->output();
    EXPECT_EQ(json::parse(connect->body, nullptr, false),
              (json{{"requestSource", "preconnect"}, {"eventId", "12345678"}, {"deviceId", kAnsweringKey}}))
        << connect->body;

    ASSERT_TRUE(sim->waitForOutput("\"bytes\":[27]", 10s)) << sim->output() << service->output();
    const auto bodies = receivedBodies(*sim, 3);
    ASSERT_EQ(bodies.size(), 3u) << sim->output();
    EXPECT_EQ(bodies[1]["bytes"], json::array({25})) << bodies[1];
    EXPECT_EQ(bodies[2]["bytes"], json::array({27})) << bodies[2];
    EXPECT_EQ(json::parse(bodies[2].value("extra_info", ""), nullptr, false),
              (json{{"retCode", 0}, {"retMsg", "connected"}}))
        << bodies[2];
}

// The PC suite signs in through the control API: the PC is reported, then the list is
// fetched with the account it gave.
TEST_F(PreconnectE2E, AccountChangeRequestReportsThePcAndFetchesTheList) {
    listPhones({});
    auto service = startService();
    EXPECT_EQ(control(pc.ns, "accountChange", {kOpenId, "tok-ac", "13912345678", home + "/store"}),
              (json{{"error", 0}, {"error_message", "accountChange request success"}}));
    const auto list = center->waitForRequest([](const RecordedRequest& r) { return r.path == "/device/list"; }, 10s);
    ASSERT_TRUE(list) << service->output();
    EXPECT_EQ(list->header("userId"), kOpenId);
    EXPECT_EQ(list->header("token"), "tok-ac");
    expectReportedBeforeList();
}

// A service that starts signed in (after a reboot, say) fetches the list and pre-connects
// without waiting for the next account or network event.
TEST_F(PreconnectE2E, StartingSignedInPreconnectsWithoutAnotherEvent) {
    listPhones({listed(phone, kAnswering, "2026-12-06 10:00:00.000")});
    auto sim = phoneSim(phone, kAnswering, "answer");
    writeAccount(kOpenId, "13912345678");
    auto service = startService();
    ASSERT_TRUE(service->waitForOutput(kSuccess + kAnsweringKey, 15s)) << service->output() << sim->output();
}

// A phone that drops its link is torn down and reported, then held again while it listens;
// once it is gone for good the scan shows it listed but not held.
TEST_F(PreconnectE2E, DroppedLinkIsTornDownAndTakenUpAgain) {
    listPhones({listed(phone, kAnswering, "2026-12-06 10:00:00.000")});
    auto sim = phoneSim(phone, kAnswering, "answer", {"--close-after", "8"});
    auto service = startService();
    writeAccount(kOpenId, "13912345678");

    ASSERT_TRUE(service->waitForOutput(kSuccess + kAnsweringKey, 15s)) << service->output() << sim->output();
    ASSERT_TRUE(sim->waitForOutput("SIM LINKS_CLOSED", 15s)) << sim->output();
    ASSERT_TRUE(service->waitForOutput(kAbnormal + kAnsweringKey, 10s)) << service->output();
    const auto closedAt = sim->output().find("SIM LINKS_CLOSED");
    EXPECT_TRUE(sim->waitForOutput("SIM TCP_ANSWERED 23", 10s, closedAt)) << sim->output() << service->output();
    ASSERT_TRUE(service->waitForOutput(kSuccess + kAnsweringKey, 10s, service->output().find(kAbnormal)));

    const auto before = service->output().size();
    sim->stop(SIGTERM, 5s);
    ASSERT_TRUE(service->waitForOutput(kAbnormal + kAnsweringKey, 10s, before)) << service->output();
    const json device = scanned(control(pc.ns, "preconnect_startScan"), kAnsweringKey);
    ASSERT_TRUE(device.is_object()) << service->output();
    EXPECT_EQ(device["isConnected"], false) << device;
}

// Listed phones that never answer, or answer for another account, are tried at most twice
// and then left alone, while the other listed phone is held.
TEST_F(PreconnectE2E, RefusingPhonesAreGivenUpAfterTwoTriesWhileAnotherIsHeld) {
    const auto quiet = addPhone("phone2", 3);
    const auto other = addPhone("phone3", 4);
    // The refusing phones reported last, so they are tried first.
    listPhones({listed(phone, kAnswering, "2026-12-06 10:00:00.000"), listed(quiet, kSilent, "2026-12-06 11:00:00.000"),
                listed(other, kStranger, "2026-12-06 12:00:00.000")});
    auto answering = phoneSim(phone, kAnswering, "answer");
    auto silent = phoneSim(quiet, kSilent, "silent");
    auto stranger = phoneSim(other, kStranger, "answer", {"--openid", "another-open"});
    auto service = startService();
    writeAccount(kOpenId, "13912345678");

    ASSERT_TRUE(service->waitForOutput(kSuccess + kAnsweringKey, 20s)) << service->output();
    ASSERT_TRUE(service->waitForOutput(kFailed + kSilentKey, 20s)) << service->output();
    ASSERT_TRUE(service->waitForOutput(kFailed + kSilentKey, 20s, service->output().find(kFailed + kSilentKey) + 1))
        << service->output();
    EXPECT_TRUE(service->waitForOutput("mobile device openId is different of PC", 1s)) << service->output();
    // A third try would follow the scheduler's next tick.
    const auto silentTried = silent->output().size();
    const auto strangerTried = stranger->output().size();
    EXPECT_FALSE(silent->waitForOutput("SIM TCP_REQUEST", 5s, silentTried)) << silent->output();
    EXPECT_FALSE(stranger->waitForOutput("SIM TCP_REQUEST", 1s, strangerTried)) << stranger->output();
    EXPECT_EQ(count(silent->output(), "SIM TCP_REQUEST"), 2u) << silent->output();
    const auto strangerTries = count(stranger->output(), "SIM TCP_REQUEST");
    EXPECT_GE(strangerTries, 1u);
    EXPECT_LE(strangerTries, 2u) << stranger->output();
    EXPECT_EQ(count(answering->output(), "SIM TCP_ANSWERED 23"), 1u) << answering->output();
}

// The user picks a listed phone the scheduler had given up on: the request waits for the
// pre-connection and answers success; a held phone and an unlisted id answer at once.
TEST_F(PreconnectE2E, UserPickWaitsForThePreconnection) {
    auto service = startServiceGivenUpOn(phone, kAnswering);
    if (HasFailure()) return;

    auto sim = phoneSim(phone, kAnswering, "answer");
    EXPECT_EQ(control(pc.ns, "preconnect_preconnect", {kAnsweringKey}),
              (json{{"error", 0}, {"error_message", "Preconnect_preconnect success"}}))
        << service->output();
    EXPECT_TRUE(sim->waitForOutput("SIM TCP_ANSWERED 23", 1s)) << sim->output();
    EXPECT_EQ(control(pc.ns, "preconnect_preconnect", {kAnsweringKey}),
              (json{{"error", 0}, {"error_message", "This device is already preconnect"}}));
    const json unknown = control(pc.ns, "preconnect_preconnect", {"00000000"});
    EXPECT_NE(unknown["error"], 0) << unknown;
    EXPECT_EQ(unknown["error_message"], "Preconnect_preconnect device not found");
}

}  // namespace
