// The phone message frame spoken on every TCP link with a phone: the ASCII tag "PAY_LOAD_1",
// the body length as 4 bytes big-endian, then the JSON body. Building, and cutting a received
// byte stream back into whole frames.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

#include "core/ISocketBase.h"

namespace kesu {

inline constexpr std::string_view kPhoneFrameTag = "PAY_LOAD_1";
inline constexpr std::size_t kPhoneFrameHeaderSize = 14;  // tag + 4 length bytes

// The four bytes [n >> 24, n >> 16, n >> 8, n], each cut to its low 8 bits.
std::array<std::uint8_t, 4> lenTo4Bytes(std::uint64_t n);
// The big-endian length stored in 4 bytes.
std::uint32_t lenFrom4Bytes(const std::uint8_t* bytes);

// A whole frame around `body`, ready for one write.
Bytes buildPhoneFrame(std::string_view body);
// A frame around the JSON value serialised compactly (indent < 0) or pretty-printed with the
// given indent. Text that is not valid UTF-8 is replaced, never thrown about.
Bytes buildPhoneFrameFromJson(const nlohmann::json& body, int indent = -1);

// The body of a received frame: everything after the 14-byte header, "" when there is none.
std::string phoneFrameBody(const Bytes& frame);

// The message tag of a frame body: the single integer of its "bytes" array. nullopt when the
// body is not a JSON object of that shape.
std::optional<int> phoneFrameTag(std::string_view body);

// Cuts a byte stream into whole frames, whatever way the stream was split into reads. A frame
// is handed out only once its whole body has arrived. Bytes that cannot start a frame
// (garbage, or a frame announcing a body above the limit) are dropped and counted; the cutter
// then looks for the next frame tag. The buffer never holds more than one frame of the
// largest size plus the bytes of the last feed.
class FrameCutter {
public:
    explicit FrameCutter(std::size_t maxBody);
    FrameCutter();  // the limit of Config::current()

    void feed(const std::uint8_t* data, std::size_t size);
    void feed(std::string_view data);
    // The next whole frame, header included; nullopt until one has arrived.
    std::optional<Bytes> next();

    // Bytes held that do not form a whole frame yet.
    std::size_t buffered() const { return buffer_.size() - start_; }
    // Bytes dropped since the last call, and whether any of them was an oversized frame.
    std::size_t takeDropped();
    bool takeOversized();
    void clear();

private:
    void drop(std::size_t count);
    void resync();

    std::size_t maxBody_;
    std::string buffer_;
    std::size_t start_ = 0;
    std::size_t dropped_ = 0;
    bool oversized_ = false;
};

}  // namespace kesu
