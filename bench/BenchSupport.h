// Pieces shared by the benchmarks: percentiles, a phone's announcement as it travels on the
// LAN, and the real service with its control API client, started in network namespaces by
// the tests' own helpers (tests/support).
#pragma once

#include <httplib.h>
#include <signal.h>

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
    explicit BenchService(const std::string& netns) {
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

}  // namespace kesu::bench
