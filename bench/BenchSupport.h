// Pieces shared by the benchmarks: percentiles, a phone's announcement as it travels on the
// LAN, and the real service started in a scratch HOME/KESU_ROOT with its control API client.
#pragma once

#include <fcntl.h>
#include <httplib.h>
#include <sched.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>

#include <algorithm>
#include <cstdlib>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "core/Json.h"
#include "discovery/Base64.h"
#include "support/PidNamespace.h"

extern char** environ;

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

inline bool shell(const std::string& cmd) { return std::system((cmd + " >/dev/null 2>&1").c_str()) == 0; }

// Makes the network namespace `name` (loopback up) and moves the calling thread into it;
// false when that is not allowed (not root). Call it while the process has one thread.
inline bool enterNewNamespace(const std::string& name) {
    shell("ip netns del " + name);
    if (!shell("ip netns add " + name) || !shell("ip -n " + name + " link set lo up")) return false;
    const int fd = ::open(("/run/netns/" + name).c_str(), O_RDONLY | O_CLOEXEC);
    const bool entered = fd >= 0 && ::setns(fd, CLONE_NEWNET) == 0;
    if (fd >= 0) ::close(fd);
    return entered;
}

// The real service binary in the named network namespace (started through `ip netns exec`,
// so that it sees that namespace's adapters) and in a PID namespace of its own (so that a
// copy running on the machine does not make it stand down), its output discarded (or
// written to $KESU_BENCH_LOG), HOME and KESU_ROOT in a scratch folder.
class BenchService {
public:
    explicit BenchService(const std::string& netns) {
        char pattern[] = "/tmp/kesu-bench-XXXXXX";
        dir_ = ::mkdtemp(pattern);
        std::filesystem::create_directories(dir_ + "/home");
        std::filesystem::create_directories(dir_ + "/root");
        std::vector<std::string> envs;
        for (char** e = environ; *e; ++e) {
            std::string s(*e);
            if (s.rfind("HOME=", 0) != 0 && s.rfind("KESU_ROOT=", 0) != 0) envs.push_back(s);
        }
        envs.push_back("HOME=" + dir_ + "/home");
        envs.push_back("KESU_ROOT=" + dir_ + "/root");
        std::vector<char*> cenv;
        for (auto& e : envs) cenv.push_back(e.data());
        cenv.push_back(nullptr);
        const char* log = std::getenv("KESU_BENCH_LOG");
        const int out = ::open(log ? log : "/dev/null", O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        std::string ip = "/usr/sbin/ip", netnsWord = "netns", exec = "exec", ns = netns, binary = KESU_BINARY;
        char* args[] = {ip.data(), netnsWord.data(), exec.data(), ns.data(), binary.data(), nullptr};
        if (out >= 0) pid_ = test::spawnInPidNamespace(args, cenv.data(), out, -1);
        if (out >= 0) ::close(out);
        client_.set_keep_alive(true);
        client_.set_tcp_nodelay(true);
        client_.set_read_timeout(std::chrono::seconds(60));
    }
    ~BenchService() {
        if (pid_ > 0) {
            ::kill(pid_, SIGTERM);
            int status = 0;
            ::waitpid(pid_, &status, 0);
        }
        std::filesystem::remove_all(dir_);
    }
    pid_t pid() const { return pid_; }

    // Waits (bounded, 10 s) until the control API answers.
    bool waitUntilUp() {
        for (int i = 0; i < 100 && pid_ > 0; ++i) {
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
    std::string dir_;
    pid_t pid_ = -1;
    httplib::Client client_{"127.0.0.1", 9197};
};

}  // namespace kesu::bench
