// Pieces shared by the benchmarks: percentiles, a phone's announcement as it travels on the
// LAN, the real service with its control API client, started in network namespaces by
// the tests' own helpers (tests/support), and the figures /proc gives about a process.
#pragma once

#include <httplib.h>
#include <dirent.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <chrono>
#include <cstdio>
#include <exception>
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

#include "core/Json.h"
#include "discovery/Base64.h"
#include "support/NetNs.h"
#include "support/ServiceProcess.h"
#include "support/TestSupport.h"

namespace kesu::bench {

using Clock = std::chrono::steady_clock;

inline double percentile(std::vector<double> v, double p) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[static_cast<std::size_t>(p * static_cast<double>(v.size() - 1))];
}

inline double micros(Clock::duration d) { return std::chrono::duration<double, std::micro>(d).count(); }

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

    // Waits (bounded, 10 s) until the control API answers.
    bool waitUntilUp() {
        for (int i = 0; i < 100 && process_ && process_->running(); ++i) {
            if (control(controlBody("HeartBeat"))) return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
        return false;
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
