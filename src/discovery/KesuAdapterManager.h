// The network adapter monitor: keeps one discovery socket per active adapter (Wi-Fi and
// Ethernet), rebuilds a socket when its adapter's address changes or when the service has
// stopped hearing its own announcement, publishes the network events, and announces the PC
// on every adapter socket. Its state lives on the service's event loop; the public calls
// may come from any thread (they run on the loop and wait for it).
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "discovery/SsdpSocket.h"
#include "discovery/SsdpSocketManager.h"

namespace kesu {

class EventLoop;
class SsdpDeviceManager;

class KesuAdapterManager {
public:
    // Takes the first adapter snapshot and opens a socket per present adapter on the calling
    // thread (so in its network namespace), without publishing anything. The sockets run on
    // `loop` and hand their datagrams to `receiver`; when it is empty, to the discovery
    // classification into `devices`, whose clock also measures the own-echo time-out.
    // `loop` and `devices` must outlive the monitor.
    explicit KesuAdapterManager(EventLoop& loop);
    KesuAdapterManager(EventLoop& loop, SsdpDeviceManager& devices, SsdpSocket::Receiver receiver = {});
    ~KesuAdapterManager();  // shutdown()
    KesuAdapterManager(const KesuAdapterManager&) = delete;
    KesuAdapterManager& operator=(const KesuAdapterManager&) = delete;

    // Snapshot, the own-announcement wait restarted, one socket per present adapter.
    void createAdapterSocket();
    // Power state of the Wi-Fi adapter; false when there is none.
    bool isWiFiEnabled();
    // One adapter check: Wi-Fi power events, adapters added, removed or readdressed (with
    // their events and socket rebuilds), and the rebuild of every socket when the service
    // has not heard its own announcement for the self-echo time-out. A rebuilt socket is
    // opened again after the rebuild pause (a timer on the loop) and announces the PC at once.
    void checkNetWorkStatus();
    // Announces the PC once on every adapter socket.
    void sendSsdp();

    // Closes every socket, drops pending rebuilds and forgets the adapters and the Wi-Fi
    // state, as before createAdapterSocket (orderly stop).
    void shutdown();
    // Whether createAdapterSocket ran since the last shutdown.
    bool isActive();

    // ---- State, for the service's own checks and tests -----------------------------------
    // Interface names that hold a socket manager.
    std::vector<std::string> socketInterfaces();
    std::shared_ptr<SsdpSocketManager> managerFor(const std::string& interfaceName);
    // The last adapter snapshot: "Wi-Fi" / "Ethernet" -> IPv4 address ("" when none).
    std::map<std::string, std::string> networkStatus();

private:
    struct Rebuild;

    // Loop only (or the constructor).
    void createSockets();
    void check();
    void announce();
    void announceOn(SsdpSocketManager& manager);
    void shutdownNow();
    // A new manager with a socket on `interfaceName`, stored as `kind`'s socket.
    void addSocket(const std::string& kind, const std::string& interfaceName);
    // Drops `kind`'s socket (wherever it was opened) and any manager held under
    // `interfaceName`, and opens a new one on `interfaceName` after the rebuild pause.
    void rebuildSocket(const std::string& kind, const std::string& interfaceName);
    void reopen(const std::string& kind, const std::string& interfaceName);
    void cancelRebuild(const std::string& kind);
    // Closes and forgets the socket of `kind`; returns the interface it was on.
    std::string removeSocket(const std::string& kind, const std::string& fallbackName);
    void dropManager(const std::string& interfaceName);
    void logInterface(const std::string& kind, const std::string& interfaceName);
    void statusLine(const std::map<std::string, std::string>& snapshot);

    EventLoop& loop_;
    SsdpDeviceManager& devices_;
    const SsdpSocket::Receiver receiver_;

    // Loop only.
    std::map<std::string, std::shared_ptr<SsdpSocketManager>> ssdpManager;  // interface name -> manager
    std::map<std::string, std::string> netStatus;                            // kind -> address
    std::map<std::string, std::string> socketInterface_;  // kind -> interface its socket is on
    std::map<std::string, std::shared_ptr<Rebuild>> rebuilds_;  // kind -> socket waiting to reopen
    bool wifiSwitch = false;
    bool active_ = false;
    // Reset on the loop at destruction: a rebuild timer that fired meanwhile finds it gone.
    std::shared_ptr<int> alive_ = std::make_shared<int>(0);
};

}  // namespace kesu
