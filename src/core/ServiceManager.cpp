#include "core/ServiceManager.h"

#include "core/RestartServiceSubscriber.h"
#include "events/EventDetected.h"
#include "events/PreConnectEventSubscriber.h"
#include "events/SystemEventSubscriber.h"
#include "core/Utils.h"
#include "events/EventPublisher.h"

namespace kesu {

ServiceManager::ServiceManager() = default;
ServiceManager::~ServiceManager() { stop(); }

void ServiceManager::start() {
    if (started_) return;
    started_ = true;
    Utils::mPrintlog("[Server Start]this is ServiceManager \n");

    // Event subscribers, in their registration order.
    subscribers_ = {std::make_shared<PreConnectEventSubscriber>(), std::make_shared<RestartServiceSubscriber>(),
                    std::make_shared<SystemEventSubscriber>()};
    for (const auto& subscriber : subscribers_) EventPublisher::instance().addObserver(subscriber);
    eventDetected_ = std::make_unique<EventDetected>();
}

void ServiceManager::stop() {
    if (!started_) return;
    started_ = false;
    eventDetected_.reset();
    EventPublisher::instance().clearObservers();
    for (const auto& subscriber : subscribers_) subscriber->waitIdle(std::chrono::seconds(5));
    subscribers_.clear();
}

void ServiceManager::restart() {
    stop();
    start();
}

}  // namespace kesu
