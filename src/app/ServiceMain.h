// The service's life: start-up in its fixed order, then wait for a stop signal.
#pragma once

namespace kesu {

// Runs the service until SIGTERM or SIGINT; returns the process exit code.
int runService();

}  // namespace kesu
