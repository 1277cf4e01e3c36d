// Logging, log-file housekeeping and the version file.
#include <spdlog/details/file_helper.h>
#include <spdlog/logger.h>
#include <spdlog/sinks/base_sink.h>
#include <spdlog/sinks/stdout_sinks.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <optional>
#include <string_view>
#include <utility>
#include <nlohmann/json.hpp>

#include "core/Config.h"
#include "core/TimeUtil.h"
#include "core/Log.h"

namespace kesu {

namespace fs = std::filesystem;

std::string rawValue(submoduleName) { return "/KesuConnService_log/KesuConnService_"; }

namespace {

constexpr char kCapNoticeStart[] = "[log] daily log file reached its size limit of ";
constexpr char kCapNoticeEnd[] = " bytes; further lines go to standard output only until the next day's file";

// The line that closes a day's file once it has reached Config::logFileMaxBytes.
std::string capNoticeText(std::uintmax_t limit) { return kCapNoticeStart + std::to_string(limit) + kCapNoticeEnd; }

// True when the file's last line is the cap notice: a file capped by an earlier run of the
// service on the same day takes no more lines even if the notice left it below the limit.
bool endsWithCapNotice(const std::string& path, std::uintmax_t size) {
    constexpr std::uintmax_t kTail = 512;  // more than one notice line
    if (size == 0) return false;
    std::ifstream in(path, std::ios::binary);
    const std::uintmax_t take = size < kTail ? size : kTail;
    in.seekg(-static_cast<std::streamoff>(take), std::ios::end);
    std::string tail(static_cast<std::size_t>(take), '\0');
    if (!in.read(tail.data(), static_cast<std::streamsize>(take))) return false;
    const std::string_view end = std::string_view(kCapNoticeEnd);
    if (tail.size() < end.size() + 1 || tail.back() != '\n' ||
        std::string_view(tail).substr(tail.size() - 1 - end.size(), end.size()) != end)
        return false;
    const auto lineStart = tail.rfind('\n', tail.size() - 2);
    const std::string_view lastLine =
        std::string_view(tail).substr(lineStart == std::string::npos ? 0 : lineStart + 1);
    return lastLine.find(std::string("][logLoop] ") + kCapNoticeStart) != std::string_view::npos;
}

// A file sink that writes to the file named by the GMT date of each message, switching to
// the next day's file with the first message after 00:00 GMT. Every line is flushed. A day's
// file takes no line that would make it larger than Config::logFileMaxBytes: the first such
// line is replaced by the cap notice, and later lines of that day are not written to the
// file. The size is counted from the file's size when it is opened, so a restart on the same
// day keeps the cap. The sink is only used under LogState::printLock.
class GmtDayFileSink final : public spdlog::sinks::base_sink<spdlog::details::null_mutex> {
public:
    void close() {
        file_.close();
        openPath_.clear();
        size_ = 0;
        capped_ = false;
    }

    // The cap notice, once, right after the line that capped the file.
    std::optional<std::string> takeCapNotice() { return std::exchange(pendingNotice_, std::nullopt); }

protected:
    void sink_it_(const spdlog::details::log_msg& msg) override {
        const std::string path = Log::logFilePath(msg.time);
        const std::uintmax_t limit = Config::current().logFileMaxBytes;
        if (path != openPath_) {
            close();
            try {
                file_.open(path, false);
                openPath_ = path;
                size_ = file_.size();
                capped_ = size_ >= limit || endsWithCapNotice(path, size_);
            } catch (const spdlog::spdlog_ex&) {
                return;  // the line still reached standard output
            }
        }
        if (capped_) return;
        spdlog::memory_buf_t formatted;
        formatter_->format(msg, formatted);
        std::optional<std::string> notice;
        if (size_ + formatted.size() > limit) {
            notice = capNoticeText(limit);
            formatted.clear();
            formatter_->format(spdlog::details::log_msg(msg.time, msg.source, msg.logger_name, msg.level, *notice),
                               formatted);
        }
        try {
            file_.write(formatted);
            file_.flush();
            size_ += formatted.size();
        } catch (const spdlog::spdlog_ex&) {
            close();
            return;
        }
        if (notice) {
            capped_ = true;
            pendingNotice_ = std::move(notice);
        }
    }
    void flush_() override {
        if (!openPath_.empty()) file_.flush();
    }

private:
    spdlog::details::file_helper file_;
    std::string openPath_;
    std::uintmax_t size_ = 0;  // bytes in the open file
    bool capped_ = false;      // the open file takes no more lines
    std::optional<std::string> pendingNotice_;
};

struct LogState {
    std::mutex printLock;  // one message at a time, on both outputs
    std::shared_ptr<GmtDayFileSink> fileSink = std::make_shared<GmtDayFileSink>();
    std::shared_ptr<spdlog::sinks::stdout_sink_st> console = std::make_shared<spdlog::sinks::stdout_sink_st>();
    std::shared_ptr<spdlog::logger> logger;

    LogState() {
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

}  // namespace

std::string Log::libraryBase() { return homeDirectory() + "/Library/"; }

std::string Log::logDirectory() {
    return libraryBase() + "Application Support/pcsuite/log" + "/KesuConnService_log";
}

std::string Log::logFilePath(WallClock::Clock::time_point at) {
    return libraryBase() + "Application Support/pcsuite/log" + rawValue(submoduleName::ConnectName) +
           timeutil::formatGmtDate(at) + ".log";
}

void Log::mPrintlog(const std::string& output) {
    LogState& state = logState();
    std::lock_guard<std::mutex> lock(state.printLock);
    try {
        const auto at = WallClock::now();
        state.logger->log(at, spdlog::source_loc{}, spdlog::level::debug, output);
        // The file has just been capped: standard output learns it too.
        if (const auto notice = state.fileSink->takeCapNotice())
            state.console->log(
                spdlog::details::log_msg(at, spdlog::source_loc{}, state.logger->name(), spdlog::level::debug, *notice));
    } catch (...) {
        // Logging never fails its caller.
    }
}

void Log::closeLog() {
    LogState& state = logState();
    std::lock_guard<std::mutex> lock(state.printLock);
    state.logger->flush();
    state.fileSink->close();
    std::fflush(stdout);
}

void Log::deleteOldLogFile() {
    const std::string dir = logDirectory();
    std::error_code ec;
    fs::directory_iterator it(dir, ec);
    if (ec) {
        mPrintlog("get file path error: " + ec.message());
        return;
    }
    const std::string prefix = "KesuConnService_";
    const auto today = timeutil::parseLocalDate(timeutil::formatLocalDate(WallClock::now())).value_or(WallClock::now());
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
        const auto fileDate = timeutil::parseLocalDate(name.substr(dateStart, end - dateStart)).value_or(WallClock::now());
        if (timeutil::wholeDays(fileDate, today) <= logTimeOut) continue;
        std::error_code removeError;
        if (fs::remove(full, removeError) && !removeError)
            mPrintlog("[Log::deleteOldLogFile] " + name + " is time out, success to remove file.");
        else
            mPrintlog("[Log::deleteOldLogFile] " + name + " is time out, failed to remove file.");
    }
}

void Log::writeConnServiceVersion(const std::string& version) {
    const std::string path = rootedPath(Config::current().versionFile);
    const nlohmann::json content = {{"version", version}, {"updateTime", WallClock::getNowTime()}};
    const std::string text = content.dump(2);
    std::error_code ec;
    fs::create_directories(fs::path(path).parent_path(), ec);
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    if (out) out << text;
    if (out) out.flush();
    if (out) {
        mPrintlog("[Log::writeConnServiceVersion] file is exist and write content is: " + text + " ...");
    } else {
        mPrintlog("[Log::writeConnServiceVersion] try to write, error is: " +
                  std::string(ec ? ec.message() : std::strerror(errno)) + " ...");
    }
}

}  // namespace kesu
