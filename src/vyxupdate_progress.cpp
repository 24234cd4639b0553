// VyxUpdate: download progress and cancellation, as any process sees them: the shared
// status file "/var/run/downloadVYX.status", the pid file and wget's progress log; the
// clean-up of earlier results and the installer-progress line.
#include "vyxupdate.h"

#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <memory>
#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "download_status.h"
#include "file_system.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "update_cpputil.h"
#include "vyxupdate_internal.h"

using namespace kyto::vyx;

namespace {

const char* const kOldPidFile = "/var/run/download_vyx.pid";

const char* const kInstallerProgress = "/tmp/update.progress";

void UnlinkIfExists(const char* path) {
    if (KLIBCFileExist(path))
        unlink(path);
}

}  // namespace

bool VyxUpdate::UpdateProgressFile(const char* key, const char* value) {
    if (key == nullptr || value == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return false;
    }
    if (kyto::SetDownloadStatusKey(key, value, nullptr) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to set [%s] = [%s] to [%s]. %s", kModule, __LINE__, key, value,
               kyto::kDownloadStatusFile, kyto::LastErrorText().c_str());
        return false;
    }
    return true;
}

namespace {

// The total wget announced in its progress log, as it printed it ("Length: 1,234,567
// (1.2M) [type]" gives "1,234,567"); empty when no line names it.  False (logged) when
// the log cannot be opened or the line cannot be read.
bool ReadAnnouncedLength(char (&sizeText)[kLengthTextSize]) {
    kyto::UniqueFile file(fopen(kProgressLog, "re"));
    if (!file) {
        syslog(LOG_ERR, "%s:%d Fail to open file [%s] for reading", kModule, __LINE__,
               kProgressLog);
        return false;
    }
    kyto::LineBuffer buffer;
    while (buffer.Read(file.get()) != -1) {
        if (strstr(buffer.data, "Length") == nullptr)
            continue;
        static_assert(kLengthTextSize == 128, "the scan below takes at most 127 characters");
        if (sscanf(buffer.data, "Length: %127s %*s", sizeText) != 1) {
            syslog(LOG_ERR, "%s:%d Fail to parse file size", kModule, __LINE__);
            return false;
        }
        break;
    }
    return true;
}

// The announced total as a number: the thousands separators dropped through the
// platform's string list, the digits converted with automatic base.  False (logged) when
// a platform call fails.
bool AnnouncedLengthToNumber(const char* sizeText, kyto::UniqueSzList& pieces,
                             unsigned long long& total) {
    PKLIBC_SZLIST list = pieces.release();
    int split = KLIBCStrSep(sizeText, ",", &list);  // may move the list
    pieces.reset(list);
    if (split < 0) {
        syslog(LOG_ERR, "%s:%d Fail to do KLIBCStrSep. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    int digitsSize = 64;
    char* digits = static_cast<char*>(malloc(digitsSize));
    if (digits == nullptr) {
        syslog(LOG_ERR, "%s:%d Fail to allocate memory", kModule, __LINE__);
        return false;
    }
    digits[0] = '\0';
    int joined = KLIBCSzListJoin(pieces.get(), "", &digits, &digitsSize);  // may move digits
    std::unique_ptr<char, decltype(&free)> digitsOwner(digits, &free);
    if (joined < 0) {
        syslog(LOG_ERR, "%s:%d Fail to do KLIBCSzListJoin. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    total = strtoull(digits, nullptr, 0);
    return true;
}

// The pid of the running wget from the pid file: negative when there is no pid file
// (logged at missingPriority), 0 when it names no process (logged as an error).
int ReadDownloadPid(int missingPriority) {
    const int pid = KLIBCReadPidFile(kPidFile);
    if (pid < 0) {
        // KEPT: "dose" is the text log readers search for.
        syslog(missingPriority, "%s:%d [%s] dose not exist", kModule, __LINE__, kPidFile);
    } else if (pid == 0) {
        syslog(LOG_ERR, "%s:%d Invalid pid [%d] in pid file [%s]", kModule, __LINE__, pid,
               kPidFile);
    }
    return pid;
}

}  // namespace

bool VyxUpdate::GetDownloadPercentage(const char* patchPath, int& percentage) {
    kyto::UniqueSzList pieces(KLIBCSzListAlloc(512));
    if (!pieces) {
        syslog(LOG_ERR, "%s:%d Fail to alloc list. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    char sizeText[kLengthTextSize];
    memset(sizeText, 0, sizeof(sizeText));
    unsigned long long total = 0;
    if (!ReadAnnouncedLength(sizeText) || !AnnouncedLengthToNumber(sizeText, pieces, total))
        return false;

    struct stat st;
    if (patchPath == nullptr || stat(patchPath, &st) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to do stat to [%s]", kModule, __LINE__,
               patchPath ? patchPath : "");
        return false;
    }
    // Allocated blocks, not the length: a sparse or preallocated file counts what is on
    // disk, and the result may pass 100 when allocation rounds up.
    unsigned long long downloaded = static_cast<unsigned long long>(st.st_blocks) * 512ULL;
    if (total == 0) {
        percentage = 0;
    } else if (downloaded == total) {
        percentage = 100;
    } else {
        percentage = kyto::PercentageToInt(static_cast<double>(downloaded) /
                                           static_cast<double>(total) * 100.0);
    }
    return true;
}

bool VyxUpdate::FinishedDownloadOnRecord(bool& finished) {
    finished = false;
    bool have = false;
    Json::Value info;
    if (!GetAutoUpdateInfo(have, info)) {
        syslog(LOG_ERR, "%s:%d Fail to get downloaded patch info", kModule, __LINE__);
        return false;
    }
    if (!have)
        return true;
    if (!CheckPatchAndUpdateType(finished, info)) {
        syslog(LOG_ERR, "%s:%d Fail to check if downloaded patch matches to current update type",
               kModule, __LINE__);
        return false;
    }
    return true;
}

int VyxUpdate::ReadStatusFileKeys(StatusFileKeys& keys) {
    const char* file = kyto::kDownloadStatusFile;
    char updateType[kVersionFieldSize];
    memset(updateType, 0, sizeof(updateType));
    int ret = KLIBCFileGetKeyValue(file, kyto::kKeyUpdateType, updateType, sizeof(updateType), 0);
    if (ret < 0) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__,
               kyto::kKeyUpdateType, file, kyto::LastErrorText().c_str());
        return -1;
    }
    // No type, or a small update's file: no full-release download.
    if (ret == 0 || strcmp(updateType, kyto::kTypeVyx) != 0)
        return 0;

    // Log readers know the messages for a missing "downloadCount" and "downloadNum" by the
    // key named before each of them.
    const bool read = ReadKeys({
        {file, kyto::kKeyPatchPath, kyto::kKeyPatchPath, keys.patchPath, sizeof(keys.patchPath)},
        {file, kyto::kKeyDownloadStatus, kyto::kKeyDownloadStatus, keys.downloadStatus,
         sizeof(keys.downloadStatus)},
        {file, kyto::kKeyDownloadCount, kyto::kKeyPatchPath, keys.downloadCount,
         sizeof(keys.downloadCount)},
        {file, kyto::kKeyDownloadNum, kyto::kKeyDownloadStatus, keys.downloadNum,
         sizeof(keys.downloadNum)},
    });
    if (!read)
        return -1;
    return 1;
}

bool VyxUpdate::RunningDownloadStatus(const StatusFileKeys& keys, int& percentage,
                                      VYX_DOWNLOAD_STATUS& status) {
    const int pid = ReadDownloadPid(LOG_ERR);
    if (pid <= 0)
        return false;
    if (kill(pid, 0) != 0) {
        status = VYX_DOWNLOAD_STATUS_FAILED;
        return true;
    }
    status = VYX_DOWNLOAD_STATUS_DOWNLOADING;
    int current = 0;
    if (!GetDownloadPercentage(keys.patchPath, current)) {
        syslog(LOG_ERR, "%s:%d Fail to get download percentag", kModule, __LINE__);
        return false;
    }
    // Image num of count: the finished images count whole, the current one in part.
    double count = static_cast<double>(ToNumber(keys.downloadCount));
    double num = static_cast<double>(ToNumber(keys.downloadNum));
    percentage = kyto::PercentageToInt((num - 1) * (100.0 / count) + current / count);
    return true;
}

bool VyxUpdate::GetDownloadStatus(int& percentage, VYX_DOWNLOAD_STATUS& status) {
    percentage = 0;
    status = VYX_DOWNLOAD_STATUS_NONE;

    bool finished = false;
    if (!FinishedDownloadOnRecord(finished))
        return false;
    if (finished) {
        percentage = 100;
        status = VYX_DOWNLOAD_STATUS_FINISHED;
        return true;
    }
    if (!KLIBCFileExist(kyto::kDownloadStatusFile))
        return true;

    StatusFileKeys keys;
    int read = ReadStatusFileKeys(keys);
    if (read <= 0)
        return read == 0;

    if (strcmp(keys.downloadStatus, "stopped") == 0) {
        status = VYX_DOWNLOAD_STATUS_STOPPED;
        return true;
    }
    if (strcmp(keys.downloadStatus, "failed") == 0 ||
        (strcmp(keys.downloadStatus, "downloading") == 0 && !KLIBCFileExist(kPidFile))) {
        status = VYX_DOWNLOAD_STATUS_FAILED;
        return true;
    }
    return RunningDownloadStatus(keys, percentage, status);
}

std::string VyxUpdate::DownloadStatusToString(VYX_DOWNLOAD_STATUS& status) {
    const int value = static_cast<int>(status);
    if (value < VYX_DOWNLOAD_STATUS_NONE || value > VYX_DOWNLOAD_STATUS_FAILED)
        return std::string();
    return kStatusWords[value];
}

bool VyxUpdate::CancelDownloadVyx() {
    const int pid = ReadDownloadPid(LOG_INFO);
    if (pid <= 0)
        return pid < 0;  // nothing to cancel, or a pid file that names no process
    if (kill(pid, SIGKILL) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to kill download VYX process. reason: [%m]", kModule, __LINE__);
    }
    unlink(kPidFile);
    if (!UpdateProgressFile(kyto::kKeyDownloadStatus, "stopped")) {
        syslog(LOG_ERR, "%s:%d Fail to update progress file. %s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    return true;
}

bool VyxUpdate::CleanDownloadResult(std::string path) {
    struct stat st;
    if (KLIBCFileExist(path.c_str()) && stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode)) {
        unlink(path.c_str());
    } else {
        int ret = stat(path.c_str(), &st);
        if (ret != 0 && errno != ENOENT) {
            syslog(LOG_ERR, "%s:%d Fail to do stat to [%s]. reason=%s", kModule, __LINE__,
                   path.c_str(), strerror(errno));
            return false;
        }
        // stat never returns a positive value, so an existing download folder and the
        // images in it stay for the installer (a new download of the same link writes over
        // its image); the folder removal below is never reached.
        if (ret > 0) {
            if (!S_ISDIR(st.st_mode)) {
                syslog(LOG_ERR, "%s:%d [%s] is neither a file nor a directory", kModule, __LINE__,
                       path.c_str());
                return false;
            }
            if (!UpdateUtil::RemoveFolder(path)) {
                syslog(LOG_ERR, "%s:%d Fail to remove folder %s. %s", kModule, __LINE__,
                       path.c_str(), kyto::LastErrorText().c_str());
                return false;
            }
        }
    }
    UnlinkIfExists(kOldPidFile);
    UnlinkIfExists(kProgressLog);
    UnlinkIfExists(kyto::kAutoUpdateInfoFile);
    return true;
}

bool VyxUpdate::ReportProgress(_tag_update_step_ step, int number, const char* text) {
    // Any other step gives the character code 0.
    const int index = static_cast<int>(step) - UPDATE_STEP_U;
    const char letter =
        index >= 0 && index <= UPDATE_STEP_R - UPDATE_STEP_U ? kStepLetters[index] : 0;
    char command[kProgressCommandSize];
    if (step == UPDATE_STEP_U && number < 0 && text != nullptr) {
        snprintf(command, sizeof(command), "/bin/echo \"%c:%s\" > %s", letter, text,
                 kInstallerProgress);
    } else {
        snprintf(command, sizeof(command), "/bin/echo \"%c:%d:\" > %s", letter, number,
                 kInstallerProgress);
    }
    int ret = system(command);
    if (ret != 0) {
        syslog(LOG_ERR, "%s:(%d) : failed to system cmd=[%s], r=%d", kModule, __LINE__, command,
               ret);
        return false;
    }
    return true;
}
