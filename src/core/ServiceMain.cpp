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
#include "core/Endpoints.h"
#include "core/Log.h"
#include "platform/SystemInfo.h"

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

    if (!processName(Log::moduleName)) {
        Log::mPrintlog("[服务启动] 服务已存在，终止操作");
        Log::closeLog();
        return 0;
    }
    Log::mPrintlog("[服务启动] 服务未存在，拉起服务");
    Endpoints::getConnectCenterUrl();
    Log::writeConnServiceVersion(Log::versionCode);
    Log::deleteOldLogFile();
    SystemInfo::GetPcSystemInfo();
    HttpService::httpService().startHttpService();
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
    Log::mPrintlog("[服务启动] signal " + std::string(strsignal(signalNumber)) + " received, stopping");
    watchdog.stop();
    manager.stop();
    fileMonitorStop();
    HttpService::httpService().stop();
    loop.stop();
    Log::mPrintlog("[服务启动] stopped");
    Log::closeLog();
    return 0;
}

}  // namespace kesu
