// Every port, fixed path and time-out of the service in one place. The daemon runs on the
// defaults; tests point a Config at ephemeral ports, temporary folders and short time-outs.
#pragma once

#include <chrono>
#include <cstddef>
#include <string>

namespace kesu {

struct Config {
    // Local control API (this service's own HTTP server).
    std::string controlHost = "127.0.0.1";
    int controlPort = 9197;
    std::size_t controlMaxBody = 1 << 20;      // larger bodies are refused unread
    int controlThreads = 16;                   // some handlers block for a whole connection
    std::chrono::seconds controlReadTimeout{5};

    // PC suite's local HTTP server, telemetry collector and the local push client.
    std::string pcsuiteHost = "127.0.0.1";
    int pcsuitePort = 9199;
    int buryPointUdpPort = 9997;
    int pushClientUdpPort = 13601;

    // Phone-side TCP port (both directions) and LAN discovery.
    int phoneTcpPort = 10191;
    int ssdpPort = 2200;
    std::string ssdpGroup = "239.255.255.250";

    // Watchdog of the control server.
    std::chrono::milliseconds httpWatchdogPeriod{120000};
    std::chrono::milliseconds httpRestartPause{3000};
    std::chrono::milliseconds httpAliveTimeout{20000};

    // Outbound HTTP.
    std::chrono::milliseconds httpRequestTimeout{20000};
    std::chrono::milliseconds http429Pause{3000};

    // Fixed paths of the PC suite's bundle, before KESU_ROOT is applied.
    std::string versionFile =
        "/Applications/pcsuite.app/Contents/Resources/kesuesService/config/version.txt";
    std::string serviceExecutable =
        "/Applications/pcsuite.app/Contents/Resources/kesuesService/KesuConnService/KesuConnService";
    std::string switchHostIni = "/Library/Preferences/pcsuite/switch_host.ini";

    std::string defaultConnectCenterUrl = "https://connect-center.kesu.example/";

    // The process-wide configuration. Set it up before anything is started.
    static Config& current();
};

// A fixed absolute path of the service, resolved below $KESU_ROOT when that is set.
std::string rootedPath(const std::string& absolutePath);

// The user's home directory, from $HOME (the password database when unset).
std::string homeDirectory();

}  // namespace kesu
