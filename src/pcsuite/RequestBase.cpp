#include "pcsuite/RequestBase.h"

#include <httplib.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <thread>

#include "core/Config.h"
#include "core/Text.h"
#include "core/Log.h"
#include "core/Text.h"

namespace kesu {

std::string rawValue(MethodType method) { return method == MethodType::get ? "GET" : "POST"; }

std::string rawValue(ContentType type) {
    return type == ContentType::form ? "application/x-www-form-urlencoded" : "application/json";
}

namespace {

constexpr int kMaxAttempts = 3;

std::string lowered(std::string s) {
    std::transform(s.begin(), s.end(), s.begin(), [](unsigned char c) { return std::tolower(c); });
    return s;
}

bool sameHeaderName(const std::string& a, const std::string& b) { return lowered(a) == lowered(b); }

// The origin ("scheme://host:port") and the request target ("/path?query") of a URL.
struct UrlParts {
    std::string origin;
    std::string target;
};

std::optional<UrlParts> splitUrl(const std::string& url) {
    const auto schemeEnd = url.find("://");
    if (schemeEnd == std::string::npos) return std::nullopt;
    const std::string scheme = lowered(url.substr(0, schemeEnd));
    if (scheme != "http" && scheme != "https") return std::nullopt;
    const std::string rest = url.substr(schemeEnd + 3);
    const auto authorityEnd = rest.find_first_of("/?#");
    const std::string authority = rest.substr(0, authorityEnd);
    if (authority.empty() || authority.find_first_of(" \t\r\n@") != std::string::npos) return std::nullopt;
    std::string target = authorityEnd == std::string::npos ? "/" : rest.substr(authorityEnd);
    if (const auto fragment = target.find('#'); fragment != std::string::npos) target.erase(fragment);
    if (target.empty() || target.front() != '/') target.insert(target.begin(), '/');
    return UrlParts{scheme + "://" + authority, target};
}

// An answer counts only when it is a non-empty object or array.
bool isEmptyAnswer(const Json& j) {
    if (j.is_object() || j.is_array()) return j.empty();
    return true;
}

constexpr std::array<const char*, 6> kCredentialWords{"token", "password", "passwd", "secret", "authorization",
                                                      "cookie"};

bool isCredentialName(const std::string& name) {
    const std::string n = lowered(name);
    return std::any_of(kCredentialWords.begin(), kCredentialWords.end(),
                       [&](const char* word) { return n.find(word) != std::string::npos; });
}

// A credential as the log shows it: its first and last three characters around "****", or
// "****" alone when it is too short to keep any of it.
std::string maskedValue(const std::string& value) {
    if (value.empty()) return value;
    const std::string shown = text::paramAddMask(value);
    return shown == value ? "****" : shown;
}

// Masks, in a text that is not JSON, the value after every credential word followed by "="
// or ":" ("token=abc", "Token: abc", "'token':'abc'"); true when anything was masked.
bool maskCredentialPairs(std::string& text) {
    const std::string low = lowered(text);
    const auto isValueEnd = [](char c) {
        return std::isspace(static_cast<unsigned char>(c)) || c == '"' || c == '\'' || c == '&' || c == ',' ||
               c == ';' || c == '}' || c == '<';
    };
    std::string out;
    std::size_t copied = 0;
    bool masked = false;
    // The next place of each word, searched again only once the scan has passed it, so that a
    // long text is read about once per word.
    std::array<std::size_t, kCredentialWords.size()> next{};
    for (std::size_t w = 0; w < kCredentialWords.size(); ++w) next[w] = low.find(kCredentialWords[w]);
    for (std::size_t pos = 0; pos < low.size();) {
        std::size_t hit = std::string::npos;
        std::size_t wordLength = 0;
        for (std::size_t w = 0; w < kCredentialWords.size(); ++w) {
            if (next[w] != std::string::npos && next[w] < pos) next[w] = low.find(kCredentialWords[w], pos);
            if (next[w] < hit) {
                hit = next[w];
                wordLength = std::char_traits<char>::length(kCredentialWords[w]);
            }
        }
        if (hit == std::string::npos) break;
        std::size_t i = hit + wordLength;
        while (i < low.size() && (std::isalnum(static_cast<unsigned char>(low[i])) || low[i] == '_')) ++i;
        while (i < low.size() && (low[i] == '"' || low[i] == '\'' || low[i] == ' ')) ++i;
        if (i < low.size() && (low[i] == '=' || low[i] == ':')) {
            ++i;
            while (i < low.size() && (low[i] == ' ' || low[i] == '"' || low[i] == '\'')) ++i;
            std::size_t end = i;
            while (end < low.size() && !isValueEnd(text[end])) ++end;
            if (end > i) {
                out.append(text, copied, i - copied);
                out += maskedValue(text.substr(i, end - i));
                copied = end;
                masked = true;
            }
            i = end;
        }
        pos = std::max(i, hit + 1);
    }
    if (masked) text = out + text.substr(copied);
    return masked;
}

// Masks credential members in place; true when anything was masked.
bool maskCredentials(Json& j) {
    bool masked = false;
    if (j.is_object()) {
        for (auto it = j.begin(); it != j.end(); ++it) {
            if (isCredentialName(it.key()) && it->is_string()) {
                *it = maskedValue(it->get<std::string>());
                masked = true;
            } else if (isCredentialName(it.key()) && !it->is_null() && !it->is_object() && !it->is_array()) {
                *it = "****";
                masked = true;
            } else {
                masked = maskCredentials(*it) || masked;
            }
        }
    } else if (j.is_array()) {
        for (auto& item : j) masked = maskCredentials(item) || masked;
    }
    return masked;
}

// A framed text "N#json": the position just after '#', or npos.
std::size_t framedJsonStart(const std::string& text) {
    const auto hash = text.find('#');
    if (hash == std::string::npos || hash == 0 || hash > 12) return std::string::npos;
    for (std::size_t i = 0; i < hash; ++i)
        if (!std::isdigit(static_cast<unsigned char>(text[i]))) return std::string::npos;
    return hash + 1;
}

}  // namespace

RequestBase::Answer RequestBase::exchange(const std::string& url, const std::string& method, const std::string& body,
                                          const Headers& headers, std::chrono::milliseconds timeout) {
    Answer answer;
    const auto parts = splitUrl(url);
    if (!parts) {
        answer.error = "invalid URL";
        return answer;
    }
    const Config& config = Config::current();
    const std::size_t maxBody = config.httpMaxAnswerBody;

    httplib::Client client(parts->origin);
    if (!client.is_valid()) {
        answer.error = "invalid URL";
        return answer;
    }
    client.set_connection_timeout(timeout);
    client.set_read_timeout(timeout);
    client.set_write_timeout(timeout);
    client.set_keep_alive(false);
    client.set_follow_location(false);
    client.enable_server_certificate_verification(true);
    if (!config.caCertPath.empty()) client.set_ca_cert_path(config.caCertPath);

    httplib::Request request;
    request.method = method;
    request.path = parts->target;
    for (const auto& [name, value] : headers) request.headers.emplace(name, value);
    request.body = body;

    // The answer is collected here so that its size and the overall deadline are checked
    // while it arrives, not after.
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    std::string received;
    bool tooLarge = false;
    bool late = false;
    request.content_receiver = [&](const char* data, std::size_t length, std::uint64_t, std::uint64_t) {
        if (received.size() + length > maxBody) {
            tooLarge = true;
            return false;
        }
        if (std::chrono::steady_clock::now() > deadline) {
            late = true;
            return false;
        }
        received.append(data, length);
        return true;
    };

    httplib::Result result = client.send(request);
    if (!result) {
        answer.error = tooLarge ? "answer larger than " + std::to_string(maxBody) + " bytes"
                       : late   ? "no complete answer in time"
                                : httplib::to_string(result.error());
        return answer;
    }
    answer.responded = true;
    answer.status = result->status;
    answer.body = std::move(received);
    return answer;
}

Json RequestBase::http(const std::string& baseUrl, const std::string& path, const std::optional<std::string>& body,
                       MethodType method, const Headers& requestHeader, int& status, std::string& msg) {
    Log::mPrintlog("[RequestBase][http] path: " + path);
    const std::string url = baseUrl + path;

    Headers headers{{"Content-Type", rawValue(ContentType::json)}};
    for (const auto& header : requestHeader) {
        std::erase_if(headers, [&](const auto& pair) { return sameHeaderName(pair.first, header.first); });
        headers[header.first] = header.second;
    }

    const Config& config = Config::current();
    const std::chrono::milliseconds timeout = config.httpRequestTimeout;
    const std::chrono::milliseconds pause = config.http429Pause;

    Answer answer;
    std::string answerText;  // the answer as UTF-8 text, empty when it is not UTF-8
    for (int attempt = 1; attempt <= kMaxAttempts; ++attempt) {
        answer = exchange(url, rawValue(method), body.value_or(std::string()), headers, timeout);
        if (!answer.responded) {
            Log::mPrintlog("[RequestBase][http] Invalid response, path: " + path + " error is: " + answer.error);
            break;
        }
        answerText = text::isValidUtf8(answer.body) ? answer.body : std::string();
        Log::mPrintlog("[RequestBase][http] http client have respond data! " + path +
                         " data: " + maskForLog(answerText) + "\n");
        if (answer.status != static_cast<int>(StatusCode::TOOMANYREQUESTS)) break;
        Log::mPrintlog("[RequestBase][http] http request status code is 429, request again, request num: " +
                         std::to_string(attempt) + "\n");
        if (attempt == kMaxAttempts) break;
        std::this_thread::sleep_for(pause);
    }

    if (answer.responded) {
        status = answer.status;
        if (const auto parsed = json::parse(answerText); parsed && !isEmptyAnswer(*parsed)) {
            status = static_cast<int>(json::integer(*parsed, "code"));
            msg = json::str(*parsed, "msg");
            return *parsed;
        }
        if (!answerText.empty()) msg = answerText;
    }
    Log::mPrintlog("[RequestBase][http] " + url + " timeout 20s \n");
    return Json{{"error", "timeout"}};
}

Json RequestBase::post(const std::string& baseUrl, const std::string& path, const std::optional<std::string>& body,
                       const Headers& requestHeader, int& status, std::string& msg) {
    return http(baseUrl, path, body, MethodType::post, requestHeader, status, msg);
}

Json RequestBase::get(const std::string& baseUrl, const std::string& path, const std::optional<std::string>& body,
                      const Headers& requestHeader, int& status, std::string& msg) {
    return http(baseUrl, path, body, MethodType::get, requestHeader, status, msg);
}

bool RequestBase::urlSessionPost(const std::string& jPara, const std::string& jIphttp) {
    const Answer answer = exchange(jIphttp, rawValue(MethodType::post), jPara,
                                   {{"Content-Type", rawValue(ContentType::form)}}, Config::current().httpWaitTimeout);
    if (answer.responded) {
        Log::mPrintlog("[Notify Pcsuite] Notify Server to accept mirroscreen data success\n");
        return true;
    }
    Log::mPrintlog("[Notify Pcsuite] Notify Server to accept mirroscreen data but no response return\n");
    return false;
}

std::string RequestBase::maskForLog(const std::string& text) {
    // Texts without credentials are logged exactly as they are.
    const std::string low = lowered(text);
    const bool mentionsCredential = std::any_of(kCredentialWords.begin(), kCredentialWords.end(),
                                                [&](const char* word) { return text::contains(low, word); });
    if (!mentionsCredential) return text;
    if (auto parsed = json::parse(text)) {
        return maskCredentials(*parsed) ? json::compact(*parsed) : text;
    }
    if (const auto start = framedJsonStart(text); start != std::string::npos) {
        if (auto parsed = json::parse(std::string_view(text).substr(start))) {
            return maskCredentials(*parsed) ? text.substr(0, start) + json::compact(*parsed) : text;
        }
    }
    // Not JSON (an error page, a form body): "name=value" and "name: value" pairs.
    std::string shown = text;
    maskCredentialPairs(shown);
    return shown;
}

}  // namespace kesu
