// The database monitor against a real Config.db, the real event bus and a real UDP peer in
// place of the local push client.
#include "account/FileMonitor.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <condition_variable>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <vector>

#include "account/DataGet.h"
#include "events/EventPublisher.h"
#include "unit/account/AccountFixture.h"

namespace kesu::test {
namespace {

const std::string kSignedIn =
    "INSERT INTO User VALUES ('oid-1', '13812345678', 'tok-1');"
    "INSERT INTO SoftwareSet VALUES ('oid-1', '/cfg/one', '/store/one');";

// Counts the "AccountChangeEvent"s published on the bus.
class AccountEvents : public IEventSubscriber {
public:
    AccountEvents() : IEventSubscriber({"AccountChangeEvent"}) {}
    void notify(const std::string& eventName) override {
        if (eventName != "AccountChangeEvent") return;
        std::lock_guard<std::mutex> lock(mutex_);
        ++count_;
        changed_.notify_all();
    }
    bool eventNotify(const std::string&) override { return false; }
    int count() {
        std::lock_guard<std::mutex> lock(mutex_);
        return count_;
    }
    // Waits for the n-th event; gives up after a generous limit.
    bool waitFor(int n) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(30), [&] { return count_ >= n; });
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    int count_ = 0;
};

// A UDP socket on 127.0.0.1 standing in for the push client.
class PushClientPeer {
public:
    PushClientPeer() {
        fd_ = ::socket(AF_INET, SOCK_DGRAM, 0);
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        ::bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
        socklen_t len = sizeof addr;
        ::getsockname(fd_, reinterpret_cast<sockaddr*>(&addr), &len);
        port_ = ntohs(addr.sin_port);
    }
    ~PushClientPeer() { ::close(fd_); }
    int port() const { return port_; }
    // A datagram already queued (loopback delivers during the send), if any.
    std::optional<std::string> take() {
        char buffer[2048];
        const ssize_t n = ::recv(fd_, buffer, sizeof buffer, MSG_DONTWAIT);
        if (n < 0) return std::nullopt;
        return std::string(buffer, static_cast<std::size_t>(n));
    }

private:
    int fd_ = -1;
    int port_ = 0;
};

class FileMonitorTest : public AccountFixture {
protected:
    void SetUp() override {
        AccountFixture::SetUp();
        env.config().pushClientUdpPort = peer.port();
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

    PushClientPeer peer;
    std::shared_ptr<AccountEvents> events = std::make_shared<AccountEvents>();
};

TEST_F(FileMonitorTest, PassesFollowTheDatabaseFile) {
    writeDatabase(dbFile(), kSignedIn);
    setModified(dbFile(), 1'700'000'000);
    FileMonitor monitor(dbDir());

    // First pass: read, client-id query, event.
    monitor.runPass();
    EXPECT_EQ(events->count(), 1);
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
    const auto query = peer.take();
    ASSERT_TRUE(query);
    EXPECT_EQ(nlohmann::json::parse(*query), (nlohmann::json{{"cmd", "QUERY_CLIENT_ID"}, {"openId", "oid-1"}}));
    EXPECT_NE(query->find('\n'), std::string::npos);  // pretty-printed
    EXPECT_NE(logText().find("is the database file Config.db read first time"), std::string::npos);

    // Unchanged: nothing.
    monitor.runPass();
    EXPECT_EQ(events->count(), 1);
    EXPECT_FALSE(peer.take());

    // Touched: one more read and event.
    setModified(dbFile(), 1'700'000'100);
    monitor.runPass();
    monitor.runPass();
    EXPECT_EQ(events->count(), 2);
    EXPECT_TRUE(peer.take());
    EXPECT_FALSE(peer.take());

    // Removed: the account is cleared, nothing is published.
    std::filesystem::remove(dbFile());
    monitor.runPass();
    EXPECT_EQ(events->count(), 2);
    const databaseParam cleared = dataInstance().get();
    EXPECT_EQ(cleared.openid + cleared.Phone + cleared.token + cleared.configDir + cleared.storageDir, "");
    EXPECT_EQ(cleared.lastOpenId, "oid-1");
    EXPECT_NE(logText().find("[fileMonitorStart] Database file :" + dbFile() + " is lost ，please fix it"),
              std::string::npos);
    EXPECT_NE(logText().find("[fileExist] File lost. File :" + dbFile() + " is not exist"), std::string::npos);

    // Restored with its old modification time: read again all the same.
    writeDatabase(dbFile(), kSignedIn);
    setModified(dbFile(), 1'700'000'100);
    monitor.runPass();
    EXPECT_EQ(events->count(), 3);
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/one");
    EXPECT_TRUE(peer.take());
    monitor.runPass();
    EXPECT_EQ(events->count(), 3);

    // Not a database any more: published, the account stays.
    env.dir().write("home/Library/Application Support/pcsuite/DataBase/Config.db", "garbage garbage garbage");
    setModified(dbFile(), 1'700'000'200);
    monitor.runPass();
    EXPECT_EQ(events->count(), 4);
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
    EXPECT_TRUE(peer.take());

    // Signed out: published, no client-id query.
    writeDatabase(dbFile(), "");
    setModified(dbFile(), 1'700'000'300);
    monitor.runPass();
    EXPECT_EQ(events->count(), 5);
    EXPECT_EQ(dataInstance().get().openid, "");
    EXPECT_FALSE(peer.take());
    EXPECT_EQ(logText().find("tok-1"), std::string::npos);
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

    const auto description = FileMonitor::dateDescription(FileMonitor::TimePoint(std::chrono::seconds(0)));
    EXPECT_EQ(description, "1970-01-01 00:00:00 +0000");
    const std::time_t epoch = 0;
    std::tm local{};
    localtime_r(&epoch, &local);
    char expected[32];
    std::strftime(expected, sizeof expected, "%Y:%m:%d %H:%M:%S", &local);
    EXPECT_EQ(FileMonitor::getLocalDate(description), expected);
    EXPECT_EQ(FileMonitor::getLocalDate("1970-01-01 01:00:00 +0100"), expected);
    EXPECT_EQ(FileMonitor::getLocalDate("yesterday"), "");
    EXPECT_EQ(FileMonitor::getLocalDate("1970-01-01 00:00:00 +0000 trailing"), "");
}

TEST_F(FileMonitorTest, ThreadReadsAtOnceSeesTouchesAndStops) {
    env.config().fileMonitorPeriod = std::chrono::milliseconds(10);
    writeDatabase(dbFile(), kSignedIn);
    setModified(dbFile(), 1'700'000'000);
    FileMonitor monitor(dbDir());
    ASSERT_TRUE(monitor.start());
    EXPECT_FALSE(monitor.start());
    ASSERT_TRUE(events->waitFor(1));
    setModified(dbFile(), 1'700'000'500);
    ASSERT_TRUE(events->waitFor(2));
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
    writeDatabase(dbFile(), kSignedIn);

    ASSERT_TRUE(fileMonitorStart());
    EXPECT_EQ(dataInstance().get().pcDeviceId, "file-id");
    EXPECT_EQ(dataInstance().get().version, Utils::versionCode);
    EXPECT_FALSE(fileMonitorStart());
    ASSERT_TRUE(events->waitFor(1));
    EXPECT_EQ(dataInstance().get().openid, "oid-1");
    fileMonitorStop();
}

}  // namespace
}  // namespace kesu::test
