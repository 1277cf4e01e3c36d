#include "control/RequestHandle.h"

#include "core/Log.h"

namespace kesu {

namespace {

// The JSON part of a body: the text after the first "#", or the whole text without one.
// Empty pieces are left out, so a leading "#" only marks the start of the JSON.
std::string jsonPart(const std::string& body) {
    const auto start = body.find_first_not_of('#');
    if (start == std::string::npos) return {};
    const auto hash = body.find('#', start);
    if (hash == std::string::npos) return body.substr(start);
    std::string rest = body.substr(hash + 1);
    return rest.empty() ? body.substr(start, hash - start) : rest;
}

}  // namespace

std::optional<Json> RequestHandle::parseJson(const std::string& jsonString) const {
    if (isEmpty(jsonString)) return std::nullopt;
    // Text that is not JSON (or nests absurdly deep) reads as null: every member is missing.
    return json::parse(jsonString).value_or(Json());
}

requestObj RequestHandle::format(const std::string& requestStr) const {
    requestObj request;
    if (isEmpty(requestStr)) return request;
    const std::string jsonText = jsonPart(requestStr);
    if (isEmpty(jsonText)) return request;
    const auto parsed = parseJson(jsonText);
    if (!parsed) {
        Log::mPrintlog("[formatRequest] jsonData is nil");
        return request;
    }
    const Json& envelope = *parsed;
    std::string eventName = json::str(envelope, "event");
    Json params;
    if (envelope.is_object() && envelope.contains("args")) params = envelope["args"];
    if (eventName.empty()) {
        eventName = json::str(envelope, "cmd");
        params = envelope.is_object() && envelope.contains("param") ? envelope["param"] : Json();
    }
    if (params.is_object() || params.is_array() || params.is_string()) request.params = std::move(params);
    if (envelope.is_object()) {
        auto app = envelope.find("app");
        if (app != envelope.end() && app->is_string()) request.source = app->get<std::string>();
    }
    request.event = requestEventFrom(eventName);
    return request;
}

}  // namespace kesu
