#include "connect/PhoneLink.h"

#include <asio/connect.hpp>
#include <asio/experimental/as_tuple.hpp>
#include <asio/experimental/awaitable_operators.hpp>
#include <asio/use_awaitable.hpp>

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

#include "core/Config.h"
#include "core/Log.h"

namespace kesu {

namespace {

using asio::experimental::awaitable_operators::operator||;
constexpr auto kTuple = asio::experimental::as_tuple(asio::use_awaitable);

}  // namespace

PhoneLink::PhoneLink(const asio::any_io_executor& executor)
    : socket_(executor), readTimer_(executor), writeTimer_(executor) {}

PhoneLink::PhoneLink(asio::ip::tcp::socket socket)
    : socket_(std::move(socket)), readTimer_(socket_.get_executor()), writeTimer_(socket_.get_executor()) {
    if (socket_.is_open()) adopt();
}

void PhoneLink::adopt() {
    asio::error_code ignored;
    socket_.set_option(asio::ip::tcp::no_delay(true), ignored);
    socket_.non_blocking(true, ignored);  // reads and writes first try without waiting
    const auto peer = socket_.remote_endpoint(ignored);
    const auto local = socket_.local_endpoint(ignored);
    peerAddress_ = peer.address().to_string();
    peerPort_ = peer.port();
    localAddress_ = local.address().to_string();
    localPort_ = local.port();
    connected_ = true;
}

template <class T>
asio::awaitable<std::optional<T>> PhoneLink::beforeDeadline(asio::awaitable<T> operation, asio::steady_timer& timer,
                                                            Clock::time_point deadline) {
    if (deadline == kNoDeadline) co_return co_await std::move(operation);
    timer.expires_at(deadline);
    auto first = co_await (std::move(operation) || timer.async_wait(kTuple));
    if (first.index() == 0) co_return std::move(std::get<0>(first));
    co_return std::nullopt;
}

bool PhoneLink::enableKeepAlive(int idleSeconds, int intervalSeconds, int probes) {
    if (!socket_.is_open()) return false;
    asio::error_code ec;
    socket_.set_option(asio::socket_base::keep_alive(true), ec);
    if (ec) return false;
    const int fd = socket_.native_handle();
    return ::setsockopt(fd, IPPROTO_TCP, TCP_KEEPIDLE, &idleSeconds, sizeof idleSeconds) == 0 &&
           ::setsockopt(fd, IPPROTO_TCP, TCP_KEEPINTVL, &intervalSeconds, sizeof intervalSeconds) == 0 &&
           ::setsockopt(fd, IPPROTO_TCP, TCP_KEEPCNT, &probes, sizeof probes) == 0;
}

void PhoneLink::shut() {
    if (shut_.exchange(true)) return;
    connected_ = false;
    asio::error_code ignored;
    if (socket_.is_open()) socket_.shutdown(asio::socket_base::shutdown_both, ignored);
    socket_.close(ignored);  // pending operations end with operation_aborted
    readTimer_.cancel();
    writeTimer_.cancel();
}

asio::awaitable<bool> PhoneLink::connect(std::string ip, std::uint16_t port, Clock::time_point deadline,
                                         std::string& error) {
    asio::error_code ec;
    const auto address = asio::ip::make_address(ip, ec);
    if (ec) {
        error = "not a numeric address: " + ip;
        co_return false;
    }
    if (shut_) {
        error = "closed before connecting";
        co_return false;
    }
    if (socket_.is_open()) {
        error = "already connected";
        co_return false;
    }
    const auto connected =
        co_await beforeDeadline(socket_.async_connect({address, port}, kTuple), writeTimer_, deadline);
    if (shut_) {
        error = "closed while connecting";
        co_return false;
    }
    if (!connected) {
        error = "connect timed out";
        co_return false;
    }
    if (const auto [connectError] = *connected; connectError) {
        error = connectError.message();
        co_return false;
    }
    adopt();
    co_return true;
}

asio::awaitable<bool> PhoneLink::writeAll(const Bytes& data, Clock::time_point deadline, std::string& error) {
    if (!socket_.is_open() || !connected_) {
        error = "not connected";
        co_return false;
    }
    std::size_t sent = 0;
    while (sent < data.size()) {
        const auto rest = asio::buffer(data.data() + sent, data.size() - sent);
        asio::error_code ec;
        std::size_t n = socket_.write_some(rest, ec);
        if (ec == asio::error::would_block) {
            const auto written = co_await beforeDeadline(socket_.async_write_some(rest, kTuple), writeTimer_, deadline);
            if (shut_) {
                error = "closed while writing";
                co_return false;
            }
            if (!written) {
                if (sent == 0) {
                    error = "write timed out";
                } else {
                    error = "sent only " + std::to_string(sent) + " of " + std::to_string(data.size()) +
                            " bytes in time, closing the link";
                    shut();
                }
                co_return false;
            }
            std::tie(ec, n) = *written;
        }
        sent += n;
        if (ec && ec != asio::error::would_block) {
            error = shut_ ? "closed while writing" : ec.message();
            connected_ = false;
            co_return false;
        }
    }
    co_return true;
}

asio::awaitable<PhoneLink::Read> PhoneLink::readFrame(Bytes& frame, Clock::time_point deadline) {
    for (;;) {
        auto next = cutter_.next();
        if (const std::size_t dropped = cutter_.takeDropped(); dropped > 0) {
            const bool oversized = cutter_.takeOversized();
            Log::mPrintlog("[PhoneLink::readFrame] " + peerAddress_ + " dropped " + std::to_string(dropped) +
                             " bytes that are not a phone frame" +
                             (oversized ? " (a frame announced a body above " +
                                              std::to_string(Config::current().phoneFrameMaxBody) + " bytes)"
                                        : std::string()));
        }
        if (next) {
            frame = std::move(*next);
            co_return Read::Frame;
        }
        if (shut_) co_return Read::Shut;
        if (peerClosed_ || !socket_.is_open()) {
            if (const std::size_t rest = cutter_.buffered(); rest > 0) {
                Log::mPrintlog("[PhoneLink::readFrame] " + peerAddress_ + " dropped " + std::to_string(rest) +
                                 " bytes of an unfinished frame");
                cutter_.clear();
            }
            co_return Read::Closed;
        }
        asio::error_code ec;
        std::size_t n = socket_.read_some(asio::buffer(chunk_), ec);
        if (ec == asio::error::would_block) {
            const auto got = co_await beforeDeadline(socket_.async_read_some(asio::buffer(chunk_), kTuple),
                                                     readTimer_, deadline);
            if (shut_) co_return Read::Shut;
            if (!got) co_return Read::TimedOut;
            std::tie(ec, n) = *got;
        }
        if (n > 0) cutter_.feed(chunk_.data(), n);
        if (!ec) continue;
        if (ec != asio::error::eof) readError_ = ec.message();
        peerClosed_ = true;
        connected_ = false;
    }
}

}  // namespace kesu
