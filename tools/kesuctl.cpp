// kesuctl: command-line client of the service's local control API.
//
// Sends one control request ("N#json" body, N the number of user-perceived characters) to
// the service, waits for the answer within a time-out and shows it readably, or as the
// service's JSON with --json. Exit codes tell scripts what happened:
//   0 ok, 1 usage error, 2 service not running, 3 timed out, 4 the service answered an
//   error, 5 malformed or missing answer.
#include <httplib.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <future>
#include <iostream>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "control/RequestEvent.h"
#include "core/Json.h"
#include "core/Text.h"

namespace {

using kesu::Json;

enum Exit { kOk = 0, kUsage = 1, kNotRunning = 2, kTimedOut = 3, kServiceError = 4, kMalformed = 5 };

constexpr double kDefaultTimeout = 70;    // a connection attempt takes up to 60 s in the service
constexpr std::size_t kMaxAnswer = 16 << 20;  // answers are small; anything this big is wrong

// How an answer is shown without --json.
enum class View { Generic, Alive, Devices, Connect, DeviceTable };

struct Command {
    std::vector<std::string> words;  // "scan", "start"
    std::string operands;            // synopsis of the operands
    std::size_t minOperands = 0;
    std::size_t maxOperands = 0;
    std::string event;
    std::string summary;
    // The request's "args" from the operands; nullopt (with a message) on a bad operand.
    std::function<std::optional<Json>(const std::vector<std::string>&)> args;
    View view = View::Generic;
};

std::optional<Json> noArgs(const std::vector<std::string>&) { return Json::array(); }
std::optional<Json> operandArgs(const std::vector<std::string>& ops) { return Json(ops); }

std::optional<Json> objectOperand(const std::vector<std::string>& ops) {
    auto value = kesu::json::parse(ops.at(0));
    if (!value || !value->is_object()) {
        std::cerr << "kesuctl: the event data must be a JSON object, e.g. '{\"eventId\":\"x\"}'\n";
        return std::nullopt;
    }
    return value;
}

// Pre-connected device connections: [id, (unused), device type].
std::optional<Json> preconnectConnectArgs(const std::vector<std::string>& ops) {
    return Json::array({ops.at(0), "", ops.size() > 1 ? ops[1] : ""});
}

const std::vector<Command>& commands() {
    static const std::vector<Command> all = {
        {{"heartbeat"}, "", 0, 0, "HeartBeat", "check that the service answers",
         [](const auto&) -> std::optional<Json> { return Json::array({0}); }, View::Alive},
        {{"devices"}, "", 0, 0, "SSDPQueryAll", "list the phones and pads found on the LAN", noArgs, View::Devices},
        {{"connect"}, "ID", 1, 1, "connectSSDP", "connect to a found device (waits up to 60 s for the phone)",
         operandArgs, View::Connect},
        {{"cancel"}, "", 0, 0, "cancelSSDPConnect", "cancel the running connection attempt", noArgs},
        {{"scan", "start"}, "", 0, 0, "startSSDPScan", "report the device list to the PC suite now", noArgs},
        {{"scan", "stop"}, "", 0, 0, "stopSSDPScan", "stop scanning (accepted, nothing to do)", noArgs},
        {{"adapters"}, "", 0, 0, "queryAdapter", "show the PC's network adapters", noArgs},
        {{"status"}, "", 0, 0, "getSystemStatus", "show firewall and related PC facts", noArgs},
        {{"agree"}, "[auto|once]", 0, 1, "QtAgree",
         "accept the phone in the allow window (auto: connect it automatically from now on)",
         [](const std::vector<std::string>& ops) -> std::optional<Json> {
             if (ops.empty()) return Json::array();
             if (ops[0] != "auto" && ops[0] != "once") {
                 std::cerr << "kesuctl: agree takes auto or once, not '" << ops[0] << "'\n";
                 return std::nullopt;
             }
             return Json::array({ops[0] == "auto" ? "true" : "false"});
         }},
        {{"refuse"}, "", 0, 0, "QtRefuse", "refuse the phone waiting in the allow window", noArgs},
        {{"preconnect", "list"}, "", 0, 0, "preconnect_startScan",
         "list the account's devices ready for pre-connection (waits up to 5 s)", noArgs, View::DeviceTable},
        {{"preconnect", "pick"}, "ID", 1, 1, "preconnect_preconnect", "pre-connect one device now", operandArgs},
        {{"preconnect", "connect"}, "ID [TYPE]", 1, 2, "preconnect_connect",
         "connect over a held pre-connection (TYPE: phone or pad)", preconnectConnectArgs, View::Connect},
        {{"preconnect", "pick-connect"}, "ID [TYPE]", 1, 2, "preconnect_preconnect-connect",
         "pre-connect a device, then connect over it", preconnectConnectArgs, View::Connect},
        {{"preconnect", "disconnect"}, "ID", 1, 1, "preconnect_disconnect", "drop a held pre-connection",
         operandArgs},
        {{"preconnect", "cancel"}, "", 0, 0, "preconnect_cancel", "cancel the running pre-connected connection",
         noArgs},
        {{"preconnect", "center"}, "", 0, 0, "preconnect_enterConnectCenter",
         "tell the service that the connect center page opened", noArgs},
        {{"account", "set"}, "OPENID TOKEN PHONE STORAGE_DIR", 4, 4, "accountChange",
         "sign the service in with an account", operandArgs},
        {{"account", "signout"}, "", 0, 0, "accountChange", "sign the service out",
         [](const auto&) -> std::optional<Json> { return Json::array({"", "", "", ""}); }},
        {{"history", "phone"}, "ID", 1, 1, "historyPhoneChange", "set the last connected phone",
         [](const std::vector<std::string>& ops) -> std::optional<Json> { return Json::array({ops[0], "phone"}); }},
        {{"history", "pad"}, "ID", 1, 1, "historyPhoneChange", "set the last connected pad",
         [](const std::vector<std::string>& ops) -> std::optional<Json> { return Json::array({ops[0], "pad"}); }},
        {{"wifi", "on"}, "", 0, 0, "enable", "switch Wi-Fi on", noArgs},
        {{"wifi", "settings"}, "", 0, 0, "open", "open the network settings", noArgs},
        {{"center", "report"}, "JSON", 1, 1, "connectCenterEventReport", "report an event to the connect center",
         objectOperand},
        {{"center", "create"}, "JSON", 1, 1, "connectCenterEventCreate", "create an event at the connect center",
         objectOperand},
    };
    return all;
}

// Events that answer with an empty body by design.
bool answersEmpty(const std::string& event) {
    using kesu::RequestEvent;
    switch (kesu::requestEventFrom(event)) {
        case RequestEvent::queryAll:
        case RequestEvent::stopSSDPScan:
        case RequestEvent::openWifi:
        case RequestEvent::LaunchSuccess:
        case RequestEvent::AlreadyStart:
        case RequestEvent::unknown:
            return true;
        default:
            return false;
    }
}

std::string joined(const std::vector<std::string>& words) {
    std::string out;
    for (const auto& w : words) out += (out.empty() ? "" : " ") + w;
    return out;
}

void printUsage(std::ostream& out) {
    out << "usage: kesuctl [--json] [--timeout SECONDS] [--host HOST] [--port PORT] COMMAND [ARG...]\n"
           "\n"
           "Talks to the service's local control API (default 127.0.0.1:9197).\n"
           "\n"
           "commands:\n";
    std::vector<std::pair<std::string, std::string>> lines;
    for (const auto& c : commands())
        lines.emplace_back(joined(c.words) + (c.operands.empty() ? "" : " " + c.operands), c.summary);
    lines.emplace_back("call EVENT [ARGS_JSON]", "send any control event, its args given as JSON (default [])");
    lines.emplace_back("help [COMMAND]", "show this text, or one command's");
    std::size_t width = 0;
    for (const auto& [left, right] : lines) width = std::max(width, left.size());
    for (const auto& [left, right] : lines) out << "  " << left << std::string(width - left.size() + 2, ' ') << right << "\n";
    out << "\n"
           "options:\n"
           "  --json             print the service's JSON answer as it came\n"
           "  --timeout SECONDS  give up after this long (default 70)\n"
           "  --host HOST        control API address (default $KESUCTL_HOST or 127.0.0.1)\n"
           "  --port PORT        control API port (default $KESUCTL_PORT or 9197)\n"
           "\n"
           "exit codes: 0 ok, 1 usage error, 2 service not running, 3 timed out,\n"
           "            4 the service answered an error, 5 malformed or missing answer\n";
}

// Readable form of outside text: control characters (terminal escapes included) and invalid
// UTF-8 become "?".
std::string printable(const std::string& s) {
    std::string out;
    for (std::string_view g : kesu::text::graphemes(s)) {
        const auto b0 = static_cast<unsigned char>(g[0]);
        const bool control = (g.size() == 1 && (b0 < 0x20 || b0 == 0x7f)) ||
                             (g.size() == 2 && b0 == 0xc2 && static_cast<unsigned char>(g[1]) < 0xa0);
        out += control || !kesu::text::isValidUtf8(g) ? std::string_view("?") : g;
    }
    return out;
}

std::string cell(const Json& j) {
    if (j.is_null()) return "";
    if (j.is_array() && std::all_of(j.begin(), j.end(), [](const Json& e) { return e.is_string(); })) {
        std::string out;  // a list of addresses reads as "a, b"
        for (const auto& e : j) out += (out.empty() ? "" : ", ") + printable(e.get<std::string>());
        return out;
    }
    return printable(j.is_string() ? j.get<std::string>() : kesu::json::compact(j));
}

void printTable(const std::vector<std::string>& head, const std::vector<std::vector<std::string>>& rows) {
    std::vector<std::size_t> width(head.size());
    for (std::size_t i = 0; i < head.size(); ++i) width[i] = head[i].size();
    for (const auto& r : rows)
        for (std::size_t i = 0; i < r.size(); ++i) width[i] = std::max(width[i], kesu::text::graphemeCount(r[i]));
    auto line = [&](const std::vector<std::string>& r) {
        std::string out;
        for (std::size_t i = 0; i < r.size(); ++i) {
            out += r[i];
            if (i + 1 < r.size()) out += std::string(width[i] - kesu::text::graphemeCount(r[i]) + 2, ' ');
        }
        std::cout << out << "\n";
    };
    line(head);
    for (const auto& r : rows) line(r);
}

void printDevices(const Json& list, bool withIp) {
    if (!list.is_array() || list.empty()) {
        std::cout << "no devices\n";
        return;
    }
    std::vector<std::vector<std::string>> rows;
    for (const auto& d : list) {
        if (!d.is_object()) continue;
        std::vector<std::string> r{cell(d.value("deviceId", Json())), cell(d.value("deviceName", Json()))};
        if (withIp) r.push_back(cell(d.value("ip", Json())));
        r.push_back(cell(d.value("deviceType", Json())));
        rows.push_back(std::move(r));
    }
    if (withIp) printTable({"ID", "NAME", "IP", "KIND"}, rows);
    else printTable({"ID", "NAME", "KIND"}, rows);
}

void printGeneric(const Json& answer) {
    const std::string message = cell(answer.value("error_message", Json()));
    if (!answer.contains("data")) {
        std::cout << (message.empty() ? "ok" : message) << "\n";
        return;
    }
    const Json& data = answer["data"];
    if (data.is_object()) {
        std::size_t width = 0;
        for (const auto& [k, v] : data.items()) width = std::max(width, printable(k).size());
        for (const auto& [k, v] : data.items())
            std::cout << printable(k) << std::string(width - printable(k).size() + 2, ' ') << cell(v) << "\n";
    } else if (data.is_array() && !data.empty() && data[0].is_object()) {
        printDevices(data, false);
    } else if (data.is_array() && data.empty()) {
        std::cout << "no devices\n";
    } else {
        const std::string text = cell(data);
        std::cout << (text.empty() ? (message.empty() ? "ok" : message) : text) << "\n";
    }
}

// The answer's error number: "error", else "code"; 0 when neither is there.
long long errorOf(const Json& answer) {
    for (const char* key : {"error", "code"}) {
        if (!answer.contains(key)) continue;
        const Json& v = answer[key];
        if (v.is_number_integer()) return v.get<long long>();
        if (v.is_number()) return v.get<double>() == 0 ? 0 : -1;
        if (v.is_string()) {
            const std::string s = v.get<std::string>();
            return !s.empty() && s.find_first_not_of('0') == std::string::npos ? 0 : -1;
        }
        return -1;
    }
    return 0;
}

std::string errorText(const Json& answer) {
    std::string message = cell(answer.value("error_message", Json()));
    if (message.empty()) message = cell(answer.value("errir_message", Json()));
    std::string out = "error " + std::to_string(errorOf(answer));
    if (!message.empty()) out += ": " + message;
    if (answer.contains("connection_steps")) out += " (steps " + cell(answer["connection_steps"]) + ")";
    return out;
}

struct Options {
    bool json = false;
    double timeout = kDefaultTimeout;
    std::string host = "127.0.0.1";
    int port = 9197;
    std::vector<std::string> words;  // the command and its operands
};

std::optional<int> parsePort(const std::string& s) {
    char* end = nullptr;
    const long v = std::strtol(s.c_str(), &end, 10);
    if (s.empty() || *end != '\0' || v < 1 || v > 65535) return std::nullopt;
    return static_cast<int>(v);
}

// Parses the options (anywhere on the line) and collects the rest; a message and false on
// a usage error.
bool parseOptions(int argc, char** argv, Options& o) {
    if (const char* h = std::getenv("KESUCTL_HOST"); h && *h) o.host = h;
    if (const char* p = std::getenv("KESUCTL_PORT"); p && *p) {
        auto port = parsePort(p);
        if (!port) {
            std::cerr << "kesuctl: KESUCTL_PORT must be a port number (1-65535), not '" << p << "'\n";
            return false;
        }
        o.port = *port;
    }
    bool optionsEnded = false;
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        if (optionsEnded || a.size() < 2 || a.compare(0, 2, "--") != 0) {
            o.words.push_back(a);
            continue;
        }
        if (a == "--") {
            optionsEnded = true;
            continue;
        }
        std::string value;
        bool hasValue = false;
        if (auto eq = a.find('='); eq != std::string::npos) {
            value = a.substr(eq + 1);
            a = a.substr(0, eq);
            hasValue = true;
        }
        if (a == "--json" || a == "--help") {
            if (hasValue) {
                std::cerr << "kesuctl: " << a << " takes no value\n";
                return false;
            }
            if (a == "--help") o.words.insert(o.words.begin(), "help");
            else o.json = true;
            continue;
        }
        if (a != "--timeout" && a != "--host" && a != "--port") {
            std::cerr << "kesuctl: unknown option " << a << " (see kesuctl --help)\n";
            return false;
        }
        if (!hasValue) {
            if (i + 1 >= argc) {
                std::cerr << "kesuctl: " << a << " needs a value\n";
                return false;
            }
            value = argv[++i];
        }
        if (a == "--timeout") {
            char* end = nullptr;
            const double t = std::strtod(value.c_str(), &end);
            if (value.empty() || *end != '\0' || !(t > 0) || t > 86400) {
                std::cerr << "kesuctl: --timeout takes seconds (more than 0, at most 86400), not '" << value
                          << "'\n";
                return false;
            }
            o.timeout = t;
        } else if (a == "--host") {
            if (value.empty()) {
                std::cerr << "kesuctl: --host needs a host name or address\n";
                return false;
            }
            o.host = value;
        } else {
            auto port = parsePort(value);
            if (!port) {
                std::cerr << "kesuctl: --port takes a port number (1-65535), not '" << value << "'\n";
                return false;
            }
            o.port = *port;
        }
    }
    return true;
}

struct Exchange {
    httplib::Error error = httplib::Error::Success;
    int status = 0;
    std::string body;
    bool tooLarge = false;
};

// Posts the body and waits for the answer until the deadline; nullopt when it passed.
std::optional<Exchange> post(const Options& o, const std::string& body) {
    auto client = std::make_shared<httplib::Client>(o.host, o.port);
    const auto whole = std::chrono::duration<double>(o.timeout);
    const auto seconds = static_cast<time_t>(o.timeout);
    const auto micros = static_cast<time_t>((o.timeout - static_cast<double>(seconds)) * 1e6);
    client->set_connection_timeout(seconds, micros);
    // The socket waits a little longer than the deadline below, which is what decides.
    client->set_read_timeout(seconds + 1, micros);
    client->set_write_timeout(seconds + 1, micros);
    client->set_keep_alive(false);

    auto exchange = std::make_shared<Exchange>();
    auto request = std::make_shared<httplib::Request>();
    request->method = "POST";
    request->path = "/";
    request->body = body;
    request->set_header("Content-Type", "text/plain");
    request->content_receiver = [exchange](const char* data, size_t n, uint64_t, uint64_t) {
        if (exchange->body.size() + n > kMaxAnswer) {
            exchange->tooLarge = true;
            return false;
        }
        exchange->body.append(data, n);
        return true;
    };
    std::packaged_task<void()> task([client, request, exchange] {
        auto result = client->send(*request);
        exchange->error = result.error();
        if (result) exchange->status = result->status;
    });
    auto done = task.get_future();
    std::thread(std::move(task)).detach();
    if (done.wait_for(whole) == std::future_status::timeout) {
        client->stop();
        return std::nullopt;
    }
    return *exchange;
}

int usageError(const std::string& message) {
    std::cerr << "kesuctl: " << message << " (see kesuctl --help)\n";
    return kUsage;
}

int run(int argc, char** argv) {
    Options o;
    if (!parseOptions(argc, argv, o)) return kUsage;
    if (o.words.empty()) {
        printUsage(std::cerr);
        return kUsage;
    }

    const std::string& first = o.words[0];
    if (first == "help") {
        if (o.words.size() == 1) {
            printUsage(std::cout);
            return kOk;
        }
        const std::string topic = joined({o.words.begin() + 1, o.words.end()});
        bool found = false;
        for (const auto& c : commands()) {
            const std::string name = joined(c.words);
            if (name != topic && c.words[0] != topic) continue;
            found = true;
            std::cout << "kesuctl " << name << (c.operands.empty() ? "" : " " + c.operands) << "\n    "
                      << c.summary << "\n    sends the event \"" << c.event << "\"\n";
        }
        if (topic == "call") {
            found = true;
            std::cout << "kesuctl call EVENT [ARGS_JSON]\n    sends EVENT (a control event name, exact case) with "
                         "ARGS_JSON as its \"args\" (default [])\n";
        }
        return found ? kOk : usageError("no command '" + topic + "'");
    }

    std::string event;
    Json args = Json::array();
    View view = View::Generic;
    std::string target;  // the device a command is about
    std::string commandName = first;
    if (first == "call") {
        if (o.words.size() < 2 || o.words.size() > 3) return usageError("usage: kesuctl call EVENT [ARGS_JSON]");
        event = o.words[1];
        commandName = event;
        if (kesu::requestEventFrom(event) == kesu::RequestEvent::unknown && event != "unknown") {
            std::string names;
            for (auto e : kesu::allValues()) names += " " + std::string(kesu::rawValue(e));
            return usageError("no control event '" + event + "'; the events are:" + names);
        }
        if (o.words.size() == 3) {
            auto parsed = kesu::json::parse(o.words[2]);
            if (!parsed) return usageError("ARGS_JSON is not JSON: " + o.words[2]);
            args = *parsed;
        }
    } else {
        const Command* match = nullptr;
        std::size_t used = 0;
        for (const auto& c : commands()) {
            if (c.words.size() > o.words.size()) continue;
            if (std::equal(c.words.begin(), c.words.end(), o.words.begin())) {
                match = &c;
                used = c.words.size();
                break;
            }
        }
        if (!match) {
            std::string choices;
            for (const auto& c : commands())
                if (c.words.size() > 1 && c.words[0] == first) choices += " " + c.words[1];
            if (!choices.empty()) return usageError(first + " needs one of:" + choices);
            return usageError("unknown command '" + first + "'");
        }
        const std::vector<std::string> operands(o.words.begin() + static_cast<std::ptrdiff_t>(used), o.words.end());
        if (operands.size() < match->minOperands || operands.size() > match->maxOperands)
            return usageError("usage: kesuctl " + joined(match->words) +
                              (match->operands.empty() ? "" : " " + match->operands));
        auto built = match->args(operands);
        if (!built) return kUsage;
        event = match->event;
        args = *built;
        if (!operands.empty()) target = operands[0];
        commandName = joined(match->words);
        view = match->view;
    }

    const std::string envelope = Json{{"event", event}, {"args", args}}.dump();
    const std::string where = o.host + ":" + std::to_string(o.port);
    const auto exchange = post(o, kesu::text::lengthPrefixed(envelope));
    if (!exchange) {
        std::cerr << "kesuctl: no answer from the service at " << where << " within " << o.timeout
                  << " s (--timeout)\n";
        std::cout.flush();
        std::cerr.flush();
        std::_Exit(kTimedOut);  // the request thread may still be blocked; nothing left to clean up
    }
    if (exchange->tooLarge) {
        std::cerr << "kesuctl: malformed answer: larger than " << (kMaxAnswer >> 20) << " MiB\n";
        return kMalformed;
    }
    if (exchange->error == httplib::Error::Connection) {
        std::cerr << "kesuctl: the service is not running (nothing accepts connections at " << where << ")\n";
        return kNotRunning;
    }
    if (exchange->error == httplib::Error::ConnectionTimeout) {
        std::cerr << "kesuctl: no answer from the service at " << where << " within " << o.timeout << " s\n";
        return kTimedOut;
    }
    if (exchange->error != httplib::Error::Success) {
        std::cerr << "kesuctl: no answer from the service at " << where << ": " << httplib::to_string(exchange->error)
                  << "\n";
        return kMalformed;
    }
    if (exchange->status != 200) {
        std::cerr << "kesuctl: malformed answer: HTTP status " << exchange->status << "\n";
        return kMalformed;
    }

    const std::string& body = exchange->body;
    if (body.empty()) {
        if (answersEmpty(event)) {
            if (!o.json) std::cout << "ok\n";
            return kOk;
        }
        std::cerr << "kesuctl: the service sent an empty answer to \"" << event
                  << "\" (it does so when the parameters are not usable)\n";
        return kMalformed;
    }
    // "N#json", N the number of user-perceived characters of the JSON text.
    const auto hash = body.find('#');
    const std::string count = body.substr(0, hash == std::string::npos ? 0 : hash);
    const std::string text = hash == std::string::npos ? std::string() : body.substr(hash + 1);
    if (hash == std::string::npos || count.empty() || count.size() > 12 ||
        count.find_first_not_of("0123456789") != std::string::npos ||
        std::stoull(count) != kesu::text::graphemeCount(text)) {
        std::cerr << "kesuctl: malformed answer: no valid length prefix: " << printable(body.substr(0, 80)) << "\n";
        return kMalformed;
    }
    const auto answer = kesu::json::parse(text);
    if (!answer || !answer->is_object()) {
        std::cerr << "kesuctl: malformed answer: not a JSON object: " << printable(text.substr(0, 80)) << "\n";
        return kMalformed;
    }

    const bool failed = errorOf(*answer) != 0;
    if (o.json) {
        std::cout << text << (text.back() == '\n' ? "" : "\n");
    } else if (failed) {
        std::cerr << "kesuctl: " << commandName << " failed: " << errorText(*answer) << "\n";
    } else {
        switch (view) {
            case View::Alive:
                std::cout << "the service at " << where << " is alive\n";
                break;
            case View::Devices:
                printDevices(answer->value("data", Json::array()), true);
                break;
            case View::DeviceTable:
                printDevices(answer->value("data", Json::array()), false);
                break;
            case View::Connect:
                std::cout << "connected to " << printable(target);
                if (const Json data = answer->value("data", Json()); data.is_string() && !data.empty())
                    std::cout << " at " << cell(data);
                if (answer->contains("connection_steps"))
                    std::cout << " (steps " << cell((*answer)["connection_steps"]) << ")";
                std::cout << "\n";
                break;
            case View::Generic:
                printGeneric(*answer);
                break;
        }
    }
    if (failed && o.json)
        std::cerr << "kesuctl: the service answered " << errorText(*answer) << "\n";
    return failed ? kServiceError : kOk;
}

}  // namespace

int main(int argc, char** argv) {
    try {
        return run(argc, argv);
    } catch (const std::exception& e) {
        std::cerr << "kesuctl: " << e.what() << "\n";
        return kMalformed;
    }
}
