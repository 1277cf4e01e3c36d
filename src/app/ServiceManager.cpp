#include "app/ServiceManager.h"

#include "account/DataInstance.h"

#include "connect/PcsuiteInterface.h"
#include "connect/SocketServer.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "app/RestartServiceSubscriber.h"
#include "cloud/HttpEventSubscriber.h"
#include "events/EventDetected.h"
#include "events/SystemEventSubscriber.h"
#include "core/Log.h"
#include "discovery/ServiceWorker.h"
#include "reports/DeviceReports.h"
#include "events/EventPublisher.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"
#include "preconnect/PreConnectEventSubscriber.h"
#include "preconnect/PreConnectionThread.h"

namespace kesu {

ServiceManager::ServiceManager(EventLoop& loop) : loop_(loop) {}
ServiceManager::~ServiceManager() { stop(); }

void ServiceManager::start() {
    if (started_) return;
    started_ = true;
    Log::mPrintlog("[Server Start]this is ServiceManager \n");

    // LAN discovery (adapter check and announcement loop), then the pre-connection scheduler,
    // whose held links run on the loop and whose list changes reach the pre-connect report.
    serviceWorker_ = std::make_unique<ServiceWorker>(loop_);
    serviceWorker_->start();
    auto& registry = DeviceWaitForPreConnectManager::instance();
    registry.setEventLoop(&loop_);
    registry.setListChangedHandler([] { ReportDevicesV2::instance().notify(); });
    preconnectScheduler_ = std::make_unique<PreConnectionThread>(loop_, registry);
    preconnectScheduler_->run();

    // The server for phone-initiated connections, and the PC-initiated ones, on the loop.
    PcsuiteInterface::setLoop(&loop_);
    phoneServer_ = std::make_unique<SocketServer>(loop_);
    ServerWorkAct(*phoneServer_).ServerAccept();

    // LAN device list: a first report now, then on every new or changed device and on expiry.
    wlanReportDevices_ = std::make_shared<WlanReportDevices>();
    wlanReportDevices_->start(loop_);
    wlanReportDevices_->notify();
    WlanDetectedDeviceCompare::instance().addObserver(wlanReportDevices_);
    wlanDeviceDelete_ = std::make_unique<WlanDeviceDelete>(loop_);
    wlanDeviceDelete_->addObserver(wlanReportDevices_);
    wlanDeviceDelete_->detectedToDelete(Config::current().expirySweepPeriod);

    ReportDevicesV2::instance().start(loop_);

    // Event subscribers, in their registration order.
    subscribers_ = {std::make_shared<PreConnectEventSubscriber>(loop_),
                    std::make_shared<HttpEventSubscriber>(loop_),
                    std::make_shared<RestartServiceSubscriber>(loop_),
                    std::make_shared<SystemEventSubscriber>(loop_)};
    for (const auto& subscriber : subscribers_) EventPublisher::instance().addObserver(subscriber);
    // The first account read announced itself before anyone listened: a service that starts
    // signed in reports the PC and fetches the account's device list now, as on a PC suite
    // event, not only at the next account, network or PC suite event.
    if (!dataInstance().get(&databaseParam::openid).empty()) {
        Log::mPrintlog("[Server Start] signed in at start, report the PC and fetch the device list");
        EventPublisher::instance().notifySubscribers(ServiceEvent::Pcsuite);
    }
    eventDetected_ = std::make_unique<EventDetected>(loop_);
}

void ServiceManager::stop() {
    if (!started_) return;
    started_ = false;
    if (serviceWorker_) serviceWorker_->stop();  // the network events' publisher goes first
    serviceWorker_.reset();
    // No new pre-connection; every held link closed while the loop still runs.
    if (preconnectScheduler_) preconnectScheduler_->stop();
    preconnectScheduler_.reset();
    auto& registry = DeviceWaitForPreConnectManager::instance();
    registry.setListChangedHandler({});
    for (const auto& entry : registry.getAllDevices()) entry->disconnectPreConnect();
    registry.clearAllDevices();
    registry.setEventLoop(nullptr);
    if (phoneServer_) phoneServer_->stop();
    phoneServer_.reset();
    PcsuiteInterface::setLoop(nullptr);
    eventDetected_.reset();
    EventPublisher::instance().clearObservers();
    for (const auto& subscriber : subscribers_) subscriber->stop(std::chrono::seconds(5));
    subscribers_.clear();
    // Device list reports: no more sweeps, no reporter left behind, nothing waiting to go.
    if (wlanDeviceDelete_) wlanDeviceDelete_->stop();
    wlanDeviceDelete_.reset();
    if (wlanReportDevices_) {
        WlanDetectedDeviceCompare::instance().removeObserver(wlanReportDevices_);
        wlanReportDevices_->stop();
    }
    wlanReportDevices_.reset();
    ReportDevicesV2::instance().stop();
}

void ServiceManager::restart() {
    stop();
    start();
}

}  // namespace kesu
