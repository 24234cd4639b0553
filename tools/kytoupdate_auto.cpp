// auto: the scheduled auto-update job, one run at a time under a lock file.
#include <string>

#include "kyto_paths.h"
#include "kytoupdate_common.h"
#include "kytoupdate_trust.h"
#include "scoped.h"
#include "update_cpputil.h"

namespace kytoupdate {

namespace {
const char* const kAutoLock = "/var/run/kytoupdate-auto.lock";
}

int CmdAuto() {
    // One auto-update at a time, whoever starts it (the timer, cron, a person).
    kyto::UniqueFd lock;
    if (const int rc = TryLock(kAutoLock, "another automatic update is running", lock); rc >= 0)
        return rc;
    CatchStopSignals();
    SystemUpdate su;
    const int rc = CheckAndDownload(su);
    if (rc == kExitUpToDate)
        return kExitOk;
    if (rc >= 0)
        return rc;
    if (su.m_updateType == UpdateUtil::PATCH_TYPE_VYX) {
        Note("the full release is left for the installer");
        return kExitOk;
    }
    // The download ran in a child: take its record (package folder included) back from the
    // info file before the facade applies it.
    su.m_smallUpdate.ImportInfoFile(kyto::kAutoUpdateInfoFile);
    if (const int refused = TrustPackageFolder(su.m_smallUpdate); refused >= 0)
        return refused;
    return ApplyWithServices(su.m_smallUpdate, [&su] { return su.Apply() == 1; });
}

}  // namespace kytoupdate
