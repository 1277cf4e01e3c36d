// Shared set-up of the account tests: a hermetic home with the PC suite's folders, real
// Config.db files written through SQLite, and access to the day's log file.
#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <filesystem>
#include <string>

#include "account/DataInstance.h"
#include "core/Utils.h"
#include "support/TestSupport.h"

namespace kesu::test {

class AccountFixture : public ::testing::Test {
protected:
    void SetUp() override {
        dataInstance().update([](databaseParam& p) { p = databaseParam{}; });
        std::filesystem::create_directories(dbDir());
    }
    void TearDown() override { dataInstance().update([](databaseParam& p) { p = databaseParam{}; }); }

    std::string supportDir() const { return env.home() + "/Library/Application Support/pcsuite"; }
    std::string dbDir() const { return supportDir() + "/DataBase"; }
    std::string dbFile() const { return dbDir() + "/Config.db"; }

    // Creates the file anew with both tables, then runs `rows` (INSERT statements).
    static void writeDatabase(const std::string& path, const std::string& rows) {
        std::filesystem::remove(path);
        sqlite3* db = nullptr;
        ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
        const std::string script =
            "CREATE TABLE User (openid TEXT, phone TEXT, token TEXT);"
            "CREATE TABLE SoftwareSet (openid TEXT, configDir TEXT, storageDir TEXT);" +
            rows;
        char* error = nullptr;
        const int rc = sqlite3_exec(db, script.c_str(), nullptr, nullptr, &error);
        const std::string message = error ? error : "";
        sqlite3_free(error);
        sqlite3_close(db);
        ASSERT_EQ(rc, SQLITE_OK) << message;
    }

    // Everything logged today so far.
    static std::string logText() { return readAll(Utils::logFilePath(Utils::now())); }

    HermeticEnv env;
};

}  // namespace kesu::test
