// Fuzzes the account read of Config.db with arbitrary bytes as the file: the read ends (a
// damaged file is cut off by its time limit), never reports the file missing, and a read that
// succeeds leaves usable text in the record.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "account/DataGet.h"
#include "account/DataInstance.h"
#include "core/Config.h"
#include "core/Text.h"

namespace {

std::string folder;

void check(bool condition) {
    if (!condition) std::abort();
}

void checkText(const std::string& field) {
    check(field.find('\0') == std::string::npos);
    check(kesu::text::isValidUtf8(field));
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    const char* home = std::getenv("HOME");
    folder = std::string(home != nullptr ? home : "/tmp") + "/account-db-fuzz";
    std::filesystem::create_directories(folder);
    kesu::Config::current().databaseBusyTimeout = std::chrono::milliseconds(0);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // Files SQLite may leave beside a file that claims another journal mode.
    for (const char* extra : {"-wal", "-shm", "-journal"}) {
        std::error_code ec;
        std::filesystem::remove(folder + "/Config.db" + extra, ec);
    }
    {
        std::ofstream out(folder + "/Config.db", std::ios::binary | std::ios::trunc);
        out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
    }
    kesu::dataInstance().update([](kesu::databaseParam& p) { p = kesu::databaseParam{}; });

    const kesu::DatabaseReadResult result = kesu::readAccountDatabase(folder);
    check(result.state != kesu::DatabaseState::Missing);
    if (result.state == kesu::DatabaseState::Good) {
        const kesu::databaseParam p = kesu::dataInstance().get();
        for (const std::string* field : {&p.openid, &p.Phone, &p.token, &p.configDir, &p.storageDir}) checkText(*field);
    } else {
        check(kesu::dataInstance().get().openid.empty());
    }
    return 0;
}
