#include "control/HttpService.h"

#include <httplib.h>
#include <pthread.h>
#include <sys/socket.h>

#include <cstdio>
#include <cstring>

#include "control/OnDemandTaskQueue.h"
#include "control/PeerCheckedServer.h"
#include "control/RequestHandle.h"
#include "control/ResponseHandler.h"
#include "core/Config.h"
#include "core/Text.h"
#include "core/Log.h"

namespace kesu {

HttpService::HttpService() = default;
HttpService::~HttpService() { stop(); }

std::string HttpService::handleBody(const std::string& body) {
    try {
        requestObj request;
        const std::string text = ResponseHandler::switchUint8ArrToString(body);
        if (!text.empty()) request = RequestHandle().format(text);
        return text::lengthPrefixed(ResponseHandler::create(request));
    } catch (const std::exception& e) {
        Log::mPrintlog(std::string("[httpService] request failed: ") + e.what());
        return {};
    }
}

bool HttpService::startHttpService() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (serve_) return true;
    const Config& config = Config::current();

    // Only processes of this service's own user (or root) are answered: the API carries
    // access tokens and switches the signed-in account.
    PeerGate* gate = &gate_;
    auto server = std::make_unique<PeerCheckedServer>([gate](socket_t sock) { return gate->admit(sock); });
    // Workers on demand: an idle service keeps one, a burst gets up to controlThreads.
    const int threads = config.controlThreads;
    server->new_task_queue = [threads] {
        return new OnDemandTaskQueue(static_cast<std::size_t>(threads), std::chrono::seconds(5));
    };
    server->set_payload_max_length(config.controlMaxBody);
    server->set_read_timeout(config.controlReadTimeout);
    server->set_write_timeout(config.controlReadTimeout);
    server->set_keep_alive_max_count(100);
    server->set_tcp_nodelay(true);  // the answer goes out at once, not after a delayed ACK
    // Plain SO_REUSEADDR: a second listener must never share the port.
    server->set_socket_options([](int sock) {
        int yes = 1;
        ::setsockopt(sock, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof yes);
    });
    // One handler for every method and path. (A pre-routing handler would run before the
    // body is read, so the catch-all is a pattern matching every path on each method.)
    const auto handler = [](const httplib::Request& req, httplib::Response& res) {
        res.status = 200;
        res.set_content(handleBody(req.body), "text/plain");
    };
    const std::string everyPath = ".*";
    server->Get(everyPath, handler);
    server->Post(everyPath, handler);
    server->Put(everyPath, handler);
    server->Patch(everyPath, handler);
    server->Delete(everyPath, handler);
    server->Options(everyPath, handler);

    // IPv4 on the loopback address only: the API can change the signed-in account.
    server->set_address_family(AF_INET);
    int bound = -1;
    errno = 0;
    if (config.controlPort == 0) {
        bound = server->bind_to_any_port(config.controlHost);
    } else if (server->bind_to_port(config.controlHost, config.controlPort)) {
        bound = config.controlPort;
    }
    if (bound <= 0) {
        const int err = errno;
        std::printf("[httpService]Run error as %s\n", std::strerror(err != 0 ? err : EADDRINUSE));
        std::fflush(stdout);
        return false;
    }
    port_ = bound;
    httplib::Server* raw = server.get();
    serve_ = std::move(server);
    auto ended = std::make_shared<std::promise<void>>();
    listenerEnded_ = ended->get_future();
    listener_ = std::thread([raw, ended] {
        pthread_setname_np(pthread_self(), "kesu-listen");
        raw->listen_after_bind();
        ended->set_value();
    });
    Log::mPrintlog("[httpService]Run succ ");
    return true;
}

void HttpService::stop() {
    std::unique_ptr<httplib::Server> server;
    std::thread listener;
    std::future<void> ended;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        server = std::move(serve_);
        listener = std::move(listener_);
        ended = std::move(listenerEnded_);
        port_ = 0;
    }
    if (!server) return;
    // The library ignores a stop that comes before its listen loop has begun: repeat it
    // until the listener has ended.
    do {
        server->stop();
    } while (ended.valid() && ended.wait_for(std::chrono::milliseconds(20)) != std::future_status::ready);
    if (listener.joinable()) listener.join();
}

bool HttpService::isRunning() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return serve_ != nullptr;
}

int HttpService::port() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return port_;
}

}  // namespace kesu
