// Which local account owns the other end of a TCP connection made on this machine. The
// kernel keeps the owner of every socket; a connection from loopback has both ends here.
// One implementation per system (linux/PeerOwner.cpp); none of it goes through Platform,
// so a test's fake platform never weakens the check.
#pragma once

#include <netinet/in.h>
#include <sys/types.h>

#include <optional>
#include <string>

namespace kesu::peer {

// The owner of a live TCP/IPv4 socket bound to `local` and connected to `remote` (addresses
// and ports in network order, as sockets report them). Nullopt when no such socket exists,
// when no process holds it any more (closed, lingering, time-wait: its owner is no longer
// known) or when the lookup fails; `why` then says which.
std::optional<uid_t> tcpSocketOwner(const sockaddr_in& local, const sockaddr_in& remote, std::string* why = nullptr);

// The owner of the socket at the far end of the accepted connection `fd` (our remote
// address is its local one and the other way round). Nullopt as above, or when `fd` is not
// a connected TCP/IPv4 socket.
std::optional<uid_t> connectedPeerOwner(int fd, std::string* why = nullptr);

}  // namespace kesu::peer
