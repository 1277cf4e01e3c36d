#include "app/ServiceMain.h"

#include <signal.h>

#include <cstring>
#include <string>

#include "app/Application.h"
#include "app/SingleInstance.h"
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
    Application application;
    application.start();

    int signalNumber = 0;
    while (sigwait(&stopSignals, &signalNumber) != 0) {
    }
    Log::mPrintlog("[服务启动] signal " + std::string(strsignal(signalNumber)) + " received, stopping");
    application.stop();
    Log::mPrintlog("[服务启动] stopped");
    Log::closeLog();
    return 0;
}

}  // namespace kesu
