// The end-to-end tests run the real service, which announces itself on every network
// adapter it finds. So that nothing leaves this machine, the test program moves into a
// network namespace of its own before anything else runs: only loopback and a veth pair
// with a test address exist there, both ends inside. Services started by the tests
// inherit it. Without that namespace (not root) the tests that start
// the service skip.
#include <sched.h>

#include <cstdlib>

#include "e2e/PrivateNetwork.h"

namespace kesu::test {

namespace {

bool enterPrivateNetwork() {
    if (unshare(CLONE_NEWNET) != 0) return false;
    return std::system("ip link set lo up && ip link add kesu-e2e0 type veth peer name kesu-e2e1 && "
                       "ip addr add 10.77.9.1/24 dev kesu-e2e0 && ip link set kesu-e2e0 up && "
                       "ip link set kesu-e2e1 up") == 0;
}

const bool privateNetwork = enterPrivateNetwork();

}  // namespace

bool inPrivateNetwork() { return privateNetwork; }

}  // namespace kesu::test
