// Text helpers over UTF-8: validation, user-perceived characters (grapheme clusters) and the
// "N#json" length prefix used on the control API and towards the PC suite.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace kesu::text {

bool isValidUtf8(std::string_view s);

// The text cut into user-perceived characters (grapheme clusters). Invalid UTF-8 is cut
// byte by byte so that nothing is lost.
std::vector<std::string_view> graphemes(std::string_view s);
std::size_t graphemeCount(std::string_view s);

// "N#" + text, N the grapheme count; the empty text stays empty.
std::string lengthPrefixed(std::string_view s);

// Nesting depth of arrays and objects in a JSON text (brackets inside strings do not count).
std::size_t jsonNestingDepth(std::string_view s);

// Text with every ASCII blank and line end cut from both ends.
std::string trim(std::string_view s);

bool contains(std::string_view s, std::string_view part);

// A name or number shown in logs and lists: its first and last three characters around
// "****" when it has seven or more characters, else unchanged.
std::string paramAddMask(const std::string& str);
// Every byte as two lowercase hex digits.
std::string uintToHexString(const std::string& value);
// Every byte read as a Latin-1 character, in UTF-8.
std::string asciiToString(const std::vector<std::uint8_t>& inBody);

}  // namespace kesu::text
