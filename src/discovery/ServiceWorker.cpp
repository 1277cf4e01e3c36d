#include "discovery/ServiceWorker.h"

#include <exception>
#include <string>

#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/PeriodicTimer.h"
#include "core/Log.h"
#include "discovery/KesuAdapterManager.h"
#include "discovery/LinkChangeListener.h"
#include "discovery/SsdpDeviceManager.h"

namespace kesu {

ServiceWorker::ServiceWorker(EventLoop& loop) : ServiceWorker(loop, SsdpDeviceManager::instance()) {}

ServiceWorker::ServiceWorker(EventLoop& loop, SsdpDeviceManager& devices) : loop_(loop), devices_(devices) {}

ServiceWorker::~ServiceWorker() { stop(); }

void ServiceWorker::start() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    if (running_.load()) return;
    ssdpInitLocked();
    preconnectInit();
}

void ServiceWorker::ssdpInit() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    ssdpInitLocked();
}

void ServiceWorker::ssdpInitLocked() {
    if (running_.load()) return;
    adapters_ = std::make_unique<KesuAdapterManager>(loop_, devices_);
    passes_ = std::make_unique<PeriodicTimer>(
        loop_.context(), [] { return Config::current().ssdpAnnouncePeriod; }, [this] { pass(); });
    // A burst of kernel notifications is one extra pass, which also restarts the period.
    changes_ = std::make_unique<LinkChangeListener>(loop_, [this] { passes_->runNow(); });
    running_.store(true);
    passes_->start(std::chrono::milliseconds(0));
}

void ServiceWorker::preconnectInit() {
    // The pre-connection scheduler (on the loop, one pass per second) is started here,
    // after discovery, and stopped in stop().
}

void ServiceWorker::stop() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    if (!running_.exchange(false)) return;
    changes_->stop();
    passes_->stop();
    // After this no pass runs any more: one that was running has ended, later ones see the
    // timer stopped.
    loop_.call([] {});
    changes_.reset();
    passes_.reset();
    adapters_.reset();  // closes the sockets and drops pending rebuilds, on the loop
}

void ServiceWorker::pass() {
    try {
        adapters_->checkNetWorkStatus();
        adapters_->sendSsdp();
    } catch (const std::exception& e) {
        // One failed pass must not end discovery.
        Log::mPrintlog(std::string("[ServiceWorker::ssdpInit] pass failed: ") + e.what());
    }
}

}  // namespace kesu
