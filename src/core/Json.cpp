#include "core/Json.h"

#include <limits>

#include "core/Text.h"

namespace kesu::json {

std::optional<Json> parse(std::string_view text) {
    if (text::jsonNestingDepth(text) > kMaxDepth) return std::nullopt;
    Json j = Json::parse(text.begin(), text.end(), nullptr, /*allow_exceptions=*/false);
    if (j.is_discarded()) return std::nullopt;
    return j;
}

std::string str(const Json& j, const std::string& key) {
    if (!j.is_object()) return {};
    auto it = j.find(key);
    return it != j.end() && it->is_string() ? it->get<std::string>() : std::string();
}

long long integer(const Json& j, const std::string& key) {
    if (!j.is_object()) return 0;
    auto it = j.find(key);
    if (it == j.end()) return 0;
    if (it->is_number_integer()) return it->get<long long>();
    if (it->is_number_float()) return static_cast<long long>(it->get<double>());
    return 0;
}

std::optional<long long> exactInteger(const Json& j, const std::string& key) {
    if (!j.is_object()) return std::nullopt;
    const auto it = j.find(key);
    if (it == j.end() || !it->is_number_integer()) return std::nullopt;
    if (it->is_number_unsigned() &&
        it->get<unsigned long long>() > static_cast<unsigned long long>(std::numeric_limits<long long>::max()))
        return std::nullopt;
    return it->get<long long>();
}

bool boolean(const Json& j, const std::string& key) {
    if (!j.is_object()) return false;
    auto it = j.find(key);
    return it != j.end() && it->is_boolean() && it->get<bool>();
}

Json array(const Json& j, const std::string& key) {
    if (j.is_object()) {
        auto it = j.find(key);
        if (it != j.end() && it->is_array()) return *it;
    }
    return Json::array();
}

Json object(const Json& j, const std::string& key) {
    if (j.is_object()) {
        auto it = j.find(key);
        if (it != j.end() && it->is_object()) return *it;
    }
    return Json::object();
}

std::string text(const Json& value) {
    if (value.is_string()) return value.get<std::string>();
    if (value.is_null()) return {};
    return compact(value);
}

std::string pretty(const Json& j) { return j.dump(2, ' ', false, Json::error_handler_t::replace); }

std::string compact(const Json& j) { return j.dump(-1, ' ', false, Json::error_handler_t::replace); }

}  // namespace kesu::json
