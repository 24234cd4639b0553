// SmallUpdate: downloading a small update.  The packages named by the record are fetched
// one after another with the system's wget into m_debDir, while the download status file
// shows the interface's poller how far it got; another process can stop the download with
// the stop marker.  A finished download is recorded in the info file for the apply.
#include "smallupdate.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <kytoplatform/klibc.h>

#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "smallupdate_internal.h"
#include "smallupdate_plan.h"
#include "update_cpputil.h"

using namespace kyto::small;

namespace {

// Each wget run makes one try; the retries are counted here.
constexpr int kWgetAttempts = 10;

bool StopRequested() {
    return KLIBCFileExist(kStopMarker) != 0;
}

void LogProgressFailure(int line) {
    syslog(LOG_ERR, "%s:%d Failed to update download progress", kModule, line);
}

// A failed download: the status file says so at the percentage reached, the package folder
// goes.  Always false.
bool FailDownload(int percentage, const std::string& debDir) {
    if (!SmallUpdate::UpdateDownloadProgress(percentage, SmallUpdate::DOWNLOAD_STATUS_FAILED)) {
        LogProgressFailure(__LINE__);
    }
    UpdateUtil::RemoveFolder(debDir);
    return false;
}

// Announces a new download ("init") and empties its package folder.
bool StartDownload(const std::string& debDir) {
    unlink(kyto::kDownloadStatusFile);
    if (!SmallUpdate::UpdateDownloadProgress(0, SmallUpdate::DOWNLOAD_STATUS_INIT)) {
        LogProgressFailure(__LINE__);
        return false;
    }
    // A marker left over from an earlier, already stopped download does not stop this one.
    if ((StopRequested() && unlink(kStopMarker) != 0) || UpdateUtil::CleanFolder(debDir) != 1) {
        // KEPT: "cleam" is the text log readers search for.
        syslog(LOG_ERR, "%s:%d Failed to cleam folder %m", kModule, __LINE__);
        return false;
    }
    return true;
}

enum class Fetched { kAll, kStopped, kFailed };

// Fetches the links one after another into debDir; percentage follows the files done.
Fetched FetchLinks(const std::vector<std::string>& links, const std::string& debDir,
                   int& percentage) {
    for (size_t i = 0; i < links.size(); ++i) {
        if (StopRequested()) {
            return Fetched::kStopped;
        }
        if (!SmallUpdate::ExecWgetWithRetry(links[i], debDir)) {
            return Fetched::kFailed;
        }
        percentage = static_cast<int>(100 * (i + 1) / links.size());
        if (!StopRequested() && !SmallUpdate::UpdateDownloadProgress(
                                    percentage, SmallUpdate::DOWNLOAD_STATUS_DOWNLOADING)) {
            LogProgressFailure(__LINE__);
            return Fetched::kFailed;
        }
    }
    return Fetched::kAll;
}

}  // namespace

bool SmallUpdate::ExecWgetP(const std::string& link, const std::string& folder) {
    if (link.empty() || folder.empty()) {
        return false;
    }
    const size_t slash = link.rfind('/');
    if (slash == std::string::npos) {
        syslog(LOG_ERR, "%s:%d Wrong download link [%s]", kModule, __LINE__, link.c_str());
        return false;
    }
    char output[kPathWidth] = {0};
    snprintf(output, sizeof(output), "%s/%s", folder.c_str(), link.c_str() + slash + 1);

    const char* argv[] = {
        kyto::kWget, link.c_str(),     "-O",    output, "--timeout=15",
        "--tries=1", "--no-dns-cache", nullptr,
    };
    const int r = KLIBCExecv(kyto::kWget, const_cast<char* const*>(argv), 1);
    if (r == 0) {
        return true;
    }
    syslog(LOG_ERR, "%s:%d failed to exec cmd=[%s %s %s %s %s %s], r=%d, %m", kModule, __LINE__,
           argv[0], argv[1], argv[2], argv[3], argv[4], argv[5], r);
    // wget has created the output file before it failed: a partial file never stays.
    if (unlink(output) != 0) {
        syslog(LOG_ERR, "%s:%d failed to unlink %s%s", kModule, __LINE__, output,
               kyto::LastErrorText().c_str());
    }
    return false;
}

bool SmallUpdate::ExecWgetWithRetry(const std::string& link, const std::string& folder) {
    for (int attempt = 0; attempt < kWgetAttempts; ++attempt) {
        // A stop request ends the retries; the caller sees the marker and stops.
        if (StopRequested()) {
            return true;
        }
        if (ExecWgetP(link, folder)) {
            return true;
        }
    }
    return false;
}

bool SmallUpdate::DownloadFiles(bool& stopped) {
    int percentage = 0;
    if (m_installDebLinks.empty() && m_smallUpdateDebLink.empty() && m_flashUpdateDebLink.empty()) {
        return FailDownload(percentage, m_debDir);
    }
    if (!StartDownload(m_debDir)) {
        return FailDownload(percentage, m_debDir);
    }
    // A record that asks for a package without a link fails the download rather than
    // applying half an update.
    const Fetched fetched = FetchLinks(kyto::SmallUpdateDownloadLinks(*this), m_debDir, percentage);
    if (fetched == Fetched::kFailed) {
        return FailDownload(percentage, m_debDir);
    }
    if (fetched == Fetched::kStopped) {
        UpdateUtil::RemoveFolder(m_debDir);
        unlink(kStopMarker);
        stopped = true;
        unlink(kyto::kDownloadStatusFile);
        return true;
    }
    if (StopRequested()) {
        // Stopped after the last file: the files and the marker stay.
        stopped = true;
    } else if (!UpdateDownloadProgress(100, DOWNLOAD_STATUS_FINISHED)) {
        LogProgressFailure(__LINE__);
        return FailDownload(percentage, m_debDir);
    }
    // From here on a finished download is recognised by the info file.
    unlink(kyto::kDownloadStatusFile);
    return true;
}

bool SmallUpdate::Download(bool blDump, const std::string& folderName, bool blPassive) {
    bool stopped = false;
    // A record that was never filled is looked up first; a filled one is used as it is.
    if (m_newSmallFixNumber < 0 && !HaveNewFix()) {
        return false;
    }
    if (!GetSourceDir(m_debDir, folderName)) {
        syslog(LOG_ERR, "%s:%d failed to get source dir", kModule, __LINE__);
        return false;
    }
    if (!DownloadFiles(stopped)) {
        return false;
    }
    if (!stopped && blDump) {
        return DumpToInfoFile(blPassive);
    }
    return true;
}

bool SmallUpdate::Download(bool blDump) {
    return Download(blDump, kyto::kDefaultDebDirName, false);
}

void SmallUpdate::GetDownloadStatus(int& percentage, std::string& status) {
    if (KLIBCFileExist(kyto::kAutoUpdateInfoFile) && ImportInfoFile(kyto::kAutoUpdateInfoFile)) {
        percentage = 100;
        status = kDownloadWords[DOWNLOAD_STATUS_FINISHED];
        return;
    }
    if (!KLIBCFileExist(kyto::kDownloadStatusFile)) {
        status = kDownloadWords[DOWNLOAD_STATUS_NONE];
        return;
    }
    char percentBuf[kStatusNumberWidth] = {0};
    char statusBuf[kStatusNumberWidth] = {0};
    if (KLIBCFileGetKeyValue(kyto::kDownloadStatusFile, kyto::kKeyPercentage, percentBuf,
                             sizeof(percentBuf), 0) <= 0 ||
        KLIBCFileGetKeyValue(kyto::kDownloadStatusFile, kyto::kKeyDownloadStatus, statusBuf,
                             sizeof(statusBuf), 0) <= 0) {
        status = kDownloadWords[DOWNLOAD_STATUS_FAILED];
        return;
    }
    percentage = static_cast<int>(strtol(percentBuf, nullptr, 10));
    const unsigned long state = static_cast<unsigned long>(strtol(statusBuf, nullptr, 10));
    status = state <= DOWNLOAD_STATUS_STOPPED ? kDownloadWords[state]
                                              : kDownloadWords[DOWNLOAD_STATUS_FAILED];
}

bool SmallUpdate::CancelDownload() {
    kyto::UniqueFd marker(open(kStopMarker, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
    if (!marker.valid() && !StopRequested()) {
        syslog(LOG_ERR, "%s:%d failed to create stop status file%s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    UpdateDownloadProgress(0, DOWNLOAD_STATUS_STOPPED);
    // The download folder's name stands where a pid file would: the platform answers for
    // whatever it names.
    if (KLIBCIsProcAlive(kyto::kDefaultDebDirName)) {
        KLIBCKill(kyto::kDefaultDebDirName, 1);
    }
    unlink(kyto::kAutoUpdateInfoFile);
    marker.reset();
    return true;
}

bool SmallUpdate::IsReadyApply() {
    if (m_newSmallFixNumber < 0 && !ImportInfoFile(kyto::kAutoUpdateInfoFile)) {
        return false;
    }
    return FilesExist(m_debDir, m_installDebs) || FilesExist(m_debDir, m_flashUpdateDeb) ||
           FilesExist(m_debDir, m_smallUpdateDeb);
}
