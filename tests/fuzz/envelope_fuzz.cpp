// Fuzzes the decoding of control request bodies up to the decoded request (bytes to text,
// the optional "N#" prefix, the JSON envelope) and the user-perceived-character count of the
// answer prefix. The dispatcher is left out: it runs real actions.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "control/RequestHandle.h"
#include "control/ResponseHandler.h"
#include "core/Text.h"

namespace {

void check(bool condition) {
    if (!condition) std::abort();
}

bool sameRequest(const kesu::requestObj& a, const kesu::requestObj& b) {
    return a.event == b.event && a.source == b.source && a.params == b.params;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view body(reinterpret_cast<const char*>(data), size);

    const std::string text = kesu::ResponseHandler::switchUint8ArrToString(body);
    check(text.find('\xff') == std::string::npos);
    check(kesu::text::isValidUtf8(text));

    const kesu::RequestHandle handle;
    kesu::requestObj request;
    if (!text.empty()) request = handle.format(text);
    check(request.params.is_object() || request.params.is_array() || request.params.is_string());

    // The same envelope with a prefix, or with a bare leading "#", decodes the same (an
    // envelope holding "#" itself needs the prefix, so only those without are compared).
    const std::string framed = kesu::text::lengthPrefixed(text);
    if (!text.empty() && text.find('#') == std::string::npos) {
        check(sameRequest(handle.format(framed), request));
        check(sameRequest(handle.format("#" + text), request));
    }

    // Characters cut from arbitrary bytes cover them exactly, none empty; the prefix counts them.
    const auto pieces = kesu::text::graphemes(body);
    std::string joined;
    for (const auto piece : pieces) {
        check(!piece.empty());
        joined += piece;
    }
    check(joined == body);
    if (text.empty()) {
        check(framed.empty());
    } else {
        const std::string count = std::to_string(kesu::text::graphemeCount(text));
        check(kesu::text::graphemeCount(text) <= text.size());
        check(framed == count + "#" + text);
    }
    return 0;
}
