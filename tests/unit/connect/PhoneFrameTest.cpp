// Phone frames: exact bytes of built frames, and cutting a received stream back into frames
// whatever way it was split, with garbage, short frames and lying length fields.
#include "connect/PhoneFrame.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace kesu {
namespace {

std::string asText(const Bytes& bytes) { return std::string(bytes.begin(), bytes.end()); }

std::string frameText(std::string_view body) { return asText(buildPhoneFrame(body)); }
// A frame header whose length field says `length`, whatever follows it.
std::string header(std::uint32_t length) {
    const auto len = lenTo4Bytes(length);
    return "PAY_LOAD_1" + std::string(len.begin(), len.end());
}

TEST(PhoneFrame, BuiltFramesAndTags) {
    const Bytes expected = {'P', 'A', 'Y', '_', 'L', 'O', 'A', 'D', '_', '1', 0, 0, 0, 2, '{', '}'};
    EXPECT_EQ(buildPhoneFrame("{}"), expected);
    const Bytes big = buildPhoneFrame(std::string(300, 'x'));
    EXPECT_EQ((Bytes{big[10], big[11], big[12], big[13]}), (Bytes{0x00, 0x00, 0x01, 0x2C}));  // big-endian
    EXPECT_EQ(lenTo4Bytes(0x7'0000'0102ULL), (std::array<std::uint8_t, 4>{0, 0, 1, 2}));     // low 32 bits only

    // JSON bodies: compact UTF-8; bad UTF-8 in a string does not throw; short frames have no body.
    const Bytes frame = buildPhoneFrameFromJson({{"bytes", {0}}, {"deviceName", "书房电脑"}});
    EXPECT_EQ(phoneFrameBody(frame), R"({"bytes":[0],"deviceName":"书房电脑"})");
    EXPECT_NO_THROW(buildPhoneFrameFromJson(nlohmann::json{{"name", std::string("\xff\xfe")}}));
    EXPECT_EQ(phoneFrameBody(Bytes(frame.begin(), frame.begin() + 14)), "");
    EXPECT_EQ(phoneFrameBody(Bytes{'P', 'A'}), "");

    EXPECT_EQ(phoneFrameTag("{\n  \"bytes\" : [\n    11\n  ]\n}"), 11);
    const std::vector<std::string> noTag = {R"({"bytes":[0,1]})", R"({"bytes":["1"]})", R"({"bytes":[99999999999]})",
                                            R"({"byte":[1]})", "[1]", "{\"bytes\":[1]", std::string(100000, '[')};
    for (const std::string& body : noTag) EXPECT_EQ(phoneFrameTag(body), std::nullopt) << body.substr(0, 30);
}

TEST(PhoneFrame, CutterWholeSplitAndJoinedFrames) {
    const std::string a = frameText(R"({"bytes":[1]})");
    const std::string b = frameText(R"({"bytes":[23],"deviceName":"平板"})");
    const std::string empty = frameText("");

    FrameCutter cutter(1024);
    // Byte by byte: nothing until the last byte of each frame.
    const std::string stream = a + empty + b;
    std::vector<std::string> got;
    for (char c : stream) {
        cutter.feed(std::string_view(&c, 1));
        while (auto f = cutter.next()) got.push_back(asText(*f));
    }
    EXPECT_EQ(got, (std::vector<std::string>{a, empty, b}));

    // Two frames and the start of a third in one read.
    cutter.feed(a + b + b.substr(0, 20));
    EXPECT_EQ(asText(*cutter.next()), a);
    EXPECT_EQ(asText(*cutter.next()), b);
    EXPECT_EQ(cutter.next(), std::nullopt);
    EXPECT_EQ(cutter.buffered(), 20u);
    cutter.feed(b.substr(20));
    EXPECT_EQ(asText(*cutter.next()), b);
    EXPECT_EQ(cutter.takeDropped(), 0u);
}

TEST(PhoneFrame, CutterDropsWhatIsNoFrame) {
    const std::string a = frameText(R"({"bytes":[2]})");
    FrameCutter cutter(1024);

    // Garbage before a frame, including a false start of the tag.
    cutter.feed("HTTP/1.1 200 OK\r\nPAY_LOA" + a);
    EXPECT_EQ(asText(*cutter.next()), a);
    EXPECT_EQ(cutter.takeDropped(), 24u);

    // Garbage alone keeps at most a tail that may grow into a tag.
    cutter.feed(std::string(5000, 'z') + "PAY_L");
    EXPECT_EQ(cutter.next(), std::nullopt);
    EXPECT_EQ(cutter.buffered(), 5u);
    cutter.feed(a.substr(5));
    EXPECT_EQ(asText(*cutter.next()), a);
    EXPECT_EQ(cutter.takeDropped(), 5000u);

    // Fewer than 14 bytes: a frame too short to hold its length waits, then completes.
    cutter.feed(a.substr(0, 12));
    EXPECT_EQ(cutter.next(), std::nullopt);
    cutter.feed(a.substr(12));
    EXPECT_EQ(asText(*cutter.next()), a);

    // A length above the limit is never waited for; the frame after it still comes out.
    const std::string huge = header(0xfffffff0u);
    cutter.feed(huge + "some body" + a);
    EXPECT_EQ(asText(*cutter.next()), a);
    EXPECT_TRUE(cutter.takeOversized());
    EXPECT_EQ(cutter.takeDropped(), huge.size() + 9);
    EXPECT_FALSE(cutter.takeOversized());
    cutter.feed(header(1025));  // one above the limit
    EXPECT_EQ(cutter.next(), std::nullopt);
    EXPECT_TRUE(cutter.takeOversized());

    // A length shorter than the body: the frame ends where the length says, the tail of the
    // body is dropped as garbage, the next frame is found.
    cutter.clear();
    cutter.takeDropped();
    const std::string lying = header(2);
    cutter.feed(lying + "{}trailing" + a);
    EXPECT_EQ(asText(*cutter.next()), lying + "{}");
    EXPECT_EQ(asText(*cutter.next()), a);
    EXPECT_EQ(cutter.takeDropped(), 8u);

    // A length longer than what arrived just waits (bounded by the limit).
    cutter.feed(header(256) + "{}");
    EXPECT_EQ(cutter.next(), std::nullopt);
    EXPECT_EQ(cutter.buffered(), 16u);
}

}  // namespace
}  // namespace kesu
