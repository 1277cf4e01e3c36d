#include "cloud/ConnectCenterRequest.h"

#include <algorithm>
#include <cctype>

#include "account/DataGet.h"
#include "account/DataInstance.h"
#include "core/Endpoints.h"
#include "core/Log.h"

namespace kesu {

std::string rawValue(CENTER_HTTP_PATH path) {
    switch (path) {
        case CENTER_HTTP_PATH::BIND_DEVICE: return "/device/bind";
        case CENTER_HTTP_PATH::UN_BIND_DEVICE: return "/device/unBind";
        case CENTER_HTTP_PATH::REPORT_DEVICE: return "/device/report";
        case CENTER_HTTP_PATH::GET_DEVICE_INFO: return "/device/info";
        case CENTER_HTTP_PATH::GET_DEVICE_LIST: return "/device/list";
        case CENTER_HTTP_PATH::CREATE_EVENT: return "/event/create";
        case CENTER_HTTP_PATH::REPORT_EVENT: return "/event/report";
        case CENTER_HTTP_PATH::GET_EVENT: return "/event/get";
    }
    return "";
}

namespace {

// Longest reply text quoted in a log line; the rest is cut (a reply may be megabytes).
constexpr std::size_t kMaxLoggedReply = 4096;

bool sameName(const std::string& a, const std::string& b) {
    return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](unsigned char x, unsigned char y) {
               return std::tolower(x) == std::tolower(y);
           });
}

// The value of a header given under any spelling of `name`, if given.
std::optional<std::string> findHeader(const ConnectCenterRequest::Headers& headers, const std::string& name) {
    for (const auto& [key, value] : headers)
        if (sameName(key, name)) return value;
    return std::nullopt;
}

// `base` with `extra` laid over it; header names compare without case.
ConnectCenterRequest::Headers merged(ConnectCenterRequest::Headers base, const ConnectCenterRequest::Headers& extra) {
    for (const auto& header : extra) {
        const std::string& name = header.first;  // a named copy: lambdas may not capture bindings (clang 14)
        std::erase_if(base, [&](const auto& pair) { return sameName(pair.first, name); });
        base[name] = header.second;
    }
    return base;
}

// A header that would end the header block early or smuggle in another header (a line break
// or NUL in an account value) must not go out.
bool sendable(const ConnectCenterRequest::Headers& headers) {
    const auto bad = [](const std::string& s) { return s.find_first_of(std::string("\r\n\0", 3)) != std::string::npos; };
    return std::none_of(headers.begin(), headers.end(),
                        [&](const auto& pair) { return pair.first.empty() || bad(pair.first) || bad(pair.second); });
}

// An id as a query value: everything but the unreserved characters percent-encoded.
std::string queryValue(const std::string& value) {
    static constexpr char hex[] = "0123456789ABCDEF";
    std::string out;
    for (const unsigned char c : value) {
        if (std::isalnum(c) || c == '-' || c == '.' || c == '_' || c == '~') {
            out += static_cast<char>(c);
        } else {
            out += '%';
            out += hex[c >> 4];
            out += hex[c & 0x0F];
        }
    }
    return out;
}

// The configured base URL and a path beginning with "/", without a doubled slash between.
std::string centerBase(const std::string& path) {
    std::string base = Endpoints::connectCenterServerUrl();
    if (!path.empty() && path.front() == '/')
        while (!base.empty() && base.back() == '/') base.pop_back();
    return base;
}

// A text for the log: credentials masked, at most kMaxLoggedReply bytes (cut on a character
// boundary).
std::string forLog(const std::string& text) {
    std::string shown = RequestBase::maskForLog(text);
    if (shown.size() <= kMaxLoggedReply) return shown;
    std::size_t cut = kMaxLoggedReply;
    while (cut > 0 && (static_cast<unsigned char>(shown[cut]) & 0xC0) == 0x80) --cut;
    shown.resize(cut);
    return shown + "...(" + std::to_string(text.size()) + " bytes)";
}

std::string headersForLog(const ConnectCenterRequest::Headers& headers) {
    Json shown = Json::object();
    for (const auto& [name, value] : headers) shown[name] = value;
    return forLog(json::compact(shown));
}

std::string describe(const databaseParam& p) {
    const Json record{{"openid", p.openid},         {"Phone", p.Phone},
                      {"token", p.token},           {"lastToken", p.lastToken},
                      {"lastOpenId", p.lastOpenId}, {"clientId", p.clientId},
                      {"pcDeviceId", p.pcDeviceId}, {"version", p.version}};
    return forLog(json::compact(record));
}

}  // namespace

std::optional<Json> ConnectCenterRequest::requestIntercept(const std::string& path, const std::optional<Json>& params,
                                                           MethodType method, const Headers& requestHeader,
                                                           int& status, std::string& msg) {
    const std::string logPrefix = "[ConnectCenterRequest][responseIntercept] path: " + path;
    const databaseParam account = dataInstance().get();

    // Not signed in: nothing goes out (and the PC suite is not asked for the PC's id either).
    const std::string userId = findHeader(requestHeader, "userId").value_or(account.openid);
    if (userId.empty()) {
        Log::mPrintlog(logPrefix + ", openid is empty \n");
        return std::nullopt;
    }

    std::string deviceId = findHeader(requestHeader, "deviceId").value_or(account.pcDeviceId);
    if (deviceId.empty()) deviceId = getPcsuiteDeviceInfo();
    if (deviceId.empty()) {
        // The center cannot place a request without the PC's id.
        Log::mPrintlog(logPrefix + ", pcDeviceId is empty \n");
        return std::nullopt;
    }

    const Headers headers = merged({{"userId", account.openid},
                                    {"token", account.token},
                                    {"source", "2"},
                                    {"version", account.version.empty() ? Log::versionCode : account.version},
                                    {"deviceId", deviceId}},
                                   requestHeader);
    Log::mPrintlog(logPrefix + ", header: " + headersForLog(headers) + "\n");
    if (!sendable(headers)) {
        Log::mPrintlog(logPrefix + ", header holds a line break, not sent \n");
        return std::nullopt;
    }

    std::optional<std::string> body;
    if (params) body = json::compact(*params);
    const Json reply = RequestBase::http(centerBase(path), path, body, method, headers, status, msg);
    return responseIntercept(reply, path);
}

std::optional<Json> ConnectCenterRequest::responseIntercept(const std::optional<Json>& json, const std::string& path) {
    if (json && json->is_object() && !json->empty()) {
        const auto code = json->find("code");
        if (code != json->end() && code->is_number_integer() && *code == 0) return json;
    }
    Log::mPrintlog("[ConnectCenterRequest][responseIntercept] path: " + path +
                   ", request err: " + (json ? forLog(json::compact(*json)) : std::string()) + " \n");
    return std::nullopt;
}

std::optional<Json> ConnectCenterRequest::unBindDevice(const std::vector<std::string>& data, int& status,
                                                       std::string& msg) {
    const databaseParam account = dataInstance().get();
    if (account.openid.empty() || account.token.empty() || account.lastToken.empty() || account.lastOpenId.empty()) {
        Log::mPrintlog("[ConnectCenterRequest][unBindDevice] Unable to unbind device. dataInstance: " +
                       describe(account) + " \n");
        return std::nullopt;
    }
    // The PC is unbound from the account signed in before, with that account's credentials.
    return requestIntercept(rawValue(CENTER_HTTP_PATH::UN_BIND_DEVICE), Json(data), MethodType::post,
                            {{"userId", account.lastOpenId}, {"token", account.lastToken}}, status, msg);
}

std::optional<Json> ConnectCenterRequest::reportDevice(const Json& data, int& status, std::string& msg) {
    const std::string path = rawValue(CENTER_HTTP_PATH::REPORT_DEVICE);
    Log::mPrintlog("[ConnectCenterRequest][reportDevice] " + path + " data: " + forLog(json::compact(data)));
    return requestIntercept(path, data, MethodType::post, {}, status, msg);
}

std::optional<Json> ConnectCenterRequest::getDeviceInfo(const std::string& deviceId, int& status, std::string& msg) {
    return requestIntercept(rawValue(CENTER_HTTP_PATH::GET_DEVICE_INFO) + "?deviceId=" + queryValue(deviceId),
                            std::nullopt, MethodType::get, {}, status, msg);
}

std::optional<Json> ConnectCenterRequest::getDeviceList(int& status, std::string& msg) {
    return requestIntercept(rawValue(CENTER_HTTP_PATH::GET_DEVICE_LIST), std::nullopt, MethodType::get, {}, status,
                            msg);
}

std::optional<Json> ConnectCenterRequest::createEvent(const Json& data, int& status, std::string& msg) {
    return requestIntercept(rawValue(CENTER_HTTP_PATH::CREATE_EVENT), data, MethodType::post, {}, status, msg);
}

std::optional<Json> ConnectCenterRequest::reportEvent(const Json& data, int& status, std::string& msg) {
    return requestIntercept(rawValue(CENTER_HTTP_PATH::REPORT_EVENT), data, MethodType::post, {}, status, msg);
}

std::optional<Json> ConnectCenterRequest::getEvent(const std::string& eventId, int& status, std::string& msg) {
    return requestIntercept(rawValue(CENTER_HTTP_PATH::GET_EVENT) + "?eventId=" + queryValue(eventId), std::nullopt,
                            MethodType::get, {}, status, msg);
}

}  // namespace kesu
