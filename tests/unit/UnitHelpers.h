// Small helpers most unit tests share: the day's log text, one control request through the
// whole dispatcher, and a free UDP port on loopback.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include "control/HttpService.h"
#include "core/Json.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "support/TestSupport.h"

namespace kesu::test {

// Everything logged today so far.
inline std::string todaysLog() { return readAll(Log::logFilePath(WallClock::now())); }

inline bool logged(const std::string& line) { return todaysLog().find(line) != std::string::npos; }

// One control request through the dispatcher; the JSON after the "N#" prefix (null when the
// answer is empty).
inline Json control(const std::string& event, Json args = Json::array()) {
    const std::string answer = HttpService::handleBody(Json{{"event", event}, {"args", std::move(args)}}.dump());
    const auto hash = answer.find('#');
    if (hash == std::string::npos) return Json();
    return Json::parse(answer.substr(hash + 1));
}

// A free UDP port on 127.0.0.1 (bound then released).
inline int freeUdpPort() {
    const int fd = ::socket(AF_INET, SOCK_DGRAM, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    ::close(fd);
    return ntohs(address.sin_port);
}

}  // namespace kesu::test
