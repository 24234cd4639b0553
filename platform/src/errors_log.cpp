// Thread-local last error, the plain log appender and the system event log.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <new>
#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>

#include "platform_internal.h"

namespace {

constexpr size_t kErrFileMax = 255;

struct LastError {
    int code = KYTO_ERR_NONE;
    int line = 0;
    char file[kErrFileMax + 1] = {0};
};

thread_local LastError t_lastError;

// Appends text and a newline with a single write(2); 0 ok, -1 with the error set.
int AppendLine(const char* logPath, const std::string& text) {
    kytoplat::UniqueFd fd(::open(logPath, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644));
    if (!fd.valid()) {
        KYTO_FAIL(errno == ENOENT ? KYTO_ERR_FILE_NOT_FOUND : KYTO_ERR_FILE_OPEN);
        return -1;
    }
    std::string line = text;
    line.push_back('\n');
    ssize_t n;
    do {
        n = ::write(fd.get(), line.data(), line.size());
    } while (n < 0 && errno == EINTR);
    if (n < 0 || static_cast<size_t>(n) != line.size()) {
        KYTO_FAIL(KYTO_ERR_FILE_WRITE);
        return -1;
    }
    return 0;
}

}  // namespace

namespace kytoplat {

ErrorKeeper::ErrorKeeper()
    : code_(t_lastError.code), line_(t_lastError.line), file_(t_lastError.file) {}

ErrorKeeper::~ErrorKeeper() {
    if (active_)
        KLIBCErrSetEx(code_, file_.c_str(), line_);
}

int CurrentExceptionCode() noexcept {
    try {
        throw;
    } catch (const std::bad_alloc&) {
        return KYTO_ERR_OUT_OF_MEMORY;
    } catch (...) {
        return KYTO_ERR_SYSTEM;
    }
}

}  // namespace kytoplat

extern "C" {

int KLIBCErrGet(void) noexcept {
    return t_lastError.code;
}

const char* KLIBCErrorGetFile(void) noexcept {
    return t_lastError.file;
}

int KLIBCErrorGetLine(void) noexcept {
    return t_lastError.line;
}

void KLIBCErrSetEx(int code, const char* file, int line) noexcept {
    t_lastError.code = code;
    t_lastError.line = line;
    if (file == nullptr)
        file = "";
    size_t len = strnlen(file, kErrFileMax);
    memcpy(t_lastError.file, file, len);
    t_lastError.file[len] = '\0';
}

int KLIBCErrLogSet(const char* logPath, const char* text) noexcept try {
    if (logPath == nullptr || *logPath == '\0' || text == nullptr) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    return AppendLine(logPath, text);
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KYTOLogSet1(int category, int level, unsigned int eventCode, const char* s1, const char* s2,
                const char* s3, const char* s4) noexcept try {
    auto str = [](const char* s) { return s ? s : ""; };
    int len = snprintf(nullptr, 0, "%d %d 0x%08X %s %s %s %s", category, level, eventCode, str(s1),
                       str(s2), str(s3), str(s4));
    if (len < 0) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::string text(static_cast<size_t>(len) + 1, '\0');
    snprintf(&text[0], text.size(), "%d %d 0x%08X %s %s %s %s", category, level, eventCode, str(s1),
             str(s2), str(s3), str(s4));
    text.resize(static_cast<size_t>(len));
    // The syslog copy is sent even when the event log file cannot be written, so the
    // event is not lost entirely.
    int rc = AppendLine(KYTO_EVENT_LOG_PATH, text);
    syslog(LOG_NOTICE, "%s", text.c_str());
    return rc;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

}  // extern "C"
