#include "discovery/SsdpMessage.h"

#include <memory>

#include "account/DataInstance.h"
#include "core/ConnectCodes.h"
#include "core/Config.h"
#include "core/Text.h"
#include "core/Log.h"
#include "core/Text.h"
#include "core/WallClock.h"
#include "platform/SystemInfo.h"
#include "discovery/Base64.h"
#include "discovery/SsdpDeviceManager.h"

namespace kesu {

namespace {

constexpr std::string_view kCompatMarker = "compatGsonStr:";

bool contains(std::string_view text, std::string_view part) { return text.find(part) != std::string_view::npos; }

// The value between the first `open` and the first `close` of the whole text. False when
// either is missing or `close` starts before the value does.
bool between(std::string_view text, std::string_view open, std::string_view close, std::string& value) {
    const auto start = text.find(open);
    const auto end = text.find(close);
    if (start == std::string_view::npos || end == std::string_view::npos) return false;
    const auto from = start + open.size();
    if (end < from) return false;
    value.assign(text.substr(from, end - from));
    return true;
}

// The pcsuite service id every device announcement of interest carries.
const std::string& pcsuiteServiceId() {
    static const std::string id = rawValue(serviceId::pcsuiteId);
    return id;
}

}  // namespace

// ---- Outgoing ------------------------------------------------------------------------------

Json SsdpMessage::pcAnnouncement(const std::string& deviceName, const std::string& deviceId,
                                 const std::string& account, const std::string& openId,
                                 const std::string& serviceId) {
    return Json{
        {"deviceName", deviceName},
        {"deviceId", deviceId},
        {"openId", openId},
        {"serviceRecord", serviceId},
        {"port", Config::current().phoneTcpPort},
        {"account", account},
        {"deviceType", "pc"},
        {"extra", "null"},
    };
}

std::string SsdpMessage::responseMessage(const std::string& deviceName, const std::string& deviceId,
                                         const std::string& account, const std::string& openId,
                                         const std::string& serviceId) {
    const std::string body = json::compact(pcAnnouncement(deviceName, deviceId, account, openId, serviceId));
    return "RESPONSE * HTTP/1.1\r\nDATE:" + WallClock::getNowTime() + "\r\ncompatGsonStr:" + base64::encode(body) +
           "\r\n";
}

std::string SsdpMessage::searchMessage(const std::string& deviceId, const std::string& openId,
                                       const std::string& serviceId) {
    const Config& config = Config::current();
    return "M-SEARCH * HTTP/1.1\nHost:" + config.ssdpGroup + ":" + std::to_string(config.ssdpPort) +
           "\nMan:\"ssdp:discover\"\nMX:5\nST:kesu_connect\ndeviceId:" + deviceId + "\nopenId:" + openId +
           "\nService:" + serviceId + "\r\n";
}

std::string SsdpMessage::pcServiceRecord() {
    return rawValue(serviceId::pcsuiteId) + "--" + rawValue(serviceId::shareId);
}

// ---- Incoming ------------------------------------------------------------------------------

SsdpMessage::Handling SsdpMessage::handleDatagram(std::string_view data, const std::string& host) {
    return handleDatagram(data, host, SsdpDeviceManager::instance());
}

SsdpMessage::Handling SsdpMessage::handleDatagram(std::string_view data, const std::string& host,
                                                  SsdpDeviceManager& manager) {
    if (data.empty()) {
        Log::mPrintlog("[ssdpSocket::udpSocket] data is nil ...\n");
        return Handling::dropped;
    }
    if (host.empty()) {
        Log::mPrintlog("[ssdpSocket::udpSocket] host is nil ...\n");
        return Handling::dropped;
    }
    // Anyone on the LAN can send anything: a text that is not UTF-8 is dropped silently.
    if (!text::isValidUtf8(data)) return Handling::dropped;

    if ((contains(data, "deviceType:mobile") || contains(data, "deviceType:pad")) &&
        contains(data, pcsuiteServiceId())) {
        insertResponseDevice(std::string(data), host, dataInstance().get(&databaseParam::openid), false, manager);
        return Handling::oldFormat;
    }

    if (!contains(data, kCompatMarker) || contains(data, "\r\n\r\n")) return Handling::ignored;

    const std::string decoded = decodeCompatPayload(data);
    if (decoded.empty()) return Handling::dropped;
    if (!text::isValidUtf8(decoded)) {
        Log::mPrintlog("[ssdpSocket::udpSocket] recvDecodeNSString is nil ...\n");
        return Handling::dropped;
    }
    // An announcement that names this PC (normally its own, looped back) shows that the
    // sockets still hear the group. An empty name would match everything: it matches nothing.
    const std::string localName = SystemInfo::getLocalName();
    if (!localName.empty() && contains(decoded, localName)) {
        manager.markOwnEcho();
    }
    if ((contains(decoded, "\"deviceType\":\"mobile\"") || contains(decoded, "\"deviceType\":\"pad\"")) &&
        contains(decoded, pcsuiteServiceId())) {
        insertResponseDevice(decoded, host, dataInstance().get(&databaseParam::openid), true, manager);
        return Handling::currentFormat;
    }
    return Handling::ignored;
}

std::string SsdpMessage::decodeCompatPayload(std::string_view text) {
    const auto at = text.find(kCompatMarker);
    if (at == std::string_view::npos) return {};
    std::string payload;
    std::string_view rest = text.substr(at + kCompatMarker.size());
    payload.reserve(rest.size());
    for (std::size_t crlf; (crlf = rest.find("\r\n")) != std::string_view::npos;) {
        payload.append(rest.substr(0, crlf));
        rest.remove_prefix(crlf + 2);
    }
    payload.append(rest);
    if (payload.empty()) return {};
    auto decoded = base64::decodeStrict(payload);
    return decoded ? std::move(*decoded) : std::string();
}

bool SsdpMessage::parserResponseData(const std::string& ssdpData, SsdpDevice& device) {
    if (ssdpData.empty()) return false;
    // Text that is not JSON reads as an object without members: every value "".
    const Json root = json::parse(ssdpData).value_or(Json::object());

    device.openId = json::str(root, "openId");
    device.guide = json::str(root, "pcCustomizedData");

    std::string name = json::str(root, "deviceName");
    if (name.starts_with("kesu ")) {
        name.erase(0, 5);
    } else if (name.starts_with("kesu")) {
        name.erase(0, 4);
    }
    device.deviceName = maskValue(name, device.isDeviceNameFull);
    device.deviceId = deviceIdentifier(json::str(root, "deviceId"));
    device.account = maskValue(json::str(root, "account"), device.isAccountFull);

    const std::string type = json::str(root, "deviceType");
    if (type == "mobile") {
        device.deviceType = "phone";
    } else if (type == "pad") {
        device.deviceType = "pad";
    }
    return true;
}

bool SsdpMessage::parserOldResponseData(const std::string& ssdpData, SsdpDevice& device) {
    if (ssdpData.empty()) return false;
    std::string name, account, openId, id;
    if (!between(ssdpData, "deviceName:", "\r\naccount", name) ||
        !between(ssdpData, "account:", "\r\ndeviceType", account) ||
        !between(ssdpData, "openId:", "\r\nserviceRecord", openId) ||
        !between(ssdpData, "deviceId:", "\r\nopenId", id)) {
        return false;
    }
    constexpr std::string_view kGuideMarker = "pcCustomizedData:";
    const auto guideAt = ssdpData.find(kGuideMarker);
    if (guideAt == std::string::npos) return false;
    const auto guideChars = text::graphemes(std::string_view(ssdpData).substr(guideAt + kGuideMarker.size()));
    if (guideChars.empty()) return false;

    device.deviceName = maskValue(name, device.isDeviceNameFull);
    device.account = maskValue(account, device.isAccountFull);
    device.openId = openId;
    device.guide = std::string(guideChars.front());
    device.deviceId = deviceIdentifier(id);
    if (contains(ssdpData, "mobile")) {
        device.deviceType = "phone";
    } else if (contains(ssdpData, "pad")) {
        device.deviceType = "pad";
    }
    return true;
}

void SsdpMessage::insertResponseDevice(const std::string& recvData, const std::string& ip, const std::string& openId,
                                       bool newDataFlag) {
    insertResponseDevice(recvData, ip, openId, newDataFlag, SsdpDeviceManager::instance());
}

void SsdpMessage::insertResponseDevice(const std::string& recvData, const std::string& ip, const std::string& openId,
                                       bool newDataFlag, SsdpDeviceManager& manager) {
    if (recvData.empty() || ip.empty()) return;

    auto device = std::make_shared<SsdpDevice>();
    const bool parsed = newDataFlag ? parserResponseData(recvData, *device) : parserOldResponseData(recvData, *device);
    if (!parsed) {
        Log::mPrintlog("[ssdpSocket::insertResponseDevice] receive data is empty or parser fail ...\n");
    }
    device->isOpenIdSame = !device->openId.empty() && !openId.empty() && device->openId == openId;
    device->ip.push_back(ip);
    if (device->ip.empty() || device->deviceId.empty()) return;

    device->lastUpdate = WallClock::currentTimeStamp();
    // The observers compare the new record with the stored one: before the table changes.
    manager.notifyChange(*device);

    const std::string key = device->deviceId;
    SsdpDevicePtr stored;
    if (manager.ssdpDeviceMap.lookup(key, stored)) {
        // A sweep may have removed it since the lookup: then it is stored afresh.
        if (!manager.ssdpDeviceMap.update(key, device)) manager.ssdpDeviceMap.insert(key, device);
        return;
    }
    manager.ssdpDeviceMap.insert(key, device);
    Log::mPrintlog("[ssdpSocket::insertResponseDevice] Insert ssdp device, deviceId: " + device->deviceId +
                     "  account: " + device->account + "  openId: " + device->openId +
                     "  deviceName: " + device->deviceName + "  guide: " + device->guide +
                     "  isOpenIdSame: " + (device->isOpenIdSame ? "true" : "false") + "\n");
}

// ---- Rules ---------------------------------------------------------------------------------

std::string SsdpMessage::maskValue(const std::string& value, bool& full) {
    full = text::graphemeCount(value) < 7;
    return full ? value : text::paramAddMask(value);
}

std::string SsdpMessage::deviceIdentifier(const std::string& announcedId) {
    const auto chars = text::graphemes(announcedId);
    std::string head;
    for (std::size_t i = 0; i < chars.size() && i < 4; ++i) head.append(chars[i]);
    return text::uintToHexString(head);
}

}  // namespace kesu
