#include "discovery/Base64.h"

#include <openssl/evp.h>

#include <algorithm>
#include <climits>

namespace kesu::base64 {

namespace {
bool isAlphabet(unsigned char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '+' || c == '/';
}
}  // namespace

std::string encode(std::string_view bytes) {
    std::string out;
    std::size_t done = 0;
    // EVP_EncodeBlock takes an int length: encode in slices of whole 3-byte groups.
    constexpr std::size_t kSlice = 3u * (1u << 20);
    while (done < bytes.size()) {
        const std::size_t n = std::min(kSlice, bytes.size() - done);
        const std::size_t at = out.size();
        out.resize(at + 4 * ((n + 2) / 3) + 1);
        const int written = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data() + at),
                                            reinterpret_cast<const unsigned char*>(bytes.data() + done),
                                            static_cast<int>(n));
        out.resize(at + static_cast<std::size_t>(written));
        done += n;
    }
    return out;
}

std::optional<std::string> decodeStrict(std::string_view text) {
    if (text.empty()) return std::string();
    if (text.size() % 4 != 0 || text.size() > static_cast<std::size_t>(INT_MAX)) return std::nullopt;
    std::size_t padding = 0;
    if (text.back() == '=') padding = text[text.size() - 2] == '=' ? 2 : 1;
    for (std::size_t i = 0; i + padding < text.size(); ++i) {
        if (!isAlphabet(static_cast<unsigned char>(text[i]))) return std::nullopt;
    }
    // EVP_DecodeBlock also accepts blanks and writes the padding as zero bytes: everything
    // was checked above, and the padding bytes are cut below.
    std::string out(text.size() / 4 * 3, '\0');
    const int written = EVP_DecodeBlock(reinterpret_cast<unsigned char*>(out.data()),
                                        reinterpret_cast<const unsigned char*>(text.data()),
                                        static_cast<int>(text.size()));
    if (written < 0 || static_cast<std::size_t>(written) != out.size()) return std::nullopt;
    out.resize(out.size() - padding);
    return out;
}

}  // namespace kesu::base64
