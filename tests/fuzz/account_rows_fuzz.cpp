// Fuzzes the mapping of Config.db rows to the account record with rows of arbitrary values
// (NULL, integers, floats, text and blobs of any bytes): every field that changes holds text
// that serialises to JSON unchanged, and the User rules (last row wins, an empty table signs
// out) hold.
//
// Input: one byte choosing the table (even: User), then values of three per row, each a type
// byte (its value mod 5) and a length byte followed by that many bytes.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "account/DataGet.h"
#include "core/Json.h"
#include "core/Text.h"

namespace {

using kesu::ColumnValue;

void check(bool condition) {
    if (!condition) std::abort();
}

// A field is the value it had or usable text.
void checkField(const std::string& before, const std::string& after, std::size_t limit) {
    if (after == before) return;
    check(after.size() <= limit);
    check(after.find('\0') == std::string::npos);
    check(kesu::text::isValidUtf8(after));
    const std::string dumped = kesu::json::compact(kesu::Json{{"v", after}});
    const auto parsed = kesu::json::parse(dumped);
    check(parsed && kesu::json::str(*parsed, "v") == after);
}

kesu::databaseParam previous() {
    kesu::databaseParam p;
    p.openid = "old-openid";
    p.Phone = "old****one";
    p.token = "old-token";
    p.lastOpenId = "old-last";
    p.lastToken = "old-last-token";
    p.configDir = "/old/cfg";
    p.storageDir = "/old/store";
    p.pcDeviceId = "pc-id";
    return p;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0) return 0;
    const bool userTable = data[0] % 2 == 0;
    kesu::AccountRows rows(userTable);
    std::size_t offset = 1;
    std::size_t rowCount = 0;
    ColumnValue row[3];
    int column = 0;
    while (offset + 2 <= size) {
        ColumnValue& value = row[column];
        value.type = static_cast<ColumnValue::Type>(data[offset] % 5);
        const std::size_t length = data[offset + 1];
        offset += 2;
        const std::size_t take = length < size - offset ? length : size - offset;
        value.bytes.assign(reinterpret_cast<const char*>(data + offset), take);
        if (value.type == ColumnValue::Type::Null) value.bytes.clear();
        offset += take;
        if (++column == 3) {
            rows.add(row[0], row[1], row[2]);
            ++rowCount;
            column = 0;
        }
    }

    const kesu::databaseParam before = previous();
    kesu::databaseParam after = before;
    rows.applyTo(after);
    const std::size_t limit = kesu::kMaxAccountValueBytes;
    checkField(before.openid, after.openid, limit);
    checkField(before.token, after.token, limit);
    checkField(before.Phone, after.Phone, limit + 4);  // the mask adds at most "****"
    checkField(before.configDir, after.configDir, limit);
    checkField(before.storageDir, after.storageDir, limit);
    check(after.pcDeviceId == before.pcDeviceId);
    if (userTable) {
        check(after.configDir == before.configDir && after.storageDir == before.storageDir);
        if (rowCount == 0) {
            check(after.openid.empty() && after.token.empty() && after.Phone.empty());
            check(after.lastOpenId == before.lastOpenId && after.lastToken == before.lastToken);
        } else {
            check(after.lastOpenId == after.openid && after.lastToken == after.token);
        }
    } else {
        check(after.token == before.token && after.Phone == before.Phone);
        if (rowCount == 0) check(after.openid == before.openid && after.configDir == before.configDir);
    }
    return 0;
}
