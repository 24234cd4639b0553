// plan: what the small update on offer would download, install, unpack and restart, taken
// from the library's own definitions (smallupdate_plan.h) without downloading anything.
#include <stdio.h>

#include <filesystem>
#include <string>
#include <vector>

#include <json/json.h>

#include "kytoupdate_common.h"
#include "smallupdate_plan.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

namespace kytoupdate {

namespace {

// Start-up scripts a restart of the given type switches (full paths), in start order.
// listReadable is false when a restart of all services would run nothing because the list
// of scripts never to restart cannot be read.
std::vector<std::string> RestartScripts(const SmallUpdate& u, int type, bool& listReadable) {
    std::vector<std::string> scripts;
    listReadable = true;
    if (type == kRestartPartial) {
        std::vector<std::string> packages;
        u.GetRestartServiceList(scripts, packages);
        for (std::string& s : scripts)
            s = std::string(kyto::kRcDir) + "/" + s;
    } else if (type == kRestartAll) {
        std::vector<std::string> invalid;
        listReadable = SmallUpdate::GetInvalidRestartService(invalid);
        if (listReadable)
            scripts = kyto::RestartAllScripts(invalid);
    }
    return scripts;
}

Json::Value StringArray(const std::vector<std::string>& items) {
    Json::Value array(Json::arrayValue);
    for (const std::string& item : items)
        array.append(item);
    return array;
}

// One start-up script with the section and key the administration interface names it by.
Json::Value ServiceEntry(const std::string& path) {
    Json::Value s(Json::objectValue);
    std::string section, key;
    s["script"] = std::filesystem::path(path).filename().string();
    s["known"] = UpdateUtil::GetServiceNameSectionKey(
                     std::filesystem::path(path).filename().string(), section, key) == 1;
    s["section"] = section;
    s["key"] = key;
    return s;
}

Json::Value PlanDocument(SmallUpdate& u, int restart, const std::vector<std::string>& scripts) {
    std::vector<std::string> ignored, packages;
    u.GetRestartServiceList(ignored, packages);
    Json::Value plan(Json::objectValue);
    plan["version"] = u.GetFullVersion();
    plan["download"] = StringArray(kyto::SmallUpdateDownloadLinks(u));
    plan["install"] = StringArray(u.m_installDebs);
    plan["unpack"] = u.m_blConfigUpdate ? u.m_smallUpdateDeb : "";
    plan["flash"] = u.m_blFlashUpdate ? u.m_flashUpdateDeb : "";
    plan["configUpdate"] = u.m_blConfigUpdate;
    plan["restart"] = RestartWord(restart);
    plan["services"] = Json::arrayValue;
    for (const std::string& path : scripts)
        plan["services"].append(ServiceEntry(path));
    plan["packages"] =
        StringArray(restart == kRestartPartial ? packages : std::vector<std::string>());
    return plan;
}

void PrintPlan(const Json::Value& plan, const SmallUpdate& u, int restart, bool listReadable) {
    printf("update: %s\n", plan["version"].asCString());
    for (const Json::Value& l : plan["download"])
        printf("download: %s\n", l.asCString());
    for (const Json::Value& d : plan["install"])
        printf("install: %s\n", d.asCString());
    if (u.m_blConfigUpdate)
        printf("unpack: %s (configuration update)\n", u.m_smallUpdateDeb.c_str());
    if (u.m_blFlashUpdate)
        printf("flash: %s\n", u.m_flashUpdateDeb.c_str());
    printf("restart: %s\n", plan["restart"].asCString());
    if (restart == kRestartReboot)
        printf("  every service through the platform, then a reboot\n");
    if (!listReadable)
        printf("  nothing: the list of scripts never to restart cannot be read\n");
    for (const Json::Value& s : plan["services"]) {
        printf("  service %s", s["script"].asCString());
        if (s["known"].asBool())
            printf("  section %s key %s", s["section"].asCString(), s["key"].asCString());
        printf("\n");
    }
    for (const Json::Value& p : plan["packages"])
        printf("  package %s\n", p.asCString());
}

// Why u holds no fix after its lookup: an exit code, and "none" when there is no fix.
int NoFix(SmallUpdate& u, bool json) {
    const int code = u.GetErrno();
    // An unreachable patch-list server leaves no error code, as a missing list does: only
    // a release feed that answers, as check asks it, tells that nothing is on offer.
    bool haveRelease = false;
    if (code == SmallUpdate::ERROR_CODE_SERVER_STATUS ||
        (code == SmallUpdate::ERROR_CODE_NONE && VyxUpdate().CheckNewRelease(haveRelease) != 1))
        return Fail("could not ask the update server", kExitCannotCheck);
    if (code != SmallUpdate::ERROR_CODE_NONE)
        return Fail(SmallErrnoText(code));
    printf(json ? "{}\n" : "none\n");
    return kExitUpToDate;
}

}  // namespace

int CmdPlan(bool json) {
    SmallUpdate u;
    if (!u.HaveNewFix())
        return NoFix(u, json);
    const int restart = u.GetServiceRestartType();
    bool listReadable = true;
    const Json::Value plan = PlanDocument(u, restart, RestartScripts(u, restart, listReadable));
    if (json)
        printf("%s", Json::FastWriter().write(plan).c_str());
    else
        PrintPlan(plan, u, restart, listReadable);
    return kExitOk;
}

}  // namespace kytoupdate
