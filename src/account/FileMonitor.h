// Watches the PC suite's account database Config.db by the file's identity (device, inode,
// size, modification and change times, SQLite's change counter) and, when it changes (and
// once at start), re-reads the account, asks the local push client for its client id and
// publishes "AccountChangeEvent". The file's state (missing, unreadable, busy, good) is
// logged once per change of state, not on every pass; a read that found the file locked is
// tried again on the next pass until it gets through.
// The pass runs at once (after a short settling delay) when inotify reports a change in the
// database's folder, or in its nearest existing ancestor while the folder does not exist yet;
// and on the event loop's timer as a safety net: every fileMonitorWatchedPeriod while inotify
// watches, every fileMonitorPeriod without it or while a read waits for a writer's lock. The file's identity is taken on the loop; a
// read of the database (which may wait for a writer's lock) runs on the loop's worker pool,
// one at a time.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "account/DataGet.h"

namespace kesu {

class EventLoop;
class PeriodicTimer;

class FileMonitor {
public:
    using TimePoint = std::chrono::system_clock::time_point;

    // `databaseFilePath` is the folder of Config.db. The push client's port is taken from
    // Config now; the period is read from Config before every wait.
    FileMonitor(EventLoop& loop, std::string databaseFilePath);
    ~FileMonitor();  // stop()
    FileMonitor(const FileMonitor&) = delete;
    FileMonitor& operator=(const FileMonitor&) = delete;

    // Starts the watch; its first pass runs at once. False when already running.
    bool start();
    // No pass starts after this; waits (bounded) for a pass under way. Harmless when it does
    // not run. Not from the loop itself.
    void stop();
    bool running() const;

    // One pass, inspection and read. Tests call it directly instead of starting the watch
    // (never both).
    void runPass();

    const std::string& databaseFilePath() const { return databaseFilePath_; }
    // The file's state as the last pass saw it; nullopt before the first pass.
    std::optional<DatabaseState> state() const;

    // What tells one version of the file from another. Replacing the file by renaming a new
    // one over it changes the inode even when size and times are kept.
    struct FileIdentity {
        std::uint64_t device = 0, inode = 0;
        std::int64_t size = 0, modifiedNs = 0, changedNs = 0;
        std::uint32_t changeCounter = 0;  // SQLite's header counter, bumped by every commit
        bool operator==(const FileIdentity&) const = default;
    };
    // The identity of the file at `path`; nullopt (with errno set) when it cannot be examined.
    static std::optional<FileIdentity> fileIdentity(const std::string& path);
    // Whether Config.db in `directory` must be read now: its modification time differs from
    // `lastFileChange`, or this is the first read. A file that cannot be examined (removed
    // since the existence check) counts as no change.
    static bool fileAttributeGet(const std::string& directory, TimePoint& lastFileChange, bool& isFirstRead,
                                 int& readFileTimes);
    // "yyyy-MM-dd HH:mm:ss Z" (Z like +0000) to local "yyyy:MM:dd HH:mm:ss"; "" when it
    // does not parse. Used in log lines only.
    static std::string getLocalDate(const std::string& from);
    // The UTC description of a time, the form getLocalDate reads.
    static std::string dateDescription(TimePoint time);

private:
    struct Watch;
    struct Passes;

    enum class Read { None, Changed, Retry };
    // The first half of a pass: the file's identity and what it asks for.
    Read inspect();
    // The second half, which may wait for the database's lock.
    void readFile(Read read);
    // Loop: the wait before the next pass: long while inotify watches the folder and the
    // last pass left nothing to retry, else Config::fileMonitorPeriod.
    std::chrono::milliseconds period() const;
    // Loop: inspects the file and reads it on the pool unless a read is under way (then one
    // more pass follows it).
    void tick();
    void readAndAnnounce();
    // Records the state and logs it when it differs from the last one.
    void enterState(DatabaseState next, const std::string& detail);
    void announce();

    EventLoop& loop_;
    const std::string databaseFilePath_;
    const int pushClientPort_;

    // State of the passes; touched by one pass at a time (its inspection on the loop, its
    // read on the pool).
    TimePoint lastModifyTime;
    bool firstRead = true;
    int databaseReadTimes = 0;
    std::optional<FileIdentity> lastIdentity_;  // none while the file is missing
    std::optional<DatabaseState> state_;        // written by passes, read by state() (mutex_)

    std::mutex lifecycle_;  // start() and stop() one at a time
    mutable std::mutex mutex_;
    std::shared_ptr<Passes> passes_;        // shared with the pass under way
    std::shared_ptr<PeriodicTimer> timer_;  // shared with a finished pass's hand-back
    std::shared_ptr<Watch> watch_;          // the inotify watch, loop only
    std::atomic<bool> running_{false};
};

// Starts the process-wide monitor on the PC suite's database folder on `loop`, then fills the
// PC's device id and version. False when a monitor already runs.
bool fileMonitorStart(EventLoop& loop);
// Stops and drops the process-wide monitor (orderly stop, tests); before the loop ends.
void fileMonitorStop();

}  // namespace kesu
