#include "support/ServiceProcess.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <stdexcept>

#include "support/PidNamespace.h"

extern char** environ;

namespace kesu::test {

ServiceProcess::ServiceProcess(const std::string& path, const std::vector<std::string>& args,
                               const std::map<std::string, std::string>& env, const std::string& netns, Pids pids) {
    std::vector<std::string> argv;
    if (!netns.empty()) argv = {"/usr/sbin/ip", "netns", "exec", netns};
    argv.push_back(path);
    argv.insert(argv.end(), args.begin(), args.end());

    std::map<std::string, std::string> merged;
    for (char** e = environ; *e != nullptr; ++e) {
        std::string entry(*e);
        auto eq = entry.find('=');
        if (eq != std::string::npos) merged[entry.substr(0, eq)] = entry.substr(eq + 1);
    }
    for (const auto& [k, v] : env) merged[k] = v;
    std::vector<std::string> envStrings;
    for (const auto& [k, v] : merged) envStrings.push_back(k + "=" + v);

    std::vector<char*> cargv;
    for (auto& a : argv) cargv.push_back(a.data());
    cargv.push_back(nullptr);
    std::vector<char*> cenv;
    for (auto& e : envStrings) cenv.push_back(e.data());
    cenv.push_back(nullptr);

    int pipeFds[2];
    if (pipe2(pipeFds, O_CLOEXEC) != 0) throw std::runtime_error("pipe failed");
    int rc = 0;
    if (pids == Pids::own) {
        pid_ = spawnInPidNamespace(cargv.data(), cenv.data(), pipeFds[1], pipeFds[1]);
        if (pid_ < 0) rc = errno;
    } else {
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, pipeFds[1], 1);
        posix_spawn_file_actions_adddup2(&actions, pipeFds[1], 2);
        posix_spawnattr_t attr;
        posix_spawnattr_init(&attr);
        sigset_t none;
        sigemptyset(&none);
        posix_spawnattr_setsigmask(&attr, &none);
        posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK);
        rc = posix_spawn(&pid_, cargv[0], &actions, &attr, cargv.data(), cenv.data());
        posix_spawn_file_actions_destroy(&actions);
        posix_spawnattr_destroy(&attr);
    }
    ::close(pipeFds[1]);
    if (rc != 0) {
        ::close(pipeFds[0]);
        throw std::runtime_error(std::string("spawn failed: ") + std::strerror(rc));
    }
    const int readFd = pipeFds[0];
    reader_ = std::thread([this, readFd] { readLoop(readFd); });
    waiter_ = std::thread([this] {
        int status = 0;
        while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
        }
        int code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        std::lock_guard<std::mutex> lock(mutex_);
        exitCode_ = code;
        cv_.notify_all();
    });
}

ServiceProcess::~ServiceProcess() {
    if (running()) stop(SIGKILL, std::chrono::seconds(10));
    if (waiter_.joinable()) waiter_.join();
    if (reader_.joinable()) reader_.join();
}

void ServiceProcess::readLoop(int fd) {
    char buf[4096];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        std::lock_guard<std::mutex> lock(mutex_);
        output_.append(buf, static_cast<size_t>(n));
        cv_.notify_all();
    }
    ::close(fd);
    std::lock_guard<std::mutex> lock(mutex_);
    outputClosed_ = true;
    cv_.notify_all();
}

bool ServiceProcess::waitForOutput(const std::string& text, std::chrono::milliseconds timeout, std::size_t from) {
    return waitForOutput(
        [&](const std::string& out) { return from <= out.size() && out.find(text, from) != std::string::npos; },
        timeout);
}

bool ServiceProcess::waitForOutput(const std::function<bool(const std::string&)>& done,
                                   std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    cv_.wait_for(lock, timeout, [&] { return done(output_) || outputClosed_; });
    return done(output_);
}

std::string ServiceProcess::output() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return output_;
}

std::optional<int> ServiceProcess::waitExit(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (!cv_.wait_for(lock, timeout, [&] { return exitCode_.has_value(); })) return std::nullopt;
    // The exit can be seen before the reader has taken the last output: give it a moment to
    // reach the end of the pipe (a grandchild that keeps the pipe open only delays this).
    cv_.wait_for(lock, std::chrono::seconds(5), [&] { return outputClosed_; });
    return exitCode_;
}

std::optional<int> ServiceProcess::stop(int signal, std::chrono::milliseconds timeout) {
    if (running()) ::kill(pid_, signal);
    return waitExit(timeout);
}

bool ServiceProcess::running() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return !exitCode_.has_value();
}

}  // namespace kesu::test
