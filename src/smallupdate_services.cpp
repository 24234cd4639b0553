// SmallUpdate: stopping the services a small update touches before the apply and starting
// them again after it.  The driving program calls SwitchServices(false) before Apply and
// SwitchServices(true) after it; the start side reports its progress to the interface's
// poller through the apply status file.
#include "smallupdate.h"

#include <glob.h>
#include <stdio.h>
#include <syslog.h>

#include <string>
#include <vector>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_system.h>

#include "custombugfix.h"
#include "platform_error.h"
#include "scoped.h"

namespace {

constexpr const char* kModule = "smallupdate";
constexpr const char* kRcDir = "/usr/kyto/etc/rc.d";
constexpr const char* kRcPattern = "/usr/kyto/etc/rc.d/S*.sh";
constexpr const char* kPkgCtl = "/usr/kyto/bin/kytopkg";
constexpr const char* kInvalidRestartList = "/usr/kyto/etc.defaults/invalid_restart_service";

// Platform actions of KYTOServiceOnOffALL.
constexpr int kAllServicesStop = 1;
constexpr int kAllServicesStart = 2;

// Owns a glob result.
struct GlobResult {
    glob_t g{};
    ~GlobResult() { globfree(&g); }
};

}  // namespace

void SmallUpdate::SwitchServices(bool on) const {
    if (m_blNeedReboot) {
        KYTOServiceOnOffALL(on ? kAllServicesStart : kAllServicesStop);
    } else if (m_blRestartAllService) {
        SwitchAllService(on);
    } else if (!m_vyxServiceRestartList.empty() || !m_pkgRestartList.empty()) {
        SwitchPartialServices(on);
    }
}

void SmallUpdate::SwitchAllService(bool on) const {
    unsigned int percentage = 0;
    if (on)
        UpdateApplyProgress(0, APPLY_STAGE_START_SERVICE, "");

    GlobResult scripts;
    std::vector<std::string> invalid;
    // A read error part-way still leaves the scripts found so far; only an empty result is
    // a listing failure.
    glob(kRcPattern, GLOB_ERR, nullptr, &scripts.g);
    if (scripts.g.gl_pathc == 0) {
        syslog(LOG_ERR, "%s:%d  failed to list service under %s", kModule, __LINE__, kRcDir);
        if (on)
            UpdateApplyProgress(0, APPLY_STAGE_START_SERVICE, "err_system");
    } else if (!GetInvalidRestartService(invalid)) {
        syslog(LOG_ERR, "%s:%d failed to get invalid service list", kModule, __LINE__);
        if (on)
            UpdateApplyProgress(0, APPLY_STAGE_START_SERVICE, "err_system");
    } else {
        const size_t count = scripts.g.gl_pathc;
        // Stopping walks the sorted list backwards so that higher-numbered services, which
        // depend on lower-numbered ones, stop first; starting walks it forwards.
        for (size_t n = 0; n < count; ++n) {
            const char* path = scripts.g.gl_pathv[on ? n : count - 1 - n];
            if (CustomBugFix::Find(invalid, path)) {
                syslog(LOG_ERR, "%s:%d skip invalid service %s%s", kModule, __LINE__,
                       path, kyto::LastErrorText().c_str());
                continue;
            }
            KLIBCExec(path, on ? "start" : "stop", nullptr, nullptr, nullptr);
            if (on) {
                percentage += 100U / static_cast<unsigned int>(count);
                UpdateApplyProgress(static_cast<int>(percentage), APPLY_STAGE_START_SERVICE, "");
            }
        }
        KYTOServiceThirdPartyAll(on ? 1 : 0);
    }
    // The poller is told "finished" even after a listing error: the services that could be
    // started are running, and the error itself is in the system log.
    if (on)
        UpdateApplyProgress(100, APPLY_STAGE_FINISHED, "");
}

void SmallUpdate::SwitchPartialServices(bool on) const {
    const char* action = on ? "start" : "stop";
    for (const std::string& script : m_vyxServiceRestartList) {
        const std::string path = std::string(kRcDir) + "/" + script;
        KLIBCExec(path.c_str(), action, nullptr, nullptr, nullptr);
    }
    for (const std::string& pkg : m_pkgRestartList)
        KLIBCExec(kPkgCtl, action, pkg.c_str(), nullptr, nullptr);
    if (on)
        UpdateApplyProgress(100, APPLY_STAGE_FINISHED, "");
}

bool SmallUpdate::GetInvalidRestartService(std::vector<std::string>& invalid) {
    invalid.clear();
    kyto::UniqueFile list(fopen(kInvalidRestartList, "re"));
    if (!list)
        return false;
    char* line = nullptr;
    size_t capacity = 0;
    ssize_t len;
    while ((len = getline(&line, &capacity, list.get())) >= 0) {
        std::string name(line, static_cast<size_t>(len));
        size_t end = name.find_last_not_of(" \t\f\v\n\r");
        name.erase(end == std::string::npos ? 0 : end + 1);
        invalid.push_back(std::string(kRcDir) + "/" + name);
    }
    free(line);
    return true;
}

void SmallUpdate::GetRestartServiceList(std::vector<std::string>& vyxServices,
                                        std::vector<std::string>& packages) const {
    vyxServices = m_vyxServiceRestartList;
    packages = m_pkgRestartList;
}

int SmallUpdate::GetServiceRestartType() {
    if (m_newSmallFixNumber < 0 && !IsReadyApply())
        return 0;
    if (m_blNeedReboot)
        return 3;
    if (m_blRestartAllService)
        return 2;
    if (!m_vyxServiceRestartList.empty() || !m_pkgRestartList.empty())
        return 1;
    return 0;
}
