// Log lines and files, log clean-up, the version file and the date helpers.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "core/Json.h"
#include "core/TimeUtil.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

// Sets the zone for the scope (TZ + tzset).
class ScopedZone {
public:
    explicit ScopedZone(const char* zone) : env_("TZ", std::string(zone)) { tzset(); }

private:
    struct Reload {
        ~Reload() { tzset(); }  // runs after TZ is put back
    } reload_;
    test::ScopedEnv env_;
};

// Fixed clock for the scope.
class ScopedClock {
public:
    explicit ScopedClock(WallClock::Clock::time_point t) { WallClock::setClock([t] { return t; }); }
    ~ScopedClock() { WallClock::setClock({}); }
};

WallClock::Clock::time_point utc(int y, int mo, int d, int h, int mi, int s, int ms) {
    std::tm tm{};
    tm.tm_sec = s, tm.tm_min = mi, tm.tm_hour = h, tm.tm_mday = d, tm.tm_mon = mo - 1, tm.tm_year = y - 1900;
    return WallClock::Clock::from_time_t(timegm(&tm)) + std::chrono::milliseconds(ms);
}

// Logs `line` with the clock fixed at `t`.
void logAt(WallClock::Clock::time_point t, const std::string& line) {
    ScopedClock clock(t);
    Log::mPrintlog(line);
}

class LogFiles : public ::testing::Test {
protected:
    void TearDown() override { Log::closeLog(); }
    test::HermeticEnv env;
    std::string file(const std::string& date) const {
        return Log::logDirectory() + "/KesuConnService_" + date + ".log";
    }
};

TEST_F(LogFiles, LinesGoToTheFileOfTheGmtDate) {
    ScopedZone zone("Asia/Shanghai");  // eight hours ahead of GMT
    logAt(utc(2026, 12, 3, 23, 59, 59, 900), "[LogTest] before midnight");
    logAt(utc(2026, 12, 4, 0, 0, 0, 100), "[LogTest] after midnight");
    Log::closeLog();
    const std::string day3 = test::readAll(file("2026-12-03"));
    const std::string day4 = test::readAll(file("2026-12-04"));
    EXPECT_NE(day3.find("[2026-12-04 07:59:59.900][logLoop] [LogTest] before midnight\n"), std::string::npos)
        << day3;
    EXPECT_EQ(day3.find("after midnight"), std::string::npos);
    EXPECT_NE(day4.find("[2026-12-04 08:00:00.100][logLoop] [LogTest] after midnight\n"), std::string::npos)
        << day4;
}

TEST_F(LogFiles, ConcurrentLinesNeverInterleave) {
    constexpr int kThreads = 8, kLines = 200;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t)
        threads.emplace_back([t] {
            for (int i = 0; i < kLines; ++i)
                Log::mPrintlog("[LogTest] thread " + std::to_string(t) + " line " + std::to_string(i) + " " +
                                 std::string(100, static_cast<char>('a' + t)));
        });
    for (auto& th : threads) th.join();
    Log::closeLog();
    const std::string log = test::readAll(Log::logFilePath(WallClock::now()));
    ASSERT_EQ(log.back(), '\n');
    std::istringstream lines(log);
    int count = 0;
    for (std::string line; std::getline(lines, line); ++count) {
        const auto pos = line.find("[logLoop] [LogTest] thread ");
        ASSERT_NE(pos, std::string::npos) << line;
        EXPECT_EQ(line.substr(line.size() - 100), std::string(100, static_cast<char>('a' + line[pos + 27] - '0')));
    }
    EXPECT_EQ(count, kThreads * kLines);
}

TEST_F(LogFiles, MissingOrUnwritableLogDirectory) {
    testing::internal::CaptureStdout();
    Log::deleteOldLogFile();  // nothing to clean: said on standard output
    EXPECT_NE(testing::internal::GetCapturedStdout().find("get file path error: "), std::string::npos);

    // The log directory's place is taken by a file: lines still reach standard output.
    fs::create_directories(fs::path(Log::logDirectory()).parent_path());
    std::ofstream(Log::logDirectory()) << "not a directory";
    testing::internal::CaptureStdout();
    Log::mPrintlog("[LogTest] to stdout only");
    EXPECT_NE(testing::internal::GetCapturedStdout().find("[logLoop] [LogTest] to stdout only"), std::string::npos);
}

std::size_t occurrences(const std::string& text, const std::string& part) {
    std::size_t n = 0;
    for (auto at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++n;
    return n;
}

const std::string kCapNotice =
    "[log] daily log file reached its size limit of 1000 bytes; further lines go to standard output only until "
    "the next day's file\n";

TEST_F(LogFiles, DailyFileStopsAtItsSizeLimitUntilTheNextDay) {
    env.config().logFileMaxBytes = 1000;
    {
        ScopedClock clock(utc(2026, 12, 3, 10, 0, 0, 0));
        testing::internal::CaptureStdout();
        for (int i = 0; i < 20; ++i)
            Log::mPrintlog("[LogTest] line " + std::to_string(i) + " " + std::string(60, 'x'));
        const std::string out = testing::internal::GetCapturedStdout();
        EXPECT_NE(out.find("[LogTest] line 19 "), std::string::npos) << "standard output gets every line";
        EXPECT_EQ(occurrences(out, kCapNotice), 1u) << out;
    }
    const std::string day3 = test::readAll(file("2026-12-03"));
    EXPECT_LE(day3.size(), 1000u + 60u + kCapNotice.size()) << day3;
    EXPECT_EQ(occurrences(day3, kCapNotice), 1u) << day3;
    EXPECT_EQ(day3.substr(day3.size() - kCapNotice.size()), kCapNotice) << "the notice is the last line";
    // The lines that fit are all there, in order; none after the first that did not fit.
    const std::size_t written = occurrences(day3, "[LogTest] line ");
    EXPECT_GE(written, 5u);
    for (std::size_t i = 0; i < written; ++i)
        EXPECT_NE(day3.find("[LogTest] line " + std::to_string(i) + " "), std::string::npos) << i;

    logAt(utc(2026, 12, 4, 0, 0, 0, 0), "[LogTest] next day");
    const std::string day4 = test::readAll(file("2026-12-04"));
    EXPECT_NE(day4.find("[logLoop] [LogTest] next day\n"), std::string::npos) << day4;
    EXPECT_EQ(day4.find("[log] daily log file"), std::string::npos);
    EXPECT_EQ(test::readAll(file("2026-12-03")), day3);
}

TEST_F(LogFiles, RestartOnTheSameDayKeepsTheCap) {
    env.config().logFileMaxBytes = 1000;
    ScopedClock clock(utc(2026, 12, 3, 10, 0, 0, 0));
    // The notice may leave the file below the limit: a later line still adds nothing.
    Log::mPrintlog("[LogTest] long " + std::string(650, 'x'));
    Log::mPrintlog("[LogTest] too long " + std::string(400, 'y'));
    Log::closeLog();
    const std::string capped = test::readAll(file("2026-12-03"));
    ASSERT_LT(capped.size() + 100, 1000u);
    ASSERT_EQ(occurrences(capped, kCapNotice), 1u);
    Log::mPrintlog("[LogTest] short");
    Log::closeLog();
    EXPECT_EQ(test::readAll(file("2026-12-03")), capped);

    // A file already at the limit takes nothing, not even the notice.
    const std::string full(1000, 'z');
    std::ofstream(file("2026-12-03"), std::ios::trunc) << full;
    Log::mPrintlog("[LogTest] short");
    Log::closeLog();
    EXPECT_EQ(test::readAll(file("2026-12-03")), full);
}

TEST_F(LogFiles, OldFilesGoAfterFourteenDays) {
    ScopedClock clock(utc(2026, 12, 20, 12, 0, 0, 0));
    const std::string dir = Log::logDirectory();
    fs::create_directories(dir);
    auto touch = [&](const std::string& name) { std::ofstream(dir + "/" + name) << "x"; };
    const std::vector<std::string> stay = {"KesuConnService_2026-12-06.log",  // 14 days
                                           "KesuConnService_notadate.log", "x.log.KesuConnService_1"};
    const std::vector<std::string> go = {"KesuConnService_2026-12-05.log", "KesuConnService_2025-01-01.log"};
    for (const auto& name : stay) touch(name);
    for (const auto& name : go) touch(name);
    fs::create_directories(dir + "/KesuConnService_2020-01-01.log");  // a directory: stays

    Log::deleteOldLogFile();
    for (const auto& name : stay) EXPECT_TRUE(fs::exists(dir + "/" + name)) << name;
    for (const auto& name : go) EXPECT_FALSE(fs::exists(dir + "/" + name)) << name;
    EXPECT_TRUE(fs::is_directory(dir + "/KesuConnService_2020-01-01.log"));
}

TEST_F(LogFiles, VersionFileHoldsVersionAndStartTime) {
    ScopedClock clock(utc(2026, 12, 4, 10, 0, 0, 250));
    Log::writeConnServiceVersion(Log::versionCode);
    const std::string path = rootedPath(Config::current().versionFile);
    const auto content = Json::parse(test::readAll(path));
    EXPECT_EQ(content["updateTime"], timeutil::formatLocal(utc(2026, 12, 4, 10, 0, 0, 250)));
    // Rewriting replaces the content (a longer old file must not leave a tail).
    std::ofstream(path) << std::string(500, ' ') << "junk";
    Log::writeConnServiceVersion("1");
    EXPECT_EQ(Json::parse(test::readAll(path))["version"], "1");
}

TEST(TimeHelpers, FormatsParsesAndCountsDays) {
    ScopedZone zone("Europe/Berlin");
    const auto t = timeutil::parseLocal("2026-03-28 12:34:56.789");
    ASSERT_TRUE(t);
    EXPECT_EQ(timeutil::formatLocal(*t), "2026-03-28 12:34:56.789");
    for (const char* bad : {"", "2026-03-28 12:34:56", "2026-02-30 00:00:00.000", "2026-13-01 00:00:00.000",
                            "2026-03-28T12:34:56.789", "2026-03-28 12:34:56.789x", "abcd-ef-gh ij:kl:mn.opq",
                            // beyond what the clock can hold (1678 to 2262)
                            "9026-11-26 10:00:00.000", "0001-01-01 00:00:00.000"})
        EXPECT_FALSE(timeutil::parseLocal(bad)) << bad;

    EXPECT_FALSE(timeutil::parseLocalDate("9999-12-31"));
    EXPECT_TRUE(timeutil::parseLocalDate("2200-12-31"));
    // Times further apart than the clock's nanoseconds reach are still counted.
    EXPECT_EQ(timeutil::wholeDays(*timeutil::parseLocalDate("1700-01-01"), *timeutil::parseLocalDate("2026-01-01")),
              119069);

    // Across the spring clock change a calendar day is 23 hours.
    const auto before = *timeutil::parseLocal("2026-03-28 12:00:00.000");
    EXPECT_EQ(timeutil::wholeDays(before, *timeutil::parseLocal("2026-03-29 12:00:00.000")), 1);
    EXPECT_EQ(timeutil::wholeDays(before, *timeutil::parseLocal("2026-03-29 11:59:59.999")), 0);
    EXPECT_EQ(timeutil::wholeDays(*timeutil::parseLocal("2026-04-05 12:00:00.000"), before), -8);
}

}  // namespace
}  // namespace kesu
