// The database monitor against a real Config.db, the real event bus and a UDP catcher in
// place of the local push client.
#include "account/FileMonitor.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <nlohmann/json.hpp>

#include "account/DataGet.h"
#include "support/UdpCatcher.h"
#include "unit/account/AccountFixture.h"
#include "unit/events/EventRecorder.h"

namespace kesu::test {
namespace {

using namespace std::chrono_literals;

class FileMonitorTest : public AccountFixture {
protected:
    void SetUp() override {
        AccountFixture::SetUp();
        env.config().pushClientUdpPort = pushClient.port();
        EventPublisher::instance().clearObservers();
        EventPublisher::instance().addObserver(events);
    }
    void TearDown() override {
        EventPublisher::instance().clearObservers();
        AccountFixture::TearDown();
    }

    static void setModified(const std::string& path, std::time_t seconds) {
        const timespec times[2] = {{seconds, 0}, {seconds, 0}};
        ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    }

    int changes() { return events->count("AccountChangeEvent"); }
    // A datagram already queued (loopback delivers during the send), if any.
    std::optional<std::string> sent() { return pushClient.receive(0ms); }

    UdpCatcher pushClient;
    std::shared_ptr<EventRecorder> events = std::make_shared<EventRecorder>();
};

TEST_F(FileMonitorTest, PassesFollowTheDatabaseFile) {
    writeDatabase(dbFile(), kSignedInRows);
    setModified(dbFile(), 1'700'000'000);
    FileMonitor monitor(dbDir());

    // First pass: read, client-id query, event.
    monitor.runPass();
    EXPECT_EQ(changes(), 1);
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
    const auto query = sent();
    ASSERT_TRUE(query);
    EXPECT_EQ(nlohmann::json::parse(*query), (nlohmann::json{{"cmd", "QUERY_CLIENT_ID"}, {"openId", "oid-1"}}));

    // Unchanged: nothing.
    monitor.runPass();
    EXPECT_EQ(changes(), 1);
    EXPECT_FALSE(sent());

    // Touched: one more read and event.
    setModified(dbFile(), 1'700'000'100);
    monitor.runPass();
    monitor.runPass();
    EXPECT_EQ(changes(), 2);
    EXPECT_TRUE(sent());
    EXPECT_FALSE(sent());

    // Removed: the account is cleared, nothing is published.
    std::filesystem::remove(dbFile());
    monitor.runPass();
    EXPECT_EQ(changes(), 2);
    const databaseParam cleared = dataInstance().get();
    EXPECT_EQ(cleared.openid + cleared.Phone + cleared.token + cleared.configDir + cleared.storageDir, "");
    EXPECT_EQ(cleared.lastOpenId, "oid-1");

    // Restored with its old modification time: read again all the same.
    writeDatabase(dbFile(), kSignedInRows);
    setModified(dbFile(), 1'700'000'100);
    monitor.runPass();
    EXPECT_EQ(changes(), 3);
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/one");
    EXPECT_TRUE(sent());
    monitor.runPass();
    EXPECT_EQ(changes(), 3);

    // Not a database any more: published, the account stays.
    env.dir().write("home/Library/Application Support/pcsuite/DataBase/Config.db", "garbage garbage garbage");
    setModified(dbFile(), 1'700'000'200);
    monitor.runPass();
    EXPECT_EQ(changes(), 4);
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
    EXPECT_TRUE(sent());

    // Signed out: published, no client-id query.
    writeDatabase(dbFile(), "");
    setModified(dbFile(), 1'700'000'300);
    monitor.runPass();
    EXPECT_EQ(changes(), 5);
    EXPECT_EQ(dataInstance().get().openid, "");
    EXPECT_FALSE(sent());
    EXPECT_EQ(todaysLog().find("tok-SECRET-1"), std::string::npos);
}

TEST_F(FileMonitorTest, AttributesOfAVanishedFileAreNoChange) {
    auto last = FileMonitor::TimePoint(std::chrono::seconds(42));
    bool first = true;
    int times = 0;
    EXPECT_FALSE(FileMonitor::fileAttributeGet(dbDir(), last, first, times));
    EXPECT_EQ(last, FileMonitor::TimePoint(std::chrono::seconds(42)));
    EXPECT_TRUE(first);
    EXPECT_EQ(times, 0);

    // Same time as stored, first read: still read once.
    writeDatabase(dbFile(), "");
    setModified(dbFile(), 42);
    EXPECT_TRUE(FileMonitor::fileAttributeGet(dbDir(), last, first, times));
    EXPECT_FALSE(FileMonitor::fileAttributeGet(dbDir(), last, first, times));
    EXPECT_EQ(times, 1);

    // Dates: the offset is honoured; anything else is no date.
    const std::time_t epoch = 0;
    std::tm local{};
    localtime_r(&epoch, &local);
    char expected[32];
    std::strftime(expected, sizeof expected, "%Y:%m:%d %H:%M:%S", &local);
    EXPECT_EQ(FileMonitor::getLocalDate("1970-01-01 01:00:00 +0100"), expected);
    EXPECT_EQ(FileMonitor::getLocalDate("yesterday"), "");
    EXPECT_EQ(FileMonitor::getLocalDate("1970-01-01 00:00:00 +0000 trailing"), "");
}

TEST_F(FileMonitorTest, ThreadReadsAtOnceSeesTouchesAndStops) {
    env.config().fileMonitorPeriod = std::chrono::milliseconds(10);
    writeDatabase(dbFile(), kSignedInRows);
    setModified(dbFile(), 1'700'000'000);
    FileMonitor monitor(dbDir());
    ASSERT_TRUE(monitor.start());
    EXPECT_FALSE(monitor.start());
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", 1));
    setModified(dbFile(), 1'700'000'500);
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", 2));
    monitor.stop();
    EXPECT_FALSE(monitor.running());
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
}

TEST_F(FileMonitorTest, ServiceStartReadsWithoutWaitingAPeriodAndFillsTheDeviceId) {
    // A period far beyond the test's limits: the first read must not wait for it, and
    // stopping must not either.
    env.config().fileMonitorPeriod = std::chrono::hours(1);
    env.config().pcsuitePort = freeTcpPort();  // nobody answers there
    env.dir().write("home/Library/Application Support/pcsuite/config.json", R"({"newDeviceId": "file-id"})");
    writeDatabase(dbFile(), kSignedInRows);

    ASSERT_TRUE(fileMonitorStart());
    EXPECT_EQ(dataInstance().get().pcDeviceId, "file-id");
    EXPECT_EQ(dataInstance().get().version, Utils::versionCode);
    EXPECT_FALSE(fileMonitorStart());
    ASSERT_TRUE(events->waitFor("AccountChangeEvent", 1));
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
    fileMonitorStop();
}

}  // namespace
}  // namespace kesu::test
