// The idle service: threads, context switches per second, CPU seconds per second and
// resident memory of the real service left alone with one adapter and no phone, printed next
// to the figures measured before the service ran on one event loop.
//
//   build/bench/idle_bench [--seconds=N] [--settle=N]    (or KESU_IDLE_SECONDS=N)
// Needs root: the service runs in a network namespace of its own whose only adapter is a
// veth pair with an address, so that it announces itself as on a LAN and nothing leaves the
// machine. It is measured after `settle` seconds (start-up, the first reports, the control
// client's kept-alive connection timing out), over `seconds` (60 by default).
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>

#include "BenchSupport.h"

namespace {

using namespace kesu::bench;

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
            const pid_t pid = proc::serviceProcess(service.pid());
            std::this_thread::sleep_for(std::chrono::seconds(settle));
            const proc::Usage first = proc::usage(pid);
            std::this_thread::sleep_for(std::chrono::seconds(seconds));
            const proc::Rates idle = proc::between(first, proc::usage(pid));

            std::printf("idle service (pid %d), measured over %.1f s after %d s of settling\n", pid, idle.seconds,
                        settle);
            std::printf("%-28s %12s %12s\n", "", "before", "now");
            std::printf("%-28s %12d %12lld\n", "threads", 26, idle.threads);
            std::printf("%-28s %12.1f %12.2f\n", "context switches / s", 1.7, idle.switchesPerSecond);
            std::printf("%-28s %12.4f %12.4f\n", "CPU seconds / s", 0.0004, idle.cpuPerSecond);
            std::printf("%-28s %12.1f %12.1f\n", "RSS MiB", 11.0, idle.rssMiB);
            std::printf("threads by name:");
            for (const auto& [name, count] : idle.names) std::printf(" %s x%d;", name.c_str(), count);
            std::printf("\n");
        }
        return rc;
    });
}
