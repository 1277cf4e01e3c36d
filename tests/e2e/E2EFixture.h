// Shared set-up of the end-to-end tests across network namespaces: a bridged lab with the PC
// node (where the real service runs with its own HOME and KESU_ROOT) and phone nodes, the
// control API reached from inside the PC node, the account database, and stand-in programs
// in the PC suite's bundle that report how they were launched.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "support/NetNs.h"
#include "support/ServiceProcess.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"

namespace kesu::test {

// The text after `marker` on the first line of `output` that holds it ("" when none).
std::string lineAfter(const std::string& output, const std::string& marker);

// The phone simulator tool, started inside `ns`.
std::unique_ptr<ServiceProcess> startSimulator(const std::string& ns, const std::vector<std::string>& args);

// Posts one control request from inside `ns` (the control API listens on that namespace's
// loopback) and returns the JSON after the length prefix of the answer (null when none).
nlohmann::json control(const std::string& ns, const std::string& event,
                       const nlohmann::json& args = nlohmann::json::array());

class LabTest : public ::testing::Test {
protected:
    void SetUp() override;

    // Adds a phone node 10.77.0.<host> to the lab.
    NetNsLab::Node addPhone(const std::string& name, int host);
    // Starts the real service in the PC node, in a PID namespace of its own (so a service
    // running on the machine does not stop it), and waits until it has started (its phone server listens).
    std::unique_ptr<ServiceProcess> startService();
    // A stand-in for the PC suite's HTTP server on every address of the PC node, port 9199.
    std::unique_ptr<StubPcSuite> startPcSuite();
    // A stand-in for the cloud connect center in the PC node (port 9300, every address, each
    // path answered {"code":0} unless set), named in switch_host.ini so that a service started
    // afterwards sends its connect-center requests there.
    std::unique_ptr<StubPcSuite> startConnectCenter();
    // Writes the PC suite's account database anew with one signed-in user.
    void writeAccount(const std::string& openId, const std::string& phone, const std::string& token = "tok");

    // Installs a stand-in for a program of the bundle (a fixed path below KESU_ROOT): when
    // launched it posts its arguments to the recorder, as one request to /launched/<name>
    // whose body holds them NUL-separated; `more` is shell text run after that.
    void installProgram(const std::string& fixedPath, const std::string& name, const std::string& more = "");
    // Waits for the launch of the program `name`; its arguments (nullopt at the time-out).
    std::optional<std::vector<std::string>> waitForLaunch(const std::string& name, std::chrono::milliseconds timeout);

    std::unique_ptr<NetNsLab> lab;
    NetNsLab::Node pc, phone;
    TempDir dir;
    std::string home = dir.str() + "/home";
    std::string root = dir.str() + "/root";
    std::unique_ptr<StubPcSuite> recorder;  // in the PC node; receives the program launches
};

// The JSON after `marker` on each whole line of `output`, in order (discarded JSON for one
// that is none). A line whose end has not arrived yet is not taken.
std::vector<nlohmann::json> bodiesIn(const std::string& output, const std::string& marker);
// bodiesIn() of a phone simulator's output, once it has printed at least `atLeast` such lines
// or the time-out has passed.
std::vector<nlohmann::json> printedBodies(ServiceProcess& sim, const std::string& marker, std::size_t atLeast,
                                          std::chrono::milliseconds timeout = std::chrono::seconds(10));
// The frame bodies a listening phone simulator received ("SIM TCP_REQUEST" lines).
std::vector<nlohmann::json> receivedBodies(ServiceProcess& sim, std::size_t atLeast = 0);

// The lab with the account's cloud: stand-ins for the PC suite (which names the PC "PC-E2E",
// version "1.0") and for the connect center, whose device list names phones simulated in
// their own nodes.
class CloudLabTest : public LabTest {
protected:
    void SetUp() override;

    // A phone of the account as the connect center lists it, reachable at the node's address.
    static nlohmann::json listed(const NetNsLab::Node& node, const std::string& businessId,
                                 const std::string& reportTime);
    // The connect center's device list from now on.
    void listPhones(const std::vector<nlohmann::json>& records);
    // A phone of the account in `node` that answers the PC's pre-connect request as `mode` says
    // (see phone_simulator --preconnect); `more` adds flags.
    std::unique_ptr<ServiceProcess> phoneSim(const NetNsLab::Node& node, const std::string& businessId,
                                             const std::string& mode, std::vector<std::string> more = {});
    // The service, signed in, with the phone `businessId` of `node` listed and given up on by
    // the scheduler: nothing listened there for both of its tries.
    std::unique_ptr<ServiceProcess> startServiceGivenUpOn(const NetNsLab::Node& node, const std::string& businessId);

    static inline const std::string kOpenId = "same-open";
    std::unique_ptr<StubPcSuite> pcsuite, center;
};

}  // namespace kesu::test
