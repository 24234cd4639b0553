// SmallUpdate: applying a downloaded small update.  Flash, unpack, configuration update and
// package installation run in that order; every step is reported in the apply status file
// for the interface's poller and the milestones in the update log for people reading it
// later.  The downloaded packages and the info files are consumed by every apply.
#include "smallupdate.h"

#include <stdio.h>
#include <syslog.h>
#include <unistd.h>

#include <sstream>
#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_system.h>

#include "debian_lib.h"
#include "kyto_paths.h"
#include "smallupdate_internal.h"
#include "update_cpputil.h"
#include "version_file.h"

using namespace kyto::small;

namespace {

// The steps of one apply up to the new small-fix number.  `percentage` and `stage` follow
// what the poller was last shown, so that a failure can be reported where it happened.
bool RunApplySteps(SmallUpdate& update, int& percentage, SmallUpdate::APPLY_STAGE& stage) {
    SmallUpdate::UpdateApplyProgress(0, SmallUpdate::APPLY_STAGE_ANALYING, "");
    // A record loaded by the caller skips this check on purpose.
    if (update.m_newSmallFixNumber < 0 && !update.IsReadyApply())
        return false;

    char installed[kApplyFixWidth] = {0};
    if (KLIBCFileGetKeyValue(kyto::VersionFile(), "smallfixnumber", installed, sizeof(installed),
                             0) <= 0)
        snprintf(installed, sizeof(installed), "%s", "0");
    std::ostringstream line;
    line << "start critical update to buildnumber: " << update.m_buildNumber
         << " original smallfixnumbre: " << installed
         << " new_smallfixnumber: " << update.m_newSmallFixNumber;
    DebianLib::WriteUpdateLog(line.str(), kyto::kUpdateLog);

    stage = SmallUpdate::APPLY_STAGE_PROGRAM;
    SmallUpdate::UpdateApplyProgress(0, stage, "");
    if (update.m_blFlashUpdate && !update.UpdateFlash()) {
        syslog(LOG_ERR, "%s:%d failed to update flash", kModule, __LINE__);
        return false;
    }
    SmallUpdate::UpdateApplyProgress(percentage = 10, stage, "");

    // The small-update package carries the configuration updater and the boot-time
    // installer: it is unpacked for a configuration update, and for a reboot update that
    // stages further packages.
    const bool unpack =
        update.m_blConfigUpdate || (update.m_blNeedReboot && !update.m_installDebs.empty());
    if (unpack && !update.UnpackSmallUpdate()) {
        syslog(LOG_ERR, "%s:%d failed to unpack smakkupdate debian", kModule, __LINE__);
        return false;
    }
    SmallUpdate::UpdateApplyProgress(percentage = 20, stage, "");

    if (update.m_blConfigUpdate && !update.UpdateConfig()) {
        syslog(LOG_ERR, "%s:%d failed to do config update", kModule, __LINE__);
        return false;
    }
    SmallUpdate::UpdateApplyProgress(percentage = 30, stage, "");
    if (!update.InstallDeb(30, stage)) {
        syslog(LOG_ERR, "%s:%d failed to do install debain action", kModule, __LINE__);
        return false;
    }

    // Written only once every package is in: a failure here leaves the old number, and the
    // next check offers the fix again.
    char fix[kApplyFixWidth] = {0};
    snprintf(fix, sizeof(fix), "%d", update.m_newSmallFixNumber);
    return KLIBCFileSetKeyValue(kyto::VersionFile(), "smallfixnumber", fix, nullptr) > 0;
}

}  // namespace

bool SmallUpdate::Apply() {
    int percentage = 0;
    APPLY_STAGE stage = APPLY_STAGE_ANALYING;
    const bool ok = RunApplySteps(*this, percentage, stage);
    if (!ok) {
        UpdateApplyProgress(percentage, stage, kErrSystem);
    } else if (!m_blNeedReboot && !KYTOHAIsRunning()) {
        // The status stays at the last package's percentage; the service start moves it on.
        DebianLib::WriteUpdateLog("Finished update!", kyto::kUpdateLog);
    } else {
        // A cluster node is restarted by the cluster's own upgrade, like a reboot update.
        UpdateApplyProgress(100, APPLY_STAGE_REBOOT, "");
        DebianLib::WriteUpdateLog("Finished update before reboot!", kyto::kUpdateLog);
    }

    // Every apply, successful or not, consumes the downloaded packages and the info files,
    // so that a broken download is never applied twice.
    char passiveDir[kPassiveDirWidth] = {0};
    if (KLIBCFileGetKeyValue(kyto::kPassiveInfoFile, "debDir", passiveDir, sizeof(passiveDir), 0) >
        0) {
        UpdateUtil::RemoveFolder(passiveDir);
        unlink(kyto::kPassiveInfoFile);
    }
    UpdateUtil::RemoveFolder(m_debDir);
    unlink(kyto::kAutoUpdateInfoFile);
    return ok;
}
