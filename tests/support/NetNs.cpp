#include "support/NetNs.h"

#include <fcntl.h>
#include <sched.h>
#include <unistd.h>

#include <cstdlib>
#include <exception>
#include <thread>

namespace kesu::test {

namespace {
constexpr const char* kLeftoverNodes[] = {"pc", "phone", "phone2", "n0", "n1", "n2", "n3"};
}

bool NetNsLab::ip(const std::string& args) {
    std::string cmd = "ip " + args + " >/dev/null 2>&1";
    return std::system(cmd.c_str()) == 0;
}

bool NetNsLab::runIn(const std::string& ns, const std::function<void()>& fn) {
    bool entered = false;
    std::exception_ptr failure;
    // setns() moves only the calling thread, so a short-lived thread does the work.
    std::thread worker([&] {
        const int fd = ::open(("/run/netns/" + ns).c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0) return;
        entered = ::setns(fd, CLONE_NEWNET) == 0;
        ::close(fd);
        if (!entered) return;
        try {
            fn();
        } catch (...) {
            failure = std::current_exception();
        }
    });
    worker.join();
    if (failure) std::rethrow_exception(failure);
    return entered;
}

bool NetNsLab::available(std::string* why) {
    if (::geteuid() != 0) {
        if (why) *why = "not running as root";
        return false;
    }
    if (!ip("netns list")) {
        if (why) *why = "`ip netns` does not work here";
        return false;
    }
    // Creating one proves that the kernel lets us (containers may not).
    std::string probe = "kesuprobe" + std::to_string(::getpid());
    bool made = ip("netns add " + probe);
    ip("netns del " + probe);
    if (!made && why) *why = "`ip netns add` fails (no CAP_SYS_ADMIN?)";
    return made;
}

NetNsLab::NetNsLab(std::string tag, bool bridged) : tag_(std::move(tag)), bridged_(bridged) {
    removeLeftovers();
    if (bridged_) {
        bridgeNs_ = "kesu" + tag_ + "-br";
        if (!run("netns add " + bridgeNs_)) return;
        namespaces_.push_back(bridgeNs_);
        run("-n " + bridgeNs_ + " link add br0 type bridge mcast_snooping 0") &&
            run("-n " + bridgeNs_ + " link set br0 up") && run("-n " + bridgeNs_ + " link set lo up");
    }
}

NetNsLab::~NetNsLab() {
    // Deleting a namespace removes its veth ends, and with them their peers.
    for (auto it = namespaces_.rbegin(); it != namespaces_.rend(); ++it) ip("netns del " + *it);
}

void NetNsLab::removeLeftovers() {
    ip("netns del kesu" + tag_ + "-br");
    for (const char* n : kLeftoverNodes) ip("netns del kesu" + tag_ + "-" + n);
}

bool NetNsLab::run(const std::string& args) {
    if (!ok_) return false;
    if (ip(args)) return true;
    ok_ = false;
    error_ = "ip " + args + " failed";
    return false;
}

NetNsLab::Node NetNsLab::addNode(const std::string& name, int host) {
    Node node{"kesu" + tag_ + "-" + name, "veth0", "10.77.0." + std::to_string(host)};
    if (!ok_ || host < 1 || host > 254) return {};
    if (!run("netns add " + node.ns)) return {};
    namespaces_.push_back(node.ns);
    const std::string n = "-n " + node.ns + " ";
    if (bridged_) {
        std::string peer = "p" + std::to_string(nodes_.size());
        if (!run(n + "link add veth0 type veth peer name " + peer + " netns " + bridgeNs_) ||
            !run("-n " + bridgeNs_ + " link set " + peer + " master br0") ||
            !run("-n " + bridgeNs_ + " link set " + peer + " up"))
            return {};
    } else if (nodes_.size() == 1) {
        if (!run(n + "link add veth0 type veth peer name veth0 netns " + nodes_[0].ns) ||
            !run("-n " + nodes_[0].ns + " addr add " + nodes_[0].ip + "/24 dev veth0") ||
            !run("-n " + nodes_[0].ns + " link set veth0 up") ||
            !run("-n " + nodes_[0].ns + " route add 224.0.0.0/4 dev veth0"))
            return {};
    } else if (nodes_.size() > 1) {
        ok_ = false;
        error_ = "an unbridged lab holds two nodes";
        return {};
    }
    run(n + "link set lo up");
    // The first node of an unbridged lab gets its address once its peer exists.
    if (bridged_ || !nodes_.empty()) {
        if (!run(n + "addr add " + node.ip + "/24 dev veth0") || !run(n + "link set veth0 up") ||
            !run(n + "route add 224.0.0.0/4 dev veth0"))
            return {};
    }
    nodes_.push_back(node);
    return node;
}

}  // namespace kesu::test
