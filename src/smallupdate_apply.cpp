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
#include "update_cpputil.h"

namespace {

constexpr const char* kModule = "smallupdate";
constexpr const char* kErrSystem = "err_system";

}  // namespace

bool SmallUpdate::Apply() {
    // What the failure report repeats: the last percentage and stage shown.
    int percentage = 0;
    APPLY_STAGE stage = APPLY_STAGE_ANALYING;
    bool ok = false;

    UpdateApplyProgress(0, APPLY_STAGE_ANALYING, "");
    // A record loaded by the caller skips this check on purpose.
    if (m_newSmallFixNumber < 0 && !IsReadyApply()) {
        goto REPORT;
    }
    {
        char installed[8] = {0};
        if (KLIBCFileGetKeyValue(kyto::kVersionFile, "smallfixnumber", installed, sizeof(installed),
                                 0) <= 0) {
            snprintf(installed, sizeof(installed), "%s", "0");
        }
        std::ostringstream line;
        line << "start critical update to buildnumber: " << m_buildNumber
             << " original smallfixnumbre: " << installed
             << " new_smallfixnumber: " << m_newSmallFixNumber;
        DebianLib::WriteUpdateLog(line.str(), kyto::kUpdateLog);
    }
    stage = APPLY_STAGE_PROGRAM;
    UpdateApplyProgress(0, APPLY_STAGE_PROGRAM, "");

    if (m_blFlashUpdate && !UpdateFlash()) {
        syslog(LOG_ERR, "%s:%d failed to update flash", kModule, __LINE__);
        goto REPORT;
    }
    UpdateApplyProgress(10, APPLY_STAGE_PROGRAM, "");
    percentage = 10;

    if ((m_blConfigUpdate || (m_blNeedReboot && !m_installDebs.empty())) && !UnpackSmallUpdate()) {
        syslog(LOG_ERR, "%s:%d failed to unpack smakkupdate debian", kModule, __LINE__);
        goto REPORT;
    }
    UpdateApplyProgress(20, APPLY_STAGE_PROGRAM, "");
    percentage = 20;

    if (m_blConfigUpdate && !UpdateConfig()) {
        syslog(LOG_ERR, "%s:%d failed to do config update", kModule, __LINE__);
        goto REPORT;
    }
    UpdateApplyProgress(30, APPLY_STAGE_PROGRAM, "");
    percentage = 30;
    if (!InstallDeb(30, APPLY_STAGE_PROGRAM)) {
        syslog(LOG_ERR, "%s:%d failed to do install debain action", kModule, __LINE__);
        goto REPORT;
    }

    {
        char fix[8] = {0};
        snprintf(fix, sizeof(fix), "%d", m_newSmallFixNumber);
        if (KLIBCFileSetKeyValue(kyto::kVersionFile, "smallfixnumber", fix, nullptr) <= 0) {
            goto REPORT;
        }
    }

    if (!m_blNeedReboot && !KYTOHAIsRunning()) {
        // The status stays at the last package's percentage; the service start moves it on.
        DebianLib::WriteUpdateLog("Finished update!", kyto::kUpdateLog);
    } else {
        UpdateApplyProgress(100, APPLY_STAGE_REBOOT, "");
        DebianLib::WriteUpdateLog("Finished update before reboot!", kyto::kUpdateLog);
    }
    ok = true;
    goto CLEANUP;

REPORT:
    UpdateApplyProgress(percentage, stage, kErrSystem);

CLEANUP : {
    char passiveDir[4095] = {0};
    if (KLIBCFileGetKeyValue(kyto::kPassiveInfoFile, "debDir", passiveDir, sizeof(passiveDir), 0) >
        0) {
        UpdateUtil::RemoveFolder(passiveDir);
        unlink(kyto::kPassiveInfoFile);
    }
}
    UpdateUtil::RemoveFolder(m_debDir);
    unlink(kyto::kAutoUpdateInfoFile);
    return ok;
}
