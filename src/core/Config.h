// Every port, fixed path and time-out of the service in one place. The daemon runs on the
// defaults; tests point a Config at ephemeral ports, temporary folders and short time-outs.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>

namespace kesu {

struct Config {
    // Largest size of one day's log file. A line that would take the file past it is not
    // written there (one notice line says so); standard output still gets every line, and
    // the next day's file starts afresh. Anyone on the LAN can make the service log, so the
    // file must not grow without bound.
    std::uintmax_t logFileMaxBytes = std::uintmax_t{64} << 20;

    // Local control API (this service's own HTTP server).
    std::string controlHost = "127.0.0.1";
    int controlPort = 9197;
    std::size_t controlMaxBody = 1 << 20;      // larger bodies are refused unread
    int controlThreads = 16;                   // some handlers block for a whole connection
    std::chrono::seconds controlReadTimeout{5};

    // PC suite's local HTTP server and the local push client.
    std::string pcsuiteHost = "127.0.0.1";
    int pcsuitePort = 9199;
    int pushClientUdpPort = 13601;
    // The local telemetry collector (datagrams to 127.0.0.1).
    int telemetryUdpPort = 9997;

    // Phone-side TCP port (both directions) and LAN discovery.
    int phoneTcpPort = 10191;
    // Largest phone frame body accepted from a phone; a frame announcing more is dropped.
    std::size_t phoneFrameMaxBody = 1 << 20;
    // Connections with phones. A PC-initiated request waits activeConnectTimeout for the
    // phone's answer. The server for phone-initiated requests listens on
    // phoneServerHost:phoneServerPort (port 0: an ephemeral one, for tests), gives a new link
    // phoneLinkReadTimeout to deliver its request (then closes it), holds at most
    // phoneServerMaxLinks links at once, gives an answer phoneAnswerWriteTimeout to leave,
    // and waits allowWindowTimeout for the user's answer in the allow window.
    std::chrono::milliseconds activeConnectTimeout{30000};
    std::string phoneServerHost = "0.0.0.0";
    int phoneServerPort = 10191;
    std::chrono::milliseconds phoneLinkReadTimeout{10000};
    std::chrono::milliseconds phoneAnswerWriteTimeout{5000};
    std::size_t phoneServerMaxLinks = 16;
    std::chrono::milliseconds allowWindowTimeout{15000};
    int ssdpPort = 2200;
    std::string ssdpGroup = "239.255.255.250";
    // Discovered-device table: an entry not heard for longer than the expiry goes at the
    // next sweep; at most ssdpMaxDevices entries are kept (the one heard longest ago makes
    // room for a new one).
    std::chrono::milliseconds ssdpDeviceExpiry{30000};
    std::size_t ssdpMaxDevices = 1024;
    // Adapter monitor: one adapter check and announcement pass per period; a socket is
    // rebuilt after a pause; all sockets are rebuilt when the service has not heard its own
    // announcement for the self-echo time-out.
    std::chrono::milliseconds ssdpAnnouncePeriod{5000};
    std::chrono::milliseconds ssdpRebuildPause{1000};
    std::chrono::milliseconds ssdpSelfEchoTimeout{60000};
    // Largest discovery datagram read; a longer one is dropped unread.
    std::size_t ssdpMaxDatagram = 65535;

    // How long preconnect_startScan waits for the cloud device list to fill the registry.
    std::chrono::milliseconds preconnectScanWait{5000};
    // Pre-connection: each address of a device gets preconnectConnectTimeout to accept the
    // link, the handshake's request and reply preconnectHandshakeTimeout each. A held link
    // keeps at most preconnectQueueMaxFrames frames (and preconnectQueueMaxBytes) of the
    // phone's for the connect flow, none older than preconnectQueueMaxAge; at most
    // preconnectMaxPendingRequests requests of the phone wait for their answer. TCP keep-alive
    // on held links: first probe after the idle time, then every interval, given up after
    // the count.
    // The scheduler tries one device per period; a user's request to pre-connect one device
    // waits for the outcome up to preconnectUserWait.
    std::chrono::milliseconds preconnectPeriod{1000};
    // A connection over a held link: the request's send and the phone's answer get their own
    // window each, the fallback on a fresh link its own.
    std::chrono::milliseconds connectFlowSendTimeout{3000};
    std::chrono::milliseconds connectFlowAnswerTimeout{3000};
    std::chrono::milliseconds connectFlowFallbackTimeout{5000};
    std::chrono::milliseconds preconnectUserWait{60000};
    std::chrono::milliseconds preconnectConnectTimeout{3000};
    std::chrono::milliseconds preconnectHandshakeTimeout{3000};
    std::size_t preconnectQueueMaxFrames = 64;
    std::size_t preconnectQueueMaxBytes = 4 << 20;
    std::chrono::milliseconds preconnectQueueMaxAge{120000};
    std::size_t preconnectMaxPendingRequests = 8;
    int preconnectKeepAliveIdle = 30;
    int preconnectKeepAliveInterval = 10;
    int preconnectKeepAliveProbes = 3;

    // Screen-lock watcher period, and the longer one used while the machine cannot tell
    // whether the screen is locked (no login manager or no user session).
    std::chrono::milliseconds screenLockPeriod{3000};
    std::chrono::milliseconds screenLockUnknownPeriod{60000};

    // Device-list reports to the PC suite: the pause after a change (a burst of changes goes
    // as one list), the least time between two lists of one kind, and the period of the
    // sweep that drops discovered devices not heard for ssdpDeviceExpiry: it runs only while
    // the table holds devices, at the next device's expiry, and at least once per period.
    std::chrono::milliseconds reportDelay{1000};
    std::chrono::milliseconds reportThrottle{3000};
    std::chrono::milliseconds expirySweepPeriod{30000};

    // Watchdog of the control server.
    std::chrono::milliseconds httpWatchdogPeriod{120000};
    std::chrono::milliseconds httpRestartPause{3000};
    std::chrono::milliseconds httpAliveTimeout{20000};

    // Outbound HTTP.
    std::chrono::milliseconds httpRequestTimeout{20000};
    std::chrono::milliseconds http429Pause{3000};
    // Requests that wait for the answer without a time-out of their own (bury points, busy
    // checks, device lists, system events) use the HTTP client's default limit.
    std::chrono::milliseconds httpWaitTimeout{60000};
    std::size_t httpMaxAnswerBody = 16 << 20;  // larger answers are dropped unread
    std::string caCertPath;                    // extra trusted CA file for https; empty: system store

    // Fixed paths of the PC suite's bundle, before KESU_ROOT is applied.
    std::string versionFile =
        "/Applications/pcsuite.app/Contents/Resources/kesuesService/config/version.txt";
    std::string serviceExecutable =
        "/Applications/pcsuite.app/Contents/Resources/kesuesService/KesuConnService/KesuConnService";
    std::string switchHostIni = "/Library/Preferences/pcsuite/switch_host.ini";
    // Programs of phone-initiated connections: the allow window, the PC suite itself, and the
    // receive folder handed to the sharing application when the account names none.
    std::string connectStatusExecutable =
        "/Applications/pcsuite.app/Contents/Resources/ConnectStatus/ConnectStatus.app/Contents/MacOS/ConnectStatus";
    std::string pcsuiteExecutable = "/Applications/pcsuite.app/Contents/MacOS/pcsuite";
    std::string shareReceiveFolder = "/Users/recvFile";

    // PC suite's account database: the monitor's modification-time poll, and how long one
    // read waits for the PC suite's write lock before it gives up (the old values stay).
    // While change notification watches the folder, the poll is only a safety net and runs
    // every fileMonitorWatchedPeriod instead.
    std::chrono::milliseconds fileMonitorPeriod{3000};
    std::chrono::milliseconds fileMonitorWatchedPeriod{60000};
    std::chrono::milliseconds databaseBusyTimeout{1000};

    std::string defaultConnectCenterUrl = "https://connect-center.kesu.example/";

    // Operating-system locations and limits of the Linux platform layer (tests may point the
    // locations at a prepared tree). A system tool that is missing or fails is not asked
    // again before platformToolRetry has passed.
    std::string sysfsRoot = "/sys";
    std::string procRoot = "/proc";
    std::string machineInfoFile = "/etc/machine-info";
    std::string ufwConfigFile = "/etc/ufw/ufw.conf";
    std::chrono::milliseconds platformCommandTimeout{2000};
    // The PC's name and hardware address, which every connection request carries, are read
    // again once they are this old.
    std::chrono::milliseconds identityCacheLifetime{5000};
    std::chrono::milliseconds platformToolRetry{60000};

    // The process-wide configuration. Set it up before anything is started.
    static Config& current();
};

// A fixed absolute path of the service, resolved below $KESU_ROOT when that is set.
std::string rootedPath(const std::string& absolutePath);

// The user's home directory, from $HOME (the password database when unset).
std::string homeDirectory();

}  // namespace kesu
