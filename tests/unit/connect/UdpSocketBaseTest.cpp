// The datagram socket: real datagrams to a loopback receiver, and the ends of its life.
#include <gtest/gtest.h>

#include "core/UdpSocketBase.h"
#include "core/Log.h"
#include "support/TestSupport.h"
#include "support/UdpCatcher.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

TEST(UdpSocketBaseTest, SendsEachMessageAsOneDatagram) {
    test::HermeticEnv env;
    test::UdpCatcher receiver;
    UdpSocketBase socket;
    EXPECT_FALSE(socket.sendMsg(3.0, Bytes{1}));  // nothing to send with yet

    ASSERT_TRUE(socket.initial(static_cast<std::uint16_t>(receiver.port()), "127.0.0.1", -1));
    const std::string first = R"({"cmd":"QUERY_CLIENT_ID"})";
    ASSERT_TRUE(socket.sendMsg(3.0, Bytes(first.begin(), first.end())));
    ASSERT_TRUE(socket.sendMsg(3.0, Bytes{0x00, 0xff, 0x00}));
    EXPECT_EQ(receiver.receive(5s), first);
    EXPECT_EQ(receiver.receive(5s), std::string("\x00\xff\x00", 3));
    Bytes data;
    int errorCode = 0;
    EXPECT_TRUE(socket.recvMsg(0.1, data, errorCode));
    EXPECT_TRUE(data.empty());

    // A host name works too, and a second initial re-targets the socket.
    test::UdpCatcher other;
    ASSERT_TRUE(socket.initial(static_cast<std::uint16_t>(other.port()), "localhost", -1));
    ASSERT_TRUE(socket.sendMsg(3.0, Bytes{'x'}));
    EXPECT_EQ(other.receive(5s), "x");

    // After close() sends fail and say so.
    EXPECT_TRUE(socket.close());
    EXPECT_FALSE(socket.sendMsg(3.0, Bytes{'y'}));
    Log::closeLog();
}

}  // namespace
}  // namespace kesu
