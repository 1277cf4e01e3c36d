// Fuzzes the parser of the connect-center host override file: whatever the text, the entry
// found is a single "ConnectionCenterHost=" item taken from the text, without blanks.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "core/Endpoints.h"

namespace {

void check(bool condition) {
    if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view content(reinterpret_cast<const char*>(data), size);
    const auto entry = kesu::Endpoints::parseSwitchHost(content);
    if (!entry) return 0;
    constexpr std::string_view key = "ConnectionCenterHost=";
    check(entry->compare(0, key.size(), key) == 0);
    check(entry->find_first_of(" \t\r\n\v\f") == std::string_view::npos);
    check(content.find(*entry) != std::string_view::npos);
    return 0;
}
