// What the phone connection tests share: the PC's identity as phones see it (a fixture), the
// service's event loop, and a stand-in for a launched program that reports its arguments
// back to the test over loopback. The phones themselves are tools/phonesim.
#pragma once

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include "account/DataInstance.h"
#include "connect/PhoneFrame.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "core/Log.h"
#include "platform/fake/FakePlatform.h"
#include "support/TestSupport.h"

namespace kesu::test {

// The PC every connection test talks for: host "Office-Desk-PC" (sent as "Off****-PC"), a
// Wi-Fi adapter aa:bb:cc:dd:ee:ff and a signed-in account.
class PcIdentityTest : public ::testing::Test {
protected:
    void SetUp() override {
        resetSharedStateForTest();
        fake->setLocalizedHostName("Office-Desk-PC");
        fake->addAdapter("Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:ff", "192.168.1.2");
        dataInstance().update([](databaseParam& p) {
            p = databaseParam();
            p.openid = "openid-of-pc";
            p.Phone = "138****5678";
        });
    }
    void TearDown() override {
        dataInstance().update([](databaseParam& p) { p = databaseParam(); });
        resetSharedStateForTest();
        Log::closeLog();
    }

    // The PC's connection request, exactly as sent.
    static Json pcRequest() {
        return {{"bytes", {0}},          {"deviceName", "Off****-PC"},        {"channel", 0},
                {"id", 87654321},        {"open_Id", "openid-of-pc"},         {"service_id", "com.kesu.pcsuite.SERVICE"},
                {"target_id", "aabbccddeeff"}, {"account", "138****5678"}, {"type", 1}};
    }
    // The PC's answer to a phone: the same identity, the tag, the service and "type" as text.
    static Json pcAnswer(int tag, const std::string& service = "com.kesu.pcsuite.SERVICE") {
        Json answer = pcRequest();
        answer["bytes"] = {tag};
        answer["service_id"] = service;
        answer["type"] = "1";
        return answer;
    }

    HermeticEnv env;
    ScopedFakePlatform fake;
    EventLoop loop;  // started by the tests that need it; outlives what runs on it
};

// A listening socket on 127.0.0.1, an ephemeral port, `backlog` pending connections.
inline int listenLoopback(int& port, int backlog = 16) {
    const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    ::listen(fd, backlog);
    socklen_t len = sizeof addr;
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
    port = ntohs(addr.sin_port);
    return fd;
}

// Waits for `fd` to become readable; false at the time-out.
inline bool readable(int fd, std::chrono::milliseconds timeout) {
    pollfd pfd{fd, POLLIN, 0};
    return ::poll(&pfd, 1, static_cast<int>(timeout.count())) > 0;
}

// A program at `path` (an executable script written there) that sends its arguments, each
// ended by a NUL byte, to this recorder over loopback and exits. A start that nobody waits
// for never blocks the program.
class LaunchRecorder {
public:
    explicit LaunchRecorder(const std::string& path) {
        listenFd_ = listenLoopback(port_);
        std::filesystem::create_directories(std::filesystem::path(path).parent_path());
        std::ofstream(path, std::ios::trunc) << "#!/bin/bash\nexec 3<>/dev/tcp/127.0.0.1/" << port_
                                              << " || exit 1\nprintf '%s\\0' \"$@\" >&3\n";
        std::filesystem::permissions(path, std::filesystem::perms::owner_all);
    }
    ~LaunchRecorder() { ::close(listenFd_); }

    // The arguments of the next start; nullopt when none came in time.
    std::optional<std::vector<std::string>> next(std::chrono::milliseconds timeout) {
        if (!readable(listenFd_, timeout)) return std::nullopt;
        const int link = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
        std::string data;
        char buffer[4096];
        while (readable(link, timeout)) {
            const ssize_t n = ::recv(link, buffer, sizeof buffer, 0);
            if (n <= 0) break;
            data.append(buffer, static_cast<std::size_t>(n));
        }
        ::close(link);
        std::vector<std::string> args;
        std::size_t start = 0;
        for (std::size_t end; (end = data.find('\0', start)) != std::string::npos; start = end + 1)
            args.push_back(data.substr(start, end - start));
        return args;
    }

private:
    int listenFd_ = -1;
    int port_ = 0;
};

}  // namespace kesu::test
