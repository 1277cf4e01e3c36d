#include "core/Text.h"

#include <utf8proc.h>

namespace kesu::text {

bool isValidUtf8(std::string_view s) {
    const auto* p = reinterpret_cast<const utf8proc_uint8_t*>(s.data());
    utf8proc_ssize_t left = static_cast<utf8proc_ssize_t>(s.size());
    while (left > 0) {
        utf8proc_int32_t cp = 0;
        utf8proc_ssize_t n = utf8proc_iterate(p, left, &cp);
        if (n <= 0) return false;
        p += n;
        left -= n;
    }
    return true;
}

std::vector<std::string_view> graphemes(std::string_view s) {
    std::vector<std::string_view> out;
    const auto* base = reinterpret_cast<const utf8proc_uint8_t*>(s.data());
    const utf8proc_ssize_t size = static_cast<utf8proc_ssize_t>(s.size());
    utf8proc_ssize_t pos = 0;
    utf8proc_ssize_t clusterStart = 0;
    utf8proc_int32_t previous = -1;
    utf8proc_int32_t state = 0;
    while (pos < size) {
        utf8proc_int32_t cp = 0;
        utf8proc_ssize_t n = utf8proc_iterate(base + pos, size - pos, &cp);
        if (n <= 0) {
            // An invalid byte is a character of its own.
            if (pos > clusterStart) out.emplace_back(s.substr(clusterStart, pos - clusterStart));
            out.emplace_back(s.substr(pos, 1));
            ++pos;
            clusterStart = pos;
            previous = -1;
            state = 0;
            continue;
        }
        if (previous >= 0 && utf8proc_grapheme_break_stateful(previous, cp, &state)) {
            out.emplace_back(s.substr(clusterStart, pos - clusterStart));
            clusterStart = pos;
        }
        previous = cp;
        pos += n;
    }
    if (pos > clusterStart) out.emplace_back(s.substr(clusterStart, pos - clusterStart));
    return out;
}

std::size_t graphemeCount(std::string_view s) { return graphemes(s).size(); }

std::string lengthPrefixed(std::string_view s) {
    if (s.empty()) return {};
    std::string out = std::to_string(graphemeCount(s));
    out += '#';
    out += s;
    return out;
}

std::size_t jsonNestingDepth(std::string_view s) {
    std::size_t depth = 0;
    std::size_t deepest = 0;
    bool inString = false;
    bool escaped = false;
    for (char c : s) {
        if (inString) {
            if (escaped) escaped = false;
            else if (c == '\\') escaped = true;
            else if (c == '"') inString = false;
            continue;
        }
        switch (c) {
            case '"': inString = true; break;
            case '[':
            case '{':
                if (++depth > deepest) deepest = depth;
                break;
            case ']':
            case '}':
                if (depth > 0) --depth;
                break;
            default: break;
        }
    }
    return deepest;
}

std::string trim(std::string_view s) {
    const char* blanks = " \t\r\n\v\f";
    auto first = s.find_first_not_of(blanks);
    if (first == std::string_view::npos) return {};
    auto last = s.find_last_not_of(blanks);
    return std::string(s.substr(first, last - first + 1));
}

bool contains(std::string_view s, std::string_view part) { return s.find(part) != std::string_view::npos; }

namespace {

void appendUtf8(std::string& out, unsigned codePoint) {
    if (codePoint < 0x80) {
        out.push_back(static_cast<char>(codePoint));
    } else {
        out.push_back(static_cast<char>(0xC0 | (codePoint >> 6)));
        out.push_back(static_cast<char>(0x80 | (codePoint & 0x3F)));
    }
}

}  // namespace

std::string paramAddMask(const std::string& str) {
    const auto chars = graphemes(str);
    if (chars.size() < 7) return str;
    std::string masked;
    for (std::size_t i = 0; i < 3; ++i) masked += chars[i];
    masked += "****";
    for (std::size_t i = chars.size() - 3; i < chars.size(); ++i) masked += chars[i];
    return masked;
}

std::string uintToHexString(const std::string& value) {
    static const char digits[] = "0123456789abcdef";
    std::string hex;
    hex.reserve(value.size() * 2);
    for (unsigned char byte : value) {
        hex.push_back(digits[byte >> 4]);
        hex.push_back(digits[byte & 0x0F]);
    }
    return hex;
}

std::string asciiToString(const std::vector<std::uint8_t>& inBody) {
    std::string out;
    out.reserve(inBody.size());
    for (std::uint8_t byte : inBody) appendUtf8(out, byte);
    return out;
}

}  // namespace kesu::text
