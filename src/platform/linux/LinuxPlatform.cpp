#include "platform/linux/LinuxPlatform.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <net/if_arp.h>
#include <netinet/in.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>

#include "core/Config.h"
#include "core/Process.h"
#include "core/Text.h"

namespace kesu {

namespace fs = std::filesystem;

namespace {

using SteadyClock = std::chrono::steady_clock;

// ---- Small file helpers ----------------------------------------------------------------------

// A small file's whole text (sysfs attributes, /proc entries, configuration files).
std::optional<std::string> readSmallFile(const std::string& path, std::size_t limit = 1 << 20) {
    std::ifstream in(path, std::ios::binary);
    if (!in) return std::nullopt;
    std::string text;
    char buffer[4096];
    while (text.size() < limit && in.read(buffer, sizeof buffer).gcount() > 0)
        text.append(buffer, static_cast<std::size_t>(in.gcount()));
    if (in.bad()) return std::nullopt;
    return text;
}

std::string readTrimmed(const std::string& path) { return text::trim(readSmallFile(path).value_or("")); }

bool exists(const std::string& path) {
    std::error_code ec;
    return fs::exists(path, ec);
}

// The value of `key` in a "KEY=value" file, with shell-style quotes removed.
std::optional<std::string> keyValue(const std::string& content, const std::string& key) {
    std::istringstream lines(content);
    for (std::string line; std::getline(lines, line);) {
        line = text::trim(line);
        if (line.rfind(key + "=", 0) != 0) continue;
        std::string value = line.substr(key.size() + 1);
        if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front()) {
            const char quote = value.front();
            value = value.substr(1, value.size() - 2);
            if (quote == '"') {
                std::string unescaped;
                for (std::size_t i = 0; i < value.size(); ++i) {
                    if (value[i] == '\\' && i + 1 < value.size()) ++i;
                    unescaped.push_back(value[i]);
                }
                value = unescaped;
            }
        }
        return value;
    }
    return std::nullopt;
}

std::string lowerAscii(std::string s) {
    std::transform(s.begin(), s.end(), s.begin(), [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return s;
}

// Turns "\xNN" escapes (as `iw` prints non-printable SSID bytes) back into bytes.
std::string unescapeHexBytes(const std::string& s) {
    std::string out;
    for (std::size_t i = 0; i < s.size(); ++i) {
        if (s[i] == '\\' && i + 3 < s.size() && s[i + 1] == 'x' && std::isxdigit(static_cast<unsigned char>(s[i + 2])) &&
            std::isxdigit(static_cast<unsigned char>(s[i + 3]))) {
            out.push_back(static_cast<char>(std::stoi(s.substr(i + 2, 2), nullptr, 16)));
            i += 3;
        } else {
            out.push_back(s[i]);
        }
    }
    return out;
}

// ---- System tools ----------------------------------------------------------------------------

// One external program. Its location is looked up once per retry period, and a query that
// fails (time-out, or a non-zero exit where only success answers) keeps it silent for that
// period, so that callers polling every few seconds never spawn a program that cannot answer.
class Tool {
public:
    explicit Tool(std::string name) : name_(std::move(name)) {}

    bool installed() {
        std::lock_guard<std::mutex> guard(lock_);
        return locateLocked().has_value();
    }

    // Standard output of a successful run (exit status 0), else nullopt.
    std::optional<std::string> run(const std::vector<std::string>& args) {
        auto result = invoke(args, Mode::SuccessOnly);
        if (!result || result->exitStatus != 0) return std::nullopt;
        return std::move(result->output);
    }

    // The exit status of a query whose status is its answer; nullopt when it cannot answer.
    std::optional<int> status(const std::vector<std::string>& args) {
        const auto result = invoke(args, Mode::AnyStatus);
        if (!result) return std::nullopt;
        return result->exitStatus;
    }

    // Runs an action the user asked for (never silenced); true when it exited with 0.
    bool act(const std::vector<std::string>& args) {
        const auto result = invoke(args, Mode::Action);
        return result && result->exitStatus == 0;
    }

private:
    enum class Mode { SuccessOnly, AnyStatus, Action };

    std::optional<process::RunResult> invoke(const std::vector<std::string>& args, Mode mode) {
        std::optional<std::string> path;
        {
            std::lock_guard<std::mutex> guard(lock_);
            if (mode != Mode::Action && failedAt_ &&
                SteadyClock::now() - *failedAt_ < Config::current().platformToolRetry)
                return std::nullopt;
            path = locateLocked();
            if (!path) return std::nullopt;
        }
        auto result = process::run(*path, args, Config::current().platformCommandTimeout, {"LC_ALL=C"});
        const bool failed = !result || result->timedOut || (mode == Mode::SuccessOnly && result->exitStatus != 0);
        if (mode != Mode::Action) {
            std::lock_guard<std::mutex> guard(lock_);
            if (failed) failedAt_ = SteadyClock::now();
            else failedAt_.reset();
        }
        if (!result || result->timedOut) return std::nullopt;
        return result;
    }

    std::optional<std::string> locateLocked() {
        const auto now = SteadyClock::now();
        if (!lookedUpAt_ || now - *lookedUpAt_ >= Config::current().platformToolRetry) {
            path_ = process::findProgram(name_);
            lookedUpAt_ = now;
        }
        return path_;
    }

    std::string name_;
    std::mutex lock_;
    std::optional<std::string> path_;
    std::optional<SteadyClock::time_point> lookedUpAt_;
    std::optional<SteadyClock::time_point> failedAt_;
};

// ---- Network links from sysfs --------------------------------------------------------------

enum class LinkKind { Wifi, WiredPhysical, WiredVirtual, Other };

struct Link {
    std::string name;
    int index = 0;
    unsigned flags = 0;
    LinkKind kind = LinkKind::Other;
    std::string hwAddress;
};

std::string netClassDir() { return Config::current().sysfsRoot + "/class/net"; }

LinkKind classify(const std::string& dir, const std::string& name) {
    const std::string devType = keyValue(readSmallFile(dir + "/uevent").value_or(""), "DEVTYPE").value_or("");
    if (exists(dir + "/wireless") || exists(dir + "/phy80211") || devType == "wlan") return LinkKind::Wifi;

    int type = -1;
    try {
        type = std::stoi(readTrimmed(dir + "/type"));
    } catch (...) {
        return LinkKind::Other;
    }
    if (type != ARPHRD_ETHER) return LinkKind::Other;  // loopback, IP tunnels, ...
    // Bridges, bonds, VLANs, VXLANs and the like carry a DEVTYPE; tap devices have tun_flags;
    // ifb and dummy devices never carry traffic of their own.
    if (!devType.empty() || exists(dir + "/bridge") || exists(dir + "/tun_flags")) return LinkKind::Other;
    if (name.rfind("ifb", 0) == 0 || name.rfind("dummy", 0) == 0) return LinkKind::Other;
    return exists(dir + "/device") ? LinkKind::WiredPhysical : LinkKind::WiredVirtual;
}

std::vector<Link> readLinks() {
    std::vector<Link> links;
    std::error_code ec;
    const std::string base = netClassDir();
    for (fs::directory_iterator it(base, ec), end; !ec && it != end; it.increment(ec)) {
        Link link;
        link.name = it->path().filename().string();
        const std::string dir = base + "/" + link.name;
        try {
            link.index = std::stoi(readTrimmed(dir + "/ifindex"));
            link.flags = static_cast<unsigned>(std::stoul(readTrimmed(dir + "/flags"), nullptr, 16));
        } catch (...) {
            // The link vanished while being read, or is not a link: left with defaults.
        }
        link.kind = classify(dir, link.name);
        link.hwAddress = lowerAscii(readTrimmed(dir + "/address"));
        if (link.hwAddress.find_first_not_of("0:") == std::string::npos) link.hwAddress.clear();
        links.push_back(std::move(link));
    }
    std::sort(links.begin(), links.end(), [](const Link& a, const Link& b) {
        return a.index != b.index ? a.index < b.index : a.name < b.name;
    });
    return links;
}

// The adapters as the service knows them: every Wi-Fi link, and as "Ethernet" the physical
// wired links or, on a machine without any (a container or VM), the virtual wired ones.
std::vector<NetworkService> adapters() {
    const std::vector<Link> links = readLinks();
    const bool anyPhysical = std::any_of(links.begin(), links.end(),
                                         [](const Link& l) { return l.kind == LinkKind::WiredPhysical; });
    std::vector<NetworkService> services;
    for (const Link& link : links) {
        if (link.kind == LinkKind::Wifi) {
            services.push_back({"Wi-Fi", link.name, link.hwAddress});
        } else if (link.kind == LinkKind::WiredPhysical ||
                   (link.kind == LinkKind::WiredVirtual && !anyPhysical)) {
            services.push_back({"Ethernet", link.name, link.hwAddress});
        }
    }
    return services;
}

std::optional<std::string> defaultWifiInterface() {
    for (const NetworkService& service : adapters())
        if (service.displayName == "Wi-Fi") return service.bsdName;
    return std::nullopt;
}

bool linkIsUp(const std::string& name) {
    try {
        return (std::stoul(readTrimmed(netClassDir() + "/" + name + "/flags"), nullptr, 16) & IFF_UP) != 0;
    } catch (...) {
        return false;
    }
}

// Whether any Wi-Fi radio is blocked by a soft or hard kill switch.
bool wifiRadioBlocked() {
    std::error_code ec;
    const std::string base = Config::current().sysfsRoot + "/class/rfkill";
    for (fs::directory_iterator it(base, ec), end; !ec && it != end; it.increment(ec)) {
        const std::string dir = it->path().string();
        if (readTrimmed(dir + "/type") != "wlan") continue;
        if (readTrimmed(dir + "/soft") == "1" || readTrimmed(dir + "/hard") == "1") return true;
    }
    return false;
}

// nmcli's terse output escapes ':' and '\' with a backslash.
std::vector<std::string> splitTerse(const std::string& line) {
    std::vector<std::string> fields(1);
    for (std::size_t i = 0; i < line.size(); ++i) {
        if (line[i] == '\\' && i + 1 < line.size()) {
            fields.back().push_back(line[++i]);
        } else if (line[i] == ':') {
            fields.emplace_back();
        } else {
            fields.back().push_back(line[i]);
        }
    }
    return fields;
}

bool systemdRunning() { return exists("/run/systemd/system"); }

bool hasGraphicalDisplay() {
    const char* x = std::getenv("DISPLAY");
    const char* wayland = std::getenv("WAYLAND_DISPLAY");
    return (x != nullptr && *x != '\0') || (wayland != nullptr && *wayland != '\0');
}

// ---- The platform ----------------------------------------------------------------------------

class LinuxPlatform final : public Platform {
public:
    std::vector<NetworkService> networkServices() override { return adapters(); }

    std::optional<std::vector<InterfaceAddress>> interfaceAddresses() override {
        ifaddrs* list = nullptr;
        if (::getifaddrs(&list) != 0) return std::nullopt;
        std::vector<InterfaceAddress> result;
        for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
            if (entry->ifa_addr == nullptr || entry->ifa_addr->sa_family != AF_INET || entry->ifa_name == nullptr)
                continue;
            InterfaceAddress address;
            address.name = entry->ifa_name;
            address.ip = dotted(entry->ifa_addr);
            if (entry->ifa_netmask != nullptr && entry->ifa_netmask->sa_family == AF_INET)
                address.netmask = dotted(entry->ifa_netmask);
            address.up = (entry->ifa_flags & IFF_UP) != 0;
            result.push_back(std::move(address));
        }
        ::freeifaddrs(list);
        return result;
    }

    std::string localizedHostName() override {
        if (auto content = readSmallFile(Config::current().machineInfoFile)) {
            const std::string pretty = text::trim(keyValue(*content, "PRETTY_HOSTNAME").value_or(""));
            if (!pretty.empty() && text::isValidUtf8(pretty)) return pretty;
        }
        char name[HOST_NAME_MAX + 1] = {};
        if (::gethostname(name, sizeof name - 1) != 0) return "";
        const std::string host = name;
        return text::isValidUtf8(host) ? host : "";
    }

    std::string wifiSsid() override {
        const auto interface = defaultWifiInterface();
        if (!interface) return "";
        std::string ssid;
        if (iw_.installed()) {
            if (auto out = iw_.run({"dev", *interface, "link"})) {
                std::istringstream lines(*out);
                for (std::string line; std::getline(lines, line);) {
                    const std::string t = text::trim(line);
                    if (t.rfind("SSID: ", 0) == 0) {
                        ssid = unescapeHexBytes(t.substr(6));
                        break;
                    }
                }
            }
        } else if (auto out = nmcli_.run({"-t", "-f", "ACTIVE,DEVICE,SSID", "device", "wifi", "list",
                                           "--rescan", "no", "ifname", *interface})) {
            std::istringstream lines(*out);
            for (std::string line; std::getline(lines, line);) {
                const auto fields = splitTerse(line);
                if (fields.size() >= 3 && fields[0] == "yes") {
                    ssid = fields[2];
                    break;
                }
            }
        }
        // An SSID is any 32 bytes; only a text that can travel in JSON is reported.
        return text::isValidUtf8(ssid) ? ssid : "";
    }

    bool wifiPowerOn() override {
        const auto interface = defaultWifiInterface();
        if (!interface) return false;
        return !wifiRadioBlocked() && linkIsUp(*interface);
    }

    bool switchWifiOn(std::string& error) override {
        const auto interface = defaultWifiInterface();
        if (!interface) {
            error = "no Wi-Fi interface";
            return false;
        }
        if (nmcli_.installed()) {
            if (nmcli_.act({"radio", "wifi", "on"})) return true;
            error = "nmcli radio wifi on failed";
        }
        if (rfkill_.installed()) {
            if (rfkill_.act({"unblock", "wifi"})) {
                if (!linkIsUp(*interface) && ip_.installed()) ip_.act({"link", "set", *interface, "up"});
                return true;
            }
            error = "rfkill unblock wifi failed";
        }
        if (error.empty()) error = "no tool to switch Wi-Fi on (nmcli or rfkill)";
        return false;
    }

    std::string bluetoothAddress() override {
        // No controller at all: answered from sysfs without asking any tool.
        std::vector<std::string> controllers;
        std::error_code ec;
        for (fs::directory_iterator it(Config::current().sysfsRoot + "/class/bluetooth", ec), end; !ec && it != end;
             it.increment(ec)) {
            const std::string name = it->path().filename().string();
            if (name.rfind("hci", 0) == 0 && name.find(':') == std::string::npos) controllers.push_back(name);
        }
        if (controllers.empty()) return "";
        std::sort(controllers.begin(), controllers.end());
        // Older kernels publish the address as an attribute.
        const std::string attribute = lowerAscii(readTrimmed(Config::current().sysfsRoot + "/class/bluetooth/" +
                                                            controllers.front() + "/address"));
        if (!attribute.empty() && attribute.find_first_not_of("0:") != std::string::npos) return upperAscii(attribute);

        std::lock_guard<std::mutex> guard(bluetoothLock_);
        const auto now = SteadyClock::now();
        if (bluetoothCheckedAt_ && now - *bluetoothCheckedAt_ < Config::current().platformToolRetry)
            return bluetoothAddress_;
        bluetoothCheckedAt_ = now;
        bluetoothAddress_.clear();
        if (auto out = bluetoothctl_.run({"show"})) {
            std::istringstream lines(*out);
            for (std::string line; std::getline(lines, line);) {
                std::istringstream words(line);
                std::string first;
                std::string address;
                if (words >> first >> address && first == "Controller" && address.size() == 17) {
                    bluetoothAddress_ = upperAscii(address);
                    break;
                }
            }
        }
        return bluetoothAddress_;
    }

    std::vector<std::string> vpnScopedInterfaces() override {
        static const std::vector<std::string> prefixes{"tun", "tap", "ppp", "ipsec", "wg"};
        std::vector<std::string> names;
        for (const Link& link : readLinks()) {
            if ((link.flags & IFF_UP) == 0) continue;
            for (const std::string& prefix : prefixes) {
                if (link.name.rfind(prefix, 0) == 0) {
                    names.push_back(link.name);
                    break;
                }
            }
        }
        return names;
    }

    std::optional<std::string> firewallGlobalState() override {
        // ufw keeps its switch in a configuration file anyone may read.
        std::optional<bool> ufw;
        if (auto conf = readSmallFile(Config::current().ufwConfigFile)) {
            const std::string enabled = lowerAscii(text::trim(keyValue(*conf, "ENABLED").value_or("")));
            if (enabled == "yes") ufw = true;
            if (enabled == "no") ufw = false;
        }
        // firewalld answers "running" with exit status 0, "not running" with another one.
        std::optional<bool> firewalld;
        if (ufw != true && firewallCmd_.installed()) {
            if (const auto status = firewallCmd_.status({"--state"})) firewalld = (*status == 0);
        }
        if (ufw == true || firewalld == true) return std::string("1");
        if (ufw || firewalld) return std::string("0");
        return std::nullopt;
    }

    std::optional<bool> screenLocked() override {
        if (!systemdRunning() || !loginctl_.installed()) return std::nullopt;
        const auto session = userSession();
        if (!session) return std::nullopt;
        const auto out = loginctl_.run({"show-session", *session, "-p", "LockedHint", "--value"});
        if (!out) return std::nullopt;
        const std::string value = text::trim(*out);
        if (value == "yes") return true;
        if (value == "no") return false;
        return std::nullopt;
    }

    std::vector<std::string> runningApplicationNames() override {
        std::vector<std::string> names;
        std::error_code ec;
        const std::string base = Config::current().procRoot;
        for (fs::directory_iterator it(base, ec), end; !ec && it != end; it.increment(ec)) {
            const std::string pid = it->path().filename().string();
            if (pid.empty() || pid.find_first_not_of("0123456789") != std::string::npos) continue;
            const std::string name = processName(base + "/" + pid);
            if (!name.empty()) names.push_back(name);
        }
        return names;
    }

    std::optional<std::string> processList() override {
        const auto result = process::run("ps", {"-A"}, Config::current().platformCommandTimeout, {"LC_ALL=C"});
        if (!result || result->timedOut || result->exitStatus != 0) return std::nullopt;
        return result->output;
    }

    std::string hardwareModel() override {
        const std::string& sys = Config::current().sysfsRoot;
        std::string model = readTrimmed(sys + "/class/dmi/id/product_name");
        if (model.empty()) {
            model = readSmallFile(sys + "/firmware/devicetree/base/model").value_or("");
            model = text::trim(model.substr(0, model.find('\0')));
        }
        return text::isValidUtf8(model) ? model : "";
    }

    std::optional<std::string> cpuVendor() override {
        const auto cpuinfo = readSmallFile(Config::current().procRoot + "/cpuinfo", 4 << 20);
        if (!cpuinfo) return std::nullopt;
        std::istringstream lines(*cpuinfo);
        for (std::string line; std::getline(lines, line);) {
            const auto colon = line.find(':');
            if (colon == std::string::npos || text::trim(line.substr(0, colon)) != "vendor_id") continue;
            const std::string vendor = text::trim(line.substr(colon + 1));
            if (!vendor.empty()) return vendor;
        }
        return std::nullopt;
    }

    bool openNetworkSettings() override {
        if (!hasGraphicalDisplay()) return false;
        // The desktop's own network panel when one is installed, else the desktop's handler.
        static const std::vector<std::pair<std::string, std::vector<std::string>>> panels{
            {"gnome-control-center", {"network"}},
            {"systemsettings", {"kcm_networkmanagement"}},
            {"nm-connection-editor", {}},
        };
        for (const auto& [program, args] : panels) {
            if (!process::findProgram(program)) continue;
            std::string error;
            if (process::spawnDetached(program, args, error)) return true;
        }
        return xdgOpen_.act({"settings://network"});
    }

    bool ping(const std::string& ipv4, std::chrono::seconds timeout) override {
        const auto seconds = std::max<long long>(timeout.count(), 1);
        const auto result = process::run("ping", {"-n", "-c", "1", "-W", std::to_string(seconds), ipv4},
                                         std::chrono::seconds(seconds), {"LC_ALL=C"});
        // Answered within the time-out: ping ended by itself and saw the reply.
        return result && !result->timedOut && result->exitStatus == 0;
    }

private:
    static std::string dotted(const sockaddr* address) {
        char text[INET_ADDRSTRLEN] = {};
        const auto* in = reinterpret_cast<const sockaddr_in*>(address);
        if (::inet_ntop(AF_INET, &in->sin_addr, text, sizeof text) == nullptr) return "";
        return text;
    }

    static std::string upperAscii(std::string s) {
        std::transform(s.begin(), s.end(), s.begin(), [](unsigned char c) { return static_cast<char>(std::toupper(c)); });
        return s;
    }

    // The base name of a process's program: from its executable, else (another user's
    // process, unreadable) from argv[0]. Kernel threads have neither and give the empty text.
    static std::string processName(const std::string& dir) {
        std::error_code ec;
        std::string exe = fs::read_symlink(dir + "/exe", ec).string();
        if (!ec && !exe.empty()) {
            static const std::string deleted = " (deleted)";
            if (exe.size() > deleted.size() && exe.compare(exe.size() - deleted.size(), deleted.size(), deleted) == 0)
                exe.resize(exe.size() - deleted.size());
            return fs::path(exe).filename().string();
        }
        const auto cmdline = readSmallFile(dir + "/cmdline", 64 << 10);
        if (!cmdline || cmdline->empty()) return "";
        const std::string argv0 = cmdline->substr(0, cmdline->find('\0'));
        return fs::path(argv0).filename().string();
    }

    // The login session of this user, as logind names it.
    std::optional<std::string> userSession() {
        if (const char* id = std::getenv("XDG_SESSION_ID"); id != nullptr && *id != '\0') return std::string(id);
        const auto out = loginctl_.run({"show-user", std::to_string(::getuid()), "-p", "Display", "--value"});
        if (!out) return std::nullopt;
        const std::string session = text::trim(*out);
        if (session.empty()) return std::nullopt;
        return session;
    }

    Tool iw_{"iw"};
    Tool nmcli_{"nmcli"};
    Tool rfkill_{"rfkill"};
    Tool ip_{"ip"};
    Tool bluetoothctl_{"bluetoothctl"};
    Tool firewallCmd_{"firewall-cmd"};
    Tool loginctl_{"loginctl"};
    Tool xdgOpen_{"xdg-open"};

    std::mutex bluetoothLock_;
    std::optional<SteadyClock::time_point> bluetoothCheckedAt_;
    std::string bluetoothAddress_;
};

}  // namespace

std::unique_ptr<Platform> makeLinuxPlatform() { return std::make_unique<LinuxPlatform>(); }

}  // namespace kesu
