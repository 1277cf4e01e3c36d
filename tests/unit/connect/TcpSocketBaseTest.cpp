// The blocking TCP link against real loopback peers: connect failures and time-outs, frames
// both ways, and every way a wait must end early (peer close, local close from another thread).
#include "connect/TcpSocketBase.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <future>
#include <string>
#include <thread>

#include "connect/PhoneFrame.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using SteadyClock = std::chrono::steady_clock;

// Waits far longer than any of these tests needs: a call that returns well before it ended
// because of its event, not its time-out.
constexpr double kLongWait = 60.0;
constexpr auto kWellBeforeLongWait = 30s;

class Fd {
public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    Fd(Fd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    Fd& operator=(Fd&& other) noexcept {
        reset();
        fd_ = std::exchange(other.fd_, -1);
        return *this;
    }
    ~Fd() { reset(); }
    int get() const { return fd_; }
    void reset() {
        if (fd_ >= 0) ::close(std::exchange(fd_, -1));
    }

private:
    int fd_;
};

// A plain listening socket on 127.0.0.1 that plays the phone.
class Listener {
public:
    // A receive buffer size, when given, is taken over by the accepted links.
    explicit Listener(int backlog = 8, int receiveBuffer = 0) : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        if (receiveBuffer > 0) ::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        EXPECT_EQ(::bind(fd_.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
        EXPECT_EQ(::listen(fd_.get(), backlog), 0);
        socklen_t len = sizeof addr;
        ::getsockname(fd_.get(), reinterpret_cast<sockaddr*>(&addr), &len);
        port_ = ntohs(addr.sin_port);
    }
    std::uint16_t port() const { return port_; }
    Fd accept() { return Fd(::accept4(fd_.get(), nullptr, nullptr, SOCK_CLOEXEC)); }

private:
    Fd fd_;
    std::uint16_t port_ = 0;
};

void writeAll(const Fd& fd, std::string_view data) {
    while (!data.empty()) {
        const ssize_t n = ::send(fd.get(), data.data(), data.size(), MSG_NOSIGNAL);
        ASSERT_GT(n, 0);
        data.remove_prefix(static_cast<std::size_t>(n));
    }
}

std::string readExactly(const Fd& fd, std::size_t count) {
    std::string out(count, '\0');
    std::size_t got = 0;
    while (got < count) {
        const ssize_t n = ::recv(fd.get(), out.data() + got, count - got, 0);
        if (n <= 0) break;
        got += static_cast<std::size_t>(n);
    }
    out.resize(got);
    return out;
}

std::string frame(std::string_view body) {
    const Bytes bytes = buildPhoneFrame(body);
    return std::string(bytes.begin(), bytes.end());
}

std::string text(const Bytes& bytes) { return std::string(bytes.begin(), bytes.end()); }

// Gives a thread that was just started the moment it needs to enter its blocking call. The
// outcome checked is the same if it has not got there yet; only the path differs.
void letThreadBlock() { std::this_thread::sleep_for(50ms); }

struct RecvOutcome {
    bool ok = false;
    Bytes data;
    int errorCode = 0;
    SteadyClock::duration took{};
};

std::future<RecvOutcome> recvAsync(TcpSocketBase& socket, double time) {
    return std::async(std::launch::async, [&socket, time] {
        RecvOutcome out;
        const auto start = SteadyClock::now();
        out.ok = socket.recvMsg(time, out.data, out.errorCode);
        out.took = SteadyClock::now() - start;
        return out;
    });
}

TEST(TcpSocketBase, RefusedConnectAndUnconnectedUse) {
    test::HermeticEnv env;
    TcpSocketBase socket;
    EXPECT_EQ(socket.getSokcetType(), "tcp");
    EXPECT_FALSE(socket.isSocketNull());

    Bytes data;
    int errorCode = 0;
    EXPECT_FALSE(socket.recvMsg(0.1, data, errorCode));
    EXPECT_EQ(errorCode, -1);
    EXPECT_FALSE(socket.sendMsg(0.1, buildPhoneFrame("{}")));

    // Nobody listens: refused at once, whatever the time-out.
    const auto start = SteadyClock::now();
    EXPECT_FALSE(socket.initial(static_cast<std::uint16_t>(test::freeTcpPort()), "127.0.0.1", 60));
    EXPECT_LT(SteadyClock::now() - start, kWellBeforeLongWait);
    EXPECT_FALSE(socket.isConnected());
    errorCode = 0;
    EXPECT_FALSE(socket.recvMsg(0.1, data, errorCode));
    EXPECT_EQ(errorCode, -1);

    EXPECT_FALSE(socket.initial(10191, "phone.local", 1));  // names are not looked up
    EXPECT_TRUE(socket.close());
    EXPECT_TRUE(socket.close());
}

TEST(TcpSocketBase, FramesBothWays) {
    test::HermeticEnv env;
    Listener listener;
    TcpSocketBase socket;
    ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
    EXPECT_TRUE(socket.isConnected());
    Fd peer = listener.accept();

    // Out: the frame's bytes exactly.
    const std::string request = frame(R"({"bytes":[22]})");
    ASSERT_TRUE(socket.sendMsg(3.0, Bytes(request.begin(), request.end())));
    EXPECT_EQ(readExactly(peer, request.size()), request);

    // In: two frames in one write come out one per call.
    const std::string a = frame(R"({"bytes":[23]})");
    const std::string b = frame(R"({"bytes":[24],"extra_info":"{}"})");
    writeAll(peer, a + b);
    Bytes data;
    int errorCode = 7;
    ASSERT_TRUE(socket.recvMsg(3.0, data, errorCode));
    EXPECT_EQ(text(data), a);
    ASSERT_TRUE(socket.recvMsg(3.0, data, errorCode));
    EXPECT_EQ(text(data), b);

    // Nothing arrives: a time-out leaves the error code alone. A frame that comes later is
    // kept for the next call.
    EXPECT_FALSE(socket.recvMsg(0.1, data, errorCode));
    EXPECT_EQ(errorCode, 7);
    writeAll(peer, a);
    ASSERT_TRUE(socket.recvMsg(3.0, data, errorCode));
    EXPECT_EQ(text(data), a);

    // A frame split over two writes, read by a thread blocked meanwhile, while this thread
    // sends on the same link (the pre-connection's read loop and a connect flow do so).
    auto reader = recvAsync(socket, kLongWait);
    letThreadBlock();
    writeAll(peer, b.substr(0, 9));
    ASSERT_TRUE(socket.sendMsg(3.0, Bytes(request.begin(), request.end())));
    EXPECT_EQ(readExactly(peer, request.size()), request);
    writeAll(peer, b.substr(9));
    RecvOutcome got = reader.get();
    ASSERT_TRUE(got.ok);
    EXPECT_EQ(text(got.data), b);

    // A large frame, read by the peer while it is being written.
    const std::string large = frame(std::string(3 << 20, 'x'));
    auto drained = std::async(std::launch::async, [&] { return readExactly(peer, large.size()).size(); });
    EXPECT_TRUE(socket.sendMsg(kLongWait, Bytes(large.begin(), large.end())));
    EXPECT_EQ(drained.get(), large.size());

    // Garbage before a frame is dropped; frames that came before the peer's close are
    // still handed out, then the close is reported.
    writeAll(peer, "junk" + a + a.substr(0, 5));
    peer.reset();
    ASSERT_TRUE(socket.recvMsg(3.0, data, errorCode));
    EXPECT_EQ(text(data), a);
    EXPECT_FALSE(socket.recvMsg(kLongWait, data, errorCode));
    EXPECT_EQ(errorCode, -1);
    EXPECT_FALSE(socket.isConnected());
    EXPECT_FALSE(socket.sendMsg(1.0, Bytes(request.begin(), request.end())));
}

TEST(TcpSocketBase, BlockedReaderWakesOnPeerCloseAndOnLocalClose) {
    test::HermeticEnv env;
    Listener listener;
    TcpSocketBase socket;

    // The peer closes while the reader waits.
    ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
    Fd peer = listener.accept();
    auto reader = recvAsync(socket, kLongWait);
    letThreadBlock();
    peer.reset();
    RecvOutcome got = reader.get();
    EXPECT_FALSE(got.ok);
    EXPECT_EQ(got.errorCode, -1);
    EXPECT_LT(got.took, kWellBeforeLongWait);

    // The peer resets the link while the reader waits: the same end as a close.
    ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
    peer = listener.accept();
    reader = recvAsync(socket, kLongWait);
    letThreadBlock();
    const linger reset{1, 0};
    ::setsockopt(peer.get(), SOL_SOCKET, SO_LINGER, &reset, sizeof reset);
    peer.reset();
    got = reader.get();
    EXPECT_FALSE(got.ok);
    EXPECT_EQ(got.errorCode, -1);
    EXPECT_FALSE(socket.isConnected());
    EXPECT_FALSE(socket.sendMsg(1.0, buildPhoneFrame("{}")));

    // This side closes from another thread while the reader waits; the same object then
    // connects again.
    ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
    peer = listener.accept();
    reader = recvAsync(socket, kLongWait);
    letThreadBlock();
    EXPECT_TRUE(socket.close());
    got = reader.get();
    EXPECT_FALSE(got.ok);
    EXPECT_EQ(got.errorCode, -1);
    EXPECT_LT(got.took, kWellBeforeLongWait);
    EXPECT_EQ(readExactly(peer, 1), "");  // the phone sees the link end

    ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
    peer = listener.accept();
    const std::string a = frame("{}");
    writeAll(peer, a);
    Bytes data;
    int errorCode = 0;
    ASSERT_TRUE(socket.recvMsg(3.0, data, errorCode));
    EXPECT_EQ(text(data), a);

    // Many readers and closers racing on one object: no crash, no stray descriptor use.
    for (int round = 0; round < 20; ++round) {
        ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
        Fd roundPeer = listener.accept();
        auto r1 = recvAsync(socket, kLongWait);
        auto r2 = recvAsync(socket, kLongWait);
        std::thread closer([&] { socket.close(); });
        closer.join();
        EXPECT_EQ(r1.get().errorCode, -1);
        EXPECT_EQ(r2.get().errorCode, -1);
    }
}

TEST(TcpSocketBase, ConnectTimeOutAndCloseDuringConnect) {
    test::HermeticEnv env;
    // A listener that never accepts and has a queue of one: further connects get no answer.
    Listener listener(0);
    std::vector<std::unique_ptr<TcpSocketBase>> fillers;
    bool timedOut = false;
    for (int i = 0; i < 6 && !timedOut; ++i) {
        fillers.push_back(std::make_unique<TcpSocketBase>());
        timedOut = !fillers.back()->initial(listener.port(), "127.0.0.1", 1);
    }
    ASSERT_TRUE(timedOut);
    EXPECT_FALSE(fillers.back()->isConnected());

    TcpSocketBase socket;
    auto connecting = std::async(std::launch::async, [&] {
        const auto start = SteadyClock::now();
        const bool ok = socket.initial(listener.port(), "127.0.0.1", static_cast<int>(kLongWait));
        return std::make_pair(ok, SteadyClock::now() - start);
    });
    letThreadBlock();
    socket.close();
    const auto [ok, took] = connecting.get();
    EXPECT_FALSE(ok);
    EXPECT_LT(took, kWellBeforeLongWait);
}

TEST(TcpSocketBase, SendTimeOutClosesHalfWrittenLink) {
    test::HermeticEnv env;
    Listener listener(8, 64 * 1024);
    TcpSocketBase socket;
    ASSERT_TRUE(socket.initial(listener.port(), "127.0.0.1", 3));
    Fd peer = listener.accept();  // never reads

    // Far more than the peer's receive buffer and this side's largest send buffer.
    const Bytes huge = buildPhoneFrame(std::string(16 << 20, 'y'));
    EXPECT_FALSE(socket.sendMsg(0.3, huge));
    EXPECT_FALSE(socket.isConnected());
    EXPECT_FALSE(socket.sendMsg(1.0, buildPhoneFrame("{}")));
    Bytes data;
    int errorCode = 0;
    EXPECT_FALSE(socket.recvMsg(1.0, data, errorCode));
    EXPECT_EQ(errorCode, -1);
}

}  // namespace
}  // namespace kesu
