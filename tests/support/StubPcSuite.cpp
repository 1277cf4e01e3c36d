#include "support/StubPcSuite.h"

#include <stdexcept>

namespace kesu::test {

namespace {

// A request the stub answers without recording: proves the accept loop runs.
const char* const kReadyPath = "/__stub_ready__";

}  // namespace

std::string RecordedRequest::header(const std::string& name) const {
    auto it = headers.find(name);
    return it == headers.end() ? std::string() : it->second;
}

std::string RecordedRequest::param(const std::string& name) const {
    auto it = params.find(name);
    return it == params.end() ? std::string() : it->second;
}

StubPcSuite::StubPcSuite() : server_(std::make_unique<httplib::Server>()) { start("127.0.0.1", 0); }

StubPcSuite::StubPcSuite(const std::string& host, int port) : server_(std::make_unique<httplib::Server>()) {
    start(host, port);
}

StubPcSuite::StubPcSuite(const std::string& certPath, const std::string& keyPath)
    : tls_(true), server_(std::make_unique<httplib::SSLServer>(certPath.c_str(), keyPath.c_str())) {
    start("127.0.0.1", 0);
}

StubPcSuite::~StubPcSuite() { stop(); }

void StubPcSuite::start(const std::string& host, int port) {
    if (!server_->is_valid()) throw std::runtime_error("stub PC suite: server could not be set up");

    // Handlers per method (not the pre-routing hook) so that the body has been read.
    auto handler = [this](const httplib::Request& req, httplib::Response& res) {
        if (req.path == kReadyPath) {
            res.status = 204;
            return;
        }
        RecordedRequest recorded{req.method, req.path,  req.target, req.params,
                                 req.headers, req.body, std::chrono::steady_clock::now()};
        CannedAnswer answer;
        {
            std::lock_guard<std::mutex> lock(mutex_);
            requests_.push_back(std::move(recorded));
            answer = answerFor(req.path);
        }
        changed_.notify_all();
        if (answer.delay.count() > 0) {
            std::unique_lock<std::mutex> lock(mutex_);
            changed_.wait_for(lock, answer.delay, [this] { return stopping_; });
        }
        res.status = answer.status;
        res.set_content(answer.body, answer.contentType.c_str());
    };
    const char* const everything = ".*";
    server_->Get(everything, handler);
    server_->Post(everything, handler);
    server_->Put(everything, handler);
    server_->Patch(everything, handler);
    server_->Delete(everything, handler);
    server_->Options(everything, handler);

    if (host != "0.0.0.0") host_ = host;
    port_ = port == 0 ? server_->bind_to_any_port(host) : (server_->bind_to_port(host, port) ? port : -1);
    if (port_ <= 0) throw std::runtime_error("stub PC suite: no port to listen on");
    httplib::Server* raw = server_.get();
    listener_ = std::thread([raw] { raw->listen_after_bind(); });

    // Server::stop() is a no-op until the accept loop runs, so make sure it does.
    httplib::Client probe(baseUrl().substr(0, baseUrl().size() - 1));
    probe.enable_server_certificate_verification(false);
    probe.set_connection_timeout(std::chrono::seconds(10));
    probe.set_read_timeout(std::chrono::seconds(10));
    if (!probe.Get(kReadyPath)) {
        stop();
        throw std::runtime_error("stub PC suite: listener did not come up");
    }
}

std::string StubPcSuite::baseUrl() const {
    return std::string(tls_ ? "https" : "http") + "://" + host_ + ":" + std::to_string(port_) + "/";
}

void StubPcSuite::pointPcsuiteHere(Config& config) const {
    config.pcsuiteHost = "127.0.0.1";
    config.pcsuitePort = port_;
}

void StubPcSuite::pointControlHere(Config& config) const {
    config.controlHost = "127.0.0.1";
    config.controlPort = port_;
}

void StubPcSuite::setAnswer(const std::string& path, CannedAnswer answer) {
    std::lock_guard<std::mutex> lock(mutex_);
    answers_[path] = std::move(answer);
}

void StubPcSuite::queueAnswer(const std::string& path, CannedAnswer answer) {
    std::lock_guard<std::mutex> lock(mutex_);
    queued_[path].push_back(std::move(answer));
}

void StubPcSuite::setDefaultAnswer(CannedAnswer answer) {
    std::lock_guard<std::mutex> lock(mutex_);
    defaultAnswer_ = std::move(answer);
}

CannedAnswer StubPcSuite::answerFor(const std::string& path) {
    if (auto q = queued_.find(path); q != queued_.end() && !q->second.empty()) {
        CannedAnswer answer = std::move(q->second.front());
        q->second.pop_front();
        return answer;
    }
    if (auto a = answers_.find(path); a != answers_.end()) return a->second;
    return defaultAnswer_;
}

std::vector<RecordedRequest> StubPcSuite::requests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_;
}

std::vector<RecordedRequest> StubPcSuite::requestsTo(const std::string& path) const {
    std::lock_guard<std::mutex> lock(mutex_);
    std::vector<RecordedRequest> out;
    for (const auto& r : requests_)
        if (r.path == path) out.push_back(r);
    return out;
}

std::size_t StubPcSuite::requestCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_.size();
}

bool StubPcSuite::waitForRequests(std::size_t count, std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return requests_.size() >= count; });
}

std::optional<RecordedRequest> StubPcSuite::waitForRequest(const std::function<bool(const RecordedRequest&)>& match,
                                                         std::chrono::milliseconds timeout) const {
    std::optional<RecordedRequest> found;
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait_for(lock, timeout, [&] {
        for (const auto& r : requests_)
            if (match(r)) return found = r, true;
        return false;
    });
    return found;
}

void StubPcSuite::clearRequests() {
    std::lock_guard<std::mutex> lock(mutex_);
    requests_.clear();
}

void StubPcSuite::stop() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopping_ = true;
    }
    changed_.notify_all();
    if (server_) server_->stop();
    if (listener_.joinable()) listener_.join();
}

}  // namespace kesu::test
