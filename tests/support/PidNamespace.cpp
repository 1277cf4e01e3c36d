#include "support/PidNamespace.h"

#include <errno.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <cstring>

namespace kesu::test {

namespace {

struct ChildArgs {
    char* const* argv;
    char* const* envp;
    int outFd;
    int errFd;
};

// The child is a copy of a process that may run many threads: only async-signal-safe calls
// from here to the exec.
[[noreturn]] void fail(const char* what) {
    const int err = errno;
    char digits[16];
    int n = 0;
    for (int e = err; n == 0 || e > 0; e /= 10) digits[n++] = static_cast<char>('0' + e % 10);
    const char prefix[] = "pid namespace launcher: ";
    (void)!::write(2, prefix, sizeof prefix - 1);
    (void)!::write(2, what, std::strlen(what));
    (void)!::write(2, " failed, errno ", 15);
    while (n > 0) (void)!::write(2, &digits[--n], 1);
    (void)!::write(2, "\n", 1);
    ::_exit(127);
}

int childMain(void* raw) {
    const auto* args = static_cast<const ChildArgs*>(raw);
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (args->outFd >= 0 && ::dup2(args->outFd, STDOUT_FILENO) < 0) fail("dup2 stdout");
    if (args->errFd >= 0 && ::dup2(args->errFd, STDERR_FILENO) < 0) fail("dup2 stderr");
    // The new /proc stays in this mount namespace: nothing propagates back to the machine.
    if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) fail("making / private");
    if (::mount("proc", "/proc", "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, nullptr) != 0) fail("mounting /proc");
    struct sigaction dfl {};
    dfl.sa_handler = SIG_DFL;
    for (int sig = 1; sig < NSIG; ++sig)
        if (sig != SIGKILL && sig != SIGSTOP) ::sigaction(sig, &dfl, nullptr);
    sigset_t none;
    sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
    ::execve(args->argv[0], args->argv, args->envp);
    fail("exec");
}

}  // namespace

pid_t spawnInPidNamespace(char* const argv[], char* const envp[], int outFd, int errFd) {
    constexpr std::size_t kStackSize = 256 * 1024;
    void* stack = ::mmap(nullptr, kStackSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
    if (stack == MAP_FAILED) return -1;
    ChildArgs args{argv, envp, outFd, errFd};
    // Without CLONE_VM the child works on its own copy of this memory, stack included, so
    // the stack can go as soon as clone() returns.
    const pid_t pid = ::clone(childMain, static_cast<char*>(stack) + kStackSize, CLONE_NEWPID | CLONE_NEWNS | SIGCHLD,
                              &args);
    const int err = errno;
    ::munmap(stack, kStackSize);
    errno = err;
    return pid;
}

}  // namespace kesu::test
