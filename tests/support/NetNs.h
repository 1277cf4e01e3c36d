// Network namespaces for end-to-end tests: a small lab of namespaces joined by veth pairs,
// either directly (two nodes) or through a bridge namespace, with addresses in 10.77.0.0/24
// and a multicast route, all removed again at the end of the scope.
#pragma once

#include <functional>
#include <string>
#include <vector>

namespace kesu::test {

class NetNsLab {
public:
    struct Node {
        std::string ns;    // namespace name, for `ip netns exec`
        std::string ifname;  // the node's veth end inside its namespace
        std::string ip;    // its address (without prefix length)
    };

    // Whether namespaces can be made here (root, and `ip netns` works); `why` says why not.
    static bool available(std::string* why = nullptr);

    // `tag` makes the names unique to one test (a few letters); namespaces of the same names
    // left over from a crashed run are removed first. With `bridged`, every node hangs off a
    // bridge in its own namespace (multicast snooping off); otherwise at most two nodes are
    // joined by one veth pair.
    NetNsLab(std::string tag, bool bridged);
    ~NetNsLab();
    NetNsLab(const NetNsLab&) = delete;
    NetNsLab& operator=(const NetNsLab&) = delete;

    // Adds a node with address 10.77.0.<host>; empty ns in the result when it failed.
    Node addNode(const std::string& name, int host);
    bool ok() const { return ok_; }
    const std::string& error() const { return error_; }

    // Runs `ip` with the arguments; true on exit code 0.
    static bool ip(const std::string& args);

    // Runs `fn` on a thread of its own that has entered the namespace `ns` (made by `ip netns
    // add`). Sockets `fn` opens belong to that namespace for good, whichever thread uses them
    // later. False when the namespace could not be entered (then `fn` did not run); an
    // exception from `fn` is passed on.
    static bool runIn(const std::string& ns, const std::function<void()>& fn);

private:
    void removeLeftovers();
    bool run(const std::string& args);

    std::string tag_;
    bool bridged_;
    std::string bridgeNs_;
    std::vector<std::string> namespaces_;
    std::vector<Node> nodes_;
    bool ok_ = true;
    std::string error_;
};

}  // namespace kesu::test
