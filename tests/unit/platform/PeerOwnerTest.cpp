// The owner of a loopback connection's far end from the kernel's socket table: ours, one made
// as nobody, and one whose maker has closed it (none rather than root).
#include <gtest/gtest.h>
#include <arpa/inet.h>
#include <fcntl.h>
#include <grp.h>
#include <netinet/in.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/PeerOwner.h"

namespace kesu {
namespace {

class Listener {
public:
    Listener() : fd_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        ::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address);
        ::listen(fd_, 8);
        ::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length);
        address_ = address;
    }
    ~Listener() { ::close(fd_); }
    const sockaddr_in& address() const { return address_; }
    int accept() const { return ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC); }

private:
    int fd_;
    sockaddr_in address_{};
};

// A process running as nobody that connects to `to`, sends one byte and holds the connection
// until end() (which makes it close the socket and exit, and waits for that).
class NobodyClient {
public:
    explicit NobodyClient(const sockaddr_in& to) {
        const passwd* nobody = ::getpwnam("nobody");
        uid_ = nobody ? nobody->pw_uid : 65534;
        const gid_t gid = nobody ? nobody->pw_gid : 65534;
        int ready[2];
        EXPECT_EQ(::pipe2(ready, O_CLOEXEC), 0);
        EXPECT_EQ(::pipe2(release_, O_CLOEXEC), 0);
        pid_ = ::fork();
        if (pid_ == 0) {
            ::close(ready[0]);
            ::close(release_[1]);
            char ok = 0;
            if (::setgroups(0, nullptr) == 0 && ::setgid(gid) == 0 && ::setuid(uid_) == 0) {
                const int s = ::socket(AF_INET, SOCK_STREAM, 0);
                ok = ::connect(s, reinterpret_cast<const sockaddr*>(&to), sizeof to) == 0 && ::write(s, "x", 1) == 1;
            }
            ::write(ready[1], &ok, 1);
            char byte;
            ::read(release_[0], &byte, 1);  // returns when the parent closes its end
            ::_exit(0);
        }
        ::close(ready[1]);
        ::close(release_[0]);
        char ok = 0;
        connected_ = ::read(ready[0], &ok, 1) == 1 && ok == 1;
        ::close(ready[0]);
    }
    ~NobodyClient() { end(); }
    bool connected() const { return connected_; }
    uid_t uid() const { return uid_; }
    void end() {
        if (release_[1] >= 0) ::close(release_[1]);
        release_[1] = -1;
        if (pid_ > 0) ::waitpid(pid_, nullptr, 0);
        pid_ = -1;
    }

private:
    pid_t pid_ = -1;
    uid_t uid_ = 65534;
    int release_[2] = {-1, -1};
    bool connected_ = false;
};

TEST(PeerOwner, OwnConnectionFromEitherEnd) {
    Listener listener;
    const int client = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    ASSERT_EQ(::connect(client, reinterpret_cast<const sockaddr*>(&listener.address()), sizeof(sockaddr_in)), 0);
    const int served = listener.accept();
    ASSERT_GE(served, 0);
    std::string why;
    EXPECT_EQ(peer::connectedPeerOwner(served, &why), ::geteuid()) << why;
    EXPECT_EQ(peer::connectedPeerOwner(client, &why), ::geteuid()) << why;
    ::close(client);
    // The client has closed its end: no process holds it, so no owner is reported.
    EXPECT_EQ(peer::connectedPeerOwner(served, &why), std::nullopt);
    ::close(served);
    // Not a connection at all.
    EXPECT_EQ(peer::connectedPeerOwner(-1, &why), std::nullopt);
}

TEST(PeerOwner, ConnectionsMadeByAnotherUser) {
    if (::geteuid() != 0) GTEST_SKIP() << "SKIPPED: needs root to run a client as nobody";
    Listener listener;
    // Once its maker has closed it, the far end lingers ownerless in the table, where the
    // kernel may report root for it: the answer must be none, whether closed before or after
    // we accept.
    for (const bool acceptFirst : {true, false}) {
        SCOPED_TRACE(acceptFirst ? "closed after accept" : "closed before accept");
        NobodyClient nobody(listener.address());
        ASSERT_TRUE(nobody.connected());
        if (!acceptFirst) nobody.end();
        const int served = listener.accept();
        std::string why;
        if (acceptFirst) {
            EXPECT_EQ(peer::connectedPeerOwner(served, &why), nobody.uid()) << why;
        }
        nobody.end();
        EXPECT_EQ(peer::connectedPeerOwner(served), std::nullopt);
        ::close(served);
    }
}

}  // namespace
}  // namespace kesu
