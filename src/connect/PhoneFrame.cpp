#include "connect/PhoneFrame.h"

#include <algorithm>
#include <utility>

#include "core/Config.h"
#include "core/Json.h"

namespace kesu {

std::array<std::uint8_t, 4> lenTo4Bytes(std::uint64_t n) {
    return {static_cast<std::uint8_t>((n >> 24) & 0xff), static_cast<std::uint8_t>((n >> 16) & 0xff),
            static_cast<std::uint8_t>((n >> 8) & 0xff), static_cast<std::uint8_t>(n & 0xff)};
}

std::uint32_t lenFrom4Bytes(const std::uint8_t* bytes) {
    return (std::uint32_t{bytes[0]} << 24) | (std::uint32_t{bytes[1]} << 16) | (std::uint32_t{bytes[2]} << 8) |
           std::uint32_t{bytes[3]};
}

Bytes buildPhoneFrame(std::string_view body) {
    Bytes frame(kPhoneFrameHeaderSize + body.size());
    auto out = std::copy(kPhoneFrameTag.begin(), kPhoneFrameTag.end(), frame.begin());
    const auto length = lenTo4Bytes(body.size());
    out = std::copy(length.begin(), length.end(), out);
    std::copy(body.begin(), body.end(), out);
    return frame;
}

Bytes buildPhoneFrameFromJson(const nlohmann::json& body, int indent) {
    return buildPhoneFrame(body.dump(indent, ' ', false, nlohmann::json::error_handler_t::replace));
}

std::string phoneFrameBody(const Bytes& frame) {
    if (frame.size() <= kPhoneFrameHeaderSize) return {};
    return std::string(frame.begin() + kPhoneFrameHeaderSize, frame.end());
}

std::optional<int> phoneFrameTag(std::string_view body) {
    const auto parsed = json::parse(body);
    if (!parsed || !parsed->is_object()) return std::nullopt;
    auto it = parsed->find("bytes");
    if (it == parsed->end() || !it->is_array() || it->size() != 1) return std::nullopt;
    const auto& tag = (*it)[0];
    if (!tag.is_number_integer()) return std::nullopt;
    const auto value = tag.get<std::int64_t>();
    if (value < INT32_MIN || value > INT32_MAX) return std::nullopt;
    return static_cast<int>(value);
}

FrameCutter::FrameCutter(std::size_t maxBody) : maxBody_(maxBody) {}

FrameCutter::FrameCutter() : FrameCutter(Config::current().phoneFrameMaxBody) {}

void FrameCutter::feed(const std::uint8_t* data, std::size_t size) {
    if (size == 0) return;
    if (start_ > 0) {
        buffer_.erase(0, start_);
        start_ = 0;
    }
    buffer_.append(reinterpret_cast<const char*>(data), size);
}

void FrameCutter::feed(std::string_view data) {
    feed(reinterpret_cast<const std::uint8_t*>(data.data()), data.size());
}

std::optional<Bytes> FrameCutter::next() {
    for (;;) {
        const std::string_view held = std::string_view(buffer_).substr(start_);
        if (held.empty()) {
            clear();
            return std::nullopt;
        }
        const std::size_t tagPart = std::min(held.size(), kPhoneFrameTag.size());
        if (held.substr(0, tagPart) != kPhoneFrameTag.substr(0, tagPart)) {
            resync();
            continue;
        }
        if (held.size() < kPhoneFrameHeaderSize) return std::nullopt;
        const std::uint32_t length =
            lenFrom4Bytes(reinterpret_cast<const std::uint8_t*>(held.data()) + kPhoneFrameTag.size());
        if (length > maxBody_) {
            // Skip the tag only: the rest is searched for the next frame.
            oversized_ = true;
            drop(kPhoneFrameTag.size());
            continue;
        }
        const std::size_t frameSize = kPhoneFrameHeaderSize + length;
        if (held.size() < frameSize) return std::nullopt;
        Bytes frame(held.begin(), held.begin() + static_cast<std::ptrdiff_t>(frameSize));
        start_ += frameSize;
        return frame;
    }
}

void FrameCutter::drop(std::size_t count) {
    start_ += count;
    dropped_ += count;
}

// Drops everything before the next frame tag. Without a whole tag in the buffer, keeps only
// the longest tail that may still grow into one.
void FrameCutter::resync() {
    const std::string_view held = std::string_view(buffer_).substr(start_);
    const std::size_t found = held.find(kPhoneFrameTag, 1);
    if (found != std::string_view::npos) {
        drop(found);
        return;
    }
    std::size_t keep = std::min(held.size() - 1, kPhoneFrameTag.size() - 1);
    while (keep > 0 && held.substr(held.size() - keep) != kPhoneFrameTag.substr(0, keep)) --keep;
    drop(held.size() - keep);
}

std::size_t FrameCutter::takeDropped() { return std::exchange(dropped_, 0); }

bool FrameCutter::takeOversized() { return std::exchange(oversized_, false); }

void FrameCutter::clear() {
    buffer_.clear();
    start_ = 0;
}

}  // namespace kesu
