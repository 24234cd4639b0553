// The one runner for the programs whose descriptors the library sets up itself (wget with
// its progress log, the package tool with its upgrade log).  Everything the child needs
// (argument vector, descriptors, /dev/null) is prepared before fork, so the child only
// makes async-signal-safe calls: dup2, open, write, close, sigaction, exec and _exit.
// Programs that need no descriptor set-up run through KLIBCExec/KLIBCExecv instead.
// Internal header: not installed.
#ifndef KYTOINSTALLCPP_CHILD_PROCESS_H
#define KYTOINSTALLCPP_CHILD_PROCESS_H

#include <sys/types.h>

namespace kyto {

// Sources of the child's standard output and error besides an open descriptor.
constexpr int kChildDevNull = -1;  // /dev/null
constexpr int kChildInherit = -2;  // the caller's own descriptor, left as it is

struct ChildSetup {
    const char* program = nullptr;
    char* const* argv = nullptr;  // NULL-terminated, argv[0] included
    int stdoutFd = kChildDevNull;
    int stderrFd = kChildDevNull;
    // When set, the child writes its own pid ("%d", no newline) into this file before it
    // executes the program, so that a canceller in another process signals the program
    // itself and not the process that waits for it.
    const char* pidFile = nullptr;
};

// Owns one child: standard input from /dev/null, default signal mask and dispositions.
// A child that was started and not waited for is killed and reaped when the owner goes
// out of scope, so no early return leaves a zombie or an orphaned program behind.
class ChildProcess {
  public:
    enum StartResult {
        kStarted,
        kForkFailed,
        // Returned in the child, which did not execute the program, when it could not
        // open the pid file; the caller decides how that child goes on.
        kInChildPidFileFailed,
    };

    ChildProcess() = default;
    ~ChildProcess();
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    StartResult Start(const ChildSetup& setup);
    // Waits for the child (a signal interrupting the wait is retried) and gives up its
    // ownership.  Returns waitpid's result: the pid, or -1 with errno set.
    pid_t Wait(int* status);

  private:
    pid_t pid_ = -1;
};

}  // namespace kyto

#endif
