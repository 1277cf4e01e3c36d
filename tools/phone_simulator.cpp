// phone_simulator: plays a phone on the local network, by hand or from end-to-end tests.
//
// UDP side: announces itself on the multicast group 239.255.255.250:2200 through the interface
// that owns --iface-ip, in the current (base64 JSON) or old (plain fields) format, and can print
// the PC announcements it hears. TCP side: listens for a PC's connection request and answers
// it, or sends its own connection request to a PC and prints the answer.
//
// Flags:
//   --iface-ip IP        local IPv4 address of the interface to announce and listen on (required
//                        for the UDP side)
//   --name N --id I --account A --openid O --guide G
//                        announced values (defaults: "kesu Sim Phone", "SIMPHONE01",
//                        "13800000000", "sim-open-id", "1")
//   --type mobile|pad    announced device type (default mobile)
//   --format current|old announcement format (default current)
//   --announce-every S   seconds between announcements; 0 = announce once (default: no
//                        announcements)
//   --listen             print every PC announcement heard:  "SIM PC_ANNOUNCE <json>"
//   --tcp-port P         listen for connection requests on P (default: none; 10191 is usual)
//   --answer accept|reject|busy|silent
//                        answer to a PC's request (default accept); prints
//                        "SIM TCP_REQUEST <body>" and "SIM TCP_ANSWERED <tag>"
//   --preconnect answer|silent|garbage|half|huge|hangup
//                        with --tcp-port: play a phone of the account that a PC pre-connects;
//                        its request ([22]) gets a reply ([23] with --openid and --id, or a
//                        broken one) and the link is held; prints "SIM TCP_ANSWERED 23";
//                        a fresh link's request gets --answer only when that is given
//   --held-answer accept|reject|busy|silent
//                        with --preconnect: answer to a connection request ([0]) on a held
//                        link (default: none)
//   --ask-connect-after S  with --preconnect: S seconds after the start, ask the PC over every
//                        held link to be connected ([24]); prints "SIM PRECONNECT_ASKED"
//   --close-after S      with --tcp-port: close every link S seconds after the start; prints
//                        "SIM LINKS_CLOSED"
//   --connect HOST:PORT  send a connection request to a PC; prints "SIM TCP_ANSWER <body>"
//                        (bodies are printed on one line, JSON compacted)
//   --service S          service id of that request (default com.kesu.pcsuite.SERVICE)
//   --duration S         run for S seconds then exit (default 30, at most 3600)
//   --help
// Every line of output is flushed at once; "SIM READY" tells that the sockets are set up.
#include <poll.h>

#include <algorithm>
#include <chrono>
#include <iostream>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include <nlohmann/json.hpp>

#include "phonesim/PhoneSimulator.h"

namespace {

using Clock = std::chrono::steady_clock;
using namespace kesu::phonesim;

struct Options {
    std::string ifaceIp;
    Identity phone;
    std::string format = "current";
    int announceEvery = -1;
    bool listen = false;
    int tcpPort = 0;
    std::string answer;  // accept, or silent for a pre-connecting phone
    std::string heldAnswer;
    std::string connect;
    std::string service = "com.kesu.pcsuite.SERVICE";
    std::string preconnect;
    int askConnectAfter = -1;
    int closeAfter = -1;
    int duration = 30;
};

// Lines come from the main thread and the listener's thread.
std::mutex& outputMutex() {
    static std::mutex mutex;
    return mutex;
}

void say(const std::string& line) {
    std::lock_guard<std::mutex> lock(outputMutex());
    std::cout << "SIM " << line << std::endl;
}

// A frame body on one line: JSON compacted (answers may come pretty-printed), other text as is.
std::string oneLine(const std::string& body) {
    auto j = nlohmann::json::parse(body, nullptr, false);
    if (!j.is_discarded()) return j.dump();
    std::string text = body;
    std::replace(text.begin(), text.end(), '\n', ' ');
    return text;
}

void usage() {
    std::cout << "phone_simulator [--iface-ip IP] [--name N] [--id I] [--account A] [--openid O]\n"
                 "  [--guide G] [--type mobile|pad] [--format current|old] [--announce-every S]\n"
                 "  [--listen] [--tcp-port P] [--answer accept|reject|busy|silent]\n"
                 "  [--preconnect answer|silent|garbage|half|huge|hangup] [--held-answer A] [--ask-connect-after S]\n"
                 "  [--close-after S] [--connect HOST:PORT] [--service S] [--duration S] [--help]\n";
}

bool parse(int argc, char** argv, Options& o) {
    std::map<std::string, std::string*> text{{"--iface-ip", &o.ifaceIp}, {"--name", &o.phone.name},
        {"--id", &o.phone.id}, {"--account", &o.phone.account}, {"--openid", &o.phone.openId},
        {"--guide", &o.phone.guide}, {"--type", &o.phone.type}, {"--format", &o.format}, {"--answer", &o.answer},
        {"--connect", &o.connect}, {"--service", &o.service}, {"--preconnect", &o.preconnect},
        {"--held-answer", &o.heldAnswer}};
    std::map<std::string, int*> number{{"--announce-every", &o.announceEvery}, {"--tcp-port", &o.tcpPort},
        {"--duration", &o.duration}, {"--ask-connect-after", &o.askConnectAfter}, {"--close-after", &o.closeAfter}};
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        if (a == "--help") return usage(), false;
        if (a == "--listen") { o.listen = true; continue; }
        if (i + 1 >= argc) { std::cerr << "missing value for " << a << "\n"; return false; }
        if (auto t = text.find(a); t != text.end()) { *t->second = argv[++i]; continue; }
        if (auto n = number.find(a); n != number.end()) {
            try { *n->second = std::stoi(argv[++i]); } catch (...) { std::cerr << "bad number for " << a << "\n"; return false; }
            continue;
        }
        std::cerr << "unknown flag " << a << "\n";
        usage();
        return false;
    }
    if (o.duration < 1 || o.duration > 3600) o.duration = 30;
    return true;
}

// Prints what a listening phone does on its links.
void sayEvent(const Listener::Event& event) {
    switch (event.kind) {
    case Listener::Event::Kind::Accepted: say("TCP_ACCEPTED"); break;
    case Listener::Event::Kind::Request: say("TCP_REQUEST " + oneLine(event.body)); break;
    case Listener::Event::Kind::Answered: say("TCP_ANSWERED " + std::to_string(event.tag)); break;
    case Listener::Event::Kind::Closed: say("TCP_CLOSED"); break;
    }
}

// Sends our own connection request to the PC and prints the first answer frame (bounded wait).
void connectToPc(const Options& o, Clock::time_point deadline) {
    const auto colon = o.connect.rfind(':');
    if (colon == std::string::npos) { say("CONNECT_BAD_TARGET"); return; }
    std::string error;
    const auto link = Link::dial(o.connect.substr(0, colon), std::atoi(o.connect.c_str() + colon + 1), error);
    if (!link) {
        say(error == "bad target" ? "CONNECT_BAD_TARGET" : "CONNECT_FAILED " + error);
        return;
    }
    const nlohmann::json request = connectRequest(o.phone, o.service);
    if (!link->send(kesu::buildPhoneFrameFromJson(request))) { say("CONNECT_FAILED write"); return; }
    say("TCP_SENT " + request.dump());
    std::string body;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    switch (link->read(body, std::max(left, std::chrono::milliseconds(0)))) {
    case Link::Got::Frame: say("TCP_ANSWER " + oneLine(body)); break;
    case Link::Got::Closed: say("TCP_CLOSED"); break;
    case Link::Got::TimedOut: break;
    }
}

}  // namespace

int main(int argc, char** argv) {
    Options o;
    if (!parse(argc, argv, o)) return argc > 1 && std::string(argv[1]) == "--help" ? 0 : 2;
    const auto deadline = Clock::now() + std::chrono::seconds(o.duration);

    std::unique_ptr<Announcer> udp;
    if (!o.ifaceIp.empty() && (o.listen || o.announceEvery >= 0)) {
        udp = std::make_unique<Announcer>(o.ifaceIp, o.listen);
        if (!udp->ok()) { say("UDP_SETUP_FAILED " + udp->error()); return 1; }
    }
    std::unique_ptr<Listener> listener;
    if (o.tcpPort > 0) {
        Listener::Options options;
        options.host = "0.0.0.0";
        options.port = o.tcpPort;
        options.answer = answerNamed(o.answer).value_or(Answer::Accept);
        if (!o.preconnect.empty()) {
            const auto mode = preconnectModeNamed(o.preconnect);
            if (!mode) { std::cerr << "unknown --preconnect mode " << o.preconnect << "\n"; return 2; }
            if (o.answer.empty()) options.answer = Answer::Silent;
            if (!o.heldAnswer.empty()) {
                options.heldAnswer = answerNamed(o.heldAnswer);
                if (!options.heldAnswer) { std::cerr << "unknown --held-answer " << o.heldAnswer << "\n"; return 2; }
            }
            options.preconnect = PreconnectReply{*mode, o.phone.openId, o.phone.id, ""};
        }
        listener = std::make_unique<Listener>(options, sayEvent);
        if (!listener->ok()) { say("TCP_SETUP_FAILED " + listener->error()); return 1; }
    }
    say("READY");
    if (!o.connect.empty()) connectToPc(o, deadline);

    const auto started = Clock::now();
    auto after = [&](int seconds) { return seconds < 0 ? Clock::time_point::max() : started + std::chrono::seconds(seconds); };
    auto askAt = listener && !o.preconnect.empty() ? after(o.askConnectAfter) : Clock::time_point::max();
    auto closeAt = listener ? after(o.closeAfter) : Clock::time_point::max();
    auto nextAnnounce = Clock::now();
    bool announcedOnce = false;
    while (Clock::now() < deadline) {
        if (Clock::now() >= askAt) {
            say(listener->sendToAll(R"({"bytes":[24]})") ? "PRECONNECT_ASKED" : "PRECONNECT_ASK_FAILED");
            askAt = Clock::time_point::max();
        }
        if (Clock::now() >= closeAt) {
            listener->closeAll();
            say("LINKS_CLOSED");
            closeAt = Clock::time_point::max();
        }
        if (udp && o.announceEvery >= 0 && Clock::now() >= nextAnnounce && !(o.announceEvery == 0 && announcedOnce)) {
            const std::string error = udp->announce(o.phone, o.format == "old");
            say(error.empty() ? "ANNOUNCED" : "ANNOUNCE_FAILED " + error);
            announcedOnce = true;
            nextAnnounce = Clock::now() + std::chrono::seconds(std::max(o.announceEvery, 1));
        }
        auto wake = deadline;
        if (udp && o.announceEvery > 0) wake = std::min(wake, nextAnnounce);
        wake = std::min({wake, askAt, closeAt});
        const auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(wake - Clock::now()).count();
        pollfd heard{udp && o.listen ? udp->fd() : -1, POLLIN, 0};
        if (::poll(&heard, 1, static_cast<int>(std::clamp<long long>(ms, 0, 1000))) > 0 && (heard.revents & POLLIN))
            for (const std::string& line : udp->receive()) say(line);
    }
    listener.reset();
    udp.reset();
    say("DONE");
    return 0;
}
