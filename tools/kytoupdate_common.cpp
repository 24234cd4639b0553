#include "kytoupdate_common.h"

#include <stdio.h>
#include <time.h>

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
    switch (errorCode) {
        case SmallUpdate::ERROR_CODE_SERVER_STATUS:
            return "the update server answered with an error";
        case SmallUpdate::ERROR_CODE_NO_ROOM:
            return "no volume has room for the download";
        case SmallUpdate::ERROR_CODE_BAD_INPUT:
            return "bad or unreadable update information";
        case SmallUpdate::ERROR_CODE_BUILD_MISMATCH:
            return "the update was made for another build";
        case SmallUpdate::ERROR_CODE_BAD_FIX_NUMBER:
            return "bad small-fix number, or a patch list for another build";
        case SmallUpdate::ERROR_CODE_DOWNGRADE:
            return "the update is older than the installed small fix";
        case SmallUpdate::ERROR_CODE_OTHER_MODEL:
            return "the patch list is for another device model";
        default:
            return "no small update";
    }
}

}  // namespace kytoupdate
