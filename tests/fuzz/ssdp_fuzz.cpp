// Fuzzes the receive path of discovery datagrams: classification, payload decoding, both
// announcement parsers and the insertion into a small bounded table. Whatever arrives, the
// table stays within its bound and holds only well-formed keys.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "core/Json.h"
#include "discovery/Base64.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpMessage.h"

namespace {

constexpr std::size_t kMaxDevices = 16;

void check(bool condition) {
    if (!condition) std::abort();
}

// The input cut at NUL bytes into up to `n` fields (missing ones empty).
std::vector<std::string> fields(const std::string& s, std::size_t n) {
    std::vector<std::string> out(n);
    std::size_t at = 0;
    for (std::size_t i = 0; i < n && at <= s.size(); ++i) {
        const std::size_t end = std::min(s.find('\0', at), s.size());
        out[i] = s.substr(at, end - at);
        at = end + 1;
    }
    return out;
}

bool isLowerHex(const std::string& s) {
    if (s.size() % 2 != 0) return false;
    for (char c : s) {
        if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'))) return false;
    }
    return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using kesu::SsdpMessage;
    if (size == 0) return 0;
    // The first byte picks how the rest is presented, so that the fuzzer reaches the JSON and
    // old-format parsers without having to discover base64 first.
    const std::uint8_t mode = data[0] % 6;
    const std::string rest(reinterpret_cast<const char*>(data + 1), size - 1);

    std::string datagram;
    switch (mode) {
        case 0:
            datagram = rest;
            break;
        case 1:
            datagram = "RESPONSE * HTTP/1.1\r\nDATE:2024-05-01 10:00:00.000\r\ncompatGsonStr:" +
                       kesu::base64::encode(rest) + "\r\n";
            break;
        case 2:
            datagram = rest + "\r\ndeviceType:mobile\r\nserviceRecord:com.kesu.pcsuite.SERVICE\r\n";
            break;
        case 3:
            datagram = "compatGsonStr:" + rest;
            break;
        case 4: {
            // A well-formed current-format announcement with arbitrary member values.
            const auto f = fields(rest, 6);
            const kesu::Json body{{"deviceName", f[0]}, {"deviceId", f[1]}, {"account", f[2]}, {"openId", f[3]},
                                  {"pcCustomizedData", f[4]}, {"deviceType", f[5].size() % 2 ? "pad" : "mobile"},
                                  {"serviceRecord", "com.kesu.pcsuite.SERVICE"}};
            datagram = "RESPONSE * HTTP/1.1\r\ncompatGsonStr:" + kesu::base64::encode(kesu::json::compact(body)) +
                       "\r\n";
            break;
        }
        default: {
            // An old-format announcement with arbitrary values between the markers.
            const auto f = fields(rest, 5);
            datagram = "deviceId:" + f[0] + "\r\nopenId:" + f[1] + "\r\nserviceRecord:com.kesu.pcsuite.SERVICE\r\n" +
                       "deviceName:" + f[2] + "\r\naccount:" + f[3] + "\r\ndeviceType:mobile\r\npcCustomizedData:" + f[4];
            break;
        }
    }

    static kesu::SsdpDeviceManager* table = new kesu::SsdpDeviceManager(kMaxDevices, 30.0);
    SsdpMessage::handleDatagram(datagram, "10.77.0.9", *table);
    SsdpMessage::handleDatagram(rest, "10.77.0.9", *table);

    // The parsers directly, on raw input.
    kesu::SsdpDevice device;
    SsdpMessage::parserResponseData(rest, device);
    check(isLowerHex(device.deviceId));
    kesu::SsdpDevice old;
    SsdpMessage::parserOldResponseData(rest, old);
    check(isLowerHex(old.deviceId));

    // Base64 round trip, and the strict decoder on arbitrary text.
    check(kesu::base64::decodeStrict(kesu::base64::encode(rest)) == rest);
    (void)kesu::base64::decodeStrict(rest);

    check(table->ssdpDeviceMap.size() <= kMaxDevices);
    for (const auto& stored : table->getAllDevices()) {
        check(!stored->deviceId.empty() && isLowerHex(stored->deviceId));
        check(stored->ip.size() == 1);
        check(stored->isDeviceNameFull || stored->deviceName.find("****") != std::string::npos);
        check(stored->isAccountFull || stored->account.find("****") != std::string::npos);
    }
    std::string answer;
    check(table->getQueryAll(answer) && !answer.empty());
    return 0;
}
