#include "e2e/E2EFixture.h"

#include <sqlite3.h>

#include <filesystem>
#include <fstream>


namespace kesu::test {

using namespace std::chrono_literals;

std::string lineAfter(const std::string& output, const std::string& marker) {
    auto at = output.find(marker);
    if (at == std::string::npos) return {};
    at += marker.size();
    return output.substr(at, output.find('\n', at) - at);
}

std::unique_ptr<ServiceProcess> startSimulator(const std::string& ns, const std::vector<std::string>& args) {
    return std::make_unique<ServiceProcess>(std::string(KESU_TOOLS_DIR) + "/phone_simulator", args,
                                            std::map<std::string, std::string>{}, ns);
}

nlohmann::json control(const std::string& ns, const std::string& event, const nlohmann::json& args) {
    const std::string body = nlohmann::json{{"event", event}, {"args", args}}.dump();
    ServiceProcess curl("/usr/bin/curl",
                        {"-s", "-m", "60", "--data-binary", std::to_string(body.size()) + "#" + body, "-H",
                         "Content-Type: text/plain", "http://127.0.0.1:9197/"},
                        {}, ns);
    curl.waitExit(70s);
    const std::string out = curl.output();
    const auto hash = out.find('#');
    if (hash == std::string::npos) return nullptr;
    return nlohmann::json::parse(out.substr(hash + 1), nullptr, false);
}

void LabTest::SetUp() {
    std::string why;
    if (!NetNsLab::available(&why))
        GTEST_SKIP() << "*** NETWORK NAMESPACES UNAVAILABLE: " << why << " ***";
    lab = std::make_unique<NetNsLab>("e2e", true);
    pc = lab->addNode("pc", 1);
    phone = addPhone("phone", 2);
    ASSERT_TRUE(lab->ok()) << lab->error();
    std::filesystem::create_directories(home);
    std::filesystem::create_directories(root);
    ASSERT_TRUE(NetNsLab::runIn(pc.ns, [&] { recorder = std::make_unique<StubPcSuite>(); }));
}

NetNsLab::Node LabTest::addPhone(const std::string& name, int host) {
    NetNsLab::Node node = lab->addNode(name, host);
    EXPECT_TRUE(lab->ok()) << lab->error();
    return node;
}

std::unique_ptr<ServiceProcess> LabTest::startService() {
    auto p = std::make_unique<ServiceProcess>(KESU_BINARY, std::vector<std::string>{},
                                              std::map<std::string, std::string>{{"HOME", home}, {"KESU_ROOT", root}},
                                              pc.ns, ServiceProcess::Pids::own);
    // Started once the phone server listens: discovery and the account are up by then.
    EXPECT_TRUE(p->waitForOutput("[ConnectStatusGet] Server Socket is open", 20s)) << p->output();
    return p;
}

std::unique_ptr<StubPcSuite> LabTest::startPcSuite() {
    std::unique_ptr<StubPcSuite> stub;
    EXPECT_TRUE(NetNsLab::runIn(pc.ns, [&] { stub = std::make_unique<StubPcSuite>("0.0.0.0", 9199); }));
    return stub;
}

std::unique_ptr<StubPcSuite> LabTest::startConnectCenter() {
    std::unique_ptr<StubPcSuite> stub;
    EXPECT_TRUE(NetNsLab::runIn(pc.ns, [&] { stub = std::make_unique<StubPcSuite>("0.0.0.0", 9300); }));
    if (!stub) return stub;
    stub->setDefaultAnswer({200, R"({"code":0})"});
    const std::filesystem::path ini = root + "/Library/Preferences/pcsuite/switch_host.ini";
    std::filesystem::create_directories(ini.parent_path());
    std::ofstream(ini) << "[host]\nConnectionCenterHost=http://127.0.0.1:" << stub->port() << "\n";
    return stub;
}

void LabTest::writeAccount(const std::string& openId, const std::string& phone, const std::string& token) {
    const std::string folder = home + "/Library/Application Support/pcsuite/DataBase";
    std::filesystem::create_directories(folder);
    // Written beside and renamed over, as a whole: the service never reads half a file.
    const std::string path = folder + "/Config.db";
    const std::string fresh = path + ".new";
    std::filesystem::remove(fresh);
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(fresh.c_str(), &db), SQLITE_OK);
    char* sql = sqlite3_mprintf(
        "CREATE TABLE User (openid TEXT, phone TEXT, token TEXT);"
        "CREATE TABLE SoftwareSet (openid TEXT, configDir TEXT, storageDir TEXT);"
        "INSERT INTO User VALUES (%Q, %Q, %Q);",
        openId.c_str(), phone.c_str(), token.c_str());
    char* error = nullptr;
    const int rc = sqlite3_exec(db, sql, nullptr, nullptr, &error);
    const std::string message = error ? error : "";
    sqlite3_free(error);
    sqlite3_free(sql);
    sqlite3_close(db);
    ASSERT_EQ(rc, SQLITE_OK) << message;
    std::filesystem::rename(fresh, path);
}

void LabTest::installProgram(const std::string& fixedPath, const std::string& name, const std::string& more) {
    const std::filesystem::path path = root + fixedPath;
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path) << "#!/bin/sh\n"
                        << "printf '%s\\0' \"$@\" | curl -s -m 5 --data-binary @- "
                        << "-H 'Content-Type: application/octet-stream' " << recorder->baseUrl() << "launched/" << name
                        << "\n"
                        << more << "\n";
    std::filesystem::permissions(path, std::filesystem::perms::owner_all | std::filesystem::perms::group_read |
                                           std::filesystem::perms::group_exec);
}

std::optional<std::vector<std::string>> LabTest::waitForLaunch(const std::string& name,
                                                               std::chrono::milliseconds timeout) {
    const auto launch =
        recorder->waitForRequest([&](const RecordedRequest& r) { return r.path == "/launched/" + name; }, timeout);
    if (!launch) return std::nullopt;
    std::vector<std::string> args;
    std::string::size_type start = 0;
    for (auto end = launch->body.find('\0'); end != std::string::npos; end = launch->body.find('\0', start)) {
        args.push_back(launch->body.substr(start, end - start));
        start = end + 1;
    }
    return args;
}

std::vector<nlohmann::json> bodiesIn(const std::string& output, const std::string& marker) {
    std::vector<nlohmann::json> bodies;
    for (auto at = output.find(marker); at != std::string::npos; at = output.find(marker, at + 1)) {
        const auto start = at + marker.size(), end = output.find('\n', start);
        if (end == std::string::npos) break;
        bodies.push_back(nlohmann::json::parse(output.substr(start, end - start), nullptr, false));
    }
    return bodies;
}

std::vector<nlohmann::json> printedBodies(ServiceProcess& sim, const std::string& marker, std::size_t atLeast,
                                          std::chrono::milliseconds timeout) {
    if (atLeast > 0)
        sim.waitForOutput([&](const std::string& out) { return bodiesIn(out, marker).size() >= atLeast; }, timeout);
    return bodiesIn(sim.output(), marker);
}

std::vector<nlohmann::json> receivedBodies(ServiceProcess& sim, std::size_t atLeast) {
    return printedBodies(sim, "SIM TCP_REQUEST ", atLeast);
}

void CloudLabTest::SetUp() {
    LabTest::SetUp();
    if (IsSkipped() || HasFatalFailure()) return;
    pcsuite = startPcSuite();
    ASSERT_TRUE(pcsuite);
    pcsuite->setAnswer("/pcDeviceInfo", {200, R"({"code":"000000","data":{"deviceId":"PC-E2E","version":"1.0"}})"});
    pcsuite->setAnswer("/connectDevice", {200, R"({"code":"000000","data":{"code":0,"reason":"connected"}})"});
    center = startConnectCenter();
    ASSERT_TRUE(center);
}

nlohmann::json CloudLabTest::listed(const NetNsLab::Node& node, const std::string& businessId,
                                    const std::string& reportTime) {
    using nlohmann::json;
    return {{"userId", kOpenId},
            {"name", "Sim " + businessId},
            {"type", 1},
            {"model", "SIM-1"},
            {"reportTime", reportTime},
            {"deviceId", "cloud-" + businessId},
            {"bizInfo", {{"conn_base", {{"businessId", businessId}, {"cloudConnectionSupported", true}}}}},
            {"inets", json::array({{{"inet", node.ip}, {"localInet", node.ip}, {"netmark", "255.255.255.0"},
                                    {"ssid", "Home"}}})}};
}

void CloudLabTest::listPhones(const std::vector<nlohmann::json>& records) {
    center->setAnswer("/device/list", {200, nlohmann::json{{"code", 0}, {"data", nlohmann::json(records)}}.dump()});
}

std::unique_ptr<ServiceProcess> CloudLabTest::phoneSim(const NetNsLab::Node& node, const std::string& businessId,
                                                       const std::string& mode, std::vector<std::string> more) {
    std::vector<std::string> args{"--tcp-port", "10191", "--preconnect", mode,         "--id",
                                  businessId,   "--openid",  kOpenId,    "--duration", "90"};
    args.insert(args.end(), more.begin(), more.end());
    auto sim = startSimulator(node.ns, args);
    EXPECT_TRUE(sim->waitForOutput("SIM READY", 5s)) << sim->output();
    return sim;
}

std::unique_ptr<ServiceProcess> CloudLabTest::startServiceGivenUpOn(const NetNsLab::Node& node,
                                                                    const std::string& businessId) {
    listPhones({listed(node, businessId, "2026-12-06 10:00:00.000")});
    auto service = startService();
    writeAccount(kOpenId, "13912345678");
    EXPECT_TRUE(service->waitForOutput("add FARAWAYWLAN connect count, current count is: 2", 20s)) << service->output();
    return service;
}

}  // namespace kesu::test
