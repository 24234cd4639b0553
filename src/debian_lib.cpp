// DebianLib: runs the package tool with its output captured in the upgrade log, writes
// time-stamped update log lines and reads small-fix numbers out of package file names.
#include "debian_lib.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <kytoplatform/klibc.h>

#include "child_process.h"
#include "kyto_paths.h"
#include "scoped.h"
#include "version_file.h"

namespace {

constexpr const char* kModule = "debian_lib";
constexpr const char* kDpkgPath = "/usr/bin/dpkg";

}  // namespace

void DebianLib::WriteUpdateLog(const std::string& text, const std::string& logPath) {
    char stamp[64] = {0};
    time_t now = time(nullptr);
    struct tm local;
    if (localtime_r(&now, &local) != nullptr) {
        if (strftime(stamp, sizeof(stamp), "%Y/%m/%d %H:%M:%S\t", &local) == 0)
            stamp[0] = '\0';
    }
    std::string line = std::string(stamp) + text;
    KLIBCErrLogSet(logPath.c_str(), line.c_str());
}

bool DebianLib::ExecDpkg(const std::string& option, const std::string& package) {
    return ExecDpkg(option, package, std::string());
}

bool DebianLib::ExecDpkg(const std::string& option, const std::string& package,
                         const std::string& folder) {
    WriteUpdateLog(" ===========[" + option + " " + package + " " + folder + "]===========",
                   kyto::kDpkgLog);

    // The package tool's output and errors go to the upgrade log for the support staff;
    // when the log cannot be opened it writes to this process's own descriptors.  Its
    // standard input is /dev/null, so a configuration-file prompt can never hang an apply.
    kyto::UniqueFd log(open(kyto::kDpkgLog, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    const int output = log.valid() ? log.get() : kyto::kChildInherit;
    const char* argv[] = {kDpkgPath, option.c_str(), package.c_str(),
                          folder.empty() ? nullptr : folder.c_str(), nullptr};
    kyto::ChildSetup setup;
    setup.program = kDpkgPath;
    setup.argv = const_cast<char* const*>(argv);
    setup.stdoutFd = output;
    setup.stderrFd = output;
    kyto::ChildProcess dpkg;
    if (dpkg.Start(setup) != kyto::ChildProcess::kStarted) {
        syslog(LOG_ERR, "%s:%d Fail to fork", kModule, __LINE__);
        return false;
    }

    int status = 0;
    if (dpkg.Wait(&status) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to exec [dpkg %s %s] error=[%m]", kModule, __LINE__,
               option.c_str(), package.c_str());
        return false;
    }
    // Only a normal non-zero exit is a failure; a child ended by a signal counts as done.
    if (WIFEXITED(status) && WEXITSTATUS(status) != 0) {
        WriteUpdateLog("Failed to install " + option + package + folder, kyto::kDpkgLog);
        return false;
    }
    return true;
}

int DebianLib::FindSmallFixNumfromDeb(const std::string& debName) {
    static const std::string kSuffix = ".deb";
    if (debName.empty() || debName.size() < kSuffix.size() ||
        debName.compare(debName.size() - kSuffix.size(), kSuffix.size(), kSuffix) != 0) {
        return -1;
    }
    size_t first = debName.find('_');
    size_t last = debName.rfind('_');
    if (first == std::string::npos || last == std::string::npos || first == last)
        return -1;

    // An absent or empty build number cannot match any package, so it counts as a
    // failure to read it, like an unreadable file.
    const kyto::VersionKey<32> build("buildnumber");
    if (build.result <= 0) {
        syslog(LOG_ERR, "%s:%d Get buildnumber Fail\n", kModule, __LINE__);
        return -1;
    }
    if (debName.find(std::string("-") + build.text + "-s") == std::string::npos) {
        syslog(LOG_ERR, "%s:%d different buildnumber of deb [%s] with system buildnumber [%s]\n",
               kModule, __LINE__, debName.c_str(), build.text);
        return -1;
    }

    std::string version = debName.substr(first + 1, last - first - 1);
    if (version.find('_') != std::string::npos)
        return -1;

    size_t fixPos = version.rfind("-s");
    if (fixPos == std::string::npos)
        return -1;
    return static_cast<int>(strtol(version.c_str() + fixPos + 2, nullptr, 10));
}

bool DebianLib::InstallDebCompare(const std::string& a, const std::string& b) {
    return FindSmallFixNumfromDeb(a) < FindSmallFixNumfromDeb(b);
}
