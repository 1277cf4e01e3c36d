// Runs a program (the real service binary, a tool) as a child process with its own
// environment, collecting its standard output and error, for end-to-end tests.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace kesu::test {

class ServiceProcess {
public:
    // Where the child sits among the machine's processes: beside them (`shared`), or as the
    // first process of a PID namespace of its own with its own /proc (`own`, root only; see
    // PidNamespace.h), where the service's single-instance check sees none but itself.
    enum class Pids { shared, own };

    // Starts `path` with `args`; `env` entries are added to (or replace) this process's
    // environment. Optionally runs it inside a network namespace (`ip netns exec NS`). With
    // Pids::own, pid() is the child itself (not a launcher), so stop() signals it directly
    // and its exit code comes back; it is killed when the thread that started it ends.
    ServiceProcess(const std::string& path, const std::vector<std::string>& args,
                   const std::map<std::string, std::string>& env, const std::string& netns = "",
                   Pids pids = Pids::shared);
    ~ServiceProcess();
    ServiceProcess(const ServiceProcess&) = delete;
    ServiceProcess& operator=(const ServiceProcess&) = delete;

    pid_t pid() const { return pid_; }
    // Waits until the output from byte `from` on holds `text`; false at the time-out or when
    // the child ended without printing it.
    bool waitForOutput(const std::string& text, std::chrono::milliseconds timeout, std::size_t from = 0);
    // Waits until `done` holds for the output so far; false at the time-out or when the
    // child ended without it.
    bool waitForOutput(const std::function<bool(const std::string&)>& done, std::chrono::milliseconds timeout);
    std::string output() const;
    // Waits for the child to end; its exit code (128+signal when killed), nullopt at the
    // time-out.
    std::optional<int> waitExit(std::chrono::milliseconds timeout);
    // Sends a signal and waits for the exit.
    std::optional<int> stop(int signal, std::chrono::milliseconds timeout);
    bool running() const;

private:
    void readLoop(int fd);
    pid_t pid_ = -1;
    mutable std::mutex mutex_;
    std::condition_variable cv_;
    std::string output_;
    bool outputClosed_ = false;
    std::optional<int> exitCode_;
    std::thread reader_;
    std::thread waiter_;
};

}  // namespace kesu::test
