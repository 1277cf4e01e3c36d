// Fuzzes the readers of the PC suite's config.json and historyPhone.json with arbitrary text:
// they never throw, and whatever id they take out is valid UTF-8 no longer than the text.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "account/DataGet.h"
#include "core/Text.h"

namespace {

void check(bool condition) {
    if (!condition) std::abort();
}

void checkId(const std::string& id, std::size_t textSize) {
    check(id.size() <= textSize);
    check(kesu::text::isValidUtf8(id));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    const std::string deviceId = kesu::deviceIdFromConfigText(text);
    checkId(deviceId, size);
    const auto ids = kesu::historyIdsFromText(text);
    if (ids) {
        checkId(ids->first, size);
        checkId(ids->second, size);
    } else {
        check(deviceId.empty());  // text that is not JSON holds no device id either
    }
    return 0;
}
