#include "child_process.h"

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include "scoped.h"

namespace kyto {

namespace {

// A close-on-exec copy of fd above the standard descriptors: the child's dup2 onto 0, 1
// and 2 then never overwrites one source with another, also when the caller runs with a
// standard descriptor closed.  Invalid stays invalid.
UniqueFd CopyAboveStd(int fd) {
    return UniqueFd(fd >= 0 ? fcntl(fd, F_DUPFD_CLOEXEC, STDERR_FILENO + 1) : -1);
}

// The descriptor the child makes its standard output or error: the caller's, /dev/null,
// or none (-1: the inherited one stays).
int ChildSource(int requested, const UniqueFd& copy, const UniqueFd& devNull) {
    if (requested >= 0)
        return copy.get();
    return requested == kChildDevNull ? devNull.get() : -1;
}

// Writes pid in decimal without allocating (the child may not allocate).
void WritePid(int fd, pid_t pid) {
    char digits[24];
    size_t at = sizeof(digits);
    unsigned long value = static_cast<unsigned long>(pid);
    do {
        digits[--at] = static_cast<char>('0' + value % 10);
        value /= 10;
    } while (value != 0 && at > 0);
    ssize_t ignored = write(fd, digits + at, sizeof(digits) - at);
    (void)ignored;
}

}  // namespace

ChildProcess::StartResult ChildProcess::Start(const ChildSetup& setup) {
    UniqueFd opened(open("/dev/null", O_RDWR | O_CLOEXEC));
    UniqueFd devNull = CopyAboveStd(opened.get());
    opened.reset();
    UniqueFd outCopy = CopyAboveStd(setup.stdoutFd);
    UniqueFd errCopy = CopyAboveStd(setup.stderrFd);
    const int inSource = devNull.get();
    const int outSource = ChildSource(setup.stdoutFd, outCopy, devNull);
    const int errSource = ChildSource(setup.stderrFd, errCopy, devNull);

    struct sigaction defaultAction = {};
    defaultAction.sa_handler = SIG_DFL;
    sigemptyset(&defaultAction.sa_mask);
    sigset_t all;
    sigset_t none;
    sigset_t callerMask;
    sigfillset(&all);
    sigemptyset(&none);
    // No handler of the caller may run in the child before its dispositions are reset.
    sigprocmask(SIG_SETMASK, &all, &callerMask);

    pid_t child = fork();
    if (child != 0) {
        sigprocmask(SIG_SETMASK, &callerMask, nullptr);
        if (child < 0)
            return kForkFailed;
        pid_ = child;
        return kStarted;
    }

    // Child: async-signal-safe calls only.  dup2 clears close-on-exec on the copies.
    if (inSource >= 0)
        dup2(inSource, STDIN_FILENO);
    if (outSource >= 0)
        dup2(outSource, STDOUT_FILENO);
    if (errSource >= 0)
        dup2(errSource, STDERR_FILENO);
    if (setup.pidFile != nullptr) {
        int pidFd = open(setup.pidFile, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
        if (pidFd < 0) {
            sigprocmask(SIG_SETMASK, &callerMask, nullptr);
            return kInChildPidFileFailed;
        }
        WritePid(pidFd, getpid());
        close(pidFd);
    }
    for (int sig = 1; sig < NSIG; ++sig)
        sigaction(sig, &defaultAction, nullptr);  // SIGKILL, SIGSTOP: refused, harmless
    sigprocmask(SIG_SETMASK, &none, nullptr);
    execv(setup.program, setup.argv);
    _exit(1);
}

pid_t ChildProcess::Wait(int* status) {
    pid_t r = WaitForChild(pid_, status);
    // Reaped, or not ours to wait for (a caller ignoring SIGCHLD): either way the pid
    // must not be signalled later, it may already name another process.
    pid_ = -1;
    return r;
}

ChildProcess::~ChildProcess() {
    if (pid_ <= 0)
        return;
    kill(pid_, SIGKILL);
    int status = 0;
    WaitForChild(pid_, &status);
}

}  // namespace kyto
