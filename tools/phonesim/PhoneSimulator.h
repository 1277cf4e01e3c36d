// A simulated phone for the tests, the benchmarks and tools/phone_simulator: announces itself
// on the multicast group, answers a PC's connection request (accept, reject, busy, silence,
// hang-up, echo), sends its own connection request and reads the PC's answer. Blocking calls
// with time-outs and one serving thread per listening phone: this is a test peer, not part of
// the service.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include <nlohmann/json.hpp>

#include "connect/PhoneFrame.h"

namespace kesu::phonesim {

// What the phone tells about itself.
struct Identity {
    std::string name = "kesu Sim Phone";
    std::string id = "SIMPHONE01";
    std::string account = "13800000000";
    std::string openId = "sim-open-id";
    std::string guide = "1";
    std::string type = "mobile";  // or "pad"
};

// The phone's own connection request to a PC for `service`.
nlohmann::json connectRequest(const Identity& phone, const std::string& service);
// The phone's announcement datagram, in the current (base64 JSON) or old (plain fields) format.
std::string announcement(const Identity& phone, bool oldFormat);

// The multicast side: announcements out through the interface that owns `ifaceIp`, and (when
// listening) what PCs announce.
class Announcer {
public:
    // Check ok() after construction; `error` tells why not.
    Announcer(const std::string& ifaceIp, bool listen);
    ~Announcer();
    Announcer(const Announcer&) = delete;
    Announcer& operator=(const Announcer&) = delete;

    bool ok() const { return fd_ >= 0; }
    const std::string& error() const { return error_; }
    int fd() const { return fd_; }
    // "" when sent, else the error.
    std::string announce(const Identity& phone, bool oldFormat);
    // Reads one datagram and describes it: {"PC_ANNOUNCE_FROM <ip>", "PC_ANNOUNCE <json>"} for a
    // PC's announcement, {"UDP_OTHER <ip>"} or {"UDP_BAD_ENVELOPE <ip>"}, nothing for a phone's.
    std::vector<std::string> receive();

private:
    int fd_ = -1;
    std::string error_;
};

// One TCP link from the phone's side.
class Link {
public:
    explicit Link(int fd);
    ~Link();
    Link(const Link&) = delete;
    Link& operator=(const Link&) = delete;

    // Connects to ip:port (numeric IPv4); null with `error` set when that fails.
    static std::unique_ptr<Link> dial(const std::string& ip, int port, std::string& error);

    bool send(const Bytes& bytes);
    bool sendFrame(std::string_view body) { return send(buildPhoneFrame(body)); }

    enum class Got { Frame, TimedOut, Closed };
    // The next whole frame's body. Closed once the peer closed (or reset) the link and every
    // frame before it was handed out.
    Got read(std::string& body, std::chrono::milliseconds timeout);
    // True when the peer closed the link with no further frame.
    bool closedByPeer(std::chrono::milliseconds timeout);

private:
    int fd_;
    FrameCutter cutter_{1 << 20};
};

// How a listening phone answers a PC's connection request.
enum class Answer {
    Accept,  // [1]
    Reject,  // [2]
    Busy,    // [11]
    Silent,  // says nothing, keeps the link until the PC closes it
    HangUp,  // closes the link as soon as the request arrived
    Echo,    // sends the request frame back (a raw round trip)
};
// "accept", "reject", "busy", "silent"; nullopt for any other name.
std::optional<Answer> answerNamed(const std::string& name);

// How a phone of the account answers a PC's pre-connect request ([22]); the link is then held.
struct PreconnectReply {
    enum class Mode {
        Answer,     // [23] with the account and identity below (or `body`)
        Silent,     // says nothing
        Garbage,    // bytes that are no frame
        HalfFrame,  // a frame header announcing more body than is ever sent
        Huge,       // a frame announcing a body over 1 MiB, and sending it
        HangUp,     // closes the link
    } mode = Mode::Answer;
    std::string openId = "sim-open-id";  // "open_Id": the phone's account
    std::string targetId = "SIMPHONE01";  // "target_id": its first 4 characters make the device key
    std::string body;                     // when set, the [23] body sent as is
};
// "answer", "silent", "garbage", "half", "huge", "hangup"; nullopt for any other name.
std::optional<PreconnectReply::Mode> preconnectModeNamed(const std::string& name);
// The phone's [23] reply body.
nlohmann::json preconnectReplyBody(const PreconnectReply& reply);

// A phone listening for PCs' connection requests; each link gets one answer (for its first
// request) and is kept until the PC closes it. With `preconnect` set, a PC's pre-connect
// request gets that reply instead, and the held link can be driven from the test (send,
// flood, close); connection requests on it get `heldAnswer`.
class Listener {
public:
    struct Options {
        std::string host = "127.0.0.1";  // "0.0.0.0" for every interface
        int port = 0;                    // 0: an ephemeral port
        Answer answer = Answer::Accept;
        std::string answerBody;          // when set, the body sent instead of {"bytes":[tag]}
        std::size_t maxLinks = 16;
        std::optional<PreconnectReply> preconnect;
        // How a connection request ([0]) on a held pre-connected link is answered (each one);
        // unset: not at all. A link without a pre-connect request gets `answer`.
        std::optional<Answer> heldAnswer;
    };
    struct Event {
        enum class Kind { Accepted, Request, Answered, Closed } kind;
        std::string body;    // Request: the request's body
        int tag = 0;         // Answered: the tag sent (0 for a custom body or an echo)
        bool byPc = false;   // Closed: the PC closed the link (else the phone hung up)
    };

    // Binds and listens at once (in the caller's network namespace), serves on a thread of its
    // own. Check ok() afterwards. `onEvent` runs on the serving thread.
    explicit Listener(Options options, std::function<void(const Event&)> onEvent = {});
    ~Listener();  // stops serving and closes every link
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    bool ok() const { return listenFd_ >= 0; }
    const std::string& error() const { return error_; }
    int port() const { return port_; }

    // The body of the next request received; nullopt when none came in time.
    std::optional<std::string> request(std::chrono::milliseconds timeout);
    // True once the PC closed a link it had sent a request on.
    bool pcClosed(std::chrono::milliseconds timeout);
    // The number of links open now.
    std::size_t links();
    // Sends a frame with `body` on every open link, `times` times each; false when no link
    // took it. Waits until the serving thread has done it (bounded).
    bool sendToAll(const std::string& body, int times = 1);
    // Closes every link: an orderly close, or a reset (RST) when `reset`.
    void closeAll(bool reset = false);

private:
    struct Peer;
    using Command = std::function<void(std::vector<Peer>&)>;
    // Runs `command` on the serving thread and waits for it (bounded).
    bool run(Command command);
    void answerPreconnect(Peer& peer);
    // Answers one connection request as `how` says; false when the link is to be closed.
    bool answerRequest(Peer& peer, Answer how, const Bytes& request);
    void serve();
    void report(const Event& event);
    bool onData(Peer& peer);

    Options options_;
    std::function<void(const Event&)> onEvent_;
    int listenFd_ = -1;
    int stopFd_ = -1;
    int commandFd_ = -1;
    std::deque<std::pair<Command, std::shared_ptr<std::promise<void>>>> commands_;  // guarded by mutex_
    std::size_t linkCount_ = 0;                                                   // guarded by mutex_
    int port_ = 0;
    std::string error_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<std::string> requests_;  // guarded by mutex_
    std::deque<bool> closes_;           // guarded by mutex_: byPc of each close after a request
    std::thread thread_;
};

}  // namespace kesu::phonesim
