// A stand-in for the PC suite's local HTTP server (or any other HTTP peer of the service) on
// an ephemeral loopback port: it records every request and answers with canned answers per
// path, optionally over https.
#pragma once

#include <httplib.h>

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "core/Config.h"

namespace kesu::test {

struct RecordedRequest {
    std::string method;
    std::string path;    // decoded, without the query ("/isConnectBusy")
    std::string target;  // as sent, query included ("/isConnectBusy?deviceType=phone")
    httplib::Params params;
    httplib::Headers headers;  // names compare case-insensitively
    std::string body;
    std::chrono::steady_clock::time_point receivedAt;

    std::string header(const std::string& name) const;  // "" when absent
    std::string param(const std::string& name) const;   // "" when absent
};

struct CannedAnswer {
    int status = 200;
    std::string body;
    std::string contentType = "application/json";
    // Time to wait before answering; stop() ends the wait early.
    std::chrono::milliseconds delay{0};
};

class StubPcSuite {
public:
    // Plain HTTP on 127.0.0.1, an ephemeral port.
    StubPcSuite();
    // Plain HTTP on a chosen address and port ("0.0.0.0" for every address).
    StubPcSuite(const std::string& host, int port);
    // https with the given certificate chain and key (PEM files).
    StubPcSuite(const std::string& certPath, const std::string& keyPath);
    ~StubPcSuite();
    StubPcSuite(const StubPcSuite&) = delete;
    StubPcSuite& operator=(const StubPcSuite&) = delete;

    int port() const { return port_; }
    // "http://127.0.0.1:PORT/" (or https).
    std::string baseUrl() const;
    // Points the PC suite's host and port of `config` at this stub.
    void pointPcsuiteHere(Config& config) const;
    // Points the control server's host and port of `config` at this stub.
    void pointControlHere(Config& config) const;

    // The answer to every request for `path` (decoded, no query: "/pcDeviceInfo").
    void setAnswer(const std::string& path, CannedAnswer answer);
    // Answers for the next requests for `path`, one each, before the setAnswer one.
    void queueAnswer(const std::string& path, CannedAnswer answer);
    // The answer for paths without one of their own; at first 200 {"code":"000000"}.
    void setDefaultAnswer(CannedAnswer answer);

    std::vector<RecordedRequest> requests() const;
    std::vector<RecordedRequest> requestsTo(const std::string& path) const;
    std::size_t requestCount() const;
    // Waits until at least `count` requests have arrived (in all) or `timeout` passed.
    bool waitForRequests(std::size_t count, std::chrono::milliseconds timeout) const;
    // Waits for the first recorded request (in arrival order) that `match` accepts; nullopt
    // at the time-out.
    std::optional<RecordedRequest> waitForRequest(const std::function<bool(const RecordedRequest&)>& match,
                                                  std::chrono::milliseconds timeout) const;
    void clearRequests();

    // Stops listening and ends delayed answers; called by the destructor.
    void stop();

private:
    void start(const std::string& host, int port);
    CannedAnswer answerFor(const std::string& path);

    bool tls_ = false;
    std::string host_ = "127.0.0.1";  // where a client reaches the stub
    std::unique_ptr<httplib::Server> server_;
    std::thread listener_;
    int port_ = 0;

    mutable std::mutex mutex_;
    mutable std::condition_variable changed_;
    bool stopping_ = false;
    std::vector<RecordedRequest> requests_;
    std::map<std::string, CannedAnswer> answers_;
    std::map<std::string, std::deque<CannedAnswer>> queued_;
    CannedAnswer defaultAnswer_{200, R"({"code":"000000"})", "application/json", std::chrono::milliseconds(0)};
};

}  // namespace kesu::test
