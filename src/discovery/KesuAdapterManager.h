// The network adapter monitor: keeps one discovery socket per active adapter (Wi-Fi and
// Ethernet), rebuilds a socket when its adapter's address changes or when the service has
// stopped hearing its own announcement, publishes the network events, and announces the PC
// on every adapter socket.
#pragma once

#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "discovery/SsdpSocket.h"
#include "discovery/SsdpSocketManager.h"

namespace kesu {

class KesuAdapterManager {
public:
    // Created on first use by the discovery start-up, never destroyed.
    static KesuAdapterManager& instance();

    // Takes the first adapter snapshot and opens a socket per present adapter, without
    // publishing anything. The sockets hand their datagrams to `receiver` (the discovery
    // classification when empty).
    explicit KesuAdapterManager(SsdpSocket::Receiver receiver = {});
    ~KesuAdapterManager();
    KesuAdapterManager(const KesuAdapterManager&) = delete;
    KesuAdapterManager& operator=(const KesuAdapterManager&) = delete;

    // Snapshot, the own-announcement clock restarted, one socket per present adapter.
    void creatAdapterSocket();
    // Power state of the Wi-Fi adapter; false when there is none.
    bool isWiFiEnabled();
    // One adapter check: Wi-Fi power events, adapters added, removed or readdressed (with
    // their events and socket rebuilds), and the rebuild of every socket when the service
    // has not heard its own announcement for the self-echo time-out.
    void checkNetWorkStatus();
    // Announces the PC once on every adapter socket.
    void sendSsdp();

    // Closes every socket and forgets the adapters and the Wi-Fi state, as before
    // creatAdapterSocket (orderly stop).
    void shutdown();
    // Whether creatAdapterSocket ran since the last shutdown.
    bool isActive() const;
    // Ends the pause of a socket rebuild at once, and every later one until resumePauses
    // (so that a stop does not wait for it).
    void interruptPauses();
    void resumePauses();

    // ---- State, for the service's own checks and tests -----------------------------------
    // Interface names that hold a socket manager.
    std::vector<std::string> socketInterfaces() const;
    std::shared_ptr<SsdpSocketManager> managerFor(const std::string& interfaceName) const;
    // The last adapter snapshot: "Wi-Fi" / "Ethernet" -> IPv4 address ("" when none).
    std::map<std::string, std::string> networkStatus() const;

private:
    void creatAdapterSocketLocked();
    // A new manager with a socket on `interfaceName`, stored as `kind`'s socket.
    void addSocket(const std::string& kind, const std::string& interfaceName);
    // Drops `kind`'s socket (wherever it was opened) and any manager held under
    // `interfaceName`, pauses, and opens a new one on `interfaceName`.
    void rebuildSocket(const std::string& kind, const std::string& interfaceName);
    // Closes and forgets the socket of `kind`; returns the interface it was on.
    std::string removeSocket(const std::string& kind, const std::string& fallbackName);
    void dropManager(const std::string& interfaceName);
    void logInterface(const std::string& kind, const std::string& interfaceName);
    void statusLine(const std::map<std::string, std::string>& snapshot);
    void pause();

    const SsdpSocket::Receiver receiver_;

    // Serialises the whole of a check, an announcement pass, a (re)start and a shutdown.
    std::mutex checkMutex_;
    // Guards the fields below for readers on other threads; never held while publishing,
    // pausing or closing a socket.
    mutable std::mutex lock_;
    std::map<std::string, std::shared_ptr<SsdpSocketManager>> ssdpManager;  // interface name -> manager
    std::map<std::string, std::string> netStatus;                            // kind -> address
    std::map<std::string, std::string> socketInterface_;  // kind -> interface its socket is on
    bool wifiSwitch = false;
    bool active_ = false;

    std::mutex pauseMutex_;
    std::condition_variable pauseCv_;
    bool pauseInterrupted_ = false;
};

}  // namespace kesu
