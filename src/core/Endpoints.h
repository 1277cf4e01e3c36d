// Where the service's peers answer: the PC suite's HTTP listener, the service's own control
// server and the connect center (whose address a host override file may change).
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace kesu {

class Endpoints {
public:
    static std::string connectCenterServerUrl();
    // An empty URL puts the configured default back.
    static void setConnectCenterServerUrl(const std::string& url);
    // Reads the host override file and takes its connect-center URL, if it names one.
    static void getConnectCenterUrl();
    // The first "ConnectionCenterHost=..." entry (up to the next blank or line end) of the
    // host override file's text; nothing when it has none.
    static std::optional<std::string> parseSwitchHost(std::string_view content);

    static std::string pcsuiteHttpServerUrl();               // http://127.0.0.1:9199/
    static std::string kesuConnHttpServerUrl();              // http://127.0.0.1:9197/
    static std::string pcsuiteHttpServerSSDPQueryAllUrl();   // .../SSDPQueryAll
    static std::string pcsuiteHttpServerPushGattClientListUrl();
    static std::string pcsuiteHttpIsConnectBusyUrl();        // .../isConnectBusy?deviceType=
    static std::string pcsuiteHttpServerNotifySystemEventUrl();
};

}  // namespace kesu
