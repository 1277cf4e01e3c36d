// JSON helpers over nlohmann::json with the service's lenient reading rules: a missing
// member or a member of another type reads as "", 0, false or an empty array. Texts that
// come from outside are parsed with a nesting limit and never throw.
#pragma once

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>

namespace kesu {

using Json = nlohmann::json;

namespace json {

// Deepest nesting of arrays/objects accepted from outside.
inline constexpr std::size_t kMaxDepth = 64;

// Parses outside input; nullopt when it is not JSON or nests deeper than kMaxDepth.
std::optional<Json> parse(std::string_view text);

std::string str(const Json& j, const std::string& key);  // "" unless a string member
long long integer(const Json& j, const std::string& key);  // 0 unless a number member
// An integer member that a long long holds; nullopt for another type, a fraction or a
// larger number.
std::optional<long long> exactInteger(const Json& j, const std::string& key);
bool boolean(const Json& j, const std::string& key);       // false unless a bool member
Json array(const Json& j, const std::string& key);         // [] unless an array member
Json object(const Json& j, const std::string& key);        // {} unless an object member

// The text of a value as a parameter: a string as itself, other values as JSON text,
// null as "".
std::string text(const Json& value);

// Serialisation that never throws (invalid UTF-8 in strings is replaced).
std::string pretty(const Json& j);
std::string compact(const Json& j);

}  // namespace json
}  // namespace kesu
