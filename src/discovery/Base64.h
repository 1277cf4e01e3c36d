// Standard base64 (RFC 4648 alphabet, with padding, no line breaks) over OpenSSL, with a
// strict decoder for the payloads of discovery announcements.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace kesu::base64 {

std::string encode(std::string_view bytes);

// The decoded bytes, or nullopt unless the text is canonical padded base64: a length that
// is a multiple of 4, only alphabet characters, at most two "=" and only at the very end.
// Blanks and line breaks are not skipped. The empty text decodes to the empty result.
std::optional<std::string> decodeStrict(std::string_view text);

}  // namespace kesu::base64
