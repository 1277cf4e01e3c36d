// Reading the PC suite's account database and JSON files into the shared account record.
#include "account/DataGet.h"

#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <vector>

#include "account/DataInstance.h"
#include "core/Config.h"
#include "core/Json.h"
#include "core/Text.h"
#include "core/Files.h"
#include "core/Log.h"
#include "core/Text.h"
#include "core/WallClock.h"
#include "pcsuite/PcsuiteRequest.h"

namespace kesu {

namespace {

// Whether the process runs in a sandbox container. There is no such container on Linux;
// the container rule of getSanboxPth stays for a platform that has one.
constexpr bool kRunsSandboxed = false;

const std::string kUserStatement = "SELECT openid, phone, token FROM User;";
// The open id goes in as a bound parameter, never spliced into the text.
const std::string kSoftwareSetStatement =
    "SELECT openid,configDir,storageDir FROM SoftwareSet WHERE openid = ?;";

// A read of a damaged file is cut off after this long beyond the busy wait.
constexpr std::chrono::seconds kMaxReadWork{5};
// No single value SQLite hands us may be larger (a bigger one fails the read).
constexpr int kMaxSqliteValueBytes = 1 << 20;

std::atomic<bool> databaseUpdate{false};

std::string pcsuiteSupportDir() {
    std::string base;
    getSanboxPth(base);
    return base + "Application Support/pcsuite/";
}

ColumnValue columnValue(sqlite3_stmt* stmt, int column) {
    ColumnValue value;
    switch (sqlite3_column_type(stmt, column)) {
        case SQLITE_NULL: return value;
        case SQLITE_INTEGER: value.type = ColumnValue::Type::Integer; break;
        case SQLITE_FLOAT: value.type = ColumnValue::Type::Float; break;
        case SQLITE_BLOB: value.type = ColumnValue::Type::Blob; break;
        default: value.type = ColumnValue::Type::Text; break;
    }
    const void* data = value.type == ColumnValue::Type::Blob ? sqlite3_column_blob(stmt, column)
                                                             : static_cast<const void*>(sqlite3_column_text(stmt, column));
    const int size = sqlite3_column_bytes(stmt, column);
    if (data != nullptr && size > 0) value.bytes.assign(static_cast<const char*>(data), static_cast<std::size_t>(size));
    return value;
}

// Closes the statement and the connection whatever way a read ends.
struct StatementGuard {
    sqlite3_stmt* stmt = nullptr;
    ~StatementGuard() { sqlite3_finalize(stmt); }
};
struct ConnectionGuard {
    sqlite3* db = nullptr;
    ~ConnectionGuard() { sqlite3_close(db); }
};

// Runs one statement and folds its rows; SQLITE_OK, or the code it failed with (and `error`).
int runStatement(sqlite3* db, const std::string& statementText, const std::string& boundValue, AccountRows& rows,
                 std::string& error) {
    StatementGuard statement;
    int rc = sqlite3_prepare_v2(db, statementText.c_str(), -1, &statement.stmt, nullptr);
    if (rc == SQLITE_OK && sqlite3_bind_parameter_count(statement.stmt) > 0)
        rc = sqlite3_bind_text(statement.stmt, 1, boundValue.data(), static_cast<int>(boundValue.size()),
                               SQLITE_TRANSIENT);
    if (rc == SQLITE_OK) {
        while ((rc = sqlite3_step(statement.stmt)) == SQLITE_ROW)
            rows.add(columnValue(statement.stmt, 0), columnValue(statement.stmt, 1), columnValue(statement.stmt, 2));
        if (rc == SQLITE_DONE) return SQLITE_OK;
    }
    error = sqlite3_errmsg(db);
    return rc == SQLITE_OK ? SQLITE_ERROR : rc;
}

bool isLockCode(int rc) { return (rc & 0xff) == SQLITE_BUSY || (rc & 0xff) == SQLITE_LOCKED; }

}  // namespace

std::optional<std::string> containerLibraryBase(const std::string& home) {
    std::vector<std::string> parts;
    std::size_t start = 0;
    while (true) {
        const std::size_t slash = home.find('/', start);
        parts.push_back(home.substr(start, slash == std::string::npos ? std::string::npos : slash - start));
        if (slash == std::string::npos) break;
        start = slash + 1;
    }
    if (parts.size() < 4) return std::nullopt;
    return "/" + parts[1] + "/" + parts[2] + "/" + parts[3] + "/";
}

bool getSanboxPth(std::string& HomePathsand) {
    const std::string home = homeDirectory();
    if (kRunsSandboxed && home.find("Containers") != std::string::npos) {
        if (auto base = containerLibraryBase(home)) {
            HomePathsand = *base;
            return true;
        }
    }
    HomePathsand = home + "/Library/";
    return false;
}

void FilePathget(std::string& fileStringPath) {
    std::string base;
    const bool sandboxed = getSanboxPth(base);
    fileStringPath = base + "Application Support/pcsuite/DataBase";
    Log::mPrintlog(std::string("[Sandbox]Service is in sandbox? ") + (sandboxed ? "true" : "false"));
}

std::string pcsuiteConfigFilePath() { return pcsuiteSupportDir() + "config.json"; }

std::string historyPhoneFilePath() { return pcsuiteSupportDir() + "historyPhone.json"; }

std::optional<std::string> accountText(const ColumnValue& value) {
    if (value.type == ColumnValue::Type::Null) return std::nullopt;
    if (value.bytes.size() > kMaxAccountValueBytes || value.bytes.find('\0') != std::string::npos ||
        !text::isValidUtf8(value.bytes))
        return std::string();
    return value.bytes;
}

void AccountRows::add(const ColumnValue& first, const ColumnValue& second, const ColumnValue& third) {
    anyRow_ = true;
    first_ = accountText(first).value_or("");
    third_ = accountText(third).value_or("");
    if (!userTable_) second_ = accountText(second).value_or("");
    else if (auto phone = accountText(second)) phone_ = text::paramAddMask(*phone);
}

void AccountRows::applyTo(databaseParam& p) const {
    if (userTable_) {
        if (anyRow_) {
            p.openid = first_;
            p.token = third_;
            if (phone_) p.Phone = *phone_;
            p.lastOpenId = p.openid;
            p.lastToken = p.token;
        } else {
            // Nobody is signed in.
            p.openid.clear();
            p.Phone.clear();
            p.token.clear();
        }
    } else if (anyRow_) {
        p.openid = first_;
        p.configDir = second_;
        p.storageDir = third_;
    }
}

std::string deviceIdFromConfigText(std::string_view text) {
    const auto parsed = json::parse(text);
    return parsed ? json::str(*parsed, "newDeviceId") : std::string();
}

std::optional<std::pair<std::string, std::string>> historyIdsFromText(std::string_view text) {
    const auto parsed = json::parse(text);
    if (!parsed) return std::nullopt;
    return std::make_pair(json::str(json::object(*parsed, "last_time_phone"), "bleId"),
                          json::str(json::object(*parsed, "last_time_pad"), "bleId"));
}

DatabaseReadResult readAccountDatabase(const std::string& filePath) {
    const std::string path = filePath + "/Config.db";
    DatabaseReadResult result;
    std::error_code ec;
    if (!std::filesystem::exists(path, ec) && !ec) {
        result.state = DatabaseState::Missing;
        result.openFailed = true;
        result.detail = std::to_string(SQLITE_CANTOPEN);
        return result;
    }
    ConnectionGuard connection;
    // Read-only: a missing file must not be created in the PC suite's folder.
    const int openRc = sqlite3_open_v2(path.c_str(), &connection.db, SQLITE_OPEN_READONLY, nullptr);
    if (openRc != SQLITE_OK) {
        result.openFailed = true;
        result.detail = std::to_string(openRc);
        return result;
    }
    // Wait a moment for a writer of the PC suite instead of failing at once, but never let a
    // damaged file keep this thread (or its memory) for long.
    const auto busy = Config::current().databaseBusyTimeout;
    sqlite3_busy_timeout(connection.db, static_cast<int>(busy.count()));
    sqlite3_limit(connection.db, SQLITE_LIMIT_LENGTH, kMaxSqliteValueBytes);
    auto deadline = std::chrono::steady_clock::now() + busy + kMaxReadWork;
    sqlite3_progress_handler(
        connection.db, 1000,
        [](void* end) -> int {
            return std::chrono::steady_clock::now() > *static_cast<std::chrono::steady_clock::time_point*>(end);
        },
        &deadline);

    // One read transaction: the account and its directories come from the same state of the
    // file, and a writer cannot slip in between the two statements.
    std::string error;
    int rc = sqlite3_exec(connection.db, "BEGIN;", nullptr, nullptr, nullptr);
    AccountRows user(true);
    if (rc == SQLITE_OK) rc = runStatement(connection.db, kUserStatement, {}, user, error);
    else error = sqlite3_errmsg(connection.db);
    if (rc != SQLITE_OK) {
        result.state = isLockCode(rc) ? DatabaseState::Busy : DatabaseState::Unreadable;
        result.failedTable = "User";
        result.detail = error;
        return result;
    }
    databaseParam next = dataInstance().get();
    user.applyTo(next);
    AccountRows softwareSet(false);
    result.softwareSetRead = runStatement(connection.db, kSoftwareSetStatement, next.openid, softwareSet, error) == SQLITE_OK;
    if (!result.softwareSetRead) {
        result.failedTable = "SoftwareSet";
        result.detail = error;
    }
    sqlite3_exec(connection.db, "COMMIT;", nullptr, nullptr, nullptr);

    dataInstance().update([&](databaseParam& p) {
        user.applyTo(p);
        if (result.softwareSetRead) softwareSet.applyTo(p);
    });
    result.state = DatabaseState::Good;
    databaseUpdate.store(result.softwareSetRead);
    return result;
}

void logDatabaseRead(const DatabaseReadResult& result) {
    if (result.openFailed) {
        Log::mPrintlog("[dataBaseRead] Database file Config.db open failed due to : " + result.detail +
                         " current time is: " + WallClock::getNowTime());
        return;
    }
    Log::mPrintlog("[dataBaseRead]  DataBase file Config.db open success");
    if (!result.failedTable.empty()) {
        Log::mPrintlog("[readDatabase] read database Table " + result.failedTable + " failed");
        Log::mPrintlog("[readDatabase] SQLite says: " + result.detail);
    }
    if (result.state == DatabaseState::Good) notifySSDP(result.softwareSetRead);
}

DatabaseReadResult dataBaseRead(const std::string& filePath) {
    const DatabaseReadResult result = readAccountDatabase(filePath);
    logDatabaseRead(result);
    return result;
}

bool notifySSDP(bool retDBRead) {
    if (retDBRead) {
        const databaseParam p = dataInstance().get();
        Log::mPrintlog("[notifySSDP] notifySSDP- Currently data param is openid: " + p.openid + " \r phone: " +
                         p.Phone + " \r ConfigDir: " + p.configDir + " \r StorageDir: " + p.storageDir);
    }
    return retDBRead;
}

std::string getPcsuiteDeviceInfo() {
    if (const auto answer = PcsuiteRequest::getPcDeviceInfo(); answer && !answer->empty()) {
        const Json data = json::object(*answer, "data");
        const std::string deviceId = json::str(data, "deviceId");
        const std::string version = json::str(data, "version");
        dataInstance().update([&](databaseParam& p) {
            p.pcDeviceId = deviceId;
            p.version = version;
        });
        Log::mPrintlog("[getPcsuiteDeviceId] Request pcsuite id: " + deviceId + ", version: " + version);
    }
    dataInstance().update([](databaseParam& p) {
        if (p.version.empty()) p.version = Log::versionCode;
    });
    if (dataInstance().get(&databaseParam::pcDeviceId).empty()) {
        const std::string path = pcsuiteConfigFilePath();
        Log::mPrintlog("[getPcsuiteDeviceInfo] Read file path is: " + path);
        std::string content;
        Files::readFile(path, content);
        if (!content.empty()) dataInstance().set(&databaseParam::pcDeviceId, deviceIdFromConfigText(content));
        if (dataInstance().get(&databaseParam::pcDeviceId).empty())
            Log::mPrintlog("[getPcsuiteDeviceId] Device ID retrieval failed.");
    }
    return dataInstance().get(&databaseParam::pcDeviceId);
}

void updateHistoryDevice() {
    const std::string path = historyPhoneFilePath();
    Log::mPrintlog("[updateHistoryDevice] Read file path is: " + path);
    std::string content;
    Files::readFile(path, content);
    if (content.empty()) return;
    const auto ids = historyIdsFromText(content);
    if (!ids) {
        // A half-written file says nothing about the last devices: keep what we know.
        Log::mPrintlog("[updateHistoryDevice] history file is not valid JSON, ids kept");
        return;
    }
    const std::string& phoneId = ids->first;
    const std::string& padId = ids->second;
    dataInstance().update([&](databaseParam& p) {
        p.historyPhoneId = phoneId;
        p.historyPadId = padId;
    });
    Log::mPrintlog("[updateHistoryDevice] historyPhoneId: " + phoneId + ", historyPadId: " + padId + " ");
}

bool retGet() { return databaseUpdate.load(); }

}  // namespace kesu
