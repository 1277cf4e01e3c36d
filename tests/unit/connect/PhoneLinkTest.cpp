// The phone link on the event loop against plain loopback peers: connect failures and
// time-outs, frames both ways whatever way they are split, the frame-size bound, and every
// way a wait must end early (peer close, shut from another thread, a write cut short).
#include "connect/PhoneLink.h"

#include <gtest/gtest.h>

#include <asio/co_spawn.hpp>
#include <asio/use_future.hpp>

#include <future>

#include "unit/connect/ConnectFixture.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using Read = PhoneLink::Read;

constexpr auto kLong = 60s;

class PhoneLinkTest : public ::testing::Test {
protected:
    void SetUp() override {
        env.config().phoneFrameMaxBody = 1024;
        loop.start();
        link = std::make_unique<PhoneLink>(loop.executor());
    }

    // A step of the link on the loop: started, or run to its result.
    template <class T>
    std::future<T> start(asio::awaitable<T> step) {
        return asio::co_spawn(loop.executor(), std::move(step), asio::use_future);
    }
    template <class T>
    T run(asio::awaitable<T> step) { return start(std::move(step)).get(); }
    static PhoneLink::Clock::time_point in(std::chrono::milliseconds time) { return PhoneLink::Clock::now() + time; }

    // A connected link and the phone's end of it.
    void connectPair(int receiveBuffer = 0) {
        int port = 0;
        listener = test::listenLoopback(port);
        if (receiveBuffer > 0) ::setsockopt(listener, SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
        std::string error;
        ASSERT_TRUE(run(link->connect("127.0.0.1", static_cast<std::uint16_t>(port), in(kLong), error))) << error;
        peer = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        ASSERT_GE(peer, 0);
    }
    void peerWrites(std::string_view data) {
        ASSERT_EQ(::send(peer, data.data(), data.size(), MSG_NOSIGNAL), static_cast<ssize_t>(data.size()));
    }
    std::string peerReads(std::size_t count) {
        std::string out(count, '\0');
        std::size_t got = 0;
        for (ssize_t n; got < count && (n = ::recv(peer, out.data() + got, count - got, 0)) > 0;) got += n;
        out.resize(got);
        return out;
    }
    static std::string frame(std::string_view body) {
        const Bytes bytes = buildPhoneFrame(body);
        return std::string(bytes.begin(), bytes.end());
    }
    void TearDown() override {
        loop.call([this] { link->shut(); });
        loop.stop();
        if (peer >= 0) ::close(peer);
        if (listener >= 0) ::close(listener);
    }

    test::HermeticEnv env;
    EventLoop loop;
    std::unique_ptr<PhoneLink> link;
    int listener = -1;
    int peer = -1;
};

TEST_F(PhoneLinkTest, RefusedConnectAndUnconnectedUse) {
    std::string error;
    Bytes data;
    EXPECT_EQ(run(link->readFrame(data, in(100ms))), Read::Closed);
    EXPECT_FALSE(run(link->writeAll(buildPhoneFrame("{}"), in(100ms), error)));
    EXPECT_FALSE(run(link->connect("phone.local", 10191, in(1s), error)));  // names are not looked up
    EXPECT_EQ(error, "not a numeric address: phone.local");
    EXPECT_FALSE(link->isConnected());
}

TEST_F(PhoneLinkTest, FramesBothWaysAndTheSizeBound) {
    connectPair();
    std::string error;
    const std::string request = frame(R"({"bytes":[0]})");
    ASSERT_TRUE(run(link->writeAll(Bytes(request.begin(), request.end()), in(kLong), error))) << error;
    EXPECT_EQ(peerReads(request.size()), request);

    // Two frames in one write, garbage and an oversized frame between them: one frame per call.
    const std::string a = frame(R"({"bytes":[23]})");
    const std::string b = frame(R"({"bytes":[24],"extra_info":"{}"})");
    peerWrites(a + "junk" + frame(std::string(2000, ' ')) + b);
    Bytes data;
    ASSERT_EQ(run(link->readFrame(data, in(kLong))), Read::Frame);
    EXPECT_EQ(std::string(data.begin(), data.end()), a);
    ASSERT_EQ(run(link->readFrame(data, in(kLong))), Read::Frame);
    EXPECT_EQ(std::string(data.begin(), data.end()), b);

    // Nothing arrives: a time-out. A frame split over two writes comes out whole.
    EXPECT_EQ(run(link->readFrame(data, in(100ms))), Read::TimedOut);
    auto reading = start(link->readFrame(data, PhoneLink::kNoDeadline));
    peerWrites(b.substr(0, 12));  // cut inside the length field
    EXPECT_EQ(reading.wait_for(50ms), std::future_status::timeout);
    peerWrites(b.substr(12));
    ASSERT_EQ(reading.get(), Read::Frame);
    EXPECT_EQ(std::string(data.begin(), data.end()), b);

    // Frames that came before the peer's close are handed out, then the close.
    peerWrites(a + a.substr(0, 5));
    ::close(std::exchange(peer, -1));
    ASSERT_EQ(run(link->readFrame(data, in(kLong))), Read::Frame);
    EXPECT_EQ(run(link->readFrame(data, in(kLong))), Read::Closed);
    EXPECT_FALSE(link->isConnected());
    EXPECT_FALSE(run(link->writeAll(Bytes(request.begin(), request.end()), in(1s), error)));
}

TEST_F(PhoneLinkTest, ShutEndsWaitsAtOnce) {
    connectPair();
    Bytes data;
    auto reading = start(link->readFrame(data, PhoneLink::kNoDeadline));  // a held link: no timer
    EXPECT_EQ(reading.wait_for(50ms), std::future_status::timeout);
    loop.post([this] { link->shut(); });
    ASSERT_EQ(reading.wait_for(kLong), std::future_status::ready);
    EXPECT_EQ(reading.get(), Read::Shut);
    EXPECT_EQ(peerReads(1), "");  // the phone sees the link end

    // A connect to a listener whose queue is full waits for its deadline, or for a shut.
    int fullPort = 0;
    const int full = test::listenLoopback(fullPort, 0);
    const auto port = static_cast<std::uint16_t>(fullPort);
    std::vector<std::unique_ptr<PhoneLink>> fillers;
    std::string error;
    for (int i = 0; i < 6 && error != "connect timed out"; ++i) {
        fillers.push_back(std::make_unique<PhoneLink>(loop.executor()));
        run(fillers.back()->connect("127.0.0.1", port, in(300ms), error));
    }
    EXPECT_EQ(error, "connect timed out");
    PhoneLink waiting(loop.executor());
    auto connecting = start(waiting.connect("127.0.0.1", port, in(kLong), error));
    EXPECT_EQ(connecting.wait_for(50ms), std::future_status::timeout);
    loop.post([&] { waiting.shut(); });
    ASSERT_EQ(connecting.wait_for(kLong), std::future_status::ready);
    EXPECT_FALSE(connecting.get());
    EXPECT_EQ(error, "closed while connecting");
    loop.call([&] {
        for (auto& filler : fillers) filler->shut();
    });
    ::close(full);
}

TEST_F(PhoneLinkTest, WriteCutShortByItsDeadlineShutsTheLink) {
    connectPair(64 * 1024);  // the phone never reads
    const Bytes huge = buildPhoneFrame(std::string(16 << 20, 'y'));
    std::string error;
    EXPECT_FALSE(run(link->writeAll(huge, in(300ms), error)));
    EXPECT_NE(error.find("bytes in time, closing the link"), std::string::npos) << error;
    EXPECT_TRUE(link->isShut());
    Bytes data;
    EXPECT_EQ(run(link->readFrame(data, in(1s))), Read::Shut);
}

}  // namespace
}  // namespace kesu
