// Shared set-up of the account tests: a hermetic home with the PC suite's folders, real
// Config.db files written through SQLite, and the rows of a signed-in account.
#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <filesystem>
#include <string>

#include "account/DataInstance.h"
#include "core/Log.h"
#include "support/TestSupport.h"
#include "unit/UnitHelpers.h"

namespace kesu::test {

// One signed-in account; its directories are the second SoftwareSet row, not the last one.
inline const std::string kSignedInRows =
    "INSERT INTO User VALUES ('oid-1', '13812345678', 'tok-SECRET-1');"
    "INSERT INTO SoftwareSet VALUES ('oid-other', '/cfg/other', '/store/other');"
    "INSERT INTO SoftwareSet VALUES ('oid-1', '/cfg/one', '/store/one');";

class AccountFixture : public ::testing::Test {
protected:
    void SetUp() override {
        dataInstance().update([](databaseParam& p) { p = databaseParam{}; });
        std::filesystem::create_directories(dbDir());
    }
    void TearDown() override {
        dataInstance().update([](databaseParam& p) { p = databaseParam{}; });
        Log::closeLog();
    }

    std::string supportDir() const { return env.home() + "/Library/Application Support/pcsuite"; }
    std::string dbDir() const { return supportDir() + "/DataBase"; }
    std::string dbFile() const { return dbDir() + "/Config.db"; }
    // Writes a file below the PC suite's support folder.
    void writeSupportFile(const std::string& name, const std::string& content) {
        env.dir().write("home/Library/Application Support/pcsuite/" + name, content);
    }

    // Creates the file anew with both tables, then runs `rows` (INSERT statements).
    static void writeDatabase(const std::string& path, const std::string& rows) {
        writeDatabaseScript(path,
                            "CREATE TABLE User (openid TEXT, phone TEXT, token TEXT);"
                            "CREATE TABLE SoftwareSet (openid TEXT, configDir TEXT, storageDir TEXT);" +
                                rows);
    }
    // Creates the file anew and runs `script` on it.
    static void writeDatabaseScript(const std::string& path, const std::string& script) {
        std::filesystem::remove(path);
        sqlite3* db = nullptr;
        ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
        char* error = nullptr;
        const int rc = sqlite3_exec(db, script.c_str(), nullptr, nullptr, &error);
        const std::string message = error ? error : "";
        sqlite3_free(error);
        sqlite3_close(db);
        ASSERT_EQ(rc, SQLITE_OK) << message;
    }

    HermeticEnv env;
};

}  // namespace kesu::test
