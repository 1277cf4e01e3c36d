// Whether the end-to-end test program runs in a network namespace of its own.
#pragma once

namespace kesu::test {

bool inPrivateNetwork();

}  // namespace kesu::test
