// Start-up scripts and third-party packages.
#include <dirent.h>
#include <errno.h>
#include <fnmatch.h>
#include <string.h>
#include <sys/stat.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>

#include "platform_internal.h"

namespace {

constexpr const char* kRcDir = "/usr/kyto/etc/rc.d";
constexpr const char* kPkgCtl = "/usr/kyto/bin/kytopkg";

struct DirCloser {
    void operator()(DIR* d) const { closedir(d); }
};

// Runs prog with one argument and waits.  The exit status, or -1 when it could not be
// executed at all (or died by a signal), with the error set.
int RunOne(const char* prog, const char* arg) {
    char* argv[3] = {const_cast<char*>(prog), const_cast<char*>(arg), nullptr};
    pid_t pid;
    bool execFailed;
    if (kytoplat::SpawnProgram(prog, argv, &pid, &execFailed) != 0)
        return -1;
    int status = kytoplat::WaitProgram(pid);
    if (execFailed) {
        KYTO_FAIL(KYTO_ERR_EXEC);
        return -1;
    }
    return status;
}

}  // namespace

extern "C" {

int KYTOServiceOnOffALL(int action) noexcept try {
    if (action != KYTO_SERVICE_STOP_ALL && action != KYTO_SERVICE_START_ALL) {
        KYTO_FAIL(KYTO_ERR_BAD_PARAMETER);
        return -1;
    }
    std::unique_ptr<DIR, DirCloser> dir(opendir(kRcDir));
    if (!dir) {
        KYTO_FAIL(kytoplat::OpenErrorCode(errno, KYTO_ERR_FILE_OPEN));
        return -1;
    }
    std::vector<std::string> scripts;
    errno = 0;
    while (struct dirent* e = readdir(dir.get())) {
        if (fnmatch("S*.sh", e->d_name, FNM_PERIOD) == 0)
            scripts.emplace_back(e->d_name);
    }
    if (errno != 0) {
        KYTO_FAIL(KYTO_ERR_FILE_READ);
        return -1;
    }
    dir.reset();
    // Byte order of the names, independent of the locale.
    std::sort(scripts.begin(), scripts.end());
    if (action == KYTO_SERVICE_STOP_ALL)
        std::reverse(scripts.begin(), scripts.end());
    const char* arg = action == KYTO_SERVICE_STOP_ALL ? "stop" : "start";
    // Like an init system, one failing script does not stop the others; its status is
    // not part of the result.
    kytoplat::ErrorKeeper keeper;
    for (const std::string& name : scripts) {
        std::string path = std::string(kRcDir) + "/" + name;
        struct stat st;
        if (stat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode))
            continue;
        RunOne(path.c_str(), arg);
    }
    return 0;
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

int KYTOServiceThirdPartyAll(int blStart) noexcept try {
    return RunOne(kPkgCtl, blStart ? "startall" : "stopall");
} catch (...) {
    return KYTO_FAIL_ON_EXCEPTION(-1);
}

}  // extern "C"
