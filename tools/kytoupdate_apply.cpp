// apply, services and import: a downloaded or imported small update installed with the
// services it touches stopped before and started after.
#include <stdio.h>

#include <string>

#include "kytoupdate_common.h"
#include "kytoupdate_trust.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

namespace kytoupdate {

namespace {

// Loads the downloaded (or imported) small update into u; an error text when there is none.
std::string LoadDownloadedSmallUpdate(SmallUpdate& u) {
    UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_NONE;
    UpdateUtil::CheckDownloadedPatchType(type);
    if (type == UpdateUtil::PATCH_TYPE_NONE)
        return "no downloaded update";
    if (type == UpdateUtil::PATCH_TYPE_VYX) {
        bool have = false;
        std::string path;
        VyxUpdate::GetDownloadedPatchPath(have, path);
        return "the downloaded update is a full release (" + path +
               "); the installer installs it, not kytoupdate";
    }
    if (!u.IsReadyApply())
        return "the downloaded small update is incomplete or was made for another build";
    return "";
}

}  // namespace

int ApplyWithServices(SmallUpdate& u, const std::function<bool()>& applyFn) {
    const std::string version = u.GetFullVersion();
    Note("stopping services (" + std::string(RestartWord(u.GetServiceRestartType())) + ")");
    u.SwitchServices(false);
    const bool ok = applyFn();
    int pct = 0;
    std::string stage = "none", error;
    SmallUpdate::GetApplyStage(pct, stage, error);
    if (ok && stage == "reboot") {
        printf("applied %s\nreboot needed\n", version.c_str());
        return kExitOk;
    }
    Note("starting services");
    u.SwitchServices(true);
    if (!ok)
        return Fail("applying " + version + " failed at stage " + stage +
                    (error.empty() ? "" : " (" + error + ")") + "; services started again");
    printf("applied %s\n", version.c_str());
    return kExitOk;
}

int CmdApply() {
    SmallUpdate u;
    const std::string why = LoadDownloadedSmallUpdate(u);
    if (!why.empty())
        return Fail("nothing to apply: " + why);
    if (const int refused = TrustPackageFolder(u); refused >= 0)
        return refused;
    return ApplyWithServices(u, [&u] { return u.Apply(); });
}

int CmdServices(const std::string& action) {
    SmallUpdate u;
    const std::string why = LoadDownloadedSmallUpdate(u);
    if (!why.empty())
        return Fail("no small update to take the services from: " + why);
    u.SwitchServices(action == "start");
    printf("services %s: %s\n", action == "start" ? "started" : "stopped",
           RestartWord(u.GetServiceRestartType()));
    return kExitOk;
}

int CmdImport(const std::string& archive) {
    bool isSmall = false;
    if (!SmallUpdate::CheckPatchIsSmallUpdate(archive, isSmall))
        return Fail("cannot read " + archive);
    if (!isSmall)
        return Fail(archive + " is not a small-update archive (no patch list in it)");
    SmallUpdate u;
    if (!u.ImportSmallPatch(archive))
        return Fail("importing " + archive + " failed: " + SmallErrnoText(u.GetErrno()));
    if (const int refused = TrustPackageFolder(u); refused >= 0)
        return refused;
    printf("imported %s\n", u.GetFullVersion().c_str());
    return kExitOk;
}

}  // namespace kytoupdate
