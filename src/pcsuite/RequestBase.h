// The service's outbound HTTP(S) client: one blocking exchange with a time-out, and the
// request operation that retries on HTTP 429 and hands back the answer as JSON.
#pragma once

#include <chrono>
#include <map>
#include <optional>
#include <string>

#include "core/Json.h"

namespace kesu {

enum class MethodType { post, get };
std::string rawValue(MethodType method);  // "POST", "GET"

enum class ContentType { json, form };
std::string rawValue(ContentType type);  // "application/json", "application/x-www-form-urlencoded"

enum class StatusCode : int { Success = 200, TOOMANYREQUESTS = 429 };

class RequestBase {
public:
    using Headers = std::map<std::string, std::string>;

    // What one exchange brought back. `responded` is false when no HTTP response arrived
    // (refused, unreachable, time-out, certificate rejected, answer too large).
    struct Answer {
        bool responded = false;
        int status = 0;
        std::string body;
        std::string error;  // the transport error when nothing arrived
    };

    // Sends `method` to `url` ("http://host:port/path?query" or https) and waits for the
    // whole answer, at most `timeout` for connecting and for the answer. https verifies the
    // server's certificate (system trust store, or Config::caCertPath when set).
    static Answer exchange(const std::string& url, const std::string& method, const std::string& body,
                           const Headers& headers, std::chrono::milliseconds timeout);

    // One request to baseUrl + path with "Content-Type: application/json" unless the caller
    // gives its own. Up to 3 attempts while the answer is HTTP 429. The result is the answer
    // JSON with `status` = its "code" and `msg` = its "msg"; {"error": "timeout"} when the
    // answer is empty or not JSON (`status` = the HTTP status, `msg` = the answer text) or
    // when no response arrived (`status` and `msg` keep the caller's values).
    static Json http(const std::string& baseUrl, const std::string& path, const std::optional<std::string>& body,
                     MethodType method, const Headers& requestHeader, int& status, std::string& msg);
    static Json post(const std::string& baseUrl, const std::string& path, const std::optional<std::string>& body,
                     const Headers& requestHeader, int& status, std::string& msg);
    static Json get(const std::string& baseUrl, const std::string& path, const std::optional<std::string>& body,
                    const Headers& requestHeader, int& status, std::string& msg);

    // POSTs `jPara` to the URL `jIphttp`; true when an answer came back.
    static bool urlSessionPost(const std::string& jPara, const std::string& jIphttp);

    // A text fit for the log: in a JSON text (optionally "N#"-framed) every string member
    // whose name mentions a token, a password or a secret is masked; other texts unchanged.
    static std::string maskForLog(const std::string& text);
};

}  // namespace kesu
