#include "support/TestSupport.h"

#include "connect/ConnectionState.h"
#include "core/Endpoints.h"
#include "platform/SystemInfo.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "reports/DeviceListReporter.h"

namespace kesu::test {

TempDir::TempDir() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "kesu-test-XXXXXX").string();
    if (mkdtemp(tmpl.data()) == nullptr) throw std::runtime_error("mkdtemp failed");
    path_ = tmpl;
}

TempDir::~TempDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
}

std::string TempDir::write(const std::string& relative, const std::string& content) const {
    auto full = path_ / relative;
    std::filesystem::create_directories(full.parent_path());
    std::ofstream out(full, std::ios::binary | std::ios::trunc);
    out << content;
    return full.string();
}

ScopedEnv::ScopedEnv(std::string name, std::optional<std::string> value) : name_(std::move(name)) {
    if (const char* old = std::getenv(name_.c_str())) old_ = old;
    if (value) setenv(name_.c_str(), value->c_str(), 1);
    else unsetenv(name_.c_str());
}

ScopedEnv::~ScopedEnv() {
    if (old_) setenv(name_.c_str(), old_->c_str(), 1);
    else unsetenv(name_.c_str());
}

HermeticEnv::HermeticEnv()
    : home_("HOME", dir_.str() + "/home"), root_("KESU_ROOT", dir_.str() + "/root"), saved_(Config::current()) {
    std::filesystem::create_directories(home());
    std::filesystem::create_directories(root());
    Config::current() = Config();
}

HermeticEnv::~HermeticEnv() {
    // A pre-connect list report a test set off must not outlive the Config it was sent under.
    ReportDevicesV2::instance().cancel();
    Config::current() = saved_;
}

void resetSharedStateForTest() {
    ConnectionState::resetForTest();
    SystemInfo::resetForTest();
    Endpoints::setConnectCenterServerUrl("");
}

std::string readAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream out;
    out << in.rdbuf();
    return out.str();
}

int freeTcpPort() {
    int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = 0;
    ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    socklen_t len = sizeof addr;
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
    int port = ntohs(addr.sin_port);
    ::close(fd);
    return port;
}

}  // namespace kesu::test
