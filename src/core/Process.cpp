#include "core/Process.h"

#include "core/Log.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
// glibc 2.36 declares pidfd_open without C linkage for C++.
extern "C" {
#include <sys/pidfd.h>
}
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <algorithm>
#include <cstring>
#include <sstream>
#include <system_error>
#include <thread>

extern char** environ;

namespace kesu::process {

namespace {

// Output beyond this is read and dropped, so that a runaway program cannot exhaust memory.
constexpr std::size_t maxCapturedOutput = 16u << 20;

// Folders searched after PATH: system tools often live in sbin folders that a user's PATH lacks.
constexpr const char* systemFolders = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";

bool isExecutableFile(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && ::access(path.c_str(), X_OK) == 0;
}

std::optional<std::string> searchFolders(const std::string& name, const std::string& folders) {
    std::istringstream list(folders);
    for (std::string folder; std::getline(list, folder, ':');) {
        if (folder.empty()) continue;
        std::string candidate = folder + "/" + name;
        if (isExecutableFile(candidate)) return candidate;
    }
    return std::nullopt;
}

int exitStatusOf(int status) { return WIFEXITED(status) ? WEXITSTATUS(status) : -1; }

int waitForChild(pid_t pid) {
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) return -1;
    }
    return exitStatusOf(status);
}

// Owns a file descriptor.
class Fd {
public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    ~Fd() { reset(); }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }
    void reset() {
        if (fd_ >= 0) ::close(fd_);
        fd_ = -1;
    }

private:
    int fd_;
};

enum class Output { Inherit, Pipe, Discard };

struct SpawnRequest {
    std::string path;
    std::vector<std::string> args;
    std::vector<std::string> extraEnv;
    Output output = Output::Inherit;
    int pipeWrite = -1;      // with Output::Pipe
    bool newSession = false; // detach from our session and terminal
    bool newGroup = false;   // own process group, so that a kill reaches its children too
};

// Starts the program; returns its pid or -1 with `error` filled.
pid_t spawn(const SpawnRequest& request, std::string& error) {
    const auto resolved = findProgram(request.path);
    if (!resolved) {
        error = request.path + ": " + std::strerror(ENOENT);
        return -1;
    }

    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(request.path.c_str()));
    for (const std::string& arg : request.args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);

    std::vector<std::string> envStore;
    std::vector<char*> envp;
    if (!request.extraEnv.empty()) {
        for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
            std::string entry(*e);
            const std::string name = entry.substr(0, entry.find('=') + 1);
            bool replaced = false;
            for (const std::string& extra : request.extraEnv)
                if (extra.compare(0, name.size(), name) == 0) replaced = true;
            if (!replaced) envStore.push_back(std::move(entry));
        }
        for (const std::string& extra : request.extraEnv) envStore.push_back(extra);
        for (std::string& entry : envStore) envp.push_back(entry.data());
        envp.push_back(nullptr);
    }

    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attr;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attr);

    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    if (request.output == Output::Pipe) {
        posix_spawn_file_actions_adddup2(&actions, request.pipeWrite, STDOUT_FILENO);
        posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    } else if (request.output == Output::Discard) {
        posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
        posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    }
    // Descriptors of this process (sockets, files) never leak into the child.
    posix_spawn_file_actions_addclosefrom_np(&actions, STDERR_FILENO + 1);

    // The child starts with every signal at its default and none blocked, whatever the
    // calling thread has blocked.
    short flags = POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF;
    sigset_t none;
    sigset_t all;
    sigemptyset(&none);
    sigfillset(&all);
    posix_spawnattr_setsigmask(&attr, &none);
    posix_spawnattr_setsigdefault(&attr, &all);
    if (request.newSession) {
        flags |= POSIX_SPAWN_SETSID;
    } else if (request.newGroup) {
        flags |= POSIX_SPAWN_SETPGROUP;
        posix_spawnattr_setpgroup(&attr, 0);
    }
    posix_spawnattr_setflags(&attr, flags);

    pid_t pid = -1;
    const int rc = ::posix_spawn(&pid, resolved->c_str(), &actions, &attr, argv.data(),
                                 envp.empty() ? environ : envp.data());
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attr);
    if (rc != 0) {
        error = request.path + ": " + std::strerror(rc);
        return -1;
    }
    return pid;
}

}  // namespace

std::optional<std::string> findProgram(const std::string& name) {
    if (name.empty()) return std::nullopt;
    if (name.find('/') != std::string::npos) {
        if (isExecutableFile(name)) return name;
        return std::nullopt;
    }
    if (const char* path = std::getenv("PATH"); path != nullptr && *path != '\0') {
        if (auto found = searchFolders(name, path)) return found;
    }
    return searchFolders(name, systemFolders);
}

bool spawnDetached(const std::string& path, const std::vector<std::string>& args, std::string& error) {
    return spawnDetached(path, args, error, nullptr);
}

bool spawnDetached(const std::string& path, const std::vector<std::string>& args, std::string& error,
                   std::function<void(int exitStatus)> onExit) {
    SpawnRequest request{path, args, {}, Output::Inherit};
    request.newSession = true;
    const pid_t pid = spawn(request, error);
    if (pid < 0) return false;
    // The child is reaped as soon as it ends, so that it never lingers as a zombie.
    try {
        std::thread([pid, onExit = std::move(onExit)] {
            const int status = waitForChild(pid);
            if (onExit) onExit(status);
        }).detach();
    } catch (const std::system_error&) {
        // No thread to spare: the program runs all the same, only its exit is not collected.
    }
    return true;
}

std::optional<int> runAndWait(const std::string& path, const std::vector<std::string>& args, std::string& error) {
    SpawnRequest request{path, args, {}, Output::Inherit};
    const pid_t pid = spawn(request, error);
    if (pid < 0) return std::nullopt;
    return waitForChild(pid);
}

std::optional<RunResult> run(const std::string& path, const std::vector<std::string>& args,
                             std::chrono::milliseconds timeout, const std::vector<std::string>& extraEnv) {
    using SteadyClock = std::chrono::steady_clock;
    // A time-out of a day or more is as good as none, and cannot overflow the clock.
    const auto deadline = SteadyClock::now() + std::min<std::chrono::milliseconds>(timeout, std::chrono::hours(24));

    int fds[2];
    if (::pipe2(fds, O_CLOEXEC) != 0) return std::nullopt;
    Fd readEnd(fds[0]);
    Fd writeEnd(fds[1]);

    SpawnRequest request{path, args, extraEnv, Output::Pipe};
    request.pipeWrite = writeEnd.get();
    request.newGroup = true;
    std::string error;
    const pid_t pid = spawn(request, error);
    writeEnd.reset();
    if (pid < 0) return std::nullopt;

    // The child's end is watched through a pidfd, so that a program that closes its output
    // and keeps running is still bounded by the deadline.
    Fd exitFd(static_cast<int>(::pidfd_open(pid, 0)));

    RunResult result;
    bool outputOpen = true;
    bool exited = false;
    char buffer[4096];
    while (outputOpen || (!exited && exitFd.get() >= 0)) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - SteadyClock::now());
        if (left.count() <= 0) {
            result.timedOut = true;
            break;
        }
        pollfd watched[2];
        nfds_t count = 0;
        int outputIndex = -1;
        int exitIndex = -1;
        if (outputOpen) {
            watched[count] = {readEnd.get(), POLLIN, 0};
            outputIndex = static_cast<int>(count++);
        }
        if (!exited && exitFd.get() >= 0) {
            watched[count] = {exitFd.get(), POLLIN, 0};
            exitIndex = static_cast<int>(count++);
        }
        const int waitMs = static_cast<int>(std::min<long long>(left.count(), 60'000));
        const int ready = ::poll(watched, count, waitMs);
        if (ready < 0) {
            if (errno == EINTR) continue;
            result.timedOut = true;  // cannot wait any more: treat as a time-out and kill
            break;
        }
        if (exitIndex >= 0 && watched[exitIndex].revents != 0) exited = true;
        if (outputIndex >= 0 && watched[outputIndex].revents != 0) {
            const ssize_t n = ::read(readEnd.get(), buffer, sizeof buffer);
            if (n > 0) {
                const std::size_t room = maxCapturedOutput - std::min(maxCapturedOutput, result.output.size());
                result.output.append(buffer, std::min<std::size_t>(room, static_cast<std::size_t>(n)));
            } else if (n == 0 || (errno != EINTR && errno != EAGAIN)) {
                outputOpen = false;
                readEnd.reset();
            }
        }
    }
    if (result.timedOut) ::kill(-pid, SIGKILL);
    const int status = waitForChild(pid);
    result.exitStatus = result.timedOut ? -1 : status;
    return result;
}

std::optional<std::string> runCapture(const std::string& path, const std::vector<std::string>& args,
                                      std::chrono::milliseconds timeout) {
    auto result = run(path, args, timeout);
    if (!result || result->timedOut) return std::nullopt;
    return std::move(result->output);
}

bool startProcess(const std::string& launchPath, const std::vector<std::string>& arguments, int& exitCode) {
    std::string error;
    if (!spawnDetached(launchPath, arguments, error)) {
        exitCode = -1;
        Log::mPrintlog("[startProcess] something went wrong, error: " + error);
        return false;
    }
    exitCode = 0;
    return true;
}

}  // namespace kesu::process
