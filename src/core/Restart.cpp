// The self-restart: the process image is replaced in place, so the restarted service keeps
// the process id and never sees its predecessor in the process list. A restart that cannot
// happen leaves the running service as it is.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "core/Config.h"
#include "core/Log.h"
#include "core/Process.h"

namespace kesu {

namespace {

// Marks every descriptor above standard error close-on-exec: the new image must be able to
// bind the control and phone ports again, and nothing is lost if exec fails.
void markDescriptorsCloseOnExec() {
    DIR* dir = opendir("/proc/self/fd");
    if (dir == nullptr) return;
    const int own = dirfd(dir);
    while (dirent* entry = readdir(dir)) {
        char* end = nullptr;
        long fd = std::strtol(entry->d_name, &end, 10);
        if (end == entry->d_name || *end != '\0' || fd <= 2 || fd == own) continue;
        int flags = fcntl(static_cast<int>(fd), F_GETFD);
        if (flags >= 0) fcntl(static_cast<int>(fd), F_SETFD, flags | FD_CLOEXEC);
    }
    closedir(dir);
}

std::string ownExecutable() {
    char buf[4096];
    ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
    if (n <= 0) return {};
    buf[n] = '\0';
    return buf;
}

}  // namespace

void process::restartService() {
    Log::mPrintlog("[Utils::restartService] restart KesuConnService");
    std::string target = rootedPath(Config::current().serviceExecutable);
    if (access(target.c_str(), X_OK) != 0) {
        const std::string self = ownExecutable();
        Log::mPrintlog("[Utils::restartService] " + target + " is not executable, restart " + self);
        target = self;
    }
    if (target.empty()) {
        Log::mPrintlog("[Utils::restartService] no executable to restart, keep running");
        return;
    }
    Log::closeLog();
    markDescriptorsCloseOnExec();
    sigset_t none;
    sigemptyset(&none);
    sigset_t previous;
    pthread_sigmask(SIG_SETMASK, &none, &previous);
    char* const argv[] = {const_cast<char*>(target.c_str()), nullptr};
    execv(target.c_str(), argv);
    const int err = errno;
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    Log::mPrintlog("[Utils::restartService] restart failed: " + std::string(std::strerror(err)) + ", keep running");
}

}  // namespace kesu
