// Reading the PC suite's local data (its account database Config.db, config.json and
// historyPhone.json) into the shared account record, and the paths of those files.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "account/DataInstance.h"
#include "core/Log.h"

namespace kesu {

// ---- Pure readers of the PC suite's data (no files, no logging) ----------------------------

// Longest account value taken from the database; a longer one is not a real open id, token or
// folder and reads as "".
inline constexpr std::size_t kMaxAccountValueBytes = 64 * 1024;

// One value of a result row as SQLite stores it, with its bytes (numbers in their text form).
struct ColumnValue {
    enum class Type { Null, Integer, Float, Text, Blob };
    Type type = Type::Null;
    std::string bytes;
};

// The value as an account field: nullopt for NULL; numbers as their text; text and blobs as
// they are when they are valid UTF-8 without NUL and at most kMaxAccountValueBytes long, else
// "" (a value nobody can use is no value).
std::optional<std::string> accountText(const ColumnValue& value);

// Folds the rows of one statement into the account record the way a read does: the last row
// wins, a NULL phone changes nothing, and an empty User table signs out (the directories and
// the last values stay). SoftwareSet rows set the open id and the directories.
class AccountRows {
public:
    explicit AccountRows(bool userTable) : userTable_(userTable) {}
    void add(const ColumnValue& first, const ColumnValue& second, const ColumnValue& third);
    void applyTo(databaseParam& p) const;

private:
    bool userTable_;
    bool anyRow_ = false;
    std::string first_, second_, third_;
    std::optional<std::string> phone_;  // the last non-NULL phone, masked
};

// "newDeviceId" of config.json; "" when the text is not JSON or has no such string.
std::string deviceIdFromConfigText(std::string_view text);
// ("last_time_phone"."bleId", "last_time_pad"."bleId") of historyPhone.json, "" for each one
// absent; nullopt when the text is not JSON.
std::optional<std::pair<std::string, std::string>> historyIdsFromText(std::string_view text);

// ---- Reading the files ------------------------------------------------------------------------

// How Config.db looked to the last read.
enum class DatabaseState {
    Missing,     // no file
    Unreadable,  // cannot be opened, not a database, damaged, or without the User table
    Busy,        // another writer held its lock longer than Config::databaseBusyTimeout
    Good,        // the account was read
};

struct DatabaseReadResult {
    DatabaseState state = DatabaseState::Unreadable;
    bool openFailed = false;       // the file could not even be opened
    bool softwareSetRead = false;  // the directories were read too
    std::string failedTable;       // "User" or "SoftwareSet" when its statement failed
    std::string detail;            // why it failed (SQLite's words or its code)
};

// Reads the account and its directories from `filePath` + "/Config.db" into the record, in
// one read transaction applied in one step, and logs nothing. The file is opened read-only;
// a locked file is waited for Config::databaseBusyTimeout, and a damaged one cannot hold the
// read for more than a few seconds beyond that. Unless the state is Good the record is
// unchanged. Without a SoftwareSet table (or row) the account is read, the directories not.
DatabaseReadResult readAccountDatabase(const std::string& filePath);

// readAccountDatabase with its log lines; sets the flag returned by retGet().
DatabaseReadResult dataBaseRead(const std::string& filePath);
// The log lines of a finished read: the open, a failed statement, the account summary.
void logDatabaseRead(const DatabaseReadResult& result);

// The library base below which the PC suite keeps its data, stored in `HomePathsand`.
// Returns true when the service runs sandboxed (never on Linux: the base is then always
// home + "/Library/", the same as Log::libraryBase()).
bool getSanboxPth(std::string& HomePathsand);

// The library base of a sandbox container home ("/Users/name/Library/Containers/app/Data"
// gives "/Users/name/Library/"); nullopt when the path has too few components.
std::optional<std::string> containerLibraryBase(const std::string& home);

// The database directory: library base + "Application Support/pcsuite/DataBase".
void FilePathget(std::string& fileStringPath);

// Paths of the PC suite's JSON files.
std::string pcsuiteConfigFilePath();   // .../pcsuite/config.json
std::string historyPhoneFilePath();    // .../pcsuite/historyPhone.json

// Logs the account summary when `retDBRead` is true; returns it unchanged.
bool notifySSDP(bool retDBRead);

// Refreshes pcDeviceId and version (the PC suite first, then config.json) and returns the id.
std::string getPcsuiteDeviceInfo();

// Refreshes historyPhoneId and historyPadId from historyPhone.json.
void updateHistoryDevice();

// Whether the last database read could run the SoftwareSet statement.
bool retGet();

}  // namespace kesu
