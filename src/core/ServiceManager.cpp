#include "core/ServiceManager.h"

#include "core/RestartServiceSubscriber.h"
#include "core/Utils.h"
#include "events/EventPublisher.h"

namespace kesu {

ServiceManager::~ServiceManager() { stop(); }

void ServiceManager::start() {
    if (started_) return;
    started_ = true;
    Utils::mPrintlog("[Server Start]this is ServiceManager \n");

    // Event subscribers, in their registration order.
    subscribers_ = {std::make_shared<RestartServiceSubscriber>()};
    for (const auto& subscriber : subscribers_) EventPublisher::instance().addObserver(subscriber);
}

void ServiceManager::stop() {
    if (!started_) return;
    started_ = false;
    EventPublisher::instance().clearObservers();
    for (const auto& subscriber : subscribers_) subscriber->waitIdle(std::chrono::seconds(5));
    subscribers_.clear();
}

void ServiceManager::restart() {
    stop();
    start();
}

}  // namespace kesu
