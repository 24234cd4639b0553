// SystemUpdate: the entry object of the administration interface and the auto-update job.
// It asks the full-release engine first and the small-update engine second, remembers which
// one has something to offer and routes download, apply and the version text to it.
// Cancelling reads the kind of the running download from the shared status file instead, so
// that it also stops a download another process started.
#include "systemupdate.h"

#include <syslog.h>
#include <unistd.h>

#include <kytoplatform/klibc.h>

#include "kyto_paths.h"
#include "platform_error.h"
#include "update_cpputil.h"

namespace {

constexpr const char* kModule = "systemupdate";

}  // namespace

SystemUpdate::SystemUpdate() : m_updateType(UpdateUtil::PATCH_TYPE_NONE), m_blChecked(false) {}

void SystemUpdate::TidyDownloadStatus() {
    // A stopped or failed full-release download leaves nothing a poller should see.
    int percentage = 0;
    VyxUpdate::VYX_DOWNLOAD_STATUS vyxStatus = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    if (!VyxUpdate::GetDownloadStatus(percentage, vyxStatus) ||
        vyxStatus > VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED)
        unlink(kyto::kDownloadStatusFile);

    // KEPT: the small-update reader needs a "percentage" key, which a full-release download never
    // writes: such a file reads as failed here and goes as well, on purpose, unless a
    // finished download's info file answers "finished".
    std::string word;
    m_smallUpdate.GetDownloadStatus(percentage, word);
    if (word != "init" && word != "downloading" && word != "finished")
        unlink(kyto::kDownloadStatusFile);
}

int SystemUpdate::CheckNewUpdate(bool& blHaveUpdate) {
    m_blChecked = true;
    TidyDownloadStatus();

    bool haveRelease = false;
    if (!m_vyxUpdate.CheckNewRelease(haveRelease))
        return 0;
    if (haveRelease) {
        // A newer full release always wins; the patch-list server is not asked.
        blHaveUpdate = true;
        m_updateType = UpdateUtil::PATCH_TYPE_VYX;
        m_fullVersion = m_vyxUpdate.GetFullVersion();
        return 1;
    }
    if (m_smallUpdate.HaveNewFix()) {
        blHaveUpdate = true;
        m_updateType = UpdateUtil::PATCH_TYPE_SMALL;
        m_fullVersion = m_smallUpdate.GetFullVersion();
        return 1;
    }
    // A patch-list server that answered with an unexpected status cannot tell whether a fix
    // exists: the question stays unanswered.
    if (m_smallUpdate.GetErrno() == SmallUpdate::ERROR_CODE_SERVER_STATUS)
        return 0;
    blHaveUpdate = false;
    m_fullVersion = m_smallUpdate.GetFullVersion();
    return 1;
}

std::string SystemUpdate::GetUpdateType() {
    if (!m_blChecked) {
        bool scratch = false;
        if (!CheckNewUpdate(scratch)) {
            syslog(LOG_ERR, "%s:%d Fail to check new update", kModule, __LINE__);
            return std::string();
        }
    }
    // Every type but the full release answers "smallupdate", the nothing-found type
    // included: callers decide whether an update exists from CheckNewUpdate's flag.
    return m_updateType == UpdateUtil::PATCH_TYPE_VYX ? "vyx" : "smallupdate";
}

std::string SystemUpdate::GetFullVersion() {
    // While nothing is offered the text stays empty and every call checks anew.
    if (m_fullVersion.empty()) {
        bool scratch = false;
        if (!CheckNewUpdate(scratch))
            syslog(LOG_ERR, "%s:%d failed to get full version", kModule, __LINE__);
    }
    return m_fullVersion;
}

int SystemUpdate::ImportInfoFile() {
    Json::Value root;
    // A document that is not an object (an array, a bare word or number) is no record; a
    // member lookup on it would throw inside jsoncpp.
    if (!UpdateUtil::ParseJsonRootFromFile(kyto::kAutoUpdateInfoFile, root) || !root.isObject())
        return 0;
    // KEPT: the type words are compared by the identity of their storage, not by their text, so
    // a word read from the file never matches: a fresh object does not apply an update
    // found in the info file.  Callers that want the downloaded kind read it with
    // UpdateUtil::CheckDownloadedPatchType, which compares the text.
    const char* type =
        root[kyto::kKeyUpdateType].isString() ? root[kyto::kKeyUpdateType].asCString() : nullptr;
    if (type == kyto::kTypeVyx) {
        m_updateType = UpdateUtil::PATCH_TYPE_VYX;
        return 1;
    }
    if (type == kyto::kTypeSmall) {
        m_updateType = UpdateUtil::PATCH_TYPE_SMALL;
        return 1;
    }
    return 0;
}

int SystemUpdate::Download() {
    if (m_updateType == UpdateUtil::PATCH_TYPE_NONE) {
        bool scratch = false;
        if (!CheckNewUpdate(scratch))
            return 0;
    }
    if (m_updateType == UpdateUtil::PATCH_TYPE_VYX)
        return m_vyxUpdate.DownloadVyx();
    if (m_updateType == UpdateUtil::PATCH_TYPE_SMALL)
        return m_smallUpdate.Download(true) ? 1 : 0;
    return 0;
}

int SystemUpdate::Apply() {
    if (m_updateType == UpdateUtil::PATCH_TYPE_NONE && !ImportInfoFile())
        return 0;
    // A full release is installed by the installer from the downloaded image, not here.
    if (m_updateType == UpdateUtil::PATCH_TYPE_SMALL)
        return m_smallUpdate.Apply() ? 1 : 0;
    return 0;
}

int SystemUpdate::CancelDownload() {
    SmallUpdate smallUpdate;
    char type[64] = {0};
    if (KLIBCFileGetKeyValue(kyto::kDownloadStatusFile, kyto::kKeyUpdateType, type, sizeof(type),
                             0) <= 0) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__,
               kyto::kKeyUpdateType, kyto::kDownloadStatusFile, kyto::LastErrorText().c_str());
        return 0;
    }
    const std::string word(type);
    if (word == kyto::kTypeVyx)
        return VyxUpdate::CancelDownloadVyx() ? 1 : 0;
    if (word == kyto::kTypeSmall)
        return smallUpdate.CancelDownload() ? 1 : 0;
    syslog(LOG_ERR, "%s:%d Unknown update type [%s]", kModule, __LINE__, type);
    return 0;
}
