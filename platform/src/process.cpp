// Running programs and handling pid files.
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "platform_internal.h"

namespace {

// Largest pid file we look at; a real one holds a few digits.
constexpr size_t kPidFileMax = 64;

// Parses a pid file's content: a positive decimal number, optionally followed by blanks
// and newlines.  0 for anything else.
int ParsePid(const std::string& text) {
    size_t i = 0;
    long long pid = 0;
    while (i < text.size() && text[i] >= '0' && text[i] <= '9') {
        pid = pid * 10 + (text[i] - '0');
        if (pid > INT_MAX)
            return 0;
        ++i;
    }
    if (i == 0)
        return 0;
    for (; i < text.size(); ++i) {
        char c = text[i];
        if (c != ' ' && c != '\t' && c != '\n' && c != '\r')
            return 0;
    }
    return static_cast<int>(pid);
}

// Pid held in pidFile, > 0; or -1 with the error set.
int PidFromFile(const char* pidFile) {
    int pid = KLIBCReadPidFile(pidFile);
    return pid > 0 ? pid : -1;  // KLIBCReadPidFile set the error
}

// Waits for a child just spawned.  A program that could not be executed still yields its
// exit status 127, but the last error tells that exec failed.
int WaitReporting(pid_t pid, bool execFailed) {
    int status = kytoplat::WaitProgram(pid);
    if (execFailed)
        KYTO_FAIL(KYTO_ERR_EXEC);
    return status;
}

}  // namespace

namespace kytoplat {

int SpawnProgram(const char* prog, char* const argv[], pid_t* pid, bool* execFailed) {
    *execFailed = false;
    // The child reports a failed exec through this pipe; a successful exec closes it.
    int p[2];
    if (::pipe2(p, O_CLOEXEC) != 0) {
        KYTO_FAIL(KYTO_ERR_EXEC);
        return -1;
    }
    UniqueFd rd(p[0]);
    UniqueFd wr(p[1]);
    pid_t child = ::fork();
    if (child < 0) {
        KYTO_FAIL(KYTO_ERR_EXEC);
        return -1;
    }
    if (child == 0) {
        // Only async-signal-safe calls from here on: the parent may have other threads.
        sigset_t none;
        sigemptyset(&none);
        sigprocmask(SIG_SETMASK, &none, nullptr);
        int nul = ::open("/dev/null", O_RDONLY);
        if (nul < 0 || ::dup2(nul, STDIN_FILENO) < 0) {
            int err = errno;
            ssize_t ignored = ::write(p[1], &err, sizeof err);
            (void)ignored;
            ::_exit(127);
        }
        if (nul != STDIN_FILENO)
            ::close(nul);
        ::execv(prog, argv);
        int err = errno;
        ssize_t ignored = ::write(p[1], &err, sizeof err);
        (void)ignored;
        ::_exit(127);
    }
    wr.reset();
    int err = 0;
    ssize_t n;
    do {
        n = ::read(rd.get(), &err, sizeof err);
    } while (n < 0 && errno == EINTR);
    *execFailed = n == static_cast<ssize_t>(sizeof err);
    *pid = child;
    return 0;
}

int WaitProgram(pid_t pid) {
    int status = 0;
    pid_t r = WaitForChild(pid, &status);
    if (r < 0 || !WIFEXITED(status)) {
        KYTO_FAIL(KYTO_ERR_EXEC);
        return -1;
    }
    return WEXITSTATUS(status);
}

}  // namespace kytoplat

extern "C" {

int KLIBCExec(const char* prog, const char* a1, const char* a2, const char* a3,
              const char* a4) noexcept try {
    if (prog == nullptr || *prog == '\0') {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    // argv is complete before the fork: the child must not allocate.
    char* argv[6] = {const_cast<char*>(prog), nullptr, nullptr, nullptr, nullptr, nullptr};
    const char* args[4] = {a1, a2, a3, a4};
    for (int i = 0; i < 4 && args[i] != nullptr; ++i)
        argv[i + 1] = const_cast<char*>(args[i]);
    pid_t pid;
    bool execFailed;
    if (kytoplat::SpawnProgram(prog, argv, &pid, &execFailed) != 0)
        return -1;
    return WaitReporting(pid, execFailed);
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCExecv(const char* prog, char* const argv[], int blWait) noexcept try {
    if (prog == nullptr || *prog == '\0' || argv == nullptr || argv[0] == nullptr) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    pid_t pid;
    bool execFailed;
    if (kytoplat::SpawnProgram(prog, argv, &pid, &execFailed) != 0)
        return -1;
    if (!blWait)
        return pid;
    return WaitReporting(pid, execFailed);
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCReadPidFile(const char* path) noexcept try {
    if (path == nullptr || *path == '\0') {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    kytoplat::UniqueFd fd = kytoplat::OpenFileForReading(path);
    if (!fd.valid())
        return -1;
    std::string text;
    char buf[kPidFileMax + 1];
    while (text.size() <= kPidFileMax) {
        ssize_t n = kytoplat::ReadRetry(fd.get(), buf, sizeof buf);
        if (n < 0) {
            KYTO_FAIL(KYTO_ERR_FILE_READ);
            return -1;
        }
        if (n == 0)
            break;
        text.append(buf, static_cast<size_t>(n));
    }
    int pid = text.size() > kPidFileMax ? 0 : ParsePid(text);
    if (pid == 0)
        KYTO_FAIL(KYTO_ERR_NOT_FOUND);
    return pid;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KLIBCIsProcAlive(const char* pidFile) noexcept try {
    int pid = PidFromFile(pidFile);
    if (pid < 0)
        return 0;
    if (::kill(pid, 0) != 0) {
        KYTO_FAIL(KYTO_ERR_PROCESS);
        return 0;
    }
    return 1;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(0);
}

int KLIBCKill(const char* pidFile, int blForce) noexcept try {
    int pid = PidFromFile(pidFile);
    if (pid < 0)
        return -1;
    if (::kill(pid, blForce ? SIGKILL : SIGTERM) == 0)
        return 0;
    KYTO_FAIL(KYTO_ERR_PROCESS);
    return -1;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

}  // extern "C"
