// Process-wide helpers: logging, time, text conversions, the shared flags and URLs, and thin
// wrappers over the platform layer. Used only through static members.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace kesu {

enum class submoduleName { ConnectName };
std::string rawValue(submoduleName name);  // "/KesuConnService_log/KesuConnService_"

class Utils {
public:
    using Clock = std::chrono::system_clock;

    static inline const std::string versionCode = "3.6.1.0";
    static inline const std::string moduleName = "KesuConnService";
    static constexpr int logTimeOut = 14;  // log files stay up to this many days

    // ---- Logging and time --------------------------------------------------------------
    // The service's only logging call: one line to standard output and to the day's file.
    static void mPrintlog(const std::string& output);
    // Flushes and closes the day's file (it is reopened by the next message).
    static void closeLog();
    static void deleteOldLogFile();
    static void writeConnServiceVersion(const std::string& version);
    static std::string getNowTime();          // local "yyyy-MM-dd HH:mm:ss.SSS"
    static double currentTimeStamp();         // seconds since 1970, with fraction
    static Clock::time_point now();
    // Replaces the clock (tests); an empty function puts the system clock back.
    static void setClock(std::function<Clock::time_point()> clock);

    static std::string logDirectory();                 // .../pcsuite/log/KesuConnService_log
    static std::string logFilePath(Clock::time_point at);  // the file named by the GMT date
    static std::string libraryBase();                  // home + "/Library/"

    // ---- Processes and files -----------------------------------------------------------
    static bool startProcess(const std::string& launchPath, const std::vector<std::string>& arguments,
                             int& exitCode);
    static bool isAppRunning(const std::string& appName);
    static bool isFileExist(const std::string& filePath);
    static void readFile(const std::string& filePath, std::string& fileContent);
    // Starts a fresh copy of the service in place of this process. Returns only when that
    // could not be done, in which case this process keeps running.
    static void restartService();

    // ---- Identity and counters ---------------------------------------------------------
    static long long getNfcLanConnectSeqNo();
    static std::string getLocalName();
    static std::string getFullLocalName();
    static std::string paramAddMask(const std::string& str);
    static std::string getMacAddress();
    static std::string getBluetoothMacAddress();
    static std::map<std::string, std::string> GetPcSystemInfo();

    // ---- Network state -----------------------------------------------------------------
    static std::map<std::string, std::string> getNetworkCorrespondAddress();
    static std::vector<std::map<std::string, std::string>> GetNetworkInfoList();
    static bool MacWifiNetworkAvailability();
    static bool MacEthernetNetworkAvailability();
    static std::string SsidWifiName();
    static bool SsidWifiCondition();
    static std::string GetWifiName();
    static std::string GetEthernetName();
    static bool isVpnOn();
    static std::optional<bool> getFirewallState();
    static bool isScreenUnlocked();
    static bool pingAddress(const std::string& ip, int timeoutSeconds);

    // ---- Actions -----------------------------------------------------------------------
    static bool openWifi();
    static std::string openWlanSetting();
    static void getConnectCenterUrl();
    // The first "ConnectionCenterHost=..." entry (up to the next blank or line end) of the
    // host override file's text; nothing when it has none.
    static std::optional<std::string> parseSwitchHost(std::string_view content);

    // ---- Text conversions --------------------------------------------------------------
    static std::string uintToHexString(const std::string& value);
    static std::string asciiToString(const std::vector<std::uint8_t>& inBody);

    // ---- Shared flags and URLs (thread-safe) -------------------------------------------
    static bool getIsAllowWindow();
    static void setIsAllowWindow(bool isAllow);
    static bool getThisPhoneAutoConnect();
    static void setThisPhoneAutoConnect(bool thisPhoneAutoConnect);
    static bool getIsCanConnectDevice();
    static void setIsCanConnectDevice(bool isCanConnect);
    // Claims the PC-initiated connection slot: true when it was free and is now taken.
    static bool tryClaimConnectDevice();
    static std::string getConnectingDeviceType();
    static void setConnectingDeviceType(const std::string& type);
    static bool getIsCanPrimaryConnectDevice();
    static void setIsCanPrimaryConnectDevice(bool isCan);
    static bool tryClaimPrimaryConnectDevice();
    static std::string getPrimaryConnectDeviceType();
    static void setPrimaryConnectDeviceType(const std::string& type);
    static bool getWlanConnState();
    static void setWlanConnState(bool state);

    static std::string connectCenterServerUrl();
    static void setConnectCenterServerUrl(const std::string& url);
    static std::string pcsuiteHttpServerUrl();                // http://127.0.0.1:9199/
    static std::string kesuConnHttpServerUrl();               // http://127.0.0.1:9197/
    static std::string pcsuiteHttpServerSSDPQuerryAllUrl();   // .../SSDPQueryAll
    static std::string pcsuiteHttpServerPushGattClientListUrl();
    static std::string pcsuiteHttpIsConnectBusyUrl();         // .../isConnectBusy?deviceType=
    static std::string pcsuiteHttpServerNotifySystemEventUrl();

    // Resets the flags and counters to their start values (tests).
    static void resetStateForTest();

    // ---- Requests to the PC suite ----
    // Frames a non-empty text as "N#text" (N its count of user-perceived characters) into
    // `finalStr`; false, and nothing framed, for an empty text.
    static bool RebuildEventData(const std::string& str, std::string& finalStr);
    // Posts a list-shape bury-point text to the PC suite; true when it answered "000000".
    static bool sendBuryPoint(const std::string& data);
    // Asks the PC suite whether a device of `deviceType` may connect. A PC suite that does
    // not answer counts as "connectable". When busy, the PC suite's connected device type
    // and connection status are handed back.
    static bool isDeviceConnectable(const std::string& deviceType, std::string& respondDeviceType,
                                    std::string& connectStatus);
    // Asks the PC suite whether it is already connected to a phone; true with the number of
    // its "N#..." answer in `responseCode`.
    static bool isConnectToPhoneAlready(int& responseCode);
    // Sends a HeartBeat to the service's own control server; true when it answered.
    static bool isHttpAlive();
    // Sends `data` with `method` to `url`; true when an answer came back. `response` is
    // left as it is.
    static bool httpMsgSend(const std::string& data, const std::string& url, const std::string& method,
                            std::string& response);
    // ---- end of requests to the PC suite ----
};

}  // namespace kesu
