#include "discovery/ServiceWorker.h"

#include <exception>
#include <string>

#include "core/Config.h"
#include "core/Utils.h"
#include "discovery/KesuAdapterManager.h"
#include "discovery/SsdpDeviceManager.h"

namespace kesu {

ServiceWorker::~ServiceWorker() { stop(); }

void ServiceWorker::start() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    if (isRunning()) return;
    ssdpInitLocked();
    preconnectInit();
}

void ServiceWorker::ssdpInit() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    ssdpInitLocked();
}

void ServiceWorker::ssdpInitLocked() {
    if (isRunning()) return;
    SsdpDeviceManager::instance();
    KesuAdapterManager& adapters = KesuAdapterManager::instance();
    if (!adapters.isActive()) adapters.creatAdapterSocket();  // again after a stop
    adapters.resumePauses();
    std::lock_guard<std::mutex> guard(mutex_);
    stopping_ = false;
    ssdpThread_ = std::thread([this] { ssdpLoop(); });
}

void ServiceWorker::preconnectInit() {
    // The pre-connection scheduler (its own thread, one pass per second) is started here,
    // after discovery, and stopped in stop().
}

void ServiceWorker::stop() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    std::thread loop;
    {
        std::lock_guard<std::mutex> guard(mutex_);
        if (!ssdpThread_.joinable()) return;
        stopping_ = true;
        loop = std::move(ssdpThread_);
    }
    wake_.notify_all();
    KesuAdapterManager::instance().interruptPauses();
    loop.join();
    KesuAdapterManager::instance().shutdown();
}

bool ServiceWorker::isRunning() const {
    std::lock_guard<std::mutex> guard(mutex_);
    return ssdpThread_.joinable();
}

void ServiceWorker::ssdpLoop() {
    KesuAdapterManager& adapters = KesuAdapterManager::instance();
    std::unique_lock<std::mutex> guard(mutex_);
    while (!stopping_) {
        guard.unlock();
        try {
            adapters.checkNetWorkStatus();
            adapters.sendSsdp();
        } catch (const std::exception& e) {
            // The loop is the whole of discovery: one failed pass must not end it.
            Utils::mPrintlog(std::string("[ServiceWorker::ssdpInit] pass failed: ") + e.what());
        }
        guard.lock();
        wake_.wait_for(guard, Config::current().ssdpAnnouncePeriod, [this] { return stopping_; });
    }
}

}  // namespace kesu
