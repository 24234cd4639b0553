// SmallUpdate: the status files the interface's poller reads.  The download status is
// written into the file shared with the release download; the apply status file
// "/var/run/applySmallUpd@te.status" is replaced whole on every change and read back as
// one snapshot.
#include "smallupdate.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include <kytoplatform/klibc.h>

#include "download_status.h"
#include "kyto_paths.h"
#include "scoped.h"
#include "smallupdate_internal.h"

using namespace kyto::small;

int SmallUpdate::UpdateDownloadProgress(int percentage, DOWNLOAD_STATUS status) {
    if (kyto::SetDownloadStatusKey(kyto::kKeyUpdateType, kyto::kTypeSmall, nullptr) < 0 ||
        kyto::SetDownloadStatusNumber(kyto::kKeyPercentage, percentage, kyto::kQuotedLineFormat) <
            0 ||
        kyto::SetDownloadStatusNumber(kyto::kKeyDownloadStatus, static_cast<int>(status),
                                      kyto::kQuotedLineFormat) < 0) {
        return 0;
    }
    return 1;
}

bool SmallUpdate::UpdateApplyProgress(int percentage, APPLY_STAGE stage,
                                      const std::string& errMsg) {
    // The new content goes to a unique temporary file next to the status file and is
    // renamed over it, so pollers never see a half-written file.  mkostemp creates the
    // name and the file in one step (no window for another process to take the name).
    char tmpPath[kStatusTempPathWidth] = {0};
    snprintf(tmpPath, sizeof(tmpPath), "%s_XXXXXX", kyto::kApplyStatusFile);
    kyto::UniqueFd fd(mkostemp(tmpPath, O_CLOEXEC));
    if (!fd.valid()) {
        return false;
    }
    kyto::ScopedUnlink removeTmp(tmpPath);
    // Pollers of other users may read the status: same mode as a freshly created file.
    fchmod(fd.get(), 0644);
    fd.reset();

    char buf[kStatusNumberWidth] = {0};
    snprintf(buf, sizeof(buf), "%d", percentage);
    if (KLIBCFileSetKeyValue(tmpPath, kyto::kKeyPercentage, buf, kyto::kQuotedLineFormat) < 0) {
        return false;
    }
    snprintf(buf, sizeof(buf), "%d", static_cast<int>(stage));
    if (KLIBCFileSetKeyValue(tmpPath, kKeyStage, buf, kyto::kQuotedLineFormat) < 0) {
        return false;
    }
    if (KLIBCFileSetKeyValue(tmpPath, kKeyErrMsg, errMsg.c_str(), kyto::kQuotedLineFormat) < 0) {
        return false;
    }
    rename(tmpPath, kyto::kApplyStatusFile);
    return true;
}

void SmallUpdate::HASetApplyProgressErr(const std::string& errMsg) const {
    UpdateApplyProgress(0, APPLY_STAGE_WAITING_REMOTE_UPGRADING, errMsg);
}

void SmallUpdate::GetApplyStage(int& percentage, std::string& stage, std::string& errMsg) {
    char msg[kErrMsgWidth] = {0};
    // The status file is only ever replaced by rename, never changed in place.  Reading
    // every key through one open descriptor therefore gives a consistent snapshot, even
    // while another process replaces the file between two key reads.
    kyto::UniqueFd fd(open(kyto::kApplyStatusFile, O_RDONLY | O_CLOEXEC));
    if (!fd.valid() && !KLIBCFileExist(kyto::kApplyStatusFile)) {
        stage = kStageWords[APPLY_STAGE_NONE];
        return;
    }
    std::string readPath = kyto::kApplyStatusFile;
    if (fd.valid()) {
        std::string viaFd = "/proc/self/fd/" + std::to_string(fd.get());
        if (access(viaFd.c_str(), R_OK) == 0) {
            readPath = viaFd;
        }
    }

    snprintf(msg, sizeof(msg), "%s", kErrSystem);
    char percentBuf[kStatusNumberWidth] = {0};
    char stageBuf[kStatusNumberWidth] = {0};
    if (KLIBCFileGetKeyValue(readPath.c_str(), kyto::kKeyPercentage, percentBuf, sizeof(percentBuf),
                             0) <= 0 ||
        KLIBCFileGetKeyValue(readPath.c_str(), kKeyStage, stageBuf, sizeof(stageBuf), 0) <= 0) {
        stage = kStageWords[APPLY_STAGE_NONE];
        errMsg = msg;
        return;
    }
    memset(msg, 0, sizeof(msg));
    if (KLIBCFileGetKeyValue(readPath.c_str(), kKeyErrMsg, msg, sizeof(msg), 0) < 0) {
        msg[0] = '\0';
    }
    percentage = static_cast<int>(strtol(percentBuf, nullptr, 10));
    const unsigned int stageNum = static_cast<unsigned int>(strtol(stageBuf, nullptr, 10));
    if (stageNum <= APPLY_STAGE_REBOOT) {
        stage = kStageWords[stageNum];
    } else {
        errMsg = kErrSystem;
    }
    if (msg[0] != '\0') {
        errMsg = msg;
    }
}
