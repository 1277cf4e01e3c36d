#include "connect/ConnectionState.h"

#include <atomic>
#include <mutex>

#include "core/Log.h"

namespace kesu {

namespace {

// The flags and counters: lock-free.
std::atomic<long long> seqNo{-1};
std::atomic<bool> isAllowQtWindow{false};
std::atomic<bool> isAutoConnFlag{false};
std::atomic<bool> isCanConnectDevice{true};
std::atomic<bool> isCanPrimaryConnectDevice{true};
std::atomic<bool> wlanConnState{false};

// The device types, under one lock.
std::mutex textLock;
std::string connectingDeviceType;
std::string primaryConnectDeviceType;

std::string readText(const std::string& text) {
    std::lock_guard<std::mutex> guard(textLock);
    return text;
}

void writeText(std::string& text, const std::string& value) {
    std::lock_guard<std::mutex> guard(textLock);
    text = value;
}

}  // namespace

long long ConnectionState::getNfcLanConnectSeqNo() { return seqNo.fetch_add(1, std::memory_order_relaxed) + 1; }

bool ConnectionState::getIsAllowWindow() { return isAllowQtWindow.load(); }

void ConnectionState::setIsAllowWindow(bool isAllow) { isAllowQtWindow.store(isAllow); }

bool ConnectionState::getThisPhoneAutoConnect() { return isAutoConnFlag.load(); }

void ConnectionState::setThisPhoneAutoConnect(bool thisPhoneAutoConnect) { isAutoConnFlag.store(thisPhoneAutoConnect); }

bool ConnectionState::getIsCanConnectDevice() { return isCanConnectDevice.load(); }

void ConnectionState::setIsCanConnectDevice(bool isCanConnect) {
    isCanConnectDevice.store(isCanConnect);
    Log::mPrintlog(std::string("setIsCanConnectDevice ") + (isCanConnect ? "true" : "false") + " ...");
}

bool ConnectionState::tryClaimConnectDevice() {
    bool expected = true;
    if (!isCanConnectDevice.compare_exchange_strong(expected, false)) return false;
    Log::mPrintlog("setIsCanConnectDevice false ...");
    return true;
}

std::string ConnectionState::getConnectingDeviceType() { return readText(connectingDeviceType); }

void ConnectionState::setConnectingDeviceType(const std::string& type) {
    writeText(connectingDeviceType, type);
    Log::mPrintlog("setConnectingDeviceType is " + type + " ...");
}

bool ConnectionState::getIsCanPrimaryConnectDevice() { return isCanPrimaryConnectDevice.load(); }

void ConnectionState::setIsCanPrimaryConnectDevice(bool isCan) { isCanPrimaryConnectDevice.store(isCan); }

bool ConnectionState::tryClaimPrimaryConnectDevice() {
    bool expected = true;
    return isCanPrimaryConnectDevice.compare_exchange_strong(expected, false);
}

std::string ConnectionState::getPrimaryConnectDeviceType() { return readText(primaryConnectDeviceType); }

void ConnectionState::setPrimaryConnectDeviceType(const std::string& type) {
    writeText(primaryConnectDeviceType, type);
    Log::mPrintlog("setPrimaryConnectDeviceType is " + type + " ...");
}

bool ConnectionState::getWlanConnState() { return wlanConnState.load(); }

void ConnectionState::setWlanConnState(bool state) { wlanConnState.store(state); }

void ConnectionState::resetForTest() {
    seqNo.store(-1);
    isAllowQtWindow.store(false);
    isAutoConnFlag.store(false);
    isCanConnectDevice.store(true);
    isCanPrimaryConnectDevice.store(true);
    wlanConnState.store(false);
    writeText(connectingDeviceType, "");
    writeText(primaryConnectDeviceType, "");
}

}  // namespace kesu
