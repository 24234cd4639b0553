// SmallUpdate: the install steps of an apply.  The flash package's updater runs inside its
// extracted folder; the small-update package's boot-time installer and configuration
// updater are staged in "/smallupd@te/"; the further packages are installed with the
// package tool, or staged there for the next boot when the update needs a reboot.
#include "smallupdate.h"

#include <sys/stat.h>
#include <sys/types.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include <kytoplatform/klibc.h>

#include "debian_lib.h"
#include "file_system.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "smallupdate_internal.h"
#include "update_cpputil.h"
#include "version_file.h"

using namespace kyto::small;

namespace {

// Removes an extraction folder (with the relative rm) on every way out of a step.
class ScopedFolderRemoval {
  public:
    explicit ScopedFolderRemoval(const char* folder) : folder_(folder) {}
    ~ScopedFolderRemoval() { kyto::RemoveFolderWith(kRmRelative, folder_); }
    ScopedFolderRemoval(const ScopedFolderRemoval&) = delete;
    ScopedFolderRemoval& operator=(const ScopedFolderRemoval&) = delete;

  private:
    const char* folder_;
};

// Runs the extracted flash updater from inside its folder; the caller's working folder is
// restored afterwards.
bool RunFlashUpdater() {
    char cwd[kPathWidth] = {0};
    if (getcwd(cwd, sizeof(cwd)) == nullptr || chdir(kFlashTempFolder) != 0) {
        return false;
    }
    const std::string updater = std::string(kFlashTempFolder) + kFlashUpdater;
    const int rc = KLIBCExec(updater.c_str(), "-r", "/", nullptr, nullptr);
    if (rc != 0) {
        syslog(LOG_ERR, "%s:%d failed to exec updater -r", kModule, __LINE__);
    }
    if (chdir(cwd) != 0) {
        syslog(LOG_ERR, "%s:%d failed to go back to %s%s", kModule, __LINE__, cwd,
               kyto::LastErrorText().c_str());
    }
    return rc == 0;
}

// Moves an extracted payload into the staging folder when it was asked for and is there.
bool StagePayload(bool wanted, const std::string& payload) {
    if (!wanted || !KLIBCFileExist(payload.c_str())) {
        return true;
    }
    return KLIBCExec(kMvRelative, "-f", payload.c_str(), kStagingFolder, nullptr) == 0;
}

}  // namespace

bool SmallUpdate::UpdateFlash() const {
    ScopedFolderRemoval removeExtracted(kFlashTempFolder);
    if (m_blFlashUpdate && m_flashUpdateDeb.empty()) {
        return false;
    }
    if (!DebianLib::ExecDpkg("-x", m_debDir + "/" + m_flashUpdateDeb, kFlashTempFolder)) {
        return false;
    }
    return RunFlashUpdater();
}

bool SmallUpdate::UnpackSmallUpdate() const {
    ScopedFolderRemoval removeExtracted(kSmallTempFolder);
    if (!DebianLib::ExecDpkg("-x", m_debDir + "/" + m_smallUpdateDeb, kSmallTempFolder)) {
        return false;
    }
    // An existing staging folder is fine; a real failure shows up in the moves below.
    mkdir(kStagingFolder, 0755);
    return StagePayload(m_blNeedReboot, std::string(kSmallTempFolder) + kBootUpdaterDir) &&
           StagePayload(m_blConfigUpdate, std::string(kSmallTempFolder) + kConfigUpdate);
}

bool SmallUpdate::UpdateConfig() const {
    const std::string program = std::string(kStagingFolder) + kConfigUpdate;
    if (access(program.c_str(), F_OK) != 0) {
        syslog(LOG_ERR, "%s:%d configupdate not exist", kModule, __LINE__);
        return false;
    }
    if (KLIBCExec(program.c_str(), "-c", "all", "-p", kyto::VersionFile()) != 0) {
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
