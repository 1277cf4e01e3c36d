#include "app/Application.h"

#include "account/DataGet.h"
#include "account/FileMonitor.h"
#include "app/HttpAliveCheck.h"
#include "app/ServiceManager.h"
#include "control/HttpService.h"
#include "core/EventLoop.h"

namespace kesu {

Application::Application() = default;
Application::~Application() { stop(); }

void Application::start() {
    if (started_) return;
    started_ = true;
    controlServer_ = std::make_unique<HttpService>();
    controlServer_->startHttpService();
    loop_ = std::make_unique<EventLoop>();
    loop_->start();
    // The account is read before discovery starts, so that the first announcement carries it.
    fileMonitorStart(*loop_);
    updateHistoryDevice();
    workers_ = std::make_unique<ServiceManager>(*loop_);
    workers_->start();
    watchdog_ = std::make_unique<HttpAliveCheck>(*loop_, *controlServer_);
}

void Application::stop() {
    if (!started_) return;
    started_ = false;
    if (watchdog_) watchdog_->stop();
    watchdog_.reset();
    if (workers_) workers_->stop();
    workers_.reset();
    fileMonitorStop();
    if (controlServer_) controlServer_->stop();
    controlServer_.reset();
    if (loop_) loop_->stop();
    loop_.reset();
}

}  // namespace kesu
