// Reading the PC suite's local data (its account database Config.db, config.json and
// historyPhone.json) into the shared account record, and the paths of those files.
#pragma once

#include <optional>
#include <string>

struct sqlite3;

namespace kesu {

// The library base below which the PC suite keeps its data, stored in `HomePathsand`.
// Returns true when the service runs sandboxed (never on Linux: the base is then always
// home + "/Library/", the same as Utils::libraryBase()).
bool getSanboxPth(std::string& HomePathsand);

// The library base of a sandbox container home ("/Users/name/Library/Containers/app/Data"
// gives "/Users/name/Library/"); nullopt when the path has too few components.
std::optional<std::string> containerLibraryBase(const std::string& home);

// The database directory: library base + "Application Support/pcsuite/DataBase".
void FilePathget(std::string& fileStringPath);

// Paths of the PC suite's JSON files.
std::string pcsuiteConfigFilePath();   // .../pcsuite/config.json
std::string historyPhoneFilePath();    // .../pcsuite/historyPhone.json

// Reads the signed-in account and its directories from `filePath` + "/Config.db" into the
// record and sets the flag returned by retGet(). The file is opened read-only and closed
// again; when it cannot be read the record keeps its values.
void dataBaseRead(const std::string& filePath);

// Runs the statement of `conditionQuery` ("User" or "SoftwareSet"; another name gives an
// empty statement, which fails). `openidNil` is unused; `openid` selects the SoftwareSet row.
bool queryTables(sqlite3* db, const std::string& conditionQuery, bool openidNil, const std::string& openid);

// Runs one statement (tableFlag: the "User" statement) and copies its rows into the record,
// the last row winning. `boundValue` fills the statement's parameter, if it has one.
// Returns false when the statement cannot be prepared or its rows cannot be read; then the
// record is unchanged.
bool readDatabase(sqlite3* db, const std::string& quertCondition, bool tableFlag,
                  const std::string& boundValue = {});

// Logs the account summary when `retDBRead` is true; returns it unchanged.
bool notifySSDP(bool retDBRead);

// Refreshes pcDeviceId and version (the PC suite first, then config.json) and returns the id.
std::string getPcsuiteDeviceInfo();

// Refreshes historyPhoneId and historyPadId from historyPhone.json.
void updateHistoryDevice();

// Whether the last database read could run the SoftwareSet statement.
bool retGet();

}  // namespace kesu
