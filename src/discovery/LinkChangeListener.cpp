#include "discovery/LinkChangeListener.h"

#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <exception>
#include <string>
#include <system_error>
#include <vector>

#include "core/EventLoop.h"
#include "core/Log.h"

namespace kesu {

namespace {

// Whether one netlink message tells of a link or address change worth an adapter check.
bool isChange(const nlmsghdr* message, std::size_t length) {
    switch (message->nlmsg_type) {
        case RTM_NEWADDR:
        case RTM_DELADDR:
        case RTM_DELLINK:
            return true;
        case RTM_NEWLINK: {
            // Wireless drivers report scans and the like as a link message carrying only a
            // wireless event: no link state changed.
            if (length < NLMSG_LENGTH(sizeof(ifinfomsg))) return true;
            const auto* info = static_cast<const ifinfomsg*>(NLMSG_DATA(message));
            int left = static_cast<int>(length - NLMSG_LENGTH(sizeof(ifinfomsg)));
            for (const rtattr* attribute = IFLA_RTA(info); RTA_OK(attribute, left);
                 attribute = RTA_NEXT(attribute, left)) {
                if (attribute->rta_type == IFLA_WIRELESS) return false;
            }
            return true;
        }
        default:
            return false;
    }
}

}  // namespace

struct LinkChangeListener::State : std::enable_shared_from_this<State> {
    State(asio::io_context& io, std::function<void()> callback, std::chrono::milliseconds wait)
        : descriptor(io), timer(io), onChange(std::move(callback)), debounce(wait) {}

    // Loop only from here on.
    void await() {
        descriptor.async_wait(asio::posix::descriptor_base::wait_read,
                              [self = shared_from_this()](const asio::error_code& error) { self->onReadable(error); });
    }

    void onReadable(const asio::error_code& error) {
        if (stopped.load() || error == asio::error::operation_aborted) return;
        if (error) {
            Log::mPrintlog("[LinkChangeListener] wait failed: " + error.message() + ", listening stops");
            return;
        }
        bool changed = false;
        for (;;) {
            const ssize_t n = ::recv(descriptor.native_handle(), buffer.data(), buffer.size(), MSG_DONTWAIT);
            if (n < 0) {
                if (errno == EINTR) continue;
                if (errno == EAGAIN || errno == EWOULDBLOCK) break;
                if (errno == ENOBUFS) {  // notifications were lost: something changed
                    changed = true;
                    continue;
                }
                Log::mPrintlog("[LinkChangeListener] receive failed: " + std::system_category().message(errno) +
                                 ", listening stops");
                return;
            }
            int left = static_cast<int>(n);
            for (const auto* message = reinterpret_cast<const nlmsghdr*>(buffer.data()); NLMSG_OK(message, left);
                 message = NLMSG_NEXT(message, left)) {
                if (isChange(message, message->nlmsg_len)) changed = true;
            }
        }
        if (changed && !armed) {
            armed = true;
            timer.expires_after(debounce);
            timer.async_wait([self = shared_from_this()](const asio::error_code& e) {
                self->armed = false;
                if (e || self->stopped.load()) return;
                try {
                    self->onChange();
                } catch (const std::exception& ex) {
                    Log::mPrintlog(std::string("[LinkChangeListener] change handling failed: ") + ex.what());
                }
            });
        }
        await();
    }

    void shut() {
        asio::error_code ignored;
        timer.cancel();
        descriptor.close(ignored);
        onChange = nullptr;
    }

    asio::posix::stream_descriptor descriptor;
    asio::steady_timer timer;
    std::function<void()> onChange;
    const std::chrono::milliseconds debounce;
    std::vector<char> buffer = std::vector<char>(32 * 1024);  // loop only
    bool armed = false;                                        // loop only
    std::atomic<bool> stopped{false};
};

LinkChangeListener::LinkChangeListener(EventLoop& loop, std::function<void()> onChange,
                                       std::chrono::milliseconds debounce)
    : loop_(loop), state_(std::make_shared<State>(loop.context(), std::move(onChange), debounce)) {
    const int fd = ::socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE);
    sockaddr_nl local{};
    local.nl_family = AF_NETLINK;
    local.nl_groups = RTMGRP_LINK | RTMGRP_IPV4_IFADDR;
    if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&local), sizeof local) != 0) {
        Log::mPrintlog("[LinkChangeListener] network change notifications unavailable: " +
                         std::system_category().message(errno));
        if (fd >= 0) ::close(fd);
        state_->stopped.store(true);
        return;
    }
    state_->descriptor.assign(fd);
    asio::post(loop.context(), [state = state_] {
        if (!state->stopped.load()) state->await();
    });
}

LinkChangeListener::~LinkChangeListener() { stop(); }

bool LinkChangeListener::listening() const { return !state_->stopped.load(); }

void LinkChangeListener::stop() {
    if (state_->stopped.exchange(true)) return;
    loop_.call([state = state_] { state->shut(); });
}

}  // namespace kesu
