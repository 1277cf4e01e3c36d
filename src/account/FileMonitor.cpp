// The modification-time poll of Config.db and what a change sets off.
#include "account/FileMonitor.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <memory>
#include <optional>

#include "account/DataGet.h"
#include "account/DataInstance.h"
#include "connect/UdpSocketBase.h"
#include "core/Config.h"
#include "core/Json.h"
#include "core/Utils.h"
#include "events/EventPublisher.h"

namespace kesu {

namespace {

const std::string kDatabaseFile = "Config.db";

// Modification time of the file; nullopt (with errno set) when it cannot be examined.
std::optional<FileMonitor::TimePoint> modificationTime(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return std::nullopt;
    const auto sinceEpoch = std::chrono::seconds(st.st_mtim.tv_sec) + std::chrono::nanoseconds(st.st_mtim.tv_nsec);
    return FileMonitor::TimePoint(std::chrono::duration_cast<FileMonitor::TimePoint::duration>(sinceEpoch));
}

}  // namespace

FileMonitor::FileMonitor(std::string databaseFilePath)
    : databaseFilePath_(std::move(databaseFilePath)),
      period_(Config::current().fileMonitorPeriod),
      pushClientPort_(Config::current().pushClientUdpPort),
      lastModifyTime(Utils::now()) {}

FileMonitor::~FileMonitor() { stop(); }

bool FileMonitor::start() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    std::lock_guard<std::mutex> lock(mutex_);
    if (thread_.joinable()) return false;
    stopping_ = false;
    thread_ = std::thread([this] { loop(); });
    return true;
}

void FileMonitor::stop() {
    // Held until the old thread is gone, so that a start() cannot revive its loop.
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    std::thread thread;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopping_ = true;
        thread = std::move(thread_);
    }
    wake_.notify_all();
    if (thread.joinable() && thread.get_id() != std::this_thread::get_id()) thread.join();
    else if (thread.joinable()) thread.detach();
}

bool FileMonitor::running() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return thread_.joinable() && !stopping_;
}

void FileMonitor::loop() {
    std::unique_lock<std::mutex> lock(mutex_);
    while (!stopping_) {
        lock.unlock();
        try {
            runPass();
        } catch (const std::exception& e) {
            // One bad pass must not end the watch.
            Utils::mPrintlog(std::string("[fileMonitorStart] pass failed: ") + e.what());
        }
        lock.lock();
        wake_.wait_for(lock, period_, [this] { return stopping_; });
    }
}

void FileMonitor::runPass() {
    const std::string path = databaseFilePath_ + "/" + kDatabaseFile;
    if (!fileExist(path)) {
        Utils::mPrintlog("[fileMonitorStart] Database file :" + path + " is lost ，please fix it");
        dataInstance().update([](databaseParam& p) {
            p.openid.clear();
            p.Phone.clear();
            p.configDir.clear();
            p.storageDir.clear();
            p.token.clear();
        });
        fileLost_ = true;
        return;
    }
    bool mustRead = fileAttributeGet(databaseFilePath_, lastModifyTime, firstRead, databaseReadTimes);
    if (!mustRead && fileLost_) {
        // The file came back with the modification time it had before (a copy that keeps
        // times, a restored backup): the account was cleared meanwhile, so read it again.
        if (auto time = modificationTime(path)) {
            Utils::mPrintlog("[fileMonitorStart] Database file :" + path + " is back, reading it again");
            lastModifyTime = *time;
            ++databaseReadTimes;
            mustRead = true;
        }
    }
    if (mustRead) {
        fileLost_ = false;
        readAndAnnounce();
    }
}

void FileMonitor::readAndAnnounce() {
    Utils::mPrintlog("[fileMonitorStart] DataBase file changed recently at time stamp: " +
                     getLocalDate(dateDescription(lastModifyTime)));
    dataBaseRead(databaseFilePath_);

    const std::string openid = dataInstance().get(&databaseParam::openid);
    if (!openid.empty()) {
        // Ask the local push client for its client id; the answer arrives on its own way.
        const std::string query = json::pretty(Json{{"cmd", "QUERY_CLIENT_ID"}, {"openId", openid}});
        UdpSocketBase socket;
        if (socket.initial(static_cast<std::uint16_t>(pushClientPort_), "127.0.0.1", -1))
            socket.sendMsg(-1, Bytes(query.begin(), query.end()));
    }
    EventPublisher::instance().notifySubscribers(ServiceEvent::AccountChange);
}

bool FileMonitor::fileExist(const std::string& filePath) {
    std::error_code ec;
    if (std::filesystem::exists(filePath, ec)) return true;
    Utils::mPrintlog("[fileExist] File lost. File :" + filePath + " is not exist");
    return false;
}

bool FileMonitor::fileAttributeGet(const std::string& directory, TimePoint& lastFileChange, bool& isFirstRead,
                                   int& readFileTimes) {
    const std::string path = directory + "/" + kDatabaseFile;
    const auto modified = modificationTime(path);
    if (!modified) {
        Utils::mPrintlog("[fileAttributeGet] Cannot read the attributes of " + path + ": " + std::strerror(errno));
        return false;
    }
    const std::string when = getLocalDate(dateDescription(*modified));
    if (*modified != lastFileChange) {
        if (isFirstRead && readFileTimes == 0) {
            Utils::mPrintlog("[fileAttributeGet] Time is : " + when + " is the database file Config.db read first time");
            isFirstRead = false;
        }
        ++readFileTimes;
        lastFileChange = *modified;
        return true;
    }
    if (isFirstRead && readFileTimes == 0) {
        Utils::mPrintlog("[fileAttributeGet] Time is : " + when + "is the database file Config.db read first time");
        isFirstRead = false;
        ++readFileTimes;
        return true;
    }
    return false;
}

std::string FileMonitor::getLocalDate(const std::string& from) {
    std::tm parsed{};
    const char* rest = ::strptime(from.c_str(), "%Y-%m-%d %H:%M:%S %z", &parsed);
    if (rest == nullptr || *rest != '\0') return {};
    const long offset = parsed.tm_gmtoff;
    const std::time_t utc = ::timegm(&parsed) - offset;
    std::tm local{};
    if (::localtime_r(&utc, &local) == nullptr) return {};
    char out[32];
    if (std::strftime(out, sizeof out, "%Y:%m:%d %H:%M:%S", &local) == 0) return {};
    return out;
}

std::string FileMonitor::dateDescription(TimePoint time) {
    const std::time_t seconds = std::chrono::system_clock::to_time_t(std::chrono::floor<std::chrono::seconds>(time));
    std::tm utc{};
    if (::gmtime_r(&seconds, &utc) == nullptr) return {};
    char out[40];
    if (std::strftime(out, sizeof out, "%Y-%m-%d %H:%M:%S +0000", &utc) == 0) return {};
    return out;
}

namespace {

struct ProcessMonitor {
    std::mutex mutex;
    std::unique_ptr<FileMonitor> monitor;
};

ProcessMonitor& processMonitor() {
    static ProcessMonitor* holder = new ProcessMonitor();
    return *holder;
}

}  // namespace

bool fileMonitorStart() {
    std::string databaseDir;
    FilePathget(databaseDir);
    {
        ProcessMonitor& holder = processMonitor();
        std::lock_guard<std::mutex> lock(holder.mutex);
        if (holder.monitor && holder.monitor->running()) {
            Utils::mPrintlog("[fileMonitorStart] the database monitor runs already");
            return false;
        }
        // A stopped monitor has joined its thread and can go.
        holder.monitor = std::make_unique<FileMonitor>(databaseDir);
        holder.monitor->start();
    }
    getPcsuiteDeviceInfo();
    return true;
}

void fileMonitorStop() {
    ProcessMonitor& holder = processMonitor();
    std::lock_guard<std::mutex> lock(holder.mutex);
    if (holder.monitor) holder.monitor->stop();
}

}  // namespace kesu
