// The discovery sockets with real datagrams on loopback, and across network namespaces
// (one socket per adapter hears and speaks only on its own network).
#include <net/if.h>

#include <future>
#include <thread>

#include "DiscoveryFixture.h"
#include "core/EventLoop.h"
#include "discovery/KesuAdapterManager.h"
#include "discovery/SsdpSocketManager.h"
#include "platform/SystemInfo.h"
#include "support/NetNs.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

// A phone's announcement in the current format.
std::string phoneAnnouncement(const std::string& id, const std::string& name) {
    return test::announce(test::phoneBody(id, "138****5678", name));
}

// A phone on this machine: sends to the group over the loopback interface from 127.0.0.1.
class LoopbackPhone {
public:
    explicit LoopbackPhone(int port) : port_(port) {
        fd_ = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        sockaddr_in local{};
        local.sin_family = AF_INET;
        local.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        ::bind(fd_, reinterpret_cast<sockaddr*>(&local), sizeof local);
        ip_mreqn interface{};
        interface.imr_ifindex = static_cast<int>(if_nametoindex("lo"));
        ::setsockopt(fd_, IPPROTO_IP, IP_MULTICAST_IF, &interface, sizeof interface);
    }
    ~LoopbackPhone() { ::close(fd_); }
    bool send(const std::string& text) const {
        sockaddr_in group{};
        group.sin_family = AF_INET;
        group.sin_port = htons(static_cast<std::uint16_t>(port_));
        group.sin_addr.s_addr = htonl(0xEFFFFFFA);  // 239.255.255.250
        return ::sendto(fd_, text.data(), text.size(), 0, reinterpret_cast<sockaddr*>(&group), sizeof group) ==
               static_cast<ssize_t>(text.size());
    }

private:
    int fd_ = -1;
    int port_;
};

class SsdpSocketTest : public test::DiscoveryTest {
protected:
    void SetUp() override {
        DiscoveryTest::SetUp();
        loop.start();
    }
    void TearDown() override {
        SsdpDeviceManager::instance().ssdpDeviceMap.clear();  // the table is process-wide
        DiscoveryTest::TearDown();
    }

    EventLoop loop;
};

TEST_F(SsdpSocketTest, LoopbackDatagramsReachTheTableAndTheQueryAnswer) {
    env.config().ssdpPort = test::freeUdpPort();
    env.config().ssdpMaxDatagram = 1024;
    test::Recorder pcHeard;
    SsdpSocketManager pc(loop, pcHeard.receiver());
    EXPECT_FALSE(pc.sendResponseData("n", "id", "acc", "open", "svc"));  // no socket yet
    pc.createSocket("lo");
    const std::shared_ptr<SsdpSocket> socket = pc.socket();
    ASSERT_TRUE(socket);
    ASSERT_TRUE(socket->isReceiving());
    EXPECT_TRUE(socket->isBoundToDevice());
    EXPECT_EQ(socket->localPort(), env.config().ssdpPort);

    // A phone's announcement is handed on with the sender's address.
    LoopbackPhone phone(env.config().ssdpPort);
    ASSERT_TRUE(phone.send(phoneAnnouncement("AB12CD34", "kesu X1 Pro")));
    const auto first = pcHeard.waitFor(1);
    ASSERT_EQ(first.size(), 1u);
    EXPECT_EQ(first[0].host, "127.0.0.1");

    // A datagram over the bound is dropped whole; the empty one after it is handed on.
    ASSERT_TRUE(phone.send(std::string(1500, 'x')));
    ASSERT_TRUE(phone.send(""));
    const auto heard = pcHeard.waitFor(2);
    ASSERT_EQ(heard.size(), 2u);
    EXPECT_EQ(heard[1].data, "");

    EXPECT_FALSE(socket->sendMsg(std::string("\xff\xfe")));  // not UTF-8

    // Deleting closes the socket even while someone still holds it.
    pc.deleteSocket();
    EXPECT_FALSE(pc.socket());
    EXPECT_FALSE(pc.sendResponseData("n", "id", "acc", "open", "svc"));
    EXPECT_TRUE(socket->isSocketNull());
    EXPECT_FALSE(socket->sendMsg("late"));
}

TEST_F(SsdpSocketTest, FailedSetUpIsLoggedAndLeavesASocketThatNeitherHearsNorSends) {
    env.config().ssdpPort = test::freeUdpPort();
    {
        SsdpSocket missing(loop, "kf-none0");
        EXPECT_FALSE(missing.isReceiving());
        EXPECT_FALSE(missing.isSocketNull());  // created and bound: it exists
        // Without its interface the system would send through another adapter.
        EXPECT_FALSE(missing.sendMsg("hello"));
    }

    env.config().ssdpGroup = "10.77.0.9";  // not a multicast group
    SsdpSocket notAGroup(loop, "lo");
    EXPECT_FALSE(notAGroup.isReceiving());
    EXPECT_FALSE(notAGroup.sendMsg("hello"));
}

// Sockets sharing a port, rebuilt in a row, closed while another thread sends, and one
// closed from its own receiver (on the loop).
TEST_F(SsdpSocketTest, SharedPortRebuildsAndCloseFromAnyThread) {
    env.config().ssdpPort = test::freeUdpPort();
    test::Recorder keeper;
    SsdpSocket listener(loop, "lo", keeper.receiver());  // stays up across the rebuilds
    ASSERT_TRUE(listener.isReceiving());

    SsdpSocketManager manager(loop);
    for (int i = 0; i < 10; ++i) {
        manager.createSocket("lo");  // replaces, and so closes, the previous socket
        ASSERT_TRUE(manager.socket()->isReceiving()) << "rebuild " << i;
    }
    std::atomic<bool> sending{true};
    std::thread sender([&] {
        while (sending.load()) manager.sendSearchData("x", "y", "z");
    });
    auto current = manager.socket();
    ASSERT_FALSE(keeper.waitFor(1).empty());
    current->close();  // while the sender thread keeps queueing
    manager.deleteSocket();
    sending.store(false);
    sender.join();
    EXPECT_TRUE(current->isSocketNull());

    std::atomic<SsdpSocket*> self{nullptr};
    std::promise<void> closedItself;
    SsdpSocket selfClosing(loop, "lo", [&](std::string_view, const std::string&, std::uint16_t) {
        if (SsdpSocket* s = self.exchange(nullptr)) {
            s->close();
            closedItself.set_value();
        }
    });
    self.store(&selfClosing);
    LoopbackPhone phone(env.config().ssdpPort);
    ASSERT_TRUE(phone.send("ping"));
    ASSERT_EQ(closedItself.get_future().wait_for(10s), std::future_status::ready);
    EXPECT_TRUE(selfClosing.isSocketNull());
}

// The PC's namespace with two adapters (kf-a0 10.77.0.1, kf-b0 10.77.0.5), each a veth pair
// to a phone's namespace (kf-a1 .2, kf-b1 .6); only kf-a0 of the PC has a multicast route.
class NetnsLab {
public:
    ~NetnsLab() {
        for (const char* role : {"pc", "pa", "pb"}) test::NetNsLab::ip("netns del " + ns(role));
    }
    std::string ns(const std::string& role) const { return "kesu-f-" + std::to_string(::getpid()) + "-" + role; }

    // Empty when the lab is up, else what failed.
    std::string up() {
        const std::string pc = "-n " + ns("pc") + " ", pa = "-n " + ns("pa") + " ", pb = "-n " + ns("pb") + " ";
        for (const std::string& step :
             {"netns add " + ns("pc"), "netns add " + ns("pa"), "netns add " + ns("pb"), pc + "link set lo up",
              pa + "link set lo up", pb + "link set lo up",
              pc + "link add kf-a0 type veth peer name kf-a1 netns " + ns("pa"),
              pc + "link add kf-b0 type veth peer name kf-b1 netns " + ns("pb"), pc + "addr add 10.77.0.1/30 dev kf-a0",
              pc + "addr add 10.77.0.5/30 dev kf-b0", pa + "addr add 10.77.0.2/30 dev kf-a1",
              pb + "addr add 10.77.0.6/30 dev kf-b1", pc + "link set kf-a0 up", pc + "link set kf-b0 up",
              pa + "link set kf-a1 up", pb + "link set kf-b1 up", pc + "route add 224.0.0.0/4 dev kf-a0",
              pa + "route add 224.0.0.0/4 dev kf-a1", pb + "route add 224.0.0.0/4 dev kf-b1"}) {
            if (!test::NetNsLab::ip(step)) return "ip " + step + " failed";
        }
        return "";
    }

    // Runs `make` on a thread that entered namespace `role`: sockets it creates live there.
    template <class F>
    auto inside(const std::string& role, F make) -> decltype(make()) {
        decltype(make()) made{};
        test::NetNsLab::runIn(ns(role), [&] { made = make(); });
        return made;
    }
};

TEST_F(SsdpSocketTest, NetnsEachAdapterSocketHearsAndSpeaksOnlyOnItsOwnNetwork) {
    if (::geteuid() != 0) GTEST_SKIP() << "network namespaces need root";
    NetnsLab lab;
    if (const std::string failed = lab.up(); !failed.empty()) GTEST_SKIP() << failed;
    // The real discovery port: nothing else listens inside these namespaces.
    test::Recorder pcA, pcB, phoneA, phoneB;
    auto socketOn = [&](const std::string& role, const std::string& netCard, test::Recorder& recorder) {
        return lab.inside(role, [&] { return std::make_unique<SsdpSocket>(loop, netCard, recorder.receiver()); });
    };
    auto pcSocketA = socketOn("pc", "kf-a0", pcA);
    auto pcSocketB = socketOn("pc", "kf-b0", pcB);
    auto phoneSocketA = socketOn("pa", "kf-a1", phoneA);
    auto phoneSocketB = socketOn("pb", "kf-b1", phoneB);
    for (auto* s : {pcSocketA.get(), pcSocketB.get(), phoneSocketA.get(), phoneSocketB.get()}) {
        ASSERT_TRUE(s && s->isReceiving() && s->isBoundToDevice());
    }

    // Phone A, B, then A again: a stray datagram from the other network would come first.
    const std::string a1 = phoneAnnouncement("PHA-0001", "kesu Phone A");
    const std::string b1 = phoneAnnouncement("PHB-0002", "kesu Phone B");
    const std::string a2 = phoneAnnouncement("PHA-0001", "kesu Phone A2");
    ASSERT_TRUE(phoneSocketA->sendMsg(a1));
    ASSERT_EQ(pcA.waitFor(1).size(), 1u);
    ASSERT_TRUE(phoneSocketB->sendMsg(b1));
    const auto heardB = pcB.waitFor(1);
    ASSERT_EQ(heardB.size(), 1u);
    EXPECT_EQ(heardB[0].data, b1);
    EXPECT_EQ(heardB[0].host, "10.77.0.6");
    ASSERT_TRUE(phoneSocketA->sendMsg(a2));
    const auto heardA = pcA.waitFor(2);
    ASSERT_EQ(heardA.size(), 2u);
    EXPECT_EQ(heardA[0].data, a1);
    EXPECT_EQ(heardA[1].data, a2);
    EXPECT_EQ(heardA[0].host, "10.77.0.2");

    // The monitor's announcement leaves on each adapter, although only kf-a0 has a multicast route.
    network({{"Wi-Fi", "kf-a0", "10.77.0.1", "255.255.255.252"}, {"Ethernet", "kf-b0", "10.77.0.5", "255.255.255.252"}});
    auto monitor = lab.inside("pc", [&] { return std::make_unique<KesuAdapterManager>(loop); });
    ASSERT_TRUE(monitor);
    EXPECT_EQ(monitor->socketInterfaces(), (std::vector<std::string>{"kf-a0", "kf-b0"}));
    monitor->sendSsdp();
    const auto pcOnA = phoneA.waitFor(1, "10.77.0.2");  // besides its own echoes
    const auto pcOnB = phoneB.waitFor(1, "10.77.0.6");
    ASSERT_EQ(pcOnA.size(), 1u);
    ASSERT_EQ(pcOnB.size(), 1u);
    EXPECT_EQ(pcOnA[0].host, "10.77.0.1");
    EXPECT_EQ(pcOnB[0].host, "10.77.0.5");
    const Json announced = json::parse(SsdpMessage::decodeCompatPayload(pcOnB[0].data)).value_or(Json());
    EXPECT_EQ(announced["deviceType"], "pc");
    EXPECT_EQ(announced["deviceName"], "Off****-PC");
    EXPECT_EQ(announced["deviceId"], SystemInfo::getMacAddress());
}

}  // namespace
}  // namespace kesu
