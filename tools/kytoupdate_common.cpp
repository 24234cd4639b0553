#include "kytoupdate_common.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <time.h>

#include <iterator>

#include "update_cpputil.h"

namespace kytoupdate {

volatile sig_atomic_t g_interrupted = 0;

namespace {
void OnSignal(int) {
    g_interrupted = 1;
}
}  // namespace

void CatchStopSignals() {
    struct sigaction sa {};
    sa.sa_handler = OnSignal;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGINT, &sa, nullptr);
    sigaction(SIGTERM, &sa, nullptr);
}

void SleepMs(long ms) {
    struct timespec ts {
        ms / 1000, (ms % 1000) * 1000000L
    };
    nanosleep(&ts, nullptr);  // an interrupting signal only shortens the wait
}

void Note(const std::string& text) {
    fprintf(stderr, "kytoupdate: %s\n", text.c_str());
}

int Fail(const std::string& text, int code) {
    Note(text);
    return code;
}

int TryLock(const char* path, const std::string& busyText, kyto::UniqueFd& lock) {
    lock.reset(open(path, O_RDWR | O_CREAT | O_CLOEXEC, 0644));
    if (!lock.valid())
        return Fail(std::string("cannot open ") + path);
    if (flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
        lock.reset();
        return Fail(busyText);
    }
    return -1;
}

const char* RestartWord(int restartType) {
    switch (restartType) {
        case kRestartPartial:
            return "partial";
        case kRestartAll:
            return "all";
        case kRestartReboot:
            return "reboot";
        default:
            return "none";
    }
}

std::string KindWord(int patchType) {
    return patchType == UpdateUtil::PATCH_TYPE_VYX ? "vyx" : "smallupdate";
}

std::string SmallErrnoText(int errorCode) {
    // Indexed by SmallUpdate::ERROR_CODE.
    static const char* const kTexts[] = {
        "no small update",
        "the update server answered with an error",
        "no volume has room for the download",
        "bad or unreadable update information",
        "the update was made for another build",
        "bad small-fix number, or a patch list for another build",
        "the update is older than the installed small fix",
        "the patch list is for another device model",
    };
    static_assert(std::size(kTexts) == SmallUpdate::ERROR_CODE_OTHER_MODEL + 1,
                  "one text per error code");
    return errorCode > 0 && errorCode < static_cast<int>(std::size(kTexts)) ? kTexts[errorCode]
                                                                            : kTexts[0];
}

}  // namespace kytoupdate
