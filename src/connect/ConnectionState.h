// The connection slots and flags the PC-initiated, phone-initiated and pre-connect flows
// share: which flow holds the PC's connection slot, the allow window's answer, whether the
// PC is connected over the LAN, and the hand-over sequence number. Thread-safe.
#pragma once

#include <string>

namespace kesu {

class ConnectionState {
public:
    // The next hand-over sequence number (0 first).
    static long long getNfcLanConnectSeqNo();

    static bool getIsAllowWindow();
    static void setIsAllowWindow(bool isAllow);
    static bool getThisPhoneAutoConnect();
    static void setThisPhoneAutoConnect(bool thisPhoneAutoConnect);

    // The slot of the PC-initiated and phone-initiated connections.
    static bool getIsCanConnectDevice();
    static void setIsCanConnectDevice(bool isCanConnect);
    // Claims the slot: true when it was free and is now taken.
    static bool tryClaimConnectDevice();
    static std::string getConnectingDeviceType();
    static void setConnectingDeviceType(const std::string& type);

    // The slot of the connections over a held link.
    static bool getIsCanPrimaryConnectDevice();
    static void setIsCanPrimaryConnectDevice(bool isCan);
    static bool tryClaimPrimaryConnectDevice();
    static std::string getPrimaryConnectDeviceType();
    static void setPrimaryConnectDeviceType(const std::string& type);

    static bool getWlanConnState();
    static void setWlanConnState(bool state);

    // Every slot free, every flag and the counter at its start value (tests).
    static void resetForTest();
};

}  // namespace kesu
