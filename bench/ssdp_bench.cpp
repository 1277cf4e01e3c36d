// Discovery receive path: announcements classified, parsed and stored per second on one
// core, next to baselines measured in the same run: a memcpy of the datagram, and a plain
// base64 decode + JSON parse of the same payload (the floor for any current-format parse).
//
//   build/bench/ssdp_bench [--benchmark_filter=...]
// Runs with HOME and KESU_ROOT in a temporary folder, so the log lines of the insertions go
// there and not to the user's home.
#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "BenchSupport.h"
#include "core/Json.h"
#include "core/Log.h"
#include "discovery/Base64.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpMessage.h"

namespace {

using kesu::Json;

using kesu::bench::phoneAnnouncement;

void BM_Baseline_Memcpy(benchmark::State& state) {
    const std::string datagram = phoneAnnouncement("AB12CD34EF56");
    std::vector<char> buffer(datagram.size());
    for (auto _ : state) {
        std::memcpy(buffer.data(), datagram.data(), datagram.size());
        benchmark::DoNotOptimize(buffer.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Baseline_Memcpy);

void BM_Baseline_Base64JsonParse(benchmark::State& state) {
    const std::string datagram = phoneAnnouncement("AB12CD34EF56");
    const std::string payload = datagram.substr(datagram.find("compatGsonStr:") + 14, std::string::npos);
    const std::string b64 = payload.substr(0, payload.size() - 2);
    for (auto _ : state) {
        auto text = kesu::base64::decodeStrict(b64);
        Json j = Json::parse(*text);
        benchmark::DoNotOptimize(j);
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Baseline_Base64JsonParse);

// Steady state: the same device re-announcing (classify, decode, parse, refresh).
void BM_Announcement_Refresh(benchmark::State& state) {
    kesu::SsdpDeviceManager table;
    const std::string datagram = phoneAnnouncement("AB12CD34EF56");
    for (auto _ : state) {
        benchmark::DoNotOptimize(kesu::SsdpMessage::handleDatagram(datagram, "192.168.1.20", table));
    }
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Announcement_Refresh);

// A flood of distinct ids into a full table: every datagram inserts, evicts the oldest entry
// and writes the insertion log line.
void BM_Announcement_DistinctIdsFullTable(benchmark::State& state) {
    kesu::SsdpDeviceManager table;
    std::vector<std::string> datagrams;
    // The table key comes from the first 4 characters of the id: make those differ.
    for (int i = 0; i < 4096; ++i) {
        char head[8];
        std::snprintf(head, sizeof head, "%04x", i);
        datagrams.push_back(phoneAnnouncement(std::string(head) + "-5F2C9E"));
    }
    std::size_t i = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(
            kesu::SsdpMessage::handleDatagram(datagrams[i++ % datagrams.size()], "192.168.1.20", table));
    }
    state.SetItemsProcessed(state.iterations());
    state.counters["table"] = static_cast<double>(table.ssdpDeviceMap.size());
}
BENCHMARK(BM_Announcement_DistinctIdsFullTable);

}  // namespace

int main(int argc, char** argv) {
    char pattern[] = "/tmp/ssdp_bench.XXXXXX";
    const char* scratch = ::mkdtemp(pattern);
    if (scratch == nullptr) return 1;
    ::setenv("HOME", (std::string(scratch) + "/home").c_str(), 1);
    ::setenv("KESU_ROOT", (std::string(scratch) + "/root").c_str(), 1);

    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    kesu::Log::closeLog();
    std::filesystem::remove_all(scratch);
    return 0;
}
