// Internal helpers of the platform layer: error reporting, the key=value file parser and the
// process runner.  Not installed.
#ifndef KYTOPLATFORM_PLATFORM_INTERNAL_H
#define KYTOPLATFORM_PLATFORM_INTERNAL_H

#include <errno.h>
#include <stdio.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "scoped.h"

// Records code as the thread's last error, with the file and line of the failure site.
#define KYTO_FAIL(code) KLIBCErrSetEx((code), __FILE__, __LINE__)
// For the catch clause of every extern "C" call: records the exception being handled as
// the last error and gives back the call's failure result, so that no exception reaches
// a C caller (or unwinds through one).
#define KYTO_FAIL_ON_EXCEPTION(result) kytoplat::FailOnException((result), __FILE__, __LINE__)

// Internal: hidden from the library's exported symbols.
#pragma GCC visibility push(hidden)
namespace kytoplat {

// The RAII owners and EINTR-retrying waits shared with the library.
using kyto::ReadRetry;
using kyto::ScopedUnlink;
using kyto::UniqueFd;
using kyto::UniqueFile;
using kyto::WaitForChild;

// Code of the exception being handled: KYTO_ERR_OUT_OF_MEMORY for std::bad_alloc,
// KYTO_ERR_SYSTEM for anything else.  Only inside a catch clause.
int CurrentExceptionCode() noexcept;

template <typename Result>
Result FailOnException(Result result, const char* file, int line) noexcept {
    KLIBCErrSetEx(CurrentExceptionCode(), file, line);
    return result;
}

// Snapshot of the thread's last error, put back when the keeper goes out of scope unless
// dismissed.  Used by calls that try something whose failure is not their own failure
// (an absent optional file, for instance), so that they leave the caller's error alone.
class ErrorKeeper {
  public:
    ErrorKeeper();
    ~ErrorKeeper();
    ErrorKeeper(const ErrorKeeper&) = delete;
    ErrorKeeper& operator=(const ErrorKeeper&) = delete;
    void dismiss() { active_ = false; }

  private:
    bool active_ = true;
    int code_;
    int line_;
    std::string file_;
};

// Error code for a failed open/opendir/mkstemp: a missing path (or a missing folder on
// the way) is KYTO_ERR_FILE_NOT_FOUND, anything else `otherwise`.
inline int OpenErrorCode(int err, int otherwise) {
    return err == ENOENT || err == ENOTDIR ? KYTO_ERR_FILE_NOT_FOUND : otherwise;
}

// Opens an existing file that is not a folder for reading (O_CLOEXEC).  Returns an
// invalid descriptor with the last error set (KYTO_ERR_FILE_NOT_FOUND or
// KYTO_ERR_FILE_OPEN) on failure.
UniqueFd OpenFileForReading(const char* path);

// ---- key=value files ------------------------------------------------------------------

// Reads every line of a key=value file (newlines stripped).  endsWithNewline tells whether
// the last line was terminated.  Returns 0 ok, -1 with the last error set (missing file:
// KYTO_ERR_FILE_NOT_FOUND; a folder or an unopenable file: KYTO_ERR_FILE_OPEN; read
// failure: KYTO_ERR_FILE_READ; a line over KLIBC_KV_MAX_LINE: KYTO_ERR_LINE_TOO_LONG).
int KvLoad(const char* path, std::vector<std::string>* lines, bool* endsWithNewline);

// When line is a key=value line for key, stores its value (blanks around it and one pair
// of surrounding double quotes removed) and returns true.
bool KvLineMatches(const std::string& line, const std::string& key, std::string* value);

// Value of the first line for key.  1 found, 0 absent.
int KvFind(const std::vector<std::string>& lines, const std::string& key, std::string* value);

// Loads the file and looks key up: 1 found, 0 absent, -1 error (last error set).
int KvGet(const char* path, const std::string& key, std::string* value);

// ---- processes ------------------------------------------------------------------------

// Forks and executes prog with argv (NULL-terminated, built before the fork), standard
// input from /dev/null.  On success *pid is the child's pid and the return is 0.  When the
// program cannot be executed the child exits with 127 and *execFailed is set (the child is
// then already reaped only if wait was asked).  -1 when fork fails (last error set).
int SpawnProgram(const char* prog, char* const argv[], pid_t* pid, bool* execFailed);

// Waits for pid (EINTR retried).  Returns the exit status 0..255, or -1 when the wait
// fails or the child died by a signal (last error KYTO_ERR_EXEC).
int WaitProgram(pid_t pid);

}  // namespace kytoplat
#pragma GCC visibility pop

#endif
