// SmallUpdate: the small-update record, its info files, the download and apply status
// files, and the flash, unpack, configuration and package installation steps.
#include "smallupdate.h"

#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include <json/json.h>
#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "debian_lib.h"
#include "download_status.h"
#include "file_system.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "update_cpputil.h"

namespace {

constexpr const char* kModule = "smallupdate";

// Extraction folders of the flash and small-update packages, and the staging folder that
// survives until the next boot.
constexpr const char* kFlashTempFolder = "/flashUpd@teTempFolder";
constexpr const char* kSmallTempFolder = "/smallUpd@teTempFolder";
constexpr const char* kStagingFolder = "/smallupd@te/";
constexpr const char* kStagingPrefix = "/smallupd@te//";
constexpr const char* kBootUpdaterDir = "/smallupd@ter";
constexpr const char* kConfigUpdate = "/configupdate";
constexpr const char* kFlashUpdater = "/updater";

// Removal and unpack-time moves use relative program names: the caller's working
// directory is the root folder on the appliance.
constexpr const char* kRmRelative = "bin/rm";
constexpr const char* kMvRelative = "bin/mv";
constexpr const char* kMvAbsolute = "/bin/mv";

// Apply status keys.
constexpr const char* kKeyStage = "stage";
constexpr const char* kKeyErrMsg = "ErrMsg";
constexpr const char* kErrSystem = "err_system";

const char* const kStageWords[] = {
    "none", "waiting_remote_upgrading", "analying", "program", "startService", "finished", "reboot",
};

}  // namespace

SmallUpdate::SmallUpdate()
    : m_errno(0),
      m_conf(),
      m_unique(),
      m_newSmallFixNumber(-1),
      m_buildNumber(-1),
      m_blConfigUpdate(false),
      m_blFlashUpdate(false),
      m_blRestartAllService(false),
      m_blNeedReboot(false) {
    m_unique = m_conf.Def("unique", "");
}

SmallUpdate::SmallUpdate(const std::string& unique) : SmallUpdate() {
    if (!unique.empty()) {
        m_unique = unique;
    }
}

int SmallUpdate::GetErrno() {
    return m_errno;
}

bool SmallUpdate::Equal(const SmallUpdate& other) const {
    if (m_blConfigUpdate != other.m_blConfigUpdate)
        return false;
    if (m_blFlashUpdate != other.m_blFlashUpdate)
        return false;
    if (m_newSmallFixNumber != other.m_newSmallFixNumber)
        return false;
    if (m_debDir != other.m_debDir)
        return false;
    if (!UpdateUtil::CompareVector(m_installDebLinks, other.m_installDebLinks))
        return false;
    if (m_smallUpdateDeb != other.m_smallUpdateDeb)
        return false;
    if (m_flashUpdateDeb != other.m_flashUpdateDeb)
        return false;
    if (!UpdateUtil::CompareVector(m_installDebs, other.m_installDebs))
        return false;
    if (m_blRestartAllService != other.m_blRestartAllService)
        return false;
    if (m_blNeedReboot != other.m_blNeedReboot)
        return false;
    if (!UpdateUtil::CompareVector(m_vyxServiceRestartList, other.m_vyxServiceRestartList)) {
        return false;
    }
    return UpdateUtil::CompareVector(m_pkgRestartList, other.m_pkgRestartList) == 1;
}

namespace {

// Whether a parsed info file has the members an apply needs, with the right types: a
// small update's type word, the build and fix numbers, the package folder, at least one
// package, and the restart behaviour stated.
bool InfoDocumentIsComplete(const Json::Value& info) {
    // Member access on anything but an object would throw inside jsoncpp.
    if (!info.isObject())
        return false;
    if (!info["updateType"].isString() || info["updateType"].asString() != kyto::kTypeSmall)
        return false;
    if (!info["buildnumber"].isInt() || !info["newSmallFixNumber"].isInt() ||
        !info["debDir"].isString()) {
        return false;
    }
    const bool namesPackage = info.isMember("installDeb") || info["smallupdateDeb"].isString() ||
                              info["flashupdateDeb"].isString();
    const bool statesRestart =
        info["blNeedReboot"].isBool() || info["blRestartAllService"].isBool() ||
        (info.isMember("vyxServiceRestartList") && info.isMember("pkgRestartList"));
    return namesPackage && statesRestart;
}

// Whether the info file was made for the build this system runs; false also when the
// running build cannot be read.
bool InfoBuildIsRunning(const Json::Value& info) {
    char buildNumber[16] = {0};
    if (KLIBCFileGetKeyValue(kyto::kVersionFile, "buildnumber", buildNumber, sizeof(buildNumber),
                             0) < 0) {
        return false;
    }
    return strtol(buildNumber, nullptr, 10) == info["buildnumber"].asInt();
}

// Package names as the package tool's wrapper reads them: every one must carry a small-fix
// number for the running build.
bool PackageNamesAreValid(const std::vector<std::string>& names) {
    for (const std::string& name : names) {
        if (DebianLib::FindSmallFixNumfromDeb(name) < 0) {
            syslog(LOG_ERR, "%s:%d format error of debian [%s]", kModule, __LINE__, name.c_str());
            return false;
        }
    }
    return true;
}

Json::Value StringArray(const std::vector<std::string>& items) {
    Json::Value array(Json::arrayValue);
    UpdateUtil::StringVector2JsonArray(items, array);
    return array;
}

}  // namespace

bool SmallUpdate::ImportInfoFile(const char* path) {
    m_errno = ERROR_CODE_BAD_INPUT;
    if (path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, __FILE__, __LINE__);
        syslog(LOG_ERR, "%s:%d bad parameter!", kModule, __LINE__);
        return false;
    }
    if (!KLIBCFileExist(path))
        return false;
    Json::Value info;
    if (UpdateUtil::ParseJsonRootFromFile(path, info) != 1 || !InfoDocumentIsComplete(info))
        return false;
    m_errno = ERROR_CODE_BUILD_MISMATCH;
    if (!InfoBuildIsRunning(info))
        return false;
    m_errno = ERROR_CODE_BAD_INPUT;
    if (!StoreInfoFields(info))
        return false;
    m_errno = ERROR_CODE_NONE;
    return true;
}

bool SmallUpdate::StoreInfoFields(const Json::Value& info) {
    // Fields assigned before a failure keep their new values: callers re-import or give
    // the record up.
    m_buildNumber = info["buildnumber"].asInt();
    m_newSmallFixNumber = info["newSmallFixNumber"].asInt();
    m_debDir = info["debDir"].asString();
    m_smallUpdateDeb = kyto::MemberText(info, "smallupdateDeb");
    m_blConfigUpdate = kyto::MemberBool(info, "configUpdate");
    m_flashUpdateDeb = kyto::MemberText(info, "flashupdateDeb");
    if (!m_flashUpdateDeb.empty())
        m_blFlashUpdate = true;
    m_blNeedReboot = kyto::MemberBool(info, "blNeedReboot");
    m_blRestartAllService = kyto::MemberBool(info, "blRestartAllService");

    std::vector<std::string> installDebs;
    if (!kyto::MemberStringList(info, "installDeb", installDebs) ||
        !PackageNamesAreValid(installDebs)) {
        return false;
    }
    m_installDebs = installDebs;
    return kyto::MemberStringList(info, "vyxServiceRestartList", m_vyxServiceRestartList) &&
           kyto::MemberStringList(info, "pkgRestartList", m_pkgRestartList);
}

Json::Value SmallUpdate::InfoDocument(bool blPassive) const {
    Json::Value root(Json::objectValue);
    root["updateType"] = kyto::kTypeSmall;
    root["buildnumber"] = m_buildNumber;
    root["newSmallFixNumber"] = m_newSmallFixNumber;
    root["debDir"] = blPassive ? std::string(kyto::kDefaultDebDirName) : m_debDir;
    if (m_blNeedReboot) {
        root["blNeedReboot"] = true;
    } else if (m_blRestartAllService) {
        root["blRestartAllService"] = true;
    } else {
        // Both lists are written even when empty, so that the reader sees the restart
        // behaviour stated.
        root["vyxServiceRestartList"] = StringArray(m_vyxServiceRestartList);
        root["pkgRestartList"] = StringArray(m_pkgRestartList);
    }
    if (m_blConfigUpdate)
        root["configUpdate"] = true;
    if (!m_smallUpdateDeb.empty())
        root["smallupdateDeb"] = m_smallUpdateDeb;
    if (!m_flashUpdateDeb.empty())
        root["flashupdateDeb"] = m_flashUpdateDeb;
    if (!m_installDebs.empty())
        root["installDeb"] = StringArray(m_installDebs);
    return root;
}

bool SmallUpdate::InfoPackagesAreConsistent() const {
    if (m_flashUpdateDeb.empty() && m_smallUpdateDeb.empty() && m_installDebs.empty()) {
        syslog(LOG_ERR, "%s:%d no flash and smallupdate or others debian file%s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    // A package name without its link (or the reverse) means the patch list was merged
    // wrongly; such a record must not reach the apply.
    if (m_smallUpdateDeb.empty() != m_smallUpdateDebLink.empty()) {
        syslog(LOG_ERR, "%s:%d bad smallupdate debian [%s][%s]%s", kModule, __LINE__,
               m_smallUpdateDeb.c_str(), m_smallUpdateDebLink.c_str(),
               kyto::LastErrorText().c_str());
        return false;
    }
    if (m_flashUpdateDeb.empty() != m_flashUpdateDebLink.empty()) {
        syslog(LOG_ERR, "%s:%d bad flashupdate debian[%s][%s]", kModule, __LINE__,
               m_flashUpdateDeb.c_str(), m_flashUpdateDebLink.c_str());
        return false;
    }
    return true;
}

bool SmallUpdate::InfoFileTarget(bool blPassive, std::string& target) const {
    if (!blPassive) {
        target = kyto::kAutoUpdateInfoFile;
        return true;
    }
    // The passive node's apply finds the info file through the marker file.
    target = m_debDir + kyto::kAutoUpdateInfoFile;
    unlink(kyto::kPassiveInfoFile);
    if (KLIBCFileSetKeyValue(kyto::kPassiveInfoFile, "debDir", m_debDir.c_str(), nullptr) < 1) {
        // The message's last conversion is a number where the marker file is meant; the
        // log readers expect this form.  Passing the char* itself to %d would be
        // undefined, so the pointer value is passed as an int.
        syslog(LOG_ERR, "%s:%d failed to set debDri=%s into %d", kModule, __LINE__,
               m_debDir.c_str(), (int)(intptr_t)kyto::kPassiveInfoFile);
        return false;
    }
    return true;
}

bool SmallUpdate::DumpToInfoFile(bool blPassive) {
    std::string target;
    bool ok = InfoPackagesAreConsistent() && InfoFileTarget(blPassive, target);
    if (ok) {
        // Written next to the target and renamed over it: the interface polls this file
        // and deletes one it cannot parse, so it must never see half a record, nor a
        // moment without one.  An old record the new one could not replace goes.
        ok = kyto::DumpJsonAtomically(target.c_str(), InfoDocument(blPassive), true) == 1;
        if (!ok) {
            unlink(target.c_str());
            syslog(LOG_ERR, "%s:%d failed to dump json to file [%s]", kModule, __LINE__,
                   target.c_str());
        }
    }
    if (!ok) {
        // No half-made download is left for the apply: both fixed files go, also when
        // the target was under the package folder.
        unlink(kyto::kAutoUpdateInfoFile);
        unlink(kyto::kPassiveInfoFile);
    }
    return ok;
}

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
    char tmpPath[128] = {0};
    snprintf(tmpPath, sizeof(tmpPath), "%s_XXXXXX", kyto::kApplyStatusFile);
    kyto::UniqueFd fd(mkostemp(tmpPath, O_CLOEXEC));
    if (!fd.valid()) {
        return false;
    }
    kyto::ScopedUnlink removeTmp(tmpPath);
    // Pollers of other users may read the status: same mode as a freshly created file.
    fchmod(fd.get(), 0644);
    fd.reset();

    char buf[16] = {0};
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
    char msg[256] = {0};
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
    char percentBuf[16] = {0};
    char stageBuf[16] = {0};
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

bool SmallUpdate::UpdateFlash() const {
    bool ok = false;
    if (m_blFlashUpdate && m_flashUpdateDeb.empty()) {
        goto END;
    }
    if (!DebianLib::ExecDpkg("-x", m_debDir + "/" + m_flashUpdateDeb, kFlashTempFolder)) {
        goto END;
    }
    {
        char cwd[4096] = {0};
        if (getcwd(cwd, sizeof(cwd)) == nullptr || chdir(kFlashTempFolder) != 0) {
            goto END;
        }
        const std::string updater = std::string(kFlashTempFolder) + kFlashUpdater;
        const int rc = KLIBCExec(updater.c_str(), "-r", "/", nullptr, nullptr);
        if (rc != 0) {
            syslog(LOG_ERR, "%s:%d failed to exec updater -r", kModule, __LINE__);
        }
        ok = (rc == 0);
        if (chdir(cwd) != 0) {
            syslog(LOG_ERR, "%s:%d failed to go back to %s%s", kModule, __LINE__, cwd,
                   kyto::LastErrorText().c_str());
        }
    }
END:
    kyto::RemoveFolderWith(kRmRelative, kFlashTempFolder);
    return ok;
}

bool SmallUpdate::UnpackSmallUpdate() const {
    bool ok = false;
    const std::string bootUpdater = std::string(kSmallTempFolder) + kBootUpdaterDir;
    const std::string configUpdate = std::string(kSmallTempFolder) + kConfigUpdate;
    if (!DebianLib::ExecDpkg("-x", m_debDir + "/" + m_smallUpdateDeb, kSmallTempFolder)) {
        goto END;
    }
    // An existing staging folder is fine; a real failure shows up in the moves below.
    mkdir(kStagingFolder, 0755);
    if (m_blNeedReboot && KLIBCFileExist(bootUpdater.c_str())) {
        if (KLIBCExec(kMvRelative, "-f", bootUpdater.c_str(), kStagingFolder, nullptr) != 0) {
            goto END;
        }
    }
    if (m_blConfigUpdate && KLIBCFileExist(configUpdate.c_str())) {
        if (KLIBCExec(kMvRelative, "-f", configUpdate.c_str(), kStagingFolder, nullptr) != 0) {
            goto END;
        }
    }
    ok = true;
END:
    kyto::RemoveFolderWith(kRmRelative, kSmallTempFolder);
    return ok;
}

bool SmallUpdate::UpdateConfig() const {
    const std::string program = std::string(kStagingFolder) + kConfigUpdate;
    if (access(program.c_str(), F_OK) != 0) {
        syslog(LOG_ERR, "%s:%d configupdate not exist", kModule, __LINE__);
        return false;
    }
    if (KLIBCExec(program.c_str(), "-c", "all", "-p", kyto::kVersionFile) != 0) {
        syslog(LOG_ERR, "%s:%d failed to update config", kModule, __LINE__);
        return false;
    }
    return true;
}

bool SmallUpdate::InstallDeb(int startPercentage, APPLY_STAGE stage) {
    int percentage = startPercentage;
    // Step per package: unsigned integer division, so 30 % and 3 packages end at 99 %.
    auto advance = [&]() {
        const unsigned int step = static_cast<unsigned int>(100 - startPercentage) /
                                  static_cast<unsigned int>(m_installDebs.size());
        percentage = static_cast<int>(static_cast<unsigned int>(percentage) + step);
        UpdateApplyProgress(percentage, stage, "");
    };

    if (!m_blNeedReboot) {
        std::sort(m_installDebs.begin(), m_installDebs.end(), DebianLib::InstallDebCompare);
        bool failed = false;
        for (const std::string& name : m_installDebs) {
            const std::string path = m_debDir + "/" + name;
            if (!DebianLib::ExecDpkg("-i", path)) {
                syslog(LOG_ERR, "%s:%d Failed to install %s", kModule, __LINE__, path.c_str());
                failed = true;
            }
            advance();
        }
        if (failed) {
            UpdateUtil::RemoveFolder(kStagingFolder);
            return false;
        }
        return true;
    }

    // Reboot needed: stage the packages for the next boot instead of installing them.
    struct stat st;
    if (stat(kStagingFolder, &st) != 0 || !S_ISDIR(st.st_mode)) {
        kyto::RemoveFolderWith(kRmRelative, kStagingFolder);
        if (mkdir(kStagingFolder, 0700) != 0) {
            syslog(LOG_ERR, "%s:%d Failed to mkdir(%s) [%m]", kModule, __LINE__, kStagingFolder);
            UpdateUtil::RemoveFolder(kStagingFolder);
            return false;
        }
    }
    for (const std::string& name : m_installDebs) {
        const std::string source = m_debDir + "/" + name;
        const std::string target = kStagingPrefix + name;
        if (KLIBCExec(kMvAbsolute, "-f", source.c_str(), target.c_str(), nullptr) != 0) {
            syslog(LOG_ERR, "%s:%d Failed to mv %s to %s [%m]", kModule, __LINE__, source.c_str(),
                   target.c_str());
            UpdateUtil::RemoveFolder(kStagingFolder);
            return false;
        }
        advance();
    }
    return true;
}

bool SmallUpdate::GetSourceDir(std::string& folder, const std::string& name) {
    std::string volume;
    if (!UpdateUtil::IsThereAvailVolPath(volume, kyto::kMinDownloadFreeBytes, true)) {
        m_errno = ERROR_CODE_NO_ROOM;
        return false;
    }
    folder = volume + "/" + name;
    return true;
}

bool SmallUpdate::FilesExist(const std::string& folder, const std::string& name) {
    if (name.empty()) {
        return true;
    }
    const std::string path = folder + "/" + name;
    if (access(path.c_str(), F_OK) != 0) {
        syslog(LOG_ERR, "%s:%d can't access [%s]", kModule, __LINE__, path.c_str());
        return false;
    }
    return true;
}

bool SmallUpdate::FilesExist(const std::string& folder, const std::vector<std::string>& names) {
    for (const std::string& name : names) {
        if (!FilesExist(folder, name)) {
            return false;
        }
    }
    return true;
}
