// Logging, log-file housekeeping, the version file and the clock of Utils.
#include <spdlog/details/file_helper.h>
#include <spdlog/logger.h>
#include <spdlog/sinks/base_sink.h>
#include <spdlog/sinks/stdout_sinks.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>

#include "core/Config.h"
#include "core/TimeUtil.h"
#include "core/Utils.h"

namespace kesu {

namespace fs = std::filesystem;

std::string rawValue(submoduleName) { return "/KesuConnService_log/KesuConnService_"; }

namespace {

// A file sink that writes to the file named by the GMT date of each message, switching to
// the next day's file with the first message after 00:00 GMT. Every line is flushed.
class GmtDayFileSink final : public spdlog::sinks::base_sink<spdlog::details::null_mutex> {
public:
    void close() {
        file_.close();
        openPath_.clear();
    }

protected:
    void sink_it_(const spdlog::details::log_msg& msg) override {
        const std::string path = Utils::logFilePath(msg.time);
        if (path != openPath_) {
            file_.close();
            openPath_.clear();
            try {
                file_.open(path, false);
                openPath_ = path;
            } catch (const spdlog::spdlog_ex&) {
                return;  // the line still reached standard output
            }
        }
        spdlog::memory_buf_t formatted;
        formatter_->format(msg, formatted);
        try {
            file_.write(formatted);
            file_.flush();
        } catch (const spdlog::spdlog_ex&) {
            close();
        }
    }
    void flush_() override {
        if (!openPath_.empty()) file_.flush();
    }

private:
    spdlog::details::file_helper file_;
    std::string openPath_;
};

struct LogState {
    std::mutex printLock;  // one message at a time, on both outputs
    std::shared_ptr<GmtDayFileSink> fileSink = std::make_shared<GmtDayFileSink>();
    std::shared_ptr<spdlog::logger> logger;

    LogState() {
        auto console = std::make_shared<spdlog::sinks::stdout_sink_st>();
        logger = std::make_shared<spdlog::logger>("logLoop", spdlog::sinks_init_list{console, fileSink});
        logger->set_pattern("[%Y-%m-%d %H:%M:%S.%e][%n] %v");
        logger->set_level(spdlog::level::debug);
        logger->flush_on(spdlog::level::debug);
    }
};

LogState& logState() {
    static LogState* state = new LogState();
    return *state;
}

std::mutex clockLock;
std::function<Utils::Clock::time_point()> clockOverride;
std::atomic<bool> clockOverridden{false};

}  // namespace

Utils::Clock::time_point Utils::now() {
    if (clockOverridden.load(std::memory_order_acquire)) {
        std::lock_guard<std::mutex> lock(clockLock);
        if (clockOverride) return clockOverride();
    }
    return Clock::now();
}

void Utils::setClock(std::function<Clock::time_point()> clock) {
    std::lock_guard<std::mutex> lock(clockLock);
    clockOverride = std::move(clock);
    clockOverridden.store(static_cast<bool>(clockOverride), std::memory_order_release);
}

std::string Utils::libraryBase() { return homeDirectory() + "/Library/"; }

std::string Utils::logDirectory() {
    return libraryBase() + "Application Support/pcsuite/log" + "/KesuConnService_log";
}

std::string Utils::logFilePath(Clock::time_point at) {
    return libraryBase() + "Application Support/pcsuite/log" + rawValue(submoduleName::ConnectName) +
           timeutil::formatGmtDate(at) + ".log";
}

void Utils::mPrintlog(const std::string& output) {
    LogState& state = logState();
    std::lock_guard<std::mutex> lock(state.printLock);
    try {
        state.logger->log(now(), spdlog::source_loc{}, spdlog::level::debug, output);
    } catch (...) {
        // Logging never fails its caller.
    }
}

void Utils::closeLog() {
    LogState& state = logState();
    std::lock_guard<std::mutex> lock(state.printLock);
    state.logger->flush();
    state.fileSink->close();
    std::fflush(stdout);
}

std::string Utils::getNowTime() { return timeutil::formatLocal(now()); }

double Utils::currentTimeStamp() {
    return std::chrono::duration<double>(now().time_since_epoch()).count();
}

long long Utils::stringToTimestamp(const std::string& time) {
    auto parsed = timeutil::parseLocal(time);
    if (!parsed) return 0;
    return std::chrono::floor<std::chrono::seconds>(parsed->time_since_epoch()).count();
}

void Utils::deleteOldLogFile() {
    const std::string dir = logDirectory();
    std::error_code ec;
    fs::directory_iterator it(dir, ec);
    if (ec) {
        mPrintlog("get file path error: " + ec.message());
        return;
    }
    const std::string prefix = "KesuConnService_";
    const auto today = timeutil::parseLocalDate(timeutil::formatLocalDate(now())).value_or(now());
    for (; it != fs::directory_iterator(); it.increment(ec)) {
        if (ec) break;
        const std::string name = it->path().filename().string();
        const std::string full = dir + "/" + name;
        std::error_code statError;
        if (!fs::exists(full, statError) || fs::is_directory(full, statError)) continue;
        const auto start = name.find(prefix);
        const auto end = name.find(".log");
        if (start == std::string::npos || end == std::string::npos) continue;
        const auto dateStart = start + prefix.size();
        if (end < dateStart) continue;  // ".log" before the prefix ends: no date range
        const auto fileDate = timeutil::parseLocalDate(name.substr(dateStart, end - dateStart)).value_or(now());
        if (timeutil::wholeDays(fileDate, today) <= logTimeOut) continue;
        std::error_code removeError;
        if (fs::remove(full, removeError) && !removeError)
            mPrintlog("[Utils::deleteOldLogFile] " + name + " is time out, success to remove file.");
        else
            mPrintlog("[Utils::deleteOldLogFile] " + name + " is time out, failed to remove file.");
    }
}

void Utils::writeConnServiceVersion(const std::string& version) {
    const std::string path = rootedPath(Config::current().versionFile);
    const nlohmann::json content = {{"version", version}, {"updateTime", getNowTime()}};
    const std::string text = content.dump(2);
    std::error_code ec;
    fs::create_directories(fs::path(path).parent_path(), ec);
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    if (out) out << text;
    if (out) out.flush();
    if (out) {
        mPrintlog("[Utils::writeConnServiceVersion] file is exist and write content is: " + text + " ...");
    } else {
        mPrintlog("[Utils::writeConnServiceVersion] try to write, error is: " +
                  std::string(ec ? ec.message() : std::strerror(errno)) + " ...");
    }
}

}  // namespace kesu
