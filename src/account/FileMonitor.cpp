// The modification-time poll of Config.db and what a change sets off.
#include "account/FileMonitor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

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

std::optional<DatabaseState> FileMonitor::state() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return state_;
}

void FileMonitor::runPass() {
    const std::string path = databaseFilePath_ + "/" + kDatabaseFile;
    const auto identity = fileIdentity(path);
    if (!identity) {
        const int error = errno;
        if (error != ENOENT && error != ENOTDIR) {
            // There is something we may not examine: the account stays as it is, and the file
            // is read again once it can be examined.
            lastIdentity_.reset();
            enterState(DatabaseState::Unreadable, std::strerror(error));
            return;
        }
        dataInstance().update([](databaseParam& p) {
            p.openid.clear();
            p.Phone.clear();
            p.configDir.clear();
            p.storageDir.clear();
            p.token.clear();
        });
        lastIdentity_.reset();
        enterState(DatabaseState::Missing, {});
        return;
    }
    // A file back after a loss, or another file renamed over it, is read even when it keeps
    // the modification time of the last one.
    const bool timeChanged = fileAttributeGet(databaseFilePath_, lastModifyTime, firstRead, databaseReadTimes);
    if (timeChanged || identity != lastIdentity_) {
        lastIdentity_ = identity;
        readAndAnnounce();
        return;
    }
    if (state() != DatabaseState::Busy) return;
    // The last read found the file locked: try again, quietly unless that changes something.
    const DatabaseReadResult result = readAccountDatabase(databaseFilePath_);
    if (result.state == DatabaseState::Busy) return;
    logDatabaseRead(result);
    enterState(result.state, result.detail);
    if (result.state == DatabaseState::Good) announce();
}

void FileMonitor::readAndAnnounce() {
    Utils::mPrintlog("[fileMonitorStart] DataBase file changed recently at time stamp: " +
                     getLocalDate(dateDescription(lastModifyTime)));
    const DatabaseReadResult result = dataBaseRead(databaseFilePath_);
    enterState(result.state, result.detail);
    announce();
}

void FileMonitor::announce() {
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

void FileMonitor::enterState(DatabaseState next, const std::string& detail) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (state_ == next) return;
        state_ = next;
    }
    const std::string file = "[fileMonitorStart] Database file :" + databaseFilePath_ + "/" + kDatabaseFile;
    switch (next) {
        case DatabaseState::Missing:
            Utils::mPrintlog("[fileExist] File lost. File :" + databaseFilePath_ + "/" + kDatabaseFile +
                             " is not exist");
            Utils::mPrintlog(file + " is lost ，please fix it");
            break;
        case DatabaseState::Unreadable:
            Utils::mPrintlog(file + " cannot be read (" + detail + "), the account is kept");
            break;
        case DatabaseState::Busy:
            Utils::mPrintlog(file + " is locked by another writer, the account is kept until it can be read");
            break;
        case DatabaseState::Good:
            Utils::mPrintlog(file + " is readable");
            break;
    }
}

std::optional<FileMonitor::FileIdentity> FileMonitor::fileIdentity(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return std::nullopt;
    FileIdentity id;
    id.device = static_cast<std::uint64_t>(st.st_dev);
    id.inode = static_cast<std::uint64_t>(st.st_ino);
    id.size = static_cast<std::int64_t>(st.st_size);
    id.modifiedNs = static_cast<std::int64_t>(st.st_mtim.tv_sec) * 1'000'000'000 + st.st_mtim.tv_nsec;
    id.changedNs = static_cast<std::int64_t>(st.st_ctim.tv_sec) * 1'000'000'000 + st.st_ctim.tv_nsec;
    // Two commits within one tick of the file-system clock may leave size and times alike;
    // the counter at offset 24 of the header tells them apart.
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd >= 0) {
        unsigned char counter[4];
        if (::pread(fd, counter, sizeof counter, 24) == static_cast<ssize_t>(sizeof counter))
            id.changeCounter = (std::uint32_t{counter[0]} << 24) | (std::uint32_t{counter[1]} << 16) |
                               (std::uint32_t{counter[2]} << 8) | std::uint32_t{counter[3]};
        ::close(fd);
    }
    return id;
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
