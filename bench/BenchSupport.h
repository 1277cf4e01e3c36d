// Pieces shared by the benchmarks: percentiles, a phone's announcement as it travels on the
// LAN, the real service with its control API client, started in network namespaces by
// the tests' own helpers (tests/support), the service signed in to an account whose cloud
// device list a stand-in connect center serves, and the figures /proc gives about a process.
#pragma once

#include <httplib.h>
#include <dirent.h>
#include <signal.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <chrono>
#include <cstdio>
#include <exception>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "core/Config.h"
#include "core/Json.h"
#include "discovery/Base64.h"
#include "discovery/SsdpMessage.h"
#include "support/NetNs.h"
#include "support/ServiceProcess.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"

namespace kesu::bench {

using Clock = std::chrono::steady_clock;

inline double percentile(std::vector<double> v, double p) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[static_cast<std::size_t>(p * static_cast<double>(v.size() - 1))];
}

inline double micros(Clock::duration d) { return std::chrono::duration<double, std::micro>(d).count(); }

struct Spread {
    double p50 = 0, p90 = 0, p99 = 0, max = 0;
};
inline Spread spread(const std::vector<double>& v) {
    return {percentile(v, 0.5), percentile(v, 0.9), percentile(v, 0.99), percentile(v, 1.0)};
}
inline double ratio(double a, double b) { return b > 0 ? a / b : 0; }

// The value of `--name=N` on the command line; else `quick` under KESU_BENCH_QUICK, else
// `fallback`.
inline int option(int argc, char** argv, const std::string& name, int fallback, int quick) {
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg.rfind("--" + name + "=", 0) == 0) return std::atoi(arg.c_str() + name.size() + 3);
    }
    return std::getenv("KESU_BENCH_QUICK") ? quick : fallback;
}

// A phone announcement in the current format.
inline std::string phoneAnnouncement(const std::string& id) {
    const Json body{{"deviceName", "kesu Mate Phone 60 Pro"},
                    {"deviceId", id},
                    {"openId", "5f2c9e7a1d3b4c6e8f0a2b4c6d8e0f12"},
                    {"account", "138****5678"},
                    {"deviceType", "mobile"},
                    {"pcCustomizedData", "1"},
                    {"serviceRecord", "com.kesu.pcsuite.SERVICE--com.kesu.share.CONNECT_PC"},
                    {"port", 10191},
                    {"extra", "null"}};
    return "RESPONSE * HTTP/1.1\r\nDATE:2024-05-01 10:00:00.000\r\ncompatGsonStr:" +
           base64::encode(json::compact(body)) + "\r\n";
}

// A control request in its length-prefixed envelope.
inline std::string controlBody(const std::string& event, const Json& args = Json::array()) {
    const std::string text = json::compact(Json{{"event", event}, {"args", args}});
    return std::to_string(text.size()) + "#" + text;
}

// The JSON of a control answer ("<length>#<json>"); nullopt when it is not one.
inline std::optional<Json> controlAnswerJson(const std::string& answer) {
    const auto hash = answer.find('#');
    if (hash == std::string::npos) return std::nullopt;
    return json::parse(std::string_view(answer).substr(hash + 1));
}

// The real service binary, started the way the end-to-end tests start it: in the network
// namespace `netns` and a PID namespace of its own (so that a copy running on the machine
// does not make it stand down), HOME and KESU_ROOT in a scratch folder. Its output is
// written to $KESU_BENCH_LOG when that is set.
class BenchService {
public:
    explicit BenchService(const std::string& netns) : BenchService(netns, nullptr) {}
    // Starts the service once `prepare` has laid out the files it reads at start-up below its
    // HOME and KESU_ROOT (the account database, the connect-center override).
    BenchService(const std::string& netns,
                 const std::function<void(const std::string& home, const std::string& root)>& prepare) {
        if (prepare) prepare(home(), root());
        try {
            process_ = std::make_unique<test::ServiceProcess>(
                KESU_BINARY, std::vector<std::string>{},
                std::map<std::string, std::string>{{"HOME", dir_.str() + "/home"}, {"KESU_ROOT", dir_.str() + "/root"}},
                netns, test::ServiceProcess::Pids::own);
        } catch (const std::exception& e) {
            std::fprintf(stderr, "%s\n", e.what());
        }
        client_.set_keep_alive(true);
        client_.set_tcp_nodelay(true);
        client_.set_read_timeout(std::chrono::seconds(60));
    }
    ~BenchService() {
        if (!process_) return;
        process_->stop(SIGTERM, std::chrono::seconds(30));
        if (const char* log = std::getenv("KESU_BENCH_LOG")) std::ofstream(log) << process_->output();
    }
    pid_t pid() const { return process_ ? process_->pid() : -1; }
    std::string home() const { return dir_.str() + "/home"; }
    std::string root() const { return dir_.str() + "/root"; }
    // The running child (its output), or null when it could not be started.
    test::ServiceProcess* process() { return process_.get(); }

    // Waits (bounded, 20 s) until the service has started (the phone server, its last part,
    // listens) and its control API answers.
    bool waitUntilUp() {
        return process_ &&
               process_->waitForOutput("[ConnectStatusGet] Server Socket is open", std::chrono::seconds(20)) &&
               control(controlBody("HeartBeat"));
    }
    // One control request; the answer body, or nullopt when none came.
    std::optional<std::string> control(const std::string& body) {
        auto res = client_.Post("/", body, "text/plain");
        if (!res || res->status != 200) return std::nullopt;
        return res->body;
    }

private:
    test::TempDir dir_;
    std::unique_ptr<test::ServiceProcess> process_;
    httplib::Client client_{"127.0.0.1", 9197};
};

// Announces a phone (`announce` sends one datagram) and asks SSDPQueryAll back to back until
// the service lists the phone announced as `id`, for at most `timeout`; each query's round
// trip goes to `queries` when given.
struct Appearance {
    bool listed = false;
    double micros = 0;  // from the announcement to the answer that listed it, or to giving up
};
inline Appearance announceUntilListed(BenchService& service, const std::function<void()>& announce,
                                      const std::string& id, std::chrono::milliseconds timeout,
                                      std::vector<double>* queries = nullptr) {
    static const std::string queryAll = controlBody("SSDPQueryAll");
    // Built piecewise: g++ 12 sees a bogus overlap (-Wrestrict) in "\"" + text.
    std::string wanted = SsdpMessage::deviceIdentifier(id);
    wanted.insert(wanted.begin(), '"');
    wanted.push_back('"');
    const auto t0 = Clock::now();
    announce();
    while (Clock::now() - t0 < timeout) {
        const auto q0 = Clock::now();
        const auto answer = service.control(queryAll);
        if (queries) queries->push_back(micros(Clock::now() - q0));
        if (answer && answer->find(wanted) != std::string::npos) return {true, micros(Clock::now() - t0)};
    }
    std::fprintf(stderr, "announcement %s never appeared\n", id.c_str());
    return {false, micros(Clock::now() - t0)};
}

// The PC suite's account database with one signed-in user, written beside and renamed over.
inline bool writeAccount(const std::string& home, const std::string& openId) {
    const std::string folder = home + "/Library/Application Support/pcsuite/DataBase";
    std::filesystem::create_directories(folder);
    const std::string path = folder + "/Config.db", fresh = path + ".new";
    std::filesystem::remove(fresh);
    sqlite3* db = nullptr;
    if (sqlite3_open(fresh.c_str(), &db) != SQLITE_OK) {
        sqlite3_close(db);
        return false;
    }
    const std::string sql =
        "CREATE TABLE User (openid TEXT, phone TEXT, token TEXT);"
        "CREATE TABLE SoftwareSet (openid TEXT, configDir TEXT, storageDir TEXT);"
        "INSERT INTO User VALUES ('" + openId + "', '13800000000', 'tok');";
    const int rc = sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr);
    sqlite3_close(db);
    std::error_code ec;
    std::filesystem::rename(fresh, path, ec);
    return rc == SQLITE_OK && !ec;
}

// A phone of the account as the cloud lists it.
struct CloudPhone {
    std::string ip;          // its one address
    std::string businessId;  // its first 4 characters make the device key
};

// The connect center's device list of the account `openId`.
inline std::string cloudDeviceList(const std::string& openId, const std::vector<CloudPhone>& phones) {
    Json data = Json::array();
    for (std::size_t i = 0; i < phones.size(); ++i) {
        const Json net = {{"inet", phones[i].ip}, {"localInet", phones[i].ip}, {"netmark", "255.255.255.0"}, {"ssid", "Home"}};
        data.push_back({{"userId", openId},
                        {"name", "Bench Phone " + std::to_string(i)},
                        {"type", 1},
                        {"model", "SIM-1"},
                        {"reportTime", "2026-12-06 10:00:00.000"},
                        {"deviceId", "cloud-" + std::to_string(i)},
                        {"bizInfo", {{"conn_base", {{"businessId", phones[i].businessId}, {"cloudConnectionSupported", true}}}}},
                        {"inets", Json::array({net})}});
    }
    return Json{{"code", 0}, {"data", data}}.dump();
}

// The real service signed in to `openId`, beside a stand-in HTTP server (in the same
// namespace, at the PC suite's port) that plays the PC suite and the connect center (named by
// switch_host.ini). Once ok(), the service has fetched the account's (empty) device list;
// list() has it fetch a new one. Construct it on a thread in the service's namespace.
class SignedInService {
public:
    SignedInService(const std::string& netns, std::string openId)
        : openId_(std::move(openId)), center_("0.0.0.0", Config().pcsuitePort) {
        center_.setAnswer("/pcDeviceInfo", {200, R"({"code":"000000","data":{"deviceId":"BENCHPC0001","version":"1.0.0"}})"});
        center_.setAnswer("/device/report", {200, R"({"code":0})"});
        center_.setAnswer("/device/unBind", {200, R"({"code":0})"});
        center_.setAnswer("/device/list", {200, cloudDeviceList(openId_, {})});
        const std::string centerUrl = "http://127.0.0.1:" + std::to_string(Config().pcsuitePort);
        bool prepared = false;
        service_ = std::make_unique<BenchService>(netns, [&](const std::string& home, const std::string& root) {
            const std::filesystem::path ini = root + Config().switchHostIni;
            std::filesystem::create_directories(ini.parent_path());
            std::ofstream(ini) << "ConnectionCenterHost=" << centerUrl << "\n";
            prepared = writeAccount(home, openId_);
        });
        if (!prepared || !service_->process() || !service_->waitUntilUp()) {
            error_ = "the service did not start (account written: " + std::to_string(prepared) + ")";
            return;
        }
        // The account read at start-up is announced before the cloud subscriber listens: the
        // database written anew is what has the service fetch the (empty) list.
        if (!list({})) error_ = "the service never asked the connect center for the device list";
    }

    bool ok() const { return error_.empty(); }
    const std::string& error() const { return error_; }
    BenchService& service() { return *service_; }
    test::StubPcSuite& center() { return center_; }
    const std::string& openId() const { return openId_; }

    // Has the service fetch the list naming `phones` (the account database written anew);
    // the fetch as the center saw it, or nullopt when it did not come within 30 s.
    std::optional<test::RecordedRequest> list(const std::vector<CloudPhone>& phones) {
        const auto from = Clock::now();
        center_.setAnswer("/device/list", {200, cloudDeviceList(openId_, phones)});
        if (!writeAccount(service_->home(), openId_)) return std::nullopt;
        return center_.waitForRequest(
            [&](const test::RecordedRequest& r) { return r.path == "/device/list" && r.receivedAt >= from; },
            std::chrono::seconds(30));
    }

    // The service's log line telling that the device `key` is held.
    static std::string heldMarker(const std::string& key = {}) { return "preConnect result is success, id " + key; }

private:
    std::string openId_;
    test::StubPcSuite center_;
    std::unique_ptr<BenchService> service_;
    std::string error_;
};

// Makes the lab `nodes` describe (names and hosts of an unbridged NetNsLab tagged "bench"),
// then runs `body` with the nodes on a thread inside the first node's namespace, so that
// the benchmark's own sockets (and the threads it starts) live beside the service. The exit
// status of `body`, or 1 when the lab could not be made (it needs root).
inline int runInLab(const char* bench, const std::vector<std::pair<std::string, int>>& nodes,
                    const std::function<int(const std::vector<test::NetNsLab::Node>&)>& body) {
    std::string why;
    if (!test::NetNsLab::available(&why)) {
        std::fprintf(stderr, "%s needs network namespaces: %s\n", bench, why.c_str());
        return 1;
    }
    test::NetNsLab lab("bench", false);
    std::vector<test::NetNsLab::Node> made;
    for (const auto& [name, host] : nodes) made.push_back(lab.addNode(name, host));
    if (!lab.ok()) {
        std::fprintf(stderr, "%s: %s\n", bench, lab.error().c_str());
        return 1;
    }
    int status = 1;
    test::NetNsLab::runIn(made.front().ns, [&] { status = body(made); });
    return status;
}

// What /proc tells about a running process: the figures the idle measurements compare.
namespace proc {

inline std::string readText(const std::string& path) {
    std::ifstream in(path);
    std::ostringstream out;
    out << in.rdbuf();
    return out.str();
}

// The number after "key:" in a /proc status text (read with a leading line break), or -1.
inline long long statusField(const std::string& status, const std::string& key) {
    const auto at = status.find("\n" + key + ":");
    if (at == std::string::npos) return -1;
    return std::atoll(status.c_str() + at + key.size() + 2);
}

// A /proc status file with a line break before its first line, so that every field follows one.
inline std::string statusText(const std::string& path) {
    std::string text = readText(path);
    text.insert(text.begin(), '\n');
    return text;
}

inline std::vector<std::string> tasks(pid_t pid) {
    std::vector<std::string> out;
    const std::string dir = "/proc/" + std::to_string(pid) + "/task";
    if (DIR* d = ::opendir(dir.c_str())) {
        while (dirent* e = ::readdir(d))
            if (e->d_name[0] != '.') out.push_back(dir + "/" + e->d_name);
        ::closedir(d);
    }
    return out;
}

inline std::string trimmed(std::string s) {
    while (!s.empty() && (s.back() == '\n' || s.back() == ' ')) s.pop_back();
    return s;
}

// The service's own process: `pid` itself, or the first descendant that runs the service
// binary (when the launcher starts it behind a helper process).
inline pid_t serviceProcess(pid_t pid) {
    std::vector<pid_t> todo{pid};
    for (std::size_t next = 0; next < todo.size(); ++next) {
        const pid_t p = todo[next];
        if (trimmed(readText("/proc/" + std::to_string(p) + "/comm")) == "KesuConnService") return p;
        for (const std::string& task : tasks(p)) {
            std::istringstream children(readText(task + "/children"));
            for (pid_t c; children >> c;) todo.push_back(c);
        }
    }
    return pid;
}

struct Usage {
    Clock::time_point at;
    long long switches = 0;  // voluntary + involuntary, summed over the live threads
    double cpuSeconds = 0;   // utime + stime of the whole process
    long long threads = 0;
    long long rssKiB = 0;
    std::map<std::string, int> names;  // thread name -> count
};

inline Usage usage(pid_t pid) {
    Usage u;
    u.at = Clock::now();
    const std::string dir = "/proc/" + std::to_string(pid);
    const std::string status = statusText(dir + "/status");
    u.threads = statusField(status, "Threads");
    u.rssKiB = statusField(status, "VmRSS");
    for (const std::string& task : tasks(pid)) {
        const std::string ts = statusText(task + "/status");
        u.switches += statusField(ts, "voluntary_ctxt_switches") + statusField(ts, "nonvoluntary_ctxt_switches");
        ++u.names[trimmed(readText(task + "/comm"))];
    }
    // Fields 14 and 15 of stat, counted after the parenthesised command name.
    const std::string stat = readText(dir + "/stat");
    const auto close = stat.rfind(')');
    if (close == std::string::npos || close + 2 > stat.size()) return u;
    std::istringstream rest(stat.substr(close + 2));
    std::string field;
    unsigned long long utime = 0, stime = 0;
    for (int i = 3; i <= 15 && rest >> field; ++i) {
        if (i == 14) utime = std::stoull(field);
        if (i == 15) stime = std::stoull(field);
    }
    u.cpuSeconds = static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
    return u;
}

// The rates between two readings of the same process.
struct Rates {
    double seconds = 0;
    double cpuPerSecond = 0;
    double switchesPerSecond = 0;
    long long threads = 0;
    double rssMiB = 0;
    std::map<std::string, int> names;
};

inline Rates between(const Usage& first, const Usage& last) {
    Rates r;
    r.seconds = std::chrono::duration<double>(last.at - first.at).count();
    if (r.seconds <= 0) return r;
    r.cpuPerSecond = (last.cpuSeconds - first.cpuSeconds) / r.seconds;
    r.switchesPerSecond = static_cast<double>(last.switches - first.switches) / r.seconds;
    r.threads = last.threads;
    r.rssMiB = static_cast<double>(last.rssKiB) / 1024.0;
    r.names = last.names;
    return r;
}

}  // namespace proc

}  // namespace kesu::bench
