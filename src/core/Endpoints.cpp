#include "core/Endpoints.h"

#include <mutex>
#include <regex>
#include <sstream>

#include "core/Config.h"
#include "core/Files.h"
#include "core/Log.h"

namespace kesu {

namespace {

// Lines of the host override file longer than this cannot hold a usable URL and are skipped
// (the regular-expression engine recurses per character).
constexpr std::size_t maxOverrideLineLength = 4096;

std::mutex overrideLock;
std::string connectCenterOverride;  // empty: the configured default is in use

std::string httpBase(const std::string& host, int port) {
    return "http://" + host + ":" + std::to_string(port) + "/";
}

}  // namespace

std::optional<std::string> Endpoints::parseSwitchHost(std::string_view content) {
    std::regex expression;
    try {
        expression = std::regex(R"((ConnectionCenterHost=\S*))");
    } catch (const std::regex_error& e) {
        Log::mPrintlog(std::string("[Endpoints::getConnectCenterUrl] regex Error: ") + e.what());
        return std::nullopt;
    }
    // A match never spans a line end, so the text is searched line by line.
    std::istringstream lines{std::string(content)};
    for (std::string line; std::getline(lines, line);) {
        if (line.size() > maxOverrideLineLength) continue;
        std::smatch match;
        if (std::regex_search(line, match, expression)) return match[1].str();
    }
    return std::nullopt;
}

void Endpoints::getConnectCenterUrl() {
    const std::string path = rootedPath(Config::current().switchHostIni);
    if (!Files::isFileExist(path)) return;
    std::string content;
    Files::readFile(path, content);
    const auto matched = parseSwitchHost(content);
    if (!matched) return;

    Log::mPrintlog("[Endpoints::getConnectCenterUrl] ConnectCenterUrl: " + *matched);
    // Everything after the first "=" is the URL (a URL may itself hold "=").
    const std::string value = matched->substr(matched->find('=') + 1);
    if (!value.empty()) setConnectCenterServerUrl(value);
    Log::mPrintlog("[Endpoints::getConnectCenterUrl] connectCenterServerUrl: " + connectCenterServerUrl());
}

std::string Endpoints::pcsuiteHttpServerUrl() {
    const Config& config = Config::current();
    return httpBase(config.pcsuiteHost, config.pcsuitePort);
}

std::string Endpoints::kesuConnHttpServerUrl() {
    const Config& config = Config::current();
    return httpBase(config.controlHost, config.controlPort);
}

std::string Endpoints::pcsuiteHttpServerSSDPQueryAllUrl() { return pcsuiteHttpServerUrl() + "SSDPQueryAll"; }

std::string Endpoints::pcsuiteHttpServerPushGattClientListUrl() {
    return pcsuiteHttpServerUrl() + "RH2RF_PUSH_GATT_CLIENT_LIST";
}

std::string Endpoints::pcsuiteHttpIsConnectBusyUrl() { return pcsuiteHttpServerUrl() + "isConnectBusy?deviceType="; }

std::string Endpoints::pcsuiteHttpServerNotifySystemEventUrl() { return pcsuiteHttpServerUrl() + "notifySystemEvent"; }

std::string Endpoints::connectCenterServerUrl() {
    std::lock_guard<std::mutex> guard(overrideLock);
    return connectCenterOverride.empty() ? Config::current().defaultConnectCenterUrl : connectCenterOverride;
}

void Endpoints::setConnectCenterServerUrl(const std::string& url) {
    std::lock_guard<std::mutex> guard(overrideLock);
    connectCenterOverride = url;
}

}  // namespace kesu
