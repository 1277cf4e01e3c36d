// Fuzzes the phone frame cutter with arbitrary streams split at arbitrary points: every frame
// handed out must be well formed and within the limit, and the buffer must stay bounded.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "connect/PhoneFrame.h"

namespace {

constexpr std::size_t kMaxBody = 4096;

void check(bool condition) {
    if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // The first byte picks the read size, so that the same stream is also cut in odd places.
    if (size == 0) return 0;
    const std::size_t chunk = 1 + data[0] % 64;
    ++data;
    --size;

    kesu::FrameCutter cutter(kMaxBody);
    std::size_t handedOut = 0;
    std::size_t dropped = 0;
    for (std::size_t offset = 0; offset < size; offset += chunk) {
        const std::size_t n = size - offset < chunk ? size - offset : chunk;
        cutter.feed(data + offset, n);
        while (auto frame = cutter.next()) {
            check(frame->size() >= kesu::kPhoneFrameHeaderSize);
            check(std::string_view(reinterpret_cast<const char*>(frame->data()), 10) == kesu::kPhoneFrameTag);
            const std::uint32_t length = kesu::lenFrom4Bytes(frame->data() + 10);
            check(length <= kMaxBody);
            check(frame->size() == kesu::kPhoneFrameHeaderSize + length);
            check(kesu::phoneFrameBody(*frame).size() == length);
            (void)kesu::phoneFrameTag(kesu::phoneFrameBody(*frame));
            handedOut += frame->size();
        }
        dropped += cutter.takeDropped();
        cutter.takeOversized();
        check(cutter.buffered() <= kesu::kPhoneFrameHeaderSize + kMaxBody + chunk);
    }
    // Every byte is accounted for: handed out, dropped or still waiting.
    check(handedOut + dropped + cutter.buffered() == size);

    // A single read taken as a whole, as a receiver without the cutter would see it.
    const kesu::Bytes whole(data, data + size);
    (void)kesu::phoneFrameTag(kesu::phoneFrameBody(whole));
    return 0;
}
