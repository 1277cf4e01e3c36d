#include "core/HttpAliveCheck.h"

#include "control/HttpService.h"
#include "core/Config.h"
#include "core/Utils.h"

namespace kesu {

HttpAliveCheck::HttpAliveCheck(std::function<bool()> probe)
    : probe_(probe ? std::move(probe) : std::function<bool()>([] { return Utils::isHttpAlive(); })) {
    thread_ = std::thread([this] { httpKeepAliveCheck(); });
}

HttpAliveCheck::~HttpAliveCheck() { stop(); }

void HttpAliveCheck::stop() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopped_ = true;
    }
    cv_.notify_all();
    if (thread_.joinable() && thread_.get_id() != std::this_thread::get_id()) thread_.join();
}

int HttpAliveCheck::restarts() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return restarts_;
}

bool HttpAliveCheck::waitForRestarts(int count, std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    return cv_.wait_for(lock, timeout, [&] { return restarts_ >= count; });
}

bool HttpAliveCheck::waitStopped(std::chrono::milliseconds period) {
    std::unique_lock<std::mutex> lock(mutex_);
    return cv_.wait_for(lock, period, [this] { return stopped_; });
}

void HttpAliveCheck::httpKeepAliveCheck() {
    for (;;) {
        if (waitStopped(Config::current().httpWatchdogPeriod)) return;
        if (probe_()) continue;
        Utils::mPrintlog("[CheckHttpAlive::keepCheckHttpAlive] Http is stop! Restart http service!");
        HttpService::httpService().stop();
        if (waitStopped(Config::current().httpRestartPause)) return;
        HttpService::httpService().startHttpServic();  // a failure is retried next pass
        std::lock_guard<std::mutex> lock(mutex_);
        ++restarts_;
        cv_.notify_all();
    }
}

}  // namespace kesu
