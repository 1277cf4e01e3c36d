// Reading the PC suite's account database and JSON files into the shared account record.
#include "account/DataGet.h"

#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <vector>

#include "account/DataInstance.h"
#include "core/Config.h"
#include "core/Json.h"
#include "core/Utils.h"
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

std::atomic<bool> databaseUpdate{false};

std::string pcsuiteSupportDir() {
    std::string base;
    getSanboxPth(base);
    return base + "Application Support/pcsuite/";
}

// A text column; NULL reads as "".
std::string columnText(sqlite3_stmt* stmt, int column) {
    const auto* text = sqlite3_column_text(stmt, column);
    if (text == nullptr) return {};
    return std::string(reinterpret_cast<const char*>(text), static_cast<std::size_t>(sqlite3_column_bytes(stmt, column)));
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
    Utils::mPrintlog(std::string("[Sandbox]Service is in sandbox? ") + (sandboxed ? "true" : "false"));
}

std::string pcsuiteConfigFilePath() { return pcsuiteSupportDir() + "config.json"; }

std::string historyPhoneFilePath() { return pcsuiteSupportDir() + "historyPhone.json"; }

void dataBaseRead(const std::string& filePath) {
    const std::string path = filePath + "/Config.db";
    ConnectionGuard connection;
    // Read-only: a missing file must not be created in the PC suite's folder.
    const int rc = sqlite3_open_v2(path.c_str(), &connection.db, SQLITE_OPEN_READONLY, nullptr);
    if (rc != SQLITE_OK) {
        Utils::mPrintlog("[dataBaseRead] Database file Config.db open failed due to : " + std::to_string(rc) +
                         " current time is: " + Utils::getNowTime());
        return;
    }
    Utils::mPrintlog("[dataBaseRead]  DataBase file Config.db open success");
    // Wait a moment for a writer of the PC suite instead of failing at once.
    const auto busy = Config::current().databaseBusyTimeout;
    sqlite3_busy_timeout(connection.db, static_cast<int>(busy.count()));

    if (!queryTables(connection.db, "User", false, "")) return;
    const bool softwareSetRead =
        queryTables(connection.db, "SoftwareSet", false, dataInstance().get(&databaseParam::openid));
    databaseUpdate.store(notifySSDP(softwareSetRead));
}

bool queryTables(sqlite3* db, const std::string& conditionQuery, bool /*openidNil*/, const std::string& openid) {
    std::string statement;
    if (conditionQuery == "User") statement = kUserStatement;
    else if (conditionQuery == "SoftwareSet") statement = kSoftwareSetStatement;
    return readDatabase(db, statement, conditionQuery == "User", openid);
}

bool readDatabase(sqlite3* db, const std::string& quertCondition, bool tableFlag, const std::string& boundValue) {
    const std::string failLine = std::string("[readDatabase] read database Table ") +
                                 (tableFlag ? "User" : "SoftwareSet") + " failed";
    auto fail = [&](const char* reason) {
        Utils::mPrintlog(failLine);
        if (reason != nullptr) Utils::mPrintlog(std::string("[readDatabase] SQLite says: ") + reason);
        return false;
    };
    if (db == nullptr) return fail(nullptr);

    StatementGuard statement;
    // An empty text prepares to no statement at all, which counts as a failure too.
    if (sqlite3_prepare_v2(db, quertCondition.c_str(), -1, &statement.stmt, nullptr) != SQLITE_OK ||
        statement.stmt == nullptr)
        return fail(sqlite3_errmsg(db));
    if (sqlite3_bind_parameter_count(statement.stmt) > 0 &&
        sqlite3_bind_text(statement.stmt, 1, boundValue.data(), static_cast<int>(boundValue.size()),
                          SQLITE_TRANSIENT) != SQLITE_OK)
        return fail(sqlite3_errmsg(db));

    // Rows are gathered first and applied in one step, so that readers never see half a
    // row and a read that breaks off (locked or damaged file) changes nothing.
    bool anyRow = false;
    std::string openid, second, third;
    std::optional<std::string> phone;  // the last non-NULL phone: a NULL one changes nothing
    int rc;
    while ((rc = sqlite3_step(statement.stmt)) == SQLITE_ROW) {
        anyRow = true;
        openid = columnText(statement.stmt, 0);
        third = columnText(statement.stmt, 2);
        if (tableFlag) {
            if (sqlite3_column_type(statement.stmt, 1) != SQLITE_NULL)
                phone = Utils::paramAddMask(columnText(statement.stmt, 1));
        } else {
            second = columnText(statement.stmt, 1);
        }
    }
    if (rc != SQLITE_DONE) return fail(sqlite3_errmsg(db));

    dataInstance().update([&](databaseParam& p) {
        if (tableFlag) {
            if (anyRow) {
                p.openid = openid;
                p.token = third;
                if (phone) p.Phone = *phone;
                p.lastOpenId = p.openid;
                p.lastToken = p.token;
            } else {
                // Nobody is signed in.
                p.openid.clear();
                p.Phone.clear();
                p.token.clear();
            }
        } else if (anyRow) {
            p.openid = openid;
            p.configDir = second;
            p.storageDir = third;
        }
    });
    return true;
}

bool notifySSDP(bool retDBRead) {
    if (retDBRead) {
        const databaseParam p = dataInstance().get();
        Utils::mPrintlog("[notifySSDP] notifySSDP- Currently data param is openid: " + p.openid + " \r phone: " +
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
        Utils::mPrintlog("[getPcsuiteDeviceId] Request pcsuite id: " + deviceId + ", version: " + version);
    }
    dataInstance().update([](databaseParam& p) {
        if (p.version.empty()) p.version = Utils::versionCode;
    });
    if (dataInstance().get(&databaseParam::pcDeviceId).empty()) {
        const std::string path = pcsuiteConfigFilePath();
        Utils::mPrintlog("[getPcsuiteDeviceInfo] Read file path is: " + path);
        std::string content;
        Utils::readFile(path, content);
        if (!content.empty()) {
            const auto parsed = json::parse(content);
            const std::string deviceId = parsed ? json::str(*parsed, "newDeviceId") : std::string();
            dataInstance().set(&databaseParam::pcDeviceId, deviceId);
        }
        if (dataInstance().get(&databaseParam::pcDeviceId).empty())
            Utils::mPrintlog("[getPcsuiteDeviceId] Device ID retrieval failed.");
    }
    return dataInstance().get(&databaseParam::pcDeviceId);
}

void updateHistoryDevice() {
    const std::string path = historyPhoneFilePath();
    Utils::mPrintlog("[updateHistoryDevice] Read file path is: " + path);
    std::string content;
    Utils::readFile(path, content);
    if (content.empty()) return;
    const auto parsed = json::parse(content);
    if (!parsed) {
        // A half-written file says nothing about the last devices: keep what we know.
        Utils::mPrintlog("[updateHistoryDevice] history file is not valid JSON, ids kept");
        return;
    }
    const std::string phoneId = json::str(json::object(*parsed, "last_time_phone"), "bleId");
    const std::string padId = json::str(json::object(*parsed, "last_time_pad"), "bleId");
    dataInstance().update([&](databaseParam& p) {
        p.historyPhoneId = phoneId;
        p.historyPadId = padId;
    });
    Utils::mPrintlog("[updateHistoryDevice] historyPhoneId: " + phoneId + ", historyPadId: " + padId + " ");
}

bool retGet() { return databaseUpdate.load(); }

}  // namespace kesu
