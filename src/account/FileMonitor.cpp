// The watch on Config.db and what a change sets off.
#include "account/FileMonitor.h"

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <asio/buffer.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>
#include <utility>

#include "account/DataGet.h"
#include "account/DataInstance.h"
#include "core/UdpSocketBase.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "core/PeriodicTimer.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "events/EventPublisher.h"

namespace kesu {

namespace {

const std::string kDatabaseFile = "Config.db";
// Events come in bursts (a write, the journal, a rename): one pass once they have settled.
constexpr std::chrono::milliseconds kSettle{100};

// Modification time of the file; nullopt (with errno set) when it cannot be examined.
std::optional<FileMonitor::TimePoint> modificationTime(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return std::nullopt;
    const auto sinceEpoch = std::chrono::seconds(st.st_mtim.tv_sec) + std::chrono::nanoseconds(st.st_mtim.tv_nsec);
    return FileMonitor::TimePoint(std::chrono::duration_cast<FileMonitor::TimePoint::duration>(sinceEpoch));
}

}  // namespace

// The inotify watch on the database's folder, or on its nearest existing ancestor while the
// folder is missing (re-armed lower as folders appear, higher when the folder goes). Every
// change that may concern Config.db calls `changed` once the events have settled.
struct FileMonitor::Watch : std::enable_shared_from_this<Watch> {
    Watch(asio::io_context& io, std::string f, std::function<void()> c)
        : descriptor(io), settle(io), folder(std::move(f)), changed(std::move(c)) {}

    // Loop only, from here on.
    void open() {
        const int fd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
        if (fd < 0) {
            Log::mPrintlog(std::string("[fileMonitorStart] no change notification (") + std::strerror(errno) +
                             "), the database is checked every period only");
            return;
        }
        descriptor.assign(fd);
        arm();
        read();
    }
    // Whether change notification is in place (a watch on the folder or an ancestor).
    bool watching() const { return !closed && descriptor.is_open() && wd >= 0; }
    void close() {
        closed = true;
        settle.cancel();
        std::error_code ignored;
        descriptor.close(ignored);
    }

    void arm() {
        const int fd = descriptor.native_handle();
        if (wd >= 0) ::inotify_rm_watch(fd, wd);
        std::filesystem::path dir(folder);
        std::error_code error;
        watchingFolder = true;
        while (!std::filesystem::is_directory(dir, error)) {
            const std::filesystem::path parent = dir.parent_path();
            watchingFolder = false;
            if (parent.empty()) {
                dir = ".";
                break;
            }
            if (parent == dir) break;
            dir = parent;
        }
        const std::uint32_t mask =
            watchingFolder ? (IN_CREATE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_MODIFY | IN_CLOSE_WRITE |
                              IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR)
                           : (IN_CREATE | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR);
        wd = ::inotify_add_watch(fd, dir.c_str(), mask);
    }
    void read() {
        descriptor.async_read_some(asio::buffer(buffer), [self = shared_from_this()](const std::error_code& error,
                                                                                     std::size_t size) {
            if (error || self->closed) return;
            self->handle(size);
            self->read();
        });
    }
    void handle(std::size_t size) {
        bool relevant = false, rearm = false;
        for (std::size_t at = 0; at + sizeof(inotify_event) <= size;) {
            inotify_event event{};
            std::memcpy(&event, buffer.data() + at, sizeof event);
            const std::string_view name =
                event.len ? std::string_view(buffer.data() + at + sizeof event) : std::string_view();
            at += sizeof event + event.len;
            if (event.mask & IN_Q_OVERFLOW) {
                relevant = rearm = true;
                continue;
            }
            if (event.wd != wd) continue;  // left over from an earlier watch
            if (event.mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
                relevant = rearm = true;
            } else if (!watchingFolder) {
                relevant = rearm = true;  // a folder on the way may have appeared
            } else if (name.starts_with(kDatabaseFile)) {
                relevant = true;  // the file, or its journal coming and going
            }
        }
        if (rearm) arm();
        if (relevant && !settling) {
            settling = true;
            settle.expires_after(kSettle);
            settle.async_wait([self = shared_from_this()](const std::error_code& error) {
                self->settling = false;
                if (!error && !self->closed) self->changed();
            });
        }
    }

    asio::posix::stream_descriptor descriptor;
    asio::steady_timer settle;
    const std::string folder;
    const std::function<void()> changed;
    alignas(inotify_event) std::array<char, 4096> buffer{};
    int wd = -1;
    bool watchingFolder = false;
    bool settling = false;
    bool closed = false;
};

// Whether a pass is under way; shared with it, so that its hand-back is safe after the stop.
struct FileMonitor::Passes {
    std::mutex mutex;
    std::condition_variable ended;
    bool underWay = false;
    bool again = false;  // a check was asked for while one was under way
    bool retrySoon = false;  // the last read left the file to look at again shortly
    bool stopped = false;
};

FileMonitor::FileMonitor(EventLoop& loop, std::string databaseFilePath)
    : loop_(loop),
      databaseFilePath_(std::move(databaseFilePath)),
      pushClientPort_(Config::current().pushClientUdpPort),
      lastModifyTime(WallClock::now()),
      passes_(std::make_shared<Passes>()),
      timer_(std::make_shared<PeriodicTimer>(loop.context(), [this] { return period(); }, [this] { tick(); })) {}

std::chrono::milliseconds FileMonitor::period() const {
    const Config& config = Config::current();
    // A lock held by a writer, or a file we may not examine yet, ends without a change to
    // report: those are looked at again every short period.
    const auto current = state();
    const bool quiet = current != DatabaseState::Busy && current != DatabaseState::Unreadable;
    if (watch_ && watch_->watching() && quiet)
        return std::max(config.fileMonitorPeriod, config.fileMonitorWatchedPeriod);
    return config.fileMonitorPeriod;
}

FileMonitor::~FileMonitor() { stop(); }

bool FileMonitor::start() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    if (running_) return false;
    running_ = true;
    {
        std::lock_guard<std::mutex> lock(passes_->mutex);
        passes_->stopped = false;
        passes_->again = false;
    }
    std::weak_ptr<PeriodicTimer> timer = timer_;
    loop_.call([this, timer] {
        watch_ = std::make_shared<Watch>(loop_.context(), databaseFilePath_, [timer] {
            if (auto t = timer.lock()) t->runNow();
        });
        watch_->open();
        // The first pass is done before start() returns, so that what starts next (the
        // announcements, the reports) already carries the signed-in account.
        try {
            runPass();
        } catch (const std::exception& e) {
            Log::mPrintlog(std::string("[fileMonitorStart] pass failed: ") + e.what());
        }
    });
    timer_->start();
    return true;
}

void FileMonitor::stop() {
    std::lock_guard<std::mutex> lifecycle(lifecycle_);
    if (!running_) return;
    running_ = false;
    timer_->stop();
    {
        std::lock_guard<std::mutex> lock(passes_->mutex);
        passes_->stopped = true;
    }
    // On the loop: a tick running there has finished once this returns.
    loop_.call([this] {
        if (watch_) watch_->close();
        watch_.reset();
    });
    // A pass gives up after the database's busy wait.
    std::unique_lock<std::mutex> lock(passes_->mutex);
    passes_->ended.wait_for(lock, Config::current().databaseBusyTimeout + std::chrono::seconds(10),
                            [this] { return !passes_->underWay; });
}

bool FileMonitor::running() const { return running_; }

void FileMonitor::tick() {
    const std::shared_ptr<Passes> passes = passes_;
    {
        std::lock_guard<std::mutex> lock(passes->mutex);
        if (passes->stopped) return;
        if (passes->underWay) {
            passes->again = true;
            return;
        }
    }
    // The file's identity is quick to take; only a read of the database goes to the pool.
    Read read = Read::None;
    try {
        read = inspect();
    } catch (const std::exception& e) {
        Log::mPrintlog(std::string("[fileMonitorStart] pass failed: ") + e.what());
    }
    if (read == Read::None) return;
    {
        std::lock_guard<std::mutex> lock(passes->mutex);
        passes->underWay = true;
    }
    std::weak_ptr<PeriodicTimer> timer = timer_;
    loop_.offload(
        [this, passes, read] {
            try {
                readFile(read);
            } catch (const std::exception& e) {
                // One bad pass must not end the watch.
                Log::mPrintlog(std::string("[fileMonitorStart] pass failed: ") + e.what());
            }
            const auto after = state();
            std::lock_guard<std::mutex> lock(passes->mutex);
            passes->retrySoon = after == DatabaseState::Busy || after == DatabaseState::Unreadable;
            passes->underWay = false;
            passes->ended.notify_all();
        },
        [passes, timer] {
            bool again = false, retrySoon = false;
            {
                std::lock_guard<std::mutex> lock(passes->mutex);
                again = std::exchange(passes->again, false) && !passes->stopped;
                retrySoon = passes->retrySoon && !passes->stopped;
            }
            auto t = timer.lock();
            if (!t) return;
            if (again) {
                t->runNow();
            } else if (retrySoon) {
                // The wait was chosen before this read found the file locked: make it short.
                t->start(Config::current().fileMonitorPeriod);
            }
        });
}

std::optional<DatabaseState> FileMonitor::state() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return state_;
}

void FileMonitor::runPass() {
    const Read read = inspect();
    if (read != Read::None) readFile(read);
}

FileMonitor::Read FileMonitor::inspect() {
    const std::string path = databaseFilePath_ + "/" + kDatabaseFile;
    const auto identity = fileIdentity(path);
    if (!identity) {
        const int error = errno;
        if (error != ENOENT && error != ENOTDIR) {
            // There is something we may not examine: the account stays as it is, and the file
            // is read again once it can be examined.
            lastIdentity_.reset();
            enterState(DatabaseState::Unreadable, std::strerror(error));
            return Read::None;
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
        return Read::None;
    }
    // A file back after a loss, or another file renamed over it, is read even when it keeps
    // the modification time of the last one.
    const bool timeChanged = fileAttributeGet(databaseFilePath_, lastModifyTime, firstRead, databaseReadTimes);
    if (timeChanged || identity != lastIdentity_) {
        lastIdentity_ = identity;
        return Read::Changed;
    }
    return state() == DatabaseState::Busy ? Read::Retry : Read::None;
}

void FileMonitor::readFile(Read read) {
    if (read == Read::Changed) return readAndAnnounce();
    // The last read found the file locked: try again, quietly unless that changes something.
    const DatabaseReadResult result = readAccountDatabase(databaseFilePath_);
    if (result.state == DatabaseState::Busy) return;
    logDatabaseRead(result);
    enterState(result.state, result.detail);
    if (result.state == DatabaseState::Good) announce();
}

void FileMonitor::readAndAnnounce() {
    Log::mPrintlog("[fileMonitorStart] DataBase file changed recently at time stamp: " +
                     getLocalDate(dateDescription(lastModifyTime)));
    const DatabaseReadResult result = dataBaseRead(databaseFilePath_);
    enterState(result.state, result.detail);
    announce();
}

void FileMonitor::announce() {
    const std::string openid = dataInstance().get(&databaseParam::openid);
    if (!openid.empty()) {
        // Ask the local push client for its client id; the answer arrives on its own way.
        UdpSocketBase::sendToLocalPort(pushClientPort_,
                                       json::pretty(Json{{"cmd", "QUERY_CLIENT_ID"}, {"openId", openid}}));
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
            Log::mPrintlog("[fileExist] File lost. File :" + databaseFilePath_ + "/" + kDatabaseFile +
                             " is not exist");
            Log::mPrintlog(file + " is lost ，please fix it");
            break;
        case DatabaseState::Unreadable:
            Log::mPrintlog(file + " cannot be read (" + detail + "), the account is kept");
            break;
        case DatabaseState::Busy:
            Log::mPrintlog(file + " is locked by another writer, the account is kept until it can be read");
            break;
        case DatabaseState::Good:
            Log::mPrintlog(file + " is readable");
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
        Log::mPrintlog("[fileAttributeGet] Cannot read the attributes of " + path + ": " + std::strerror(errno));
        return false;
    }
    const std::string when = getLocalDate(dateDescription(*modified));
    if (*modified != lastFileChange) {
        if (isFirstRead && readFileTimes == 0) {
            Log::mPrintlog("[fileAttributeGet] Time is : " + when + " is the database file Config.db read first time");
            isFirstRead = false;
        }
        ++readFileTimes;
        lastFileChange = *modified;
        return true;
    }
    if (isFirstRead && readFileTimes == 0) {
        Log::mPrintlog("[fileAttributeGet] Time is : " + when + "is the database file Config.db read first time");
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

bool fileMonitorStart(EventLoop& loop) {
    std::string databaseDir;
    FilePathget(databaseDir);
    {
        ProcessMonitor& holder = processMonitor();
        std::lock_guard<std::mutex> lock(holder.mutex);
        if (holder.monitor && holder.monitor->running()) {
            Log::mPrintlog("[fileMonitorStart] the database monitor runs already");
            return false;
        }
        // A stopped monitor has joined its thread and can go.
        holder.monitor = std::make_unique<FileMonitor>(loop, databaseDir);
        holder.monitor->start();
    }
    getPcsuiteDeviceInfo();
    return true;
}

void fileMonitorStop() {
    std::unique_ptr<FileMonitor> monitor;
    {
        ProcessMonitor& holder = processMonitor();
        std::lock_guard<std::mutex> lock(holder.mutex);
        monitor = std::move(holder.monitor);
    }
    monitor.reset();  // stops it
}

}  // namespace kesu
