// The library declares its per-connection step private; this file alone is compiled with
// access checks off (see CMakeLists.txt) so that the override can hand an admitted
// connection to the library's own step. Keep nothing else here.
#include "control/PeerCheckedServer.h"

#include <sys/socket.h>
#include <unistd.h>

namespace kesu {

bool PeerCheckedServer::process_and_close_socket(socket_t sock) {
    if (admit_ && admit_(sock)) return httplib::Server::process_and_close_socket(sock);
    ::shutdown(sock, SHUT_RDWR);
    ::close(sock);
    return false;
}

}  // namespace kesu
