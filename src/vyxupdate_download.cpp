// VyxUpdate: the release download.  The image is fetched by wget in a forked child (so
// another process can cancel it by signal), verified by its MD5 checksum and recorded in
// "/autoupd@te.info" for the installer; the administrators are told how it ended.
#include "vyxupdate.h"

#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>

#include "child_process.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "vyxupdate_internal.h"

using namespace kyto::vyx;

namespace {

const char* const kOpenssl = "/usr/kyto/bin/openssl";
const char* const kNotifier = "/usr/kyto/bin/kytovyxnotify";

constexpr int kMaxDownloadAttempts = 10;

constexpr unsigned int kEventDownloadDone = 0x11B01021;
constexpr unsigned int kEventDownloadFailed = 0x11B01022;
const char* const kNotifyLinkText =
    "<a style='font-size:12px;text-decoration:underline;' "
    "href=javascript:KYTO.QVS.AppLaunch('KYTO.QVS.ControlPanel.Instance',{fn:'KYTO.QVS."
    "ControlPanel.Upgrade.Main'})> {0} </a>";

void LogPidFileOpenFailure() {
    syslog(LOG_ERR, "%s:%d Fail to open [%s] for writing", kModule, __LINE__, kPidFile);
}

}  // namespace

bool VyxUpdate::ExecWgetP(std::string outputPath, std::string url, bool& cancelled) {
    cancelled = false;
    // wget's progress goes to the progress log (read by GetDownloadPercentage in the
    // pollers), its standard output is discarded.  When the log cannot be opened wget
    // keeps this process's standard error.
    kyto::UniqueFd progress(open(kProgressLog, O_RDWR | O_CREAT | O_CLOEXEC, 0644));
    const char* argv[] = {kyto::kWget,    "-O",        outputPath.c_str(), url.c_str(),
                          "--timeout=15", "--tries=1", "--no-dns-cache",   nullptr};
    kyto::ChildSetup setup;
    setup.program = kyto::kWget;
    setup.argv = const_cast<char* const*>(argv);
    setup.stdoutFd = kyto::kChildDevNull;
    setup.stderrFd = progress.valid() ? progress.get() : kyto::kChildInherit;
    setup.pidFile = kPidFile;
    kyto::ChildProcess wget;
    switch (wget.Start(setup)) {
        case kyto::ChildProcess::kForkFailed:
            syslog(LOG_ERR, "%s:%d Fail to fork", kModule, __LINE__);
            return false;
        case kyto::ChildProcess::kInChildPidFileFailed:
            // This is the child.  It reports the failure by returning false instead of
            // ending, so it carries on in the caller's code (and its retry loop) as a
            // second process: callers and log readers have always seen it that way.
            LogPidFileOpenFailure();
            syslog(LOG_ERR, "%s:%d Fail to write pid file", kModule, __LINE__);
            return false;
        case kyto::ChildProcess::kStarted:
            break;
    }

    int status = 0;
    if (wget.Wait(&status) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to download VYX patch [%m]", kModule, __LINE__);
        KLIBCExec("/bin/rm", "-f", outputPath.c_str(), nullptr, nullptr);
        return false;
    }
    if (WIFSIGNALED(status)) {
        // Only a cancel kills wget: not a failure.
        syslog(LOG_ERR, "%s:%d Download process is cancelled", kModule, __LINE__);
        cancelled = true;
        return true;
    }
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0)
        return true;
    syslog(LOG_ERR, "%s:%d Fail to download VYX patch", kModule, __LINE__);
    return false;
}

bool VyxUpdate::ExecWgetWithRetry(std::string outputPath, std::string url, bool& cancelled) {
    for (int attempt = 0; attempt < kMaxDownloadAttempts; ++attempt) {
        if (ExecWgetP(outputPath, url, cancelled))
            return true;
    }
    return false;
}

int VyxUpdate::VerifyChecksum(const char* expected, const char* path) {
    if (expected == nullptr || path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return 0;
    }
    char command[kPathSize];
    snprintf(command, sizeof(command), "%s md5 %s 2>/dev/null", kOpenssl, path);
    kyto::UniqueFile pipe(popen(command, "re"), kyto::UniqueFile::kPopen);
    if (!pipe) {
        syslog(LOG_ERR, "%s:%d Fail to exec [%s]", kModule, __LINE__, command);
        return 0;
    }
    char line[kPathSize];
    if (fgets(line, sizeof(line), pipe.get()) == nullptr) {
        syslog(LOG_ERR, "%s:%d Fail to get check sum result. reason=%m", kModule, __LINE__);
        return 0;
    }
    // "MD5(<path>)= <hex>": the digest is the second word.
    char sum[kIdentityFieldSize];
    memset(sum, 0, sizeof(sum));
    static_assert(sizeof(sum) == 256, "the scan below takes at most 255 characters");
    if (sscanf(line, "%*s %255s", sum) != 1) {
        syslog(LOG_ERR, "%s:%d Fail to get check sum result", kModule, __LINE__);
        return 0;
    }
    if (strcmp(sum, expected) != 0) {
        syslog(LOG_ERR, "%s:%d Checksum not match", kModule, __LINE__);
        return 0;
    }
    return 1;
}

bool VyxUpdate::WriteDownloadPidFile() {
    kyto::UniqueFile file(fopen(kPidFile, "we"));
    if (!file) {
        LogPidFileOpenFailure();
        return false;
    }
    fprintf(file.get(), "%d", static_cast<int>(getpid()));
    return true;
}

int VyxUpdate::SendNotification(bool success, const std::string& patchPath) {
    if (success) {
        KYTOLogSet1(1, 1, kEventDownloadDone, patchPath.c_str(), "", "", "");
        return KLIBCExec(kNotifier, "@administrators", "update:update_download_noti_title",
                         kNotifyLinkText, "update:update_download_noti_link");
    }
    KYTOLogSet1(1, 3, kEventDownloadFailed, patchPath.c_str(), "", "", "");
    return KLIBCExec(kNotifier, "@administrators", "update:update_download_noti_title_err",
                     kNotifyLinkText, "update:update_download_noti_link");
}

void VyxUpdate::UpdateVyx(const char* /*reserved1*/, const char* /*reserved2*/,
                          bool /*reserved3*/) {}

bool VyxUpdate::SetStatusKey(const char* key, const char* value) {
    if (UpdateProgressFile(key, value))
        return true;
    syslog(LOG_ERR, "%s:%d Fail to update progress file. %s", kModule, __LINE__,
           kyto::LastErrorText().c_str());
    return false;
}

int VyxUpdate::FetchImage(const _tag_vyxinfo_& release, const std::string& folder, int number,
                          const char* recordKey, Json::Value& record, bool& cancelled) {
    std::string outputPath;
    if (!GetOutputFilePath(release.link, folder, outputPath)) {
        syslog(LOG_ERR, "%s:%d Fail to get output file path", kModule, __LINE__);
        return 0;
    }
    if (!SetStatusKey(kyto::kKeyPatchPath, outputPath.c_str()) ||
        !SetStatusKey(kyto::kKeyDownloadNum, number == 1 ? "1" : "2")) {
        return 0;
    }
    if (!ExecWgetWithRetry(outputPath, release.link, cancelled)) {
        if (number == 1)
            syslog(LOG_ERR, "%s:%d Fail to download patch file", kModule, __LINE__);
        else
            syslog(LOG_ERR, "%s:%d Fail to download patch file for passive", kModule, __LINE__);
        return 0;
    }
    if (cancelled)
        return 1;
    record[recordKey] = outputPath;
    if (VerifyChecksum(release.checksum, outputPath.c_str()) != 1) {
        syslog(LOG_ERR, "%s:%d Fail to verify checksum", kModule, __LINE__);
        return 0;
    }
    return 1;
}

int VyxUpdate::DownloadImages(Json::Value& record, bool& cancelled) {
    bool canStart = false;
    if (!PreCheckDownload(canStart)) {
        syslog(LOG_ERR, "%s:%d Fail to do pre check download", kModule, __LINE__);
        return 0;
    }
    // Another download is running: reported as success, and the end steps run as for
    // any success.
    if (!canStart)
        return 1;

    std::string folder;
    if (!PrepareDownloadEnv(folder)) {
        syslog(LOG_ERR, "%s:%d Fail to prepare download env", kModule, __LINE__);
        return 0;
    }

    unlink(kyto::kDownloadStatusFile);
    if (!SetStatusKey(kyto::kKeyUpdateType, kyto::kTypeVyx) ||
        !SetStatusKey(kyto::kKeyDownloadStatus, "downloading") ||
        !SetStatusKey(kyto::kKeyDownloadCount, m_hybridDL ? "2" : "1")) {
        return 0;
    }

    if (!FetchImage(m_release, folder, 1, "patchPath", record, cancelled) || cancelled)
        return cancelled ? 1 : 0;
    if (m_hybridDL &&
        (!FetchImage(m_partnerRelease, folder, 2, "passivePatchPath", record, cancelled) ||
         cancelled)) {
        return cancelled ? 1 : 0;
    }

    if (!SetStatusKey(kyto::kKeyDownloadStatus, "finish"))
        return 0;
    record["buildnumber"] = m_release.buildNum;
    record["minorversion"] = m_release.minor;
    record["majorversion"] = m_release.major;
    record["updateType"] = kyto::kTypeVyx;
    // For the installer and the interface's poller, which must never read half a record;
    // a file that cannot be written is not reported, the download itself succeeded.
    kyto::DumpJsonAtomically(kyto::kAutoUpdateInfoFile, record, false);
    return 1;
}

int VyxUpdate::DownloadVyx() {
    bool cancelled = false;
    Json::Value record(Json::objectValue);
    int result = DownloadImages(record, cancelled);

    if (!cancelled)
        SendNotification(result == 1, kyto::MemberText(record, "patchPath"));
    if (result == 0) {
        SetStatusKey(kyto::kKeyDownloadStatus, "failed");
    } else {
        unlink(kyto::kDownloadStatusFile);
    }
    unlink(kProgressLog);
    unlink(kPidFile);
    return result;
}
