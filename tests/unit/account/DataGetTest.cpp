// Reading the account from real Config.db files, the history file and the PC suite's device id.
#include "account/DataGet.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <atomic>
#include <fstream>
#include <thread>

#include "support/StubPcSuite.h"
#include "unit/account/AccountFixture.h"
#include "core/Log.h"

namespace kesu::test {
namespace {

using DataGetTest = AccountFixture;

// Fills the first page of `table` with garbage, leaving the schema page intact.
void overwriteTablePage(const std::string& path, const std::string& table) {
    sqlite3* db = nullptr;
    sqlite3_stmt* stmt = nullptr;
    ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
    sqlite3_prepare_v2(db, "SELECT rootpage, (SELECT page_size FROM pragma_page_size()) FROM sqlite_master WHERE name = ?;",
                       -1, &stmt, nullptr);
    sqlite3_bind_text(stmt, 1, table.c_str(), -1, SQLITE_TRANSIENT);
    const bool found = sqlite3_step(stmt) == SQLITE_ROW;
    const int page = found ? sqlite3_column_int(stmt, 0) : 0, pageSize = found ? sqlite3_column_int(stmt, 1) : 0;
    sqlite3_finalize(stmt);
    sqlite3_close(db);
    ASSERT_GT(page, 1);
    std::fstream file(path, std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(static_cast<std::streamoff>(page - 1) * pageSize);
    file << std::string(static_cast<std::size_t>(pageSize), '\xA5');
}

// A home that merely contains "Containers" is an ordinary home.
TEST_F(DataGetTest, PathsFollowTheHomeFolderWithoutASandbox) {
    std::string base;
    ScopedEnv home("HOME", "/srv/Containers/app/Data");
    EXPECT_FALSE(getSanboxPth(base));
    EXPECT_EQ(base, "/srv/Containers/app/Data/Library/");
    EXPECT_EQ(containerLibraryBase("/Users/name/Library/Containers/app/Data"), "/Users/name/Library/");
    EXPECT_EQ(containerLibraryBase("/Containers"), std::nullopt);
}

TEST_F(DataGetTest, AccountRowsAreReadWithoutLoggingTheToken) {
    writeDatabase(dbFile(), kSignedInRows);
    dataBaseRead(dbDir());
    databaseParam p = dataInstance().get();
    EXPECT_EQ(p.openid, "oid-1");
    EXPECT_EQ(p.Phone, "138****678");
    EXPECT_EQ(p.token, "tok-SECRET-1");
    EXPECT_EQ(p.configDir, "/cfg/one");  // the row of this account, not the last row
    EXPECT_EQ(p.storageDir, "/store/one");
    EXPECT_TRUE(retGet());
    EXPECT_EQ(todaysLog().find("tok-SECRET-1"), std::string::npos);
    EXPECT_EQ(todaysLog().find("13812345678"), std::string::npos);

    // An empty User table signs out but keeps the directories and the last values.
    writeDatabase(dbFile(), "INSERT INTO SoftwareSet VALUES ('oid-1', '/cfg/new', '/store/new');");
    dataBaseRead(dbDir());
    p = dataInstance().get();
    EXPECT_EQ(p.openid + p.Phone + p.token, "");
    EXPECT_EQ(p.lastOpenId, "oid-1");
    EXPECT_EQ(p.lastToken, "tok-SECRET-1");
    EXPECT_EQ(p.configDir, "/cfg/one");

    // The last row wins; a short phone stays unmasked; a NULL phone leaves the phone alone,
    // a NULL token or open id reads as "".
    writeDatabase(dbFile(), "INSERT INTO User VALUES ('oid-a', '13800000001', 'tok-a');"
                            "INSERT INTO User VALUES ('oid-b', '123456', 'tok-b');");
    dataBaseRead(dbDir());
    EXPECT_EQ(dataInstance().get().openid, "oid-b");
    EXPECT_EQ(dataInstance().get().Phone, "123456");
    writeDatabase(dbFile(), "INSERT INTO User VALUES ('oid-c', NULL, NULL);");
    dataBaseRead(dbDir());
    p = dataInstance().get();
    EXPECT_EQ(p.openid, "oid-c");
    EXPECT_EQ(p.Phone, "123456");
    EXPECT_EQ(p.token, "");
    writeDatabase(dbFile(), "INSERT INTO User VALUES (NULL, '13800000002', 'tok-d');"
                            "INSERT INTO SoftwareSet VALUES (NULL, NULL, NULL);");
    dataBaseRead(dbDir());
    EXPECT_EQ(dataInstance().get().openid, "");
    EXPECT_EQ(dataInstance().get().Phone, "138****002");
}

TEST_F(DataGetTest, UnreadableDatabaseKeepsThePreviousAccount) {
    env.config().databaseBusyTimeout = std::chrono::milliseconds(0);
    writeDatabase(dbFile(), kSignedInRows);
    dataBaseRead(dbDir());
    ASSERT_EQ(dataInstance().get().openid, "oid-1");

    // Missing file: the read fails and, being read-only, creates nothing.
    const std::string otherDir = env.dir().str() + "/nodb";
    std::filesystem::create_directories(otherDir);
    dataBaseRead(otherDir);
    EXPECT_FALSE(std::filesystem::exists(otherDir + "/Config.db"));
    EXPECT_EQ(dataInstance().get().openid, "oid-1");

    // A damaged table page under a sound schema: unreadable rows are not "no rows".
    const std::string damagedDir = env.dir().str() + "/damaged";
    std::filesystem::create_directories(damagedDir);
    writeDatabase(damagedDir + "/Config.db", "INSERT INTO User VALUES ('oid-x', '13800000009', 'tok-x');");
    overwriteTablePage(damagedDir + "/Config.db", "User");
    dataBaseRead(damagedDir);
    EXPECT_EQ(dataInstance().get().token, "tok-SECRET-1");

    // Without the SoftwareSet table the account is read, the directories are not.
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(dbFile().c_str(), &db), SQLITE_OK);
    sqlite3_exec(db, "DROP TABLE SoftwareSet; UPDATE User SET token = 'tok-2';", nullptr, nullptr, nullptr);
    sqlite3_close(db);
    dataBaseRead(dbDir());
    EXPECT_EQ(dataInstance().get().token, "tok-2");
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/one");
    EXPECT_FALSE(retGet());
}

TEST(AccountText, OnlyUsableTextReachesTheRecord) {
    using T = ColumnValue::Type;
    const std::string longest(kMaxAccountValueBytes, 'a');
    const struct {
        ColumnValue value;
        std::optional<std::string> expected;
    } cases[] = {
        {{T::Null, ""}, std::nullopt},
        {{T::Integer, "12345"}, "12345"},
        {{T::Float, "2.5"}, "2.5"},
        {{T::Text, "o\xC3\xA9id"}, "o\xC3\xA9id"},
        {{T::Blob, "oid-b"}, "oid-b"},
        {{T::Blob, "\xFF\xFE"}, ""},
        {{T::Text, std::string("a\0b", 3)}, ""},
        {{T::Text, longest}, longest},
        {{T::Text, longest + "a"}, ""},
    };
    for (const auto& c : cases) EXPECT_EQ(accountText(c.value), c.expected) << c.value.bytes.substr(0, 16);
}

TEST_F(DataGetTest, OpenIdWithQuotesIsMatchedLiterally) {
    writeDatabase(dbFile(), "INSERT INTO User VALUES ('o''brien\"x', '13812345678', 't');"
                            "INSERT INTO SoftwareSet VALUES ('o''brien\"x', '/cfg/ob', '/store/ob');");
    dataBaseRead(dbDir());
    EXPECT_EQ(dataInstance().get().openid, "o'brien\"x");
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/ob");

    // An open id shaped like SQL selects nothing: the other account's row must not leak in.
    writeDatabase(dbFile(), "INSERT INTO User VALUES ('x'' OR ''1''=''1', '13812345678', 't');"
                            "INSERT INTO SoftwareSet VALUES ('someone-else', '/cfg/else', '/store/else');");
    dataBaseRead(dbDir());
    EXPECT_EQ(dataInstance().get().openid, "x' OR '1'='1");
    EXPECT_EQ(dataInstance().get().configDir, "/cfg/ob");
}

TEST_F(DataGetTest, ReadersNeverSeeAnOpenIdWithAnotherAccountsToken) {
    env.config().databaseBusyTimeout = std::chrono::milliseconds(0);
    const std::string dirA = env.dir().str() + "/a", dirB = env.dir().str() + "/b";
    std::filesystem::create_directories(dirA);
    std::filesystem::create_directories(dirB);
    writeDatabase(dirA + "/Config.db", "INSERT INTO User VALUES ('aaaa', '11111111111', 'token-aaaa');");
    writeDatabase(dirB + "/Config.db", "INSERT INTO User VALUES ('bbbb', '22222222222', 'token-bbbb');");

    std::atomic<bool> done{false};
    std::atomic<int> mismatches{0};
    std::thread reader([&] {
        while (!done.load()) {
            const databaseParam p = dataInstance().get();
            if (!p.openid.empty() && p.token != "token-" + p.openid) ++mismatches;
        }
    });
    for (int i = 0; i < 100; ++i) dataBaseRead(i % 2 ? dirB : dirA);
    done = true;
    reader.join();
    EXPECT_EQ(mismatches.load(), 0);
}

TEST_F(DataGetTest, HistoryFileAndDeviceIdSurviveBadInput) {
    dataInstance().update([](databaseParam& p) {
        p.historyPhoneId = "old-phone";
        p.historyPadId = "old-pad";
    });
    updateHistoryDevice();  // missing file
    writeSupportFile("historyPhone.json", "{\"last_time_phone\": {\"bl");
    updateHistoryDevice();  // half-written
    EXPECT_EQ(dataInstance().get().historyPhoneId, "old-phone");
    EXPECT_EQ(dataInstance().get().historyPadId, "old-pad");
    writeSupportFile("historyPhone.json", R"({"last_time_phone": {"bleId": "AA:BB"}, "last_time_pad": {"bleId": 7}})");
    updateHistoryDevice();
    EXPECT_EQ(dataInstance().get().historyPhoneId, "AA:BB");
    EXPECT_EQ(dataInstance().get().historyPadId, "");

    // The device id comes from the PC suite, then from config.json.
    StubPcSuite pcsuite;
    pcsuite.pointPcsuiteHere(env.config());
    env.config().httpRequestTimeout = std::chrono::milliseconds(5000);
    writeSupportFile("config.json", R"({"newDeviceId": "file-id"})");
    pcsuite.setAnswer("/pcDeviceInfo", {200, R"({"code": "000000", "data": {"deviceId": "suite-id", "version": "9.1.0"}})"});
    EXPECT_EQ(getPcsuiteDeviceInfo(), "suite-id");
    EXPECT_EQ(dataInstance().get().version, "9.1.0");
    // A numeric id is no id; a missing version falls back to the service's own.
    pcsuite.setAnswer("/pcDeviceInfo", {200, R"({"code": "000000", "data": {"deviceId": 12345}})"});
    EXPECT_EQ(getPcsuiteDeviceInfo(), "file-id");
    EXPECT_EQ(dataInstance().get().version, Log::versionCode);
    // Refused, and config.json has no id: empty.
    pcsuite.setAnswer("/pcDeviceInfo", {200, R"({"code": "000001"})"});
    dataInstance().set(&databaseParam::pcDeviceId, "");
    writeSupportFile("config.json", R"({"other": 1})");
    EXPECT_EQ(getPcsuiteDeviceInfo(), "");
}

}  // namespace
}  // namespace kesu::test
