#include "core/ServiceMain.h"

#include <signal.h>

#include <cstring>
#include <string>

#include "account/DataGet.h"
#include "account/FileMonitor.h"
#include "control/HttpService.h"
#include "core/EventLoop.h"
#include "core/HttpAliveCheck.h"
#include "core/ServiceManager.h"
#include "core/SingleInstance.h"
#include "core/Utils.h"

namespace kesu {

int runService() {
    // Stop signals are taken by the main thread alone (sigwait below); every thread started
    // from here on inherits the blocked mask.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGTERM);
    sigaddset(&stopSignals, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    if (!processName(Utils::moduleName)) {
        Utils::mPrintlog("[服务启动] 服务已存在，终止操作");
        Utils::closeLog();
        return 0;
    }
    Utils::mPrintlog("[服务启动] 服务未存在，拉起服务");
    Utils::getConnectCenterUrl();
    Utils::writeConnServiceVersion(Utils::versionCode);
    Utils::deleteOldLogFile();
    Utils::GetPcSystemInfo();
    HttpService::httpService().startHttpServic();
    EventLoop loop;
    loop.start();
    fileMonitorStart(loop);
    updateHistoryDevice();

    ServiceManager manager(loop);
    manager.start();
    HttpAliveCheck watchdog(loop);

    int signalNumber = 0;
    while (sigwait(&stopSignals, &signalNumber) != 0) {
    }
    Utils::mPrintlog("[服务启动] signal " + std::string(strsignal(signalNumber)) + " received, stopping");
    watchdog.stop();
    manager.stop();
    fileMonitorStop();
    HttpService::httpService().stop();
    loop.stop();
    Utils::mPrintlog("[服务启动] stopped");
    Utils::closeLog();
    return 0;
}

}  // namespace kesu
