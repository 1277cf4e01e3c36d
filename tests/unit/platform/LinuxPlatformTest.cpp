// The Linux platform layer and process helpers: a prepared sysfs tree, real interfaces,
// real processes and pings confined to loopback (or a private network namespace as root).
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <thread>

#include "core/Process.h"
#include "core/Log.h"
#include "platform/SystemInfo.h"
#include "platform/linux/LinuxPlatform.h"
#include "support/TestSupport.h"

extern char** environ;

namespace kesu {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

bool hasAdapter(const std::vector<NetworkService>& services, const std::string& kind, const std::string& name) {
    return std::any_of(services.begin(), services.end(),
                       [&](const NetworkService& s) { return s.displayName == kind && s.bsdName == name; });
}

// A sysfs-like tree of network links below a temporary folder.
class FakeSysfs {
public:
    explicit FakeSysfs(const test::TempDir& dir) : root_(dir.str() + "/sys") {}
    const std::string& root() const { return root_; }

    void link(const std::string& name, int index, int type, unsigned flags, const std::string& address,
              const std::vector<std::string>& markers = {}, const std::string& devType = "") {
        const std::string dir = root_ + "/class/net/" + name;
        fs::create_directories(dir);
        write(dir + "/ifindex", std::to_string(index) + "\n");
        write(dir + "/type", std::to_string(type) + "\n");
        char hex[16];
        std::snprintf(hex, sizeof hex, "0x%x\n", flags);
        write(dir + "/flags", hex);
        write(dir + "/address", address + "\n");
        write(dir + "/uevent", "INTERFACE=" + name + "\nIFINDEX=" + std::to_string(index) + "\n" +
                                   (devType.empty() ? "" : "DEVTYPE=" + devType + "\n"));
        for (const std::string& marker : markers) fs::create_directories(dir + "/" + marker);
    }
    void remove(const std::string& name) { fs::remove_all(root_ + "/class/net/" + name); }
    void file(const std::string& relative, const std::string& content) {
        fs::create_directories(fs::path(root_ + "/" + relative).parent_path());
        write(root_ + "/" + relative, content);
    }

private:
    static void write(const std::string& path, const std::string& content) { std::ofstream(path) << content; }
    std::string root_;
};

// True when the process whose pid `pidFile` holds is gone (killed and reaped, no zombie).
bool reaped(const std::string& pidFile) {
    return ::kill(std::stoi(test::readAll(pidFile)), 0) == -1 && errno == ESRCH;
}

class LinuxPlatformTest : public ::testing::Test {
protected:
    void SetUp() override { Platform::install(nullptr); }
    void TearDown() override { Log::closeLog(); }
    test::HermeticEnv env;
    std::unique_ptr<Platform> platform = makeLinuxPlatform();
};

TEST_F(LinuxPlatformTest, ClassifiesLinksFromSysfs) {
    FakeSysfs sys(env.dir());
    env.config().sysfsRoot = sys.root();
    sys.link("lo", 1, 772, 0x9, "00:00:00:00:00:00");
    sys.link("eth0", 2, 1, 0x1003, "AA:BB:CC:00:00:01", {"device"});
    sys.link("wlan0", 3, 1, 0x1003, "aa:bb:cc:00:00:02", {"device", "wireless"});
    sys.link("wlp4s0", 4, 1, 0x1002, "aa:bb:cc:00:00:03", {"device"}, "wlan");
    sys.link("br0", 5, 1, 0x1003, "aa:bb:cc:00:00:04", {"bridge"}, "bridge");
    sys.link("tap0", 6, 1, 0x1002, "aa:bb:cc:00:00:05", {"tun_flags"});
    sys.link("veth1", 7, 1, 0x1003, "aa:bb:cc:00:00:06");
    sys.link("eth0.7", 8, 1, 0x1003, "aa:bb:cc:00:00:07", {}, "vlan");
    sys.link("tun0", 9, 65534, 0x1091, "");
    sys.link("ifb0", 10, 1, 0x1002, "aa:bb:cc:00:00:08");
    sys.link("wg0", 11, 65534, 0x91, "");
    sys.link("ppp0", 12, 512, 0x1090, "");  // down

    auto services = platform->networkServices();
    ASSERT_EQ(services.size(), 3u);  // in interface-index order
    EXPECT_EQ(services[0].hwAddress, "aa:bb:cc:00:00:01");
    EXPECT_TRUE(hasAdapter(services, "Ethernet", "eth0"));
    EXPECT_EQ(services[1].bsdName, "wlan0");
    EXPECT_TRUE(hasAdapter(services, "Wi-Fi", "wlp4s0"));

    // Without a physical wired link, virtual Ethernet-type links stand in; the zero address is none.
    sys.remove("eth0");
    sys.link("veth2", 13, 1, 0x1003, "00:00:00:00:00:00");
    services = platform->networkServices();
    EXPECT_TRUE(hasAdapter(services, "Ethernet", "veth1"));
    EXPECT_TRUE(hasAdapter(services, "Ethernet", "veth2"));
    for (const char* virtualLink : {"ifb0", "br0", "tap0", "eth0.7"})
        EXPECT_FALSE(hasAdapter(services, "Ethernet", virtualLink)) << virtualLink;
    EXPECT_EQ(services.back().hwAddress, "");

    // VPN: up links named like tunnels.
    auto vpn = platform->vpnScopedInterfaces();
    std::sort(vpn.begin(), vpn.end());
    EXPECT_EQ(vpn, (std::vector<std::string>{"tun0", "wg0"}));

    // Wi-Fi power: the first Wi-Fi link is up and no radio is blocked; then a soft block.
    EXPECT_TRUE(platform->wifiPowerOn());
    sys.file("class/rfkill/rfkill0/type", "wlan\n");
    sys.file("class/rfkill/rfkill0/soft", "1\n");
    sys.file("class/rfkill/rfkill0/hard", "0\n");
    EXPECT_FALSE(platform->wifiPowerOn());
    sys.file("class/dmi/id/product_name", "ThinkPad X1 Carbon\n");
    EXPECT_EQ(platform->hardwareModel(), "ThinkPad X1 Carbon");
}

TEST_F(LinuxPlatformTest, MachineFilesAndMissingFacilities) {
    const std::string info = env.dir().write("machine-info", "ICON_NAME=computer\nPRETTY_HOSTNAME=\"Lin's \\\"Desk\\\"\"\n");
    env.config().machineInfoFile = info;
    EXPECT_EQ(platform->localizedHostName(), "Lin's \"Desk\"");
    env.config().machineInfoFile = env.dir().str() + "/missing";
    char host[256] = {};
    ASSERT_EQ(::gethostname(host, sizeof host - 1), 0);
    EXPECT_EQ(platform->localizedHostName(), host);

    env.config().procRoot = env.dir().str() + "/proc";
    env.dir().write("proc/cpuinfo", "processor\t: 0\nmodel name\t: Something\n");
    EXPECT_EQ(platform->cpuVendor(), std::nullopt);
    env.dir().write("proc/cpuinfo", "processor\t: 0\nvendor_id\t: AuthenticAMD\n");
    EXPECT_EQ(platform->cpuVendor(), "AuthenticAMD");

    env.config().ufwConfigFile = env.dir().write("ufw.conf", "# comment\nENABLED=yes\n");
    EXPECT_EQ(platform->firewallGlobalState(), "1");
    if (!process::findProgram("firewall-cmd")) {
        env.dir().write("ufw.conf", "ENABLED=no\n");
        EXPECT_EQ(platform->firewallGlobalState(), "0");
        env.config().ufwConfigFile = env.dir().str() + "/missing.conf";
        EXPECT_EQ(platform->firewallGlobalState(), std::nullopt);
    }

    // A machine with no Wi-Fi link, no Bluetooth controller and no desktop answers neutrally.
    FakeSysfs sys(env.dir());
    env.config().sysfsRoot = sys.root();
    sys.link("eth0", 2, 1, 0x1003, "aa:bb:cc:00:00:01", {"device"});
    test::ScopedEnv display("DISPLAY", std::nullopt);
    test::ScopedEnv wayland("WAYLAND_DISPLAY", std::nullopt);
    EXPECT_EQ(platform->wifiSsid(), "");
    EXPECT_FALSE(platform->wifiPowerOn());
    std::string error;
    EXPECT_FALSE(platform->switchWifiOn(error));
    EXPECT_EQ(error, "no Wi-Fi interface");
    EXPECT_EQ(platform->bluetoothAddress(), "");
    EXPECT_FALSE(platform->openNetworkSettings());
    if (!fs::exists("/run/systemd/system")) {
        EXPECT_EQ(platform->screenLocked(), std::nullopt);
    }
}

TEST_F(LinuxPlatformTest, RealInterfacesAndProcesses) {
    // The real address list holds loopback's.
    const auto addresses = platform->interfaceAddresses();
    ASSERT_TRUE(addresses.has_value());
    EXPECT_TRUE(std::any_of(addresses->begin(), addresses->end(), [](const InterfaceAddress& a) {
        return a.name == "lo" && a.ip == "127.0.0.1" && a.netmask == "255.0.0.0" && a.up;
    }));

    // Program names are whole even past the 15 bytes the kernel keeps as a process's name.
    const std::string name = "kesu-test-long-program-name";
    const std::string program = env.dir().str() + "/" + name;
    fs::copy_file("/bin/sleep", program);
    auto start = [&] {
        pid_t pid = -1;
        std::vector<char*> argv{const_cast<char*>(program.c_str()), const_cast<char*>("30"), nullptr};
        EXPECT_EQ(::posix_spawn(&pid, program.c_str(), nullptr, nullptr, argv.data(), environ), 0);
        return pid;
    };
    auto countOf = [&] {
        const auto names = platform->runningApplicationNames();
        return std::count(names.begin(), names.end(), name);
    };
    const pid_t first = start();
    EXPECT_EQ(countOf(), 1);
    const pid_t second = start();
    EXPECT_EQ(countOf(), 2);
    for (pid_t pid : {first, second}) {
        ::kill(pid, SIGKILL);
        ::waitpid(pid, nullptr, 0);
    }
    EXPECT_EQ(countOf(), 0);
}

TEST(ProcessHelpers, RunCaptureReadsAllAndKillsAtTimeout) {
    // Arguments reach the program as they are: no shell sees them.
    EXPECT_EQ(process::runCapture("printf", {"%s", "$(id); *"}, 5s), "$(id); *");
    const auto big = process::runCapture("head", {"-c", "3000000", "/dev/zero"}, 20s);
    ASSERT_TRUE(big.has_value());
    EXPECT_EQ(big->size(), 3000000u);
    EXPECT_EQ(process::runCapture("/no/such/program", {}, 5s), std::nullopt);

    const auto failing = process::run("sh", {"-c", "echo partial; exit 7"}, 5s);
    ASSERT_TRUE(failing.has_value());
    EXPECT_EQ(failing->exitStatus, 7);
    EXPECT_EQ(failing->output, "partial\n");
    EXPECT_EQ(process::run("sh", {"-c", "printf \"$KESU_PROBE\""}, 5s, {"KESU_PROBE=seen"})->output, "seen");

    // A program that outlives the time-out is killed and reaped: its pid is gone at return.
    test::TempDir dir;
    const std::string pidFile = dir.str() + "/pid";
    EXPECT_EQ(process::runCapture("sh", {"-c", "echo $$ > \"$0\"; exec sleep 30", pidFile}, 300ms), std::nullopt);
    EXPECT_TRUE(reaped(pidFile));

    // Closing its output does not free a program from the deadline.
    const auto closed = process::run("sh", {"-c", "exec >&-; exec sleep 30"}, 300ms);
    ASSERT_TRUE(closed.has_value());
    EXPECT_TRUE(closed->timedOut);
}

TEST(ProcessHelpers, DetachedProgramIsReaped) {
    std::string error;
    EXPECT_FALSE(process::spawnDetached("/no/such/program", {}, error));
    EXPECT_NE(error, "");

    test::TempDir dir;
    const std::string pidFile = dir.str() + "/pid";
    std::promise<int> exited;
    ASSERT_TRUE(process::spawnDetached("sh", {"-c", "echo $$ > \"$0\"; exit 4", pidFile}, error,
                                       [&](int status) { exited.set_value(status); }));
    auto done = exited.get_future();
    ASSERT_EQ(done.wait_for(20s), std::future_status::ready);
    EXPECT_EQ(done.get(), 4);
    EXPECT_TRUE(reaped(pidFile));

    EXPECT_EQ(process::runAndWait("sh", {"-c", "exit 9"}, error), 9);
}

// Runs `body` on a thread in a fresh network and mount namespace; false when they cannot be made.
bool inPrivateNetwork(const std::function<void()>& body) {
    bool entered = false;
    std::thread worker([&] {
        if (::unshare(CLONE_NEWNET | CLONE_NEWNS) != 0) return;
        if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return;
        entered = true;
        body();
    });
    worker.join();
    return entered;
}

TEST_F(LinuxPlatformTest, PingLoopbackAndUnansweredLoopback) {
    if (!process::findProgram("ping")) GTEST_SKIP() << "no ping";
    EXPECT_TRUE(SystemInfo::pingAddress("127.0.0.1", 2));

    if (::geteuid() != 0 || !process::findProgram("ip")) GTEST_SKIP() << "needs root and ip";
    bool ran = false;
    const bool entered = inPrivateNetwork([&] {
        // Loopback down: no route at all, the ping fails.
        EXPECT_FALSE(SystemInfo::pingAddress("127.0.0.1", 1));
        // Loopback up but echo requests ignored: unanswered until the time-out.
        std::string error;
        if (process::runAndWait("ip", {"link", "set", "lo", "up"}, error) != 0) return;
        std::ofstream ignore("/proc/sys/net/ipv4/icmp_echo_ignore_all");
        if (!(ignore << "1" << std::flush)) return;
        ran = true;
        EXPECT_FALSE(SystemInfo::pingAddress("127.0.0.1", 1));
    });
    if (!entered || !ran) GTEST_SKIP() << "network namespaces are not available here";
}

}  // namespace
}  // namespace kesu
