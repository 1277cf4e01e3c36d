// The service's log: one line per message to standard output and to the day's file below the
// PC suite's log folder, old files removed after `logTimeOut` days, and the version file.
#pragma once

#include <string>

#include "core/WallClock.h"

namespace kesu {

enum class submoduleName { ConnectName };
std::string rawValue(submoduleName name);  // "/KesuConnService_log/KesuConnService_"

class Log {
public:
    static inline const std::string versionCode = "3.6.1.0";
    static inline const std::string moduleName = "KesuConnService";
    static constexpr int logTimeOut = 14;  // log files stay up to this many days

    // The service's only logging call: one line to standard output and to the day's file.
    static void mPrintlog(const std::string& output);
    // Flushes and closes the day's file (it is reopened by the next message).
    static void closeLog();
    static void deleteOldLogFile();
    static void writeConnServiceVersion(const std::string& version);

    static std::string logDirectory();                              // .../pcsuite/log/KesuConnService_log
    static std::string logFilePath(WallClock::Clock::time_point at);  // the file named by the GMT date
    static std::string libraryBase();                               // home + "/Library/"
};

}  // namespace kesu
