#include "app/HttpAliveCheck.h"

#include <asio/steady_timer.hpp>

#include <condition_variable>
#include <mutex>

#include "control/HttpService.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Log.h"
#include "pcsuite/PcsuiteClient.h"

namespace kesu {

struct HttpAliveCheck::State : std::enable_shared_from_this<State> {
    State(EventLoop& l, HttpService& s, std::function<bool()> p)
        : loop(l), server(s), probe(std::move(p)), pause(l.context()) {}

    // Loop: one round, HeartBeat then (when it failed) stop, pause, start.
    void check() {
        {
            std::lock_guard<std::mutex> lock(mutex);
            if (stopped || working) return;
            working = true;
        }
        auto self = shared_from_this();
        loop.offload([self] { return self->probe(); }, [self](bool alive) {
            if (alive || self->isStopped()) return self->finish(false);
            Log::mPrintlog("[CheckHttpAlive::keepCheckHttpAlive] Http is stop! Restart http service!");
            self->loop.offload([self] { self->server.stop(); }, [self] {
                if (self->isStopped()) return self->finish(false);
                self->pause.expires_after(Config::current().httpRestartPause);
                self->pause.async_wait([self](const std::error_code& error) {
                    if (error || self->isStopped()) return self->finish(false);
                    // A failure to start is retried next round.
                    self->loop.offload([self] { self->server.startHttpService(); },
                                       [self] { self->finish(true); });
                });
            });
        });
    }
    bool isStopped() {
        std::lock_guard<std::mutex> lock(mutex);
        return stopped;
    }
    void finish(bool restarted) {
        std::lock_guard<std::mutex> lock(mutex);
        working = false;
        if (restarted) ++restarts;
        cv.notify_all();
    }

    EventLoop& loop;
    HttpService& server;
    const std::function<bool()> probe;
    asio::steady_timer pause;  // loop only

    std::mutex mutex;
    std::condition_variable cv;
    bool stopped = false;
    bool working = false;  // a round is under way
    int restarts = 0;
};

HttpAliveCheck::HttpAliveCheck(EventLoop& loop, HttpService& server, std::function<bool()> probe)
    : state_(std::make_shared<State>(loop, server, probe ? std::move(probe)
                                                 : std::function<bool()>([] { return PcsuiteClient::isHttpAlive(); }))),
      timer_(loop.context(), [] { return Config::current().httpWatchdogPeriod; },
             [state = state_] { state->check(); }) {
    timer_.start();
}

HttpAliveCheck::~HttpAliveCheck() { stop(); }

void HttpAliveCheck::stop() {
    timer_.stop();
    {
        std::lock_guard<std::mutex> lock(state_->mutex);
        state_->stopped = true;
    }
    state_->loop.post([state = state_] { state->pause.cancel(); });
    // The HeartBeat gives up after its own time-out; the server's stop and start are short.
    std::unique_lock<std::mutex> lock(state_->mutex);
    state_->cv.wait_for(lock, Config::current().httpAliveTimeout + std::chrono::seconds(10),
                        [this] { return !state_->working; });
}

int HttpAliveCheck::restarts() const {
    std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->restarts;
}

bool HttpAliveCheck::waitForRestarts(int count, std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(state_->mutex);
    return state_->cv.wait_for(lock, timeout, [&] { return state_->restarts >= count; });
}

}  // namespace kesu
