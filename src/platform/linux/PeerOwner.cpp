// The owner of a connection's far end from the kernel's socket table, asked over
// NETLINK_SOCK_DIAG: one exact look-up by the 4-tuple, no dump of the table.
#include "platform/PeerOwner.h"

#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/sock_diag.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace kesu::peer {
namespace {

void say(std::string* why, std::string text) {
    if (why) *why = std::move(text);
}

std::string errnoText(const char* what, int err) { return std::string(what) + ": " + std::strerror(err); }

class NetlinkSocket {
public:
    NetlinkSocket() : fd_(::socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC, NETLINK_SOCK_DIAG)) {}
    ~NetlinkSocket() {
        if (fd_ >= 0) ::close(fd_);
    }
    NetlinkSocket(const NetlinkSocket&) = delete;
    NetlinkSocket& operator=(const NetlinkSocket&) = delete;
    int fd() const { return fd_; }

private:
    int fd_;
};

}  // namespace

std::optional<uid_t> tcpSocketOwner(const sockaddr_in& local, const sockaddr_in& remote, std::string* why) {
    NetlinkSocket nl;
    if (nl.fd() < 0) {
        say(why, errnoText("netlink socket", errno));
        return std::nullopt;
    }
    // The kernel answers an exact look-up while handling the send; the time-out only
    // bounds the wait should that ever change.
    const timeval bound{1, 0};
    ::setsockopt(nl.fd(), SOL_SOCKET, SO_RCVTIMEO, &bound, sizeof bound);

    struct {
        nlmsghdr header;
        inet_diag_req_v2 body;
    } request{};
    request.header.nlmsg_len = sizeof request;
    request.header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
    request.header.nlmsg_flags = NLM_F_REQUEST;
    request.header.nlmsg_seq = 1;
    request.body.sdiag_family = AF_INET;
    request.body.sdiag_protocol = IPPROTO_TCP;
    request.body.idiag_states = ~0u;
    request.body.id.idiag_sport = local.sin_port;
    request.body.id.idiag_dport = remote.sin_port;
    request.body.id.idiag_src[0] = local.sin_addr.s_addr;
    request.body.id.idiag_dst[0] = remote.sin_addr.s_addr;
    request.body.id.idiag_cookie[0] = INET_DIAG_NOCOOKIE;
    request.body.id.idiag_cookie[1] = INET_DIAG_NOCOOKIE;

    sockaddr_nl kernel{};
    kernel.nl_family = AF_NETLINK;
    if (::sendto(nl.fd(), &request, sizeof request, 0, reinterpret_cast<sockaddr*>(&kernel), sizeof kernel) < 0) {
        say(why, errnoText("netlink send", errno));
        return std::nullopt;
    }

    alignas(nlmsghdr) char buffer[8192];
    const ssize_t got = ::recv(nl.fd(), buffer, sizeof buffer, 0);
    if (got < 0) {
        say(why, errnoText("netlink receive", errno));
        return std::nullopt;
    }
    int length = static_cast<int>(got);
    for (auto* msg = reinterpret_cast<nlmsghdr*>(buffer); NLMSG_OK(msg, length); msg = NLMSG_NEXT(msg, length)) {
        if (msg->nlmsg_seq != request.header.nlmsg_seq) continue;
        if (msg->nlmsg_type == NLMSG_ERROR) {
            const auto* err = static_cast<const nlmsgerr*>(NLMSG_DATA(msg));
            if (msg->nlmsg_len < NLMSG_LENGTH(sizeof(nlmsgerr)) || err->error == 0) break;
            say(why, -err->error == ENOENT ? std::string("no such socket") : errnoText("socket table", -err->error));
            return std::nullopt;
        }
        if (msg->nlmsg_type != SOCK_DIAG_BY_FAMILY || msg->nlmsg_len < NLMSG_LENGTH(sizeof(inet_diag_msg))) continue;
        const auto* found = static_cast<const inet_diag_msg*>(NLMSG_DATA(msg));
        // The kernel may answer with a listener when the exact socket is gone: take only
        // the socket asked for.
        if (found->idiag_family != AF_INET || found->id.idiag_sport != local.sin_port ||
            found->id.idiag_dport != remote.sin_port || found->id.idiag_src[0] != local.sin_addr.s_addr ||
            found->id.idiag_dst[0] != remote.sin_addr.s_addr) {
            say(why, "no such socket");
            return std::nullopt;
        }
        // A socket no process holds (closed by its owner, or a time-wait entry) reports
        // root or nothing as its owner: that says nothing about who made it.
        if (found->idiag_inode == 0 || found->idiag_state == TCP_TIME_WAIT || found->idiag_state == TCP_LISTEN) {
            say(why, "socket no longer held by a process");
            return std::nullopt;
        }
        return static_cast<uid_t>(found->idiag_uid);
    }
    say(why, "no answer from the socket table");
    return std::nullopt;
}

std::optional<uid_t> connectedPeerOwner(int fd, std::string* why) {
    sockaddr_storage ours{}, theirs{};
    socklen_t oursLength = sizeof ours, theirsLength = sizeof theirs;
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&ours), &oursLength) != 0 ||
        ::getpeername(fd, reinterpret_cast<sockaddr*>(&theirs), &theirsLength) != 0) {
        say(why, errnoText("socket addresses", errno));
        return std::nullopt;
    }
    if (ours.ss_family != AF_INET || theirs.ss_family != AF_INET) {
        say(why, "not a TCP/IPv4 connection");
        return std::nullopt;
    }
    // The far end's local address is our remote one.
    return tcpSocketOwner(reinterpret_cast<const sockaddr_in&>(theirs), reinterpret_cast<const sockaddr_in&>(ours), why);
}

}  // namespace kesu::peer
