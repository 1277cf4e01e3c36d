// Helpers shared by the tests: temporary folders, scoped environment variables and a
// hermetic service environment (HOME and KESU_ROOT in a temporary folder).
#pragma once

#include <chrono>
#include <filesystem>
#include <optional>
#include <string>

#include "core/Config.h"

namespace kesu::test {

// A fresh folder under /tmp, removed with everything in it at the end of the scope.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;
    const std::filesystem::path& path() const { return path_; }
    std::string str() const { return path_.string(); }
    // Writes a file below the folder (creating folders) and returns its full path.
    std::string write(const std::string& relative, const std::string& content) const;

private:
    std::filesystem::path path_;
};

// Sets (or, with nullopt, unsets) an environment variable for the scope.
class ScopedEnv {
public:
    ScopedEnv(std::string name, std::optional<std::string> value);
    ~ScopedEnv();
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

private:
    std::string name_;
    std::optional<std::string> old_;
};

// HOME and KESU_ROOT pointed at a temporary folder, and the process-wide Config reset to
// its defaults and restored at the end of the scope.
class HermeticEnv {
public:
    HermeticEnv();
    ~HermeticEnv();
    const TempDir& dir() const { return dir_; }
    std::string home() const { return dir_.str() + "/home"; }
    std::string root() const { return dir_.str() + "/root"; }
    Config& config() { return Config::current(); }

private:
    TempDir dir_;
    ScopedEnv home_;
    ScopedEnv root_;
    Config saved_;
};

// Reads a whole file; empty when missing.
// The process-wide connection slots, flags and remembered adapters back at their start
// values, so that one test's connection does not leave the next one busy.
void resetSharedStateForTest();

std::string readAll(const std::string& path);

// A free TCP port on 127.0.0.1 (bound then released; good enough for tests).
int freeTcpPort();

}  // namespace kesu::test
