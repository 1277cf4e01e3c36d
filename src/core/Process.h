// Starting other programs without a shell: a detached start whose child is reaped in the
// background, and a run that captures standard output and is killed at a time-out.
#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace kesu::process {

// Every start uses an argument vector (no shell), gives the child a clean signal mask and
// none of this process's descriptors beyond 0-2. A `path` without "/" is looked up with
// findProgram; a missing program is a failure to start.

// Starts `path` with `args` (argv[1..]) in a session of its own and returns at once. The
// child is reaped in the background so that it never stays a zombie. On failure fills
// `error` and returns false.
bool spawnDetached(const std::string& path, const std::vector<std::string>& args, std::string& error);
// The same; `onExit` runs on the reaping thread with the exit status (-1 when a signal ended
// the program) once the child has ended and been reaped.
bool spawnDetached(const std::string& path, const std::vector<std::string>& args, std::string& error,
                   std::function<void(int exitStatus)> onExit);

// Result of a program run to its end.
struct RunResult {
    int exitStatus = -1;   // exit code, or -1 when killed by a signal or time-out
    bool timedOut = false;
    std::string output;    // everything it wrote to standard output
};

// Runs `path` with `args`, standard input from /dev/null, standard error discarded, and
// reads standard output to its end, whatever its exit status. When `timeout` passes first the
// child and its process group are killed. nullopt when the program cannot be started or was
// killed at the time-out.
std::optional<std::string> runCapture(const std::string& path, const std::vector<std::string>& args,
                                      std::chrono::milliseconds timeout);

// As runCapture, with the exit status and the time-out reported in the result; nullopt only
// when the program cannot be started. `extraEnv` ("NAME=value") is added to the environment.
std::optional<RunResult> run(const std::string& path, const std::vector<std::string>& args,
                             std::chrono::milliseconds timeout, const std::vector<std::string>& extraEnv = {});

// Runs `path` with `args`, standard input from /dev/null and the other outputs shared with
// this process, and waits for it to end. Returns its exit status (-1 when a signal ended it);
// nullopt with `error` filled when it cannot be started.
std::optional<int> runAndWait(const std::string& path, const std::vector<std::string>& args, std::string& error);

// The full path of a program: `name` itself when it holds "/", else the first executable
// match in PATH, then in the standard system folders (sbin included); nullopt when none.
std::optional<std::string> findProgram(const std::string& name);

// spawnDetached with a logged failure: `exitCode` 0 when started, -1 when not.
bool startProcess(const std::string& launchPath, const std::vector<std::string>& arguments, int& exitCode);

// Starts a fresh copy of the service in place of this process. Returns only when that
// could not be done, in which case this process keeps running.
void restartService();

}  // namespace kesu::process
