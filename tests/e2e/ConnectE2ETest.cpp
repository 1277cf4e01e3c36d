// Connections with phones across network namespaces, against the real service: the PC asks
// a discovered phone (connectSSDP), and phones ask the PC (the server on 10191), with
// stand-ins for the allow window and the PC suite. Needs root and `ip netns`.
#include <gtest/gtest.h>

#include <future>

#include <map>
#include <nlohmann/json.hpp>
#include <regex>

#include "e2e/E2EFixture.h"

using namespace std::chrono_literals;
using namespace kesu::test;
using nlohmann::json;

namespace {

const std::string kConnectStatus =
    "/Applications/pcsuite.app/Contents/Resources/ConnectStatus/ConnectStatus.app/Contents/MacOS/ConnectStatus";
const std::string kPcsuiteProgram = "/Applications/pcsuite.app/Contents/MacOS/pcsuite";
// Shell text for the allow-window stand-in: the user presses "agree" (auto-connect on).
const std::string kPressAgree =
    "body='{\"event\":\"QtAgree\",\"args\":[\"true\"]}'\n"
    "curl -s -m 5 --data-binary \"${#body}#$body\" http://127.0.0.1:9197/ >/dev/null\n";

// The first body the phone printed after `marker`, once its whole line is there.
json bodyOf(ServiceProcess& sim, const std::string& marker) {
    const auto bodies = printedBodies(sim, marker, 1);
    return bodies.empty() ? json() : bodies.front();
}

class ConnectE2E : public LabTest {
protected:
    // A phone that announces itself every second and answers a PC's request with `answer`;
    // returns once the service has it in its table.
    std::unique_ptr<ServiceProcess> answeringPhone(const NetNsLab::Node& node, const std::string& id,
                                                   const std::string& answer, ServiceProcess& service) {
        auto sim = startSimulator(node.ns, {"--iface-ip", node.ip, "--announce-every", "1", "--tcp-port", "10191",
                                            "--answer", answer, "--id", id, "--duration", "90"});
        EXPECT_TRUE(sim->waitForOutput("SIM READY", 5s)) << sim->output();
        EXPECT_TRUE(service.waitForOutput("Insert ssdp device, deviceId: " + hexId(id), 10s)) << service.output();
        return sim;
    }
    // A phone that asks the PC to connect (`more` adds simulator flags).
    std::unique_ptr<ServiceProcess> askingPhone(const NetNsLab::Node& node, std::vector<std::string> more = {}) {
        std::vector<std::string> args{"--connect", pc.ip + ":10191", "--duration", "40", "--name", "kesu Sim Phone",
                                      "--id", "SIMPHONE01", "--account", "13800000000", "--openid", "same-open"};
        args.insert(args.end(), more.begin(), more.end());
        return startSimulator(node.ns, args);
    }
    // The table's id of a phone: the hex of the first four characters it announces.
    static std::string hexId(const std::string& id) {
        static const std::map<std::string, std::string> known{
            {"ACC1", "41434331"}, {"REJ1", "52454a31"}, {"BSY1", "42535931"}, {"SIL1", "53494c31"}};
        return known.at(id);
    }
};

TEST_F(ConnectE2E, PhoneAnswersShapeTheConnectReply) {
    writeAccount("pc-open", "13912345678");
    auto service = startService();
    const auto rejecting = addPhone("phone2", 3);
    const auto busy = addPhone("n1", 4);
    auto acceptSim = answeringPhone(phone, "ACC1", "accept", *service);
    auto rejectSim = answeringPhone(rejecting, "REJ1", "reject", *service);
    auto busySim = answeringPhone(busy, "BSY1", "busy", *service);

    EXPECT_EQ(control(pc.ns, "connectSSDP", {hexId("ACC1")}),
              (json{{"error", 0}, {"error_message", ""}, {"connection_steps", "_WI:0_WF:0_TF:0_WO:0"},
                    {"data", phone.ip}}));
    EXPECT_EQ(control(pc.ns, "connectSSDP", {hexId("REJ1")}),
              (json{{"error", -10004}, {"error_message", "[SSDP search] phone reject the connect."},
                    {"connection_steps", "_WI:0_WF:0_TF:0_WO:-3"}}));
    EXPECT_EQ(control(pc.ns, "connectSSDP", {hexId("BSY1")}),
              (json{{"error", -10001}, {"error_message", "[SSDP search] phone is busy."},
                    {"connection_steps", "_WI:0_WF:0_TF:0_WO:-2"}}));
    EXPECT_EQ(control(pc.ns, "connectSSDP", {"00000000"}),
              (json{{"error", -10002}, {"error_message", ""},
                    {"errir_message", "[ActiveConnect] address_ 00000000 find ssdp device error not find"},
                    {"connection_steps", "_WI:0_WF:-1"}}));

    // What the phone was asked carries the signed-in account (the request's exact members are
    // checked on the wire in ActiveConnectTest).
    const json request = bodyOf(*acceptSim, "SIM TCP_REQUEST ");
    ASSERT_TRUE(request.is_object()) << acceptSim->output();
    EXPECT_EQ(request["open_Id"], "pc-open");
    EXPECT_EQ(request["account"], "139****678");
}

// A phone that never answers: the reply comes at the 30 s deadline, and meanwhile a second
// attempt is refused at once instead of being mixed into the first.
TEST_F(ConnectE2E, SilentPhoneTimesOutAndASecondAttemptIsBusy) {
    auto service = startService();
    auto sim = answeringPhone(phone, "SIL1", "silent", *service);

    auto waiting = std::async(std::launch::async, [&] { return control(pc.ns, "connectSSDP", {hexId("SIL1")}); });
    ASSERT_TRUE(sim->waitForOutput("SIM TCP_REQUEST", 10s)) << sim->output();
    const json second = control(pc.ns, "connectSSDP", {hexId("SIL1")});
    const json first = waiting.get();

    EXPECT_EQ(second["error"], -10001) << second;
    EXPECT_EQ(second["connection_steps"], "_WI:-1") << second;
    EXPECT_EQ(first, (json{{"error", -10007},
                           {"error_message", "[SSDP search] connect timeout or phone wake up pcsuite failed."},
                           {"connection_steps", "_WI:0_WF:0_TF:0_WO:-1"}}));
}

// A phone asks; the allow window's user agrees; the phone hears [3] and the PC suite gets the
// phone's details on the PC's own address of that link.
TEST_F(ConnectE2E, PhoneRequestAgreedInTheAllowWindow) {
    writeAccount("same-open", "13912345678");
    auto pcsuite = startPcSuite();
    installProgram(kConnectStatus, "ConnectStatus", kPressAgree);
    auto service = startService();
    auto sim = askingPhone(phone);

    EXPECT_EQ(waitForLaunch("ConnectStatus", 10s),
              (std::vector<std::string>{"1", "kesu Sim Phone", "53494d50", "138****000", "1", "phone"}));
    ASSERT_TRUE(sim->waitForOutput("SIM TCP_ANSWER", 10s)) << sim->output() << service->output();
    const json answer = bodyOf(*sim, "SIM TCP_ANSWER ");
    EXPECT_EQ(answer["bytes"], json::array({3})) << answer;
    EXPECT_EQ(answer["type"], "1");
    EXPECT_EQ(answer["service_id"], "com.kesu.pcsuite.SERVICE");

    const auto told = pcsuite->waitForRequest(
        [](const RecordedRequest& r) { return r.body.find("nfcConection") != std::string::npos; }, 10s);
    ASSERT_TRUE(told) << service->output();
    const auto hash = told->body.find('#');
    ASSERT_NE(hash, std::string::npos) << told->body;
    const json event = json::parse(told->body.substr(hash + 1), nullptr, false);
    ASSERT_TRUE(event.is_object()) << told->body;
    EXPECT_EQ(event["event"], "nfcConection");
    const json args = event["args"];
    ASSERT_EQ(args.size(), 9u) << event;
    EXPECT_TRUE(std::regex_match(args[4].get<std::string>(), std::regex("[0-9]+"))) << args;
    EXPECT_EQ(args, (json{phone.ip, "kesu Sim Phone", "WLAN", "53494d50", args[4], "true", "138****000", "phone",
                          "1"}));
}

// Nobody answers the allow window: the phone is refused ([4]) when the 15 s wait ends, and
// phones asking meanwhile hear busy: [11] for the same kind of device, [12] for another.
TEST_F(ConnectE2E, UnansweredWindowRefusesAndOthersHearBusy) {
    writeAccount("same-open", "13912345678");
    auto pcsuite = startPcSuite();
    installProgram(kConnectStatus, "ConnectStatus");
    auto service = startService();
    const auto second = addPhone("phone2", 3);
    const auto started = std::chrono::steady_clock::now();
    auto first = askingPhone(phone);
    ASSERT_TRUE(waitForLaunch("ConnectStatus", 10s));

    auto samePhone = askingPhone(second, {"--id", "OTHER1"});
    auto pad = askingPhone(second, {"--id", "PAD1", "--type", "pad"});
    ASSERT_TRUE(samePhone->waitForOutput("SIM TCP_ANSWER", 10s)) << samePhone->output();
    ASSERT_TRUE(pad->waitForOutput("SIM TCP_ANSWER", 10s)) << pad->output();
    EXPECT_EQ(bodyOf(*samePhone, "SIM TCP_ANSWER ")["bytes"], json::array({11}));
    EXPECT_EQ(bodyOf(*pad, "SIM TCP_ANSWER ")["bytes"], json::array({12}));

    ASSERT_TRUE(first->waitForOutput("SIM TCP_ANSWER", 25s)) << first->output();
    EXPECT_GE(std::chrono::steady_clock::now() - started, 15s) << "refused before the window's time-out";
    EXPECT_EQ(bodyOf(*first, "SIM TCP_ANSWER ")["bytes"], json::array({4}));
    EXPECT_TRUE(pcsuite->requestsTo("/").empty()) << "a refused phone must not reach the PC suite";
}

// The sharing application's requests need no PC suite window: agreed at once, and the share
// window is launched with the phone's address and the receive folder.
TEST_F(ConnectE2E, SharingRequestOpensTheShareWindow) {
    writeAccount("same-open", "13912345678");
    installProgram(kConnectStatus, "ConnectStatus");
    auto service = startService();
    auto sim = askingPhone(phone, {"--service", "com.kesu.share.CONNECT_PC"});

    ASSERT_TRUE(sim->waitForOutput("SIM TCP_ANSWER", 10s)) << sim->output();
    const json answer = bodyOf(*sim, "SIM TCP_ANSWER ");
    EXPECT_EQ(answer["bytes"], json::array({3}));
    EXPECT_EQ(answer["service_id"], "com.kesu.share.CONNECT_PC");
    const auto args = waitForLaunch("ConnectStatus", 10s);
    ASSERT_TRUE(args);
    ASSERT_EQ(args->size(), 8u);
    const std::string folder = root + "/Users/recvFile";  // the account names no folder of its own
    EXPECT_EQ(*args, (std::vector<std::string>{"2", "kesu Sim Phone", "53494d50", phone.ip + ":10191", "1", folder,
                                               (*args)[6], folder}));
}

// When the PC suite does not take the phone's details, the service launches it with them.
TEST_F(ConnectE2E, UnreachablePcSuiteIsLaunchedWithThePhone) {
    writeAccount("pc-open", "13912345678");
    installProgram(kConnectStatus, "ConnectStatus", kPressAgree);
    installProgram(kPcsuiteProgram, "pcsuite");
    auto service = startService();
    auto sim = askingPhone(phone);

    const auto args = waitForLaunch("pcsuite", 20s);
    ASSERT_TRUE(args) << service->output();
    ASSERT_EQ(args->size(), 9u);
    EXPECT_TRUE(std::regex_match((*args)[2], std::regex("--seq=[0-9]+"))) << (*args)[2];
    EXPECT_EQ(*args, (std::vector<std::string>{"--h=" + phone.ip, "--n=\"kesu Sim Phone\"", (*args)[2], "--m=WLAN",
                                               "--i=53494d50", "--a=true", "--account=138****000", "--dt=phone",
                                               "--as=0"}));
    EXPECT_EQ(bodyOf(*sim, "SIM TCP_ANSWER ")["bytes"], json::array({3}));
}

}  // namespace
