// Starts a program as the first process (PID 1) of a PID namespace of its own, with a /proc
// of its own, so that the process list it reads holds only itself and what it starts: the
// service under test then passes its single-instance check while another copy runs on the
// machine. Shared by the end-to-end tests and the benchmarks.
#pragma once

#include <sys/types.h>

namespace kesu::test {

// `argv[0]` is an absolute path. `outFd` and `errFd` become the child's standard output and
// error (-1: inherited). The child starts with no blocked signals and default dispositions.
// It is killed (SIGKILL) when the calling thread ends, and everything it started goes with
// it, so a test killed midway leaves nothing running. Returns the child's pid as this
// process sees it, for waitpid() and kill(): a signal the child blocks (as the service does
// with SIGTERM and SIGINT, to sigwait() for them) is queued for it like for any process.
// -1 with errno set when the namespace cannot be made (it needs CAP_SYS_ADMIN); a failure
// in the child (mounting /proc, exec) is written to its standard error, exit code 127.
pid_t spawnInPidNamespace(char* const argv[], char* const envp[], int outFd, int errFd);

}  // namespace kesu::test
