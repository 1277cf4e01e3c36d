// The database monitor against a real Config.db, the real event bus and a UDP catcher in
// place of the local push client.
#include "account/FileMonitor.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <nlohmann/json.hpp>

#include <cstdint>
#include <optional>

#include "account/DataGet.h"
#include "core/EventLoop.h"
#include "support/UdpCatcher.h"
#include "unit/account/AccountFixture.h"
#include "unit/events/EventRecorder.h"

namespace kesu::test {
namespace {

using namespace std::chrono_literals;

// Moves the signed-in account's rows to a new open id and token.
constexpr const char* kSwitchAccount = "UPDATE User SET openid = 'oid-2', token = 'tok-2';"
                                       "UPDATE SoftwareSet SET openid = 'oid-2' WHERE openid = 'oid-1';";

class FileMonitorTest : public AccountFixture {
protected:
    void SetUp() override {
        AccountFixture::SetUp();
        loop.start();
        env.config().pushClientUdpPort = pushClient.port();
        EventPublisher::instance().clearObservers();
        EventPublisher::instance().addObserver(events);
    }
    void TearDown() override {
        loop.stop();
        EventPublisher::instance().clearObservers();
        AccountFixture::TearDown();
    }

    static void setModified(const std::string& path, std::time_t seconds) {
        const timespec times[2] = {{seconds, 0}, {seconds, 0}};
        ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    }
    // The monitor's state lines so far: one per change of the file's state.
    static int stateLines() {
        const std::string log = todaysLog();
        const std::string line = "[fileMonitorStart] Database file :";
        int n = 0;
        for (auto at = log.find(line); at != std::string::npos; at = log.find(line, at + 1)) ++n;
        return n;
    }

    int changes() { return events->count("AccountChangeEvent"); }
    static std::string openid() { return dataInstance().get().openid; }
    // A writer that ran `script` on Config.db and now holds it in an exclusive transaction.
    sqlite3* lockedWriter(const std::string& script) {
        sqlite3* writer = nullptr;
        EXPECT_EQ(sqlite3_open(dbFile().c_str(), &writer), SQLITE_OK);
        EXPECT_EQ(sqlite3_exec(writer, (script + "BEGIN EXCLUSIVE;").c_str(), nullptr, nullptr, nullptr), SQLITE_OK);
        return writer;
    }
    static void unlock(sqlite3* writer) {
        EXPECT_EQ(sqlite3_exec(writer, "ROLLBACK;", nullptr, nullptr, nullptr), SQLITE_OK);
        sqlite3_close(writer);
    }
    // A datagram already queued (loopback delivers during the send), if any.
    std::optional<std::string> sent() { return pushClient.receive(0ms); }

    EventLoop loop;
    UdpCatcher pushClient;
    std::shared_ptr<EventRecorder> events = std::make_shared<EventRecorder>();
};

TEST_F(FileMonitorTest, PassesFollowTheDatabaseFile) {
    writeDatabase(dbFile(), kSignedInRows);
    setModified(dbFile(), 1'700'000'000);
    FileMonitor monitor(loop, dbDir());

    monitor.runPass();  // read, client-id query, event
    EXPECT_EQ(changes(), 1);
    EXPECT_EQ(openid(), "oid-1");
    const auto query = sent();
    ASSERT_TRUE(query);
    EXPECT_EQ(nlohmann::json::parse(*query), (nlohmann::json{{"cmd", "QUERY_CLIENT_ID"}, {"openId", "oid-1"}}));

    monitor.runPass();  // unchanged: nothing
    EXPECT_EQ(changes(), 1);
    EXPECT_FALSE(sent());

    // A new file renamed over the old one with the same size and modification time is read.
    const std::string next = dbDir() + "/Config.db.new";
    writeDatabase(next, "INSERT INTO User VALUES ('oid-2', '13812345678', 'tok-SECRET-2');"
                        "INSERT INTO SoftwareSet VALUES ('oid-2', '/cfg/two', '/store/two');");
    setModified(next, 1'700'000'000);
    ASSERT_EQ(std::filesystem::file_size(next), std::filesystem::file_size(dbFile()));
    std::filesystem::rename(next, dbFile());
    monitor.runPass();
    EXPECT_EQ(changes(), 2);
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/two");
    EXPECT_TRUE(sent());

    // Touched: one more read and event.
    setModified(dbFile(), 1'700'000'100);
    monitor.runPass();
    monitor.runPass();
    EXPECT_EQ(changes(), 3);
    EXPECT_TRUE(sent());
    EXPECT_FALSE(sent());

    // Removed: the account is cleared, nothing is published.
    std::filesystem::remove(dbFile());
    monitor.runPass();
    EXPECT_EQ(changes(), 3);
    const databaseParam cleared = dataInstance().get();
    EXPECT_EQ(cleared.openid + cleared.Phone + cleared.token + cleared.configDir + cleared.storageDir, "");
    EXPECT_EQ(cleared.lastOpenId, "oid-2");

    // Restored with its old modification time: read again all the same.
    writeDatabase(dbFile(), kSignedInRows);
    setModified(dbFile(), 1'700'000'100);
    monitor.runPass();
    monitor.runPass();
    EXPECT_EQ(changes(), 4);
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/one");
    EXPECT_TRUE(sent());

    // Not a database any more: published, the account stays.
    writeSupportFile("DataBase/Config.db", "garbage garbage garbage");
    setModified(dbFile(), 1'700'000'200);
    monitor.runPass();
    EXPECT_EQ(changes(), 5);
    EXPECT_EQ(openid(), "oid-1");
    EXPECT_TRUE(sent());

    // Signed out: published, no client-id query.
    writeDatabase(dbFile(), "");
    setModified(dbFile(), 1'700'000'300);
    monitor.runPass();
    EXPECT_EQ(changes(), 6);
    EXPECT_EQ(openid(), "");
    EXPECT_FALSE(sent());
    EXPECT_EQ(todaysLog().find("tok-SECRET-1"), std::string::npos);
}

// Each bad Config.db, entered from a good file and left back to it: one log line per change.
TEST_F(FileMonitorTest, BadFilesKeepTheServiceGoingAndAreLoggedOncePerChange) {
    env.config().databaseBusyTimeout = 0ms;
    const std::string untyped = "CREATE TABLE User (openid, phone, token);"
                                "CREATE TABLE SoftwareSet (openid, configDir, storageDir);";
    std::string junk(8192, '\0');
    std::uint32_t x = 2463534242u;
    for (char& c : junk) c = static_cast<char>(x ^= x << 13, x ^= x >> 17, x ^= x << 5);
    struct Case {
        const char* name;
        std::optional<std::string> script;  // SQL run on a new file; else raw `bytes`; neither: no file
        std::optional<std::string> bytes;
        DatabaseState state;
        std::string openid;
    };
    const Case cases[] = {
        {"missing", {}, {}, DatabaseState::Missing, ""},
        {"empty", {}, "", DatabaseState::Unreadable, "oid-1"},
        {"random bytes", {}, junk, DatabaseState::Unreadable, "oid-1"},
        {"no User table", "CREATE TABLE Other (x TEXT);", {}, DatabaseState::Unreadable, "oid-1"},
        {"User without the columns", "CREATE TABLE User (name TEXT);", {}, DatabaseState::Unreadable, "oid-1"},
        {"integer open id", untyped + "INSERT INTO User VALUES (12345, 1, 2.5);", {}, DatabaseState::Good, "12345"},
        {"blob text", untyped + "INSERT INTO User VALUES (X'6F69642D62', NULL, NULL);", {}, DatabaseState::Good, "oid-b"},
    };

    std::time_t stamp = 1'700'000'000;
    auto good = [&] {
        writeDatabase(dbFile(), kSignedInRows);
        setModified(dbFile(), ++stamp);
    };
    good();
    FileMonitor monitor(loop, dbDir());
    monitor.runPass();
    ASSERT_EQ(monitor.state(), DatabaseState::Good);
    EXPECT_EQ(stateLines(), 1);  // the first look counts as a change

    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        const bool bad = c.state != DatabaseState::Good;
        const int linesBefore = stateLines();
        if (c.script) writeDatabaseScript(dbFile(), *c.script);
        else if (c.bytes) writeSupportFile("DataBase/Config.db", *c.bytes);
        else std::filesystem::remove(dbFile());
        if (std::filesystem::exists(dbFile())) setModified(dbFile(), ++stamp);
        monitor.runPass();
        EXPECT_EQ(monitor.state(), c.state);
        EXPECT_EQ(stateLines(), linesBefore + (bad ? 1 : 0));
        const std::size_t logSize = todaysLog().size();
        monitor.runPass();
        monitor.runPass();
        EXPECT_EQ(todaysLog().size(), logSize) << "a pass in an unchanged state logged";
        EXPECT_EQ(openid(), c.openid);

        good();
        monitor.runPass();
        EXPECT_EQ(monitor.state(), DatabaseState::Good);
        EXPECT_EQ(dataInstance().get().configDir, "/cfg/one");
        EXPECT_EQ(stateLines(), linesBefore + (bad ? 2 : 0));
    }
}

// A new account written under a held lock: the old account stays, retries log nothing, and
// the new one is read once the lock goes although the file did not change again.
TEST_F(FileMonitorTest, LockedDatabaseKeepsTheAccountUntilTheLockGoes) {
    env.config().databaseBusyTimeout = 20ms;
    writeDatabase(dbFile(), kSignedInRows);
    setModified(dbFile(), 1'700'000'000);
    FileMonitor monitor(loop, dbDir());
    monitor.runPass();
    ASSERT_EQ(openid(), "oid-1");
    ASSERT_TRUE(sent());

    sqlite3* writer = lockedWriter(kSwitchAccount);
    const int lines = stateLines();
    monitor.runPass();
    EXPECT_EQ(monitor.state(), DatabaseState::Busy);
    EXPECT_EQ(dataInstance().get().token, "tok-SECRET-1");
    EXPECT_EQ(stateLines(), lines + 1);
    const int eventsWhileLocked = changes();
    while (sent()) {
    }
    const std::size_t logSize = todaysLog().size();
    monitor.runPass();
    monitor.runPass();
    EXPECT_EQ(todaysLog().size(), logSize);
    EXPECT_EQ(changes(), eventsWhileLocked);
    EXPECT_EQ(openid(), "oid-1");

    const auto lockedIdentity = FileMonitor::fileIdentity(dbFile());
    unlock(writer);
    ASSERT_EQ(FileMonitor::fileIdentity(dbFile()), lockedIdentity);  // only the retry can see it
    monitor.runPass();
    EXPECT_EQ(monitor.state(), DatabaseState::Good);
    EXPECT_EQ(dataInstance().get().token, "tok-2");
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/one");
    EXPECT_EQ(stateLines(), lines + 2);
    EXPECT_EQ(changes(), eventsWhileLocked + 1);
    const auto query = sent();
    ASSERT_TRUE(query);
    EXPECT_EQ(nlohmann::json::parse(*query)["openId"], "oid-2");
}

// The offset is honoured; anything else is no date.
TEST(FileMonitorDate, OffsetIsHonouredAndAnythingElseIsNoDate) {
    const std::time_t epoch = 0;
    std::tm local{};
    localtime_r(&epoch, &local);
    char expected[32];
    std::strftime(expected, sizeof expected, "%Y:%m:%d %H:%M:%S", &local);
    EXPECT_EQ(FileMonitor::getLocalDate("1970-01-01 01:00:00 +0100"), expected);
    EXPECT_EQ(FileMonitor::getLocalDate("yesterday"), "");
    EXPECT_EQ(FileMonitor::getLocalDate("1970-01-01 00:00:00 +0000 trailing"), "");
}

// An hour's period: only the change notification can bring in the folder made after the start
// and the file renamed into it.
TEST_F(FileMonitorTest, ChangesAreSeenWithoutWaitingForThePeriod) {
    env.config().fileMonitorPeriod = std::chrono::hours(1);
    std::filesystem::remove_all(supportDir());
    FileMonitor monitor(loop, dbDir());
    ASSERT_TRUE(monitor.start());
    EXPECT_FALSE(monitor.start());
    ASSERT_TRUE(loop.call([] {}));  // the watch is armed
    auto replace = [&](const std::string& rows) {
        const std::string next = dbDir() + "/Config.db.new";
        writeDatabase(next, rows);
        std::filesystem::rename(next, dbFile());
    };

    std::filesystem::create_directories(dbDir());
    replace(kSignedInRows);
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", 1, 10s));
    EXPECT_EQ(openid(), "oid-1");
    replace("INSERT INTO User VALUES ('oid-2', '13812345678', 'tok-SECRET-2');");
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", 2, 10s));
    EXPECT_EQ(openid(), "oid-2");
    monitor.stop();
}

// While watched the pass is rare, yet a locked read is retried on the short period.
TEST_F(FileMonitorTest, LockedReadIsRetriedSoonWhileTheWatchMakesThePassRare) {
    env.config().databaseBusyTimeout = 20ms;
    env.config().fileMonitorPeriod = 20ms;
    env.config().fileMonitorWatchedPeriod = std::chrono::hours(1);
    writeDatabase(dbFile(), kSignedInRows);
    FileMonitor monitor(loop, dbDir());
    ASSERT_TRUE(monitor.start());
    ASSERT_EQ(openid(), "oid-1");
    const int started = changes();

    sqlite3* writer = lockedWriter(std::string("BEGIN EXCLUSIVE;") + kSwitchAccount + "COMMIT;");
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", started + 1, 10s));  // noticed, not readable yet
    EXPECT_EQ(openid(), "oid-1");
    unlock(writer);
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", started + 2, 10s));
    EXPECT_EQ(openid(), "oid-2");
    monitor.stop();
}

TEST_F(FileMonitorTest, ServiceStartReadsWithoutWaitingAPeriodAndFillsTheDeviceId) {
    // An hour's period: neither the first read nor the stop may wait for it.
    env.config().fileMonitorPeriod = std::chrono::hours(1);
    env.config().pcsuitePort = freeTcpPort();  // nobody answers there
    writeSupportFile("config.json", R"({"newDeviceId": "file-id"})");
    writeDatabase(dbFile(), kSignedInRows);

    ASSERT_TRUE(fileMonitorStart(loop));
    EXPECT_EQ(dataInstance().get().pcDeviceId, "file-id");
    EXPECT_FALSE(fileMonitorStart(loop));
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", 1));
    EXPECT_EQ(openid(), "oid-1");
    fileMonitorStop();
}

}  // namespace
}  // namespace kesu::test
