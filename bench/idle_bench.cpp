// The idle service: threads, context switches per second, CPU seconds per second and
// resident memory of the real service left alone with one adapter and no phone, printed next
// to the figures measured before the service ran on one event loop.
//
//   build/bench/idle_bench [--seconds=N] [--settle=N]    (or KESU_IDLE_SECONDS=N)
// Needs root: the service runs in a network namespace of its own whose only adapter is a
// veth pair with an address, so that it announces itself as on a LAN and nothing leaves the
// machine. It is measured after `settle` seconds (start-up, the first reports, the control
// client's kept-alive connection timing out), over `seconds` (60 by default).
#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "BenchSupport.h"

namespace {

using namespace kesu::bench;

std::string readText(const std::string& path) {
    std::ifstream in(path);
    std::ostringstream out;
    out << in.rdbuf();
    return out.str();
}

// The number after "key:" in a /proc status file, or -1.
long long statusField(const std::string& status, const std::string& key) {
    const auto at = status.find("\n" + key + ":");
    if (at == std::string::npos) return -1;
    return std::atoll(status.c_str() + at + key.size() + 2);
}

std::vector<std::string> tasks(pid_t pid) {
    std::vector<std::string> out;
    const std::string dir = "/proc/" + std::to_string(pid) + "/task";
    if (DIR* d = ::opendir(dir.c_str())) {
        while (dirent* e = ::readdir(d))
            if (e->d_name[0] != '.') out.push_back(dir + "/" + e->d_name);
        ::closedir(d);
    }
    return out;
}

std::string trimmed(std::string s) {
    while (!s.empty() && (s.back() == '\n' || s.back() == ' ')) s.pop_back();
    return s;
}

// The service's own process: `pid` itself, or the first descendant that runs the service
// binary (when the launcher starts it behind a helper process).
pid_t serviceProcess(pid_t pid) {
    std::vector<pid_t> todo{pid};
    while (!todo.empty()) {
        const pid_t p = todo.front();
        todo.erase(todo.begin());
        if (trimmed(readText("/proc/" + std::to_string(p) + "/comm")) == "KesuConnService") return p;
        for (const std::string& task : tasks(p)) {
            std::istringstream children(readText(task + "/children"));
            for (pid_t c; children >> c;) todo.push_back(c);
        }
    }
    return pid;
}

struct Sample {
    std::chrono::steady_clock::time_point at;
    long long switches = 0;  // voluntary + involuntary, summed over the live threads
    double cpuSeconds = 0;   // utime + stime of the whole process
    long long threads = 0;
    long long rssKiB = 0;
    std::map<std::string, int> names;  // thread name -> count
};

Sample sample(pid_t pid) {
    Sample s;
    s.at = std::chrono::steady_clock::now();
    const std::string proc = "/proc/" + std::to_string(pid);
    const std::string status = "\n" + readText(proc + "/status");
    s.threads = statusField(status, "Threads");
    s.rssKiB = statusField(status, "VmRSS");
    for (const std::string& task : tasks(pid)) {
        const std::string ts = "\n" + readText(task + "/status");
        s.switches += statusField(ts, "voluntary_ctxt_switches") + statusField(ts, "nonvoluntary_ctxt_switches");
        ++s.names[trimmed(readText(task + "/comm"))];
    }
    // Fields 14 and 15 of stat, counted after the parenthesised command name.
    const std::string stat = readText(proc + "/stat");
    std::istringstream rest(stat.substr(stat.rfind(')') + 2));
    std::string field;
    unsigned long long utime = 0, stime = 0;
    for (int i = 3; i <= 15 && rest >> field; ++i) {
        if (i == 14) utime = std::stoull(field);
        if (i == 15) stime = std::stoull(field);
    }
    s.cpuSeconds = static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
    return s;
}

int option(int argc, char** argv, const std::string& name, const char* env, int fallback) {
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg.rfind("--" + name + "=", 0) == 0) return std::atoi(arg.c_str() + name.size() + 3);
    }
    if (env && std::getenv(env)) return std::atoi(std::getenv(env));
    return fallback;
}

}  // namespace

int main(int argc, char** argv) {
    const int seconds = std::max(1, option(argc, argv, "seconds", "KESU_IDLE_SECONDS", 60));
    const int settle = std::max(0, option(argc, argv, "settle", nullptr, 10));

    // One wired adapter with an address (a veth pair to a silent peer): the service keeps a
    // socket on it and announces.
    return runInLab("idle_bench", {{"pc", 1}, {"phone", 2}}, [&](const auto& nodes) {
        int rc = 0;
        BenchService service(nodes[0].ns);
        if (!service.waitUntilUp()) {
            std::fprintf(stderr, "service did not answer\n");
            rc = 1;
        } else {
            const pid_t pid = serviceProcess(service.pid());
            std::this_thread::sleep_for(std::chrono::seconds(settle));
            const Sample first = sample(pid);
            std::this_thread::sleep_for(std::chrono::seconds(seconds));
            const Sample last = sample(pid);
            const double span = std::chrono::duration<double>(last.at - first.at).count();

            std::printf("idle service (pid %d), measured over %.1f s after %d s of settling\n", pid, span, settle);
            std::printf("%-28s %12s %12s\n", "", "before", "now");
            std::printf("%-28s %12d %12lld\n", "threads", 26, last.threads);
            std::printf("%-28s %12.1f %12.2f\n", "context switches / s", 1.7,
                        static_cast<double>(last.switches - first.switches) / span);
            std::printf("%-28s %12.4f %12.4f\n", "CPU seconds / s", 0.0004, (last.cpuSeconds - first.cpuSeconds) / span);
            std::printf("%-28s %12.1f %12.1f\n", "RSS MiB", 11.0, static_cast<double>(last.rssKiB) / 1024.0);
            std::printf("threads by name:");
            for (const auto& [name, count] : last.names) std::printf(" %s x%d;", name.c_str(), count);
            std::printf("\n");
        }
        return rc;
    });
}
