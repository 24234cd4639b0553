// SmallUpdate: stopping the services a small update touches before the apply and starting
// them again after it.  The driving program calls SwitchServices(false) before Apply and
// SwitchServices(true) after it; the start side reports its progress to the interface's
// poller through the apply status file.
#include "smallupdate.h"

#include <stdio.h>
#include <syslog.h>

#include <string>
#include <vector>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_system.h>

#include "platform_error.h"
#include "scoped.h"
#include "smallupdate_internal.h"
#include "smallupdate_plan.h"

using namespace kyto::small;

namespace {

// Platform actions of KYTOServiceOnOffALL.
constexpr int kAllServicesStop = 1;
constexpr int kAllServicesStart = 2;

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

    const std::vector<std::string> scripts = kyto::StartupScripts();
    std::vector<std::string> invalid;
    if (scripts.empty()) {
        syslog(LOG_ERR, "%s:%d  failed to list service under %s", kModule, __LINE__, kyto::kRcDir);
        if (on)
            UpdateApplyProgress(0, APPLY_STAGE_START_SERVICE, kErrSystem);
    } else if (!GetInvalidRestartService(invalid)) {
        syslog(LOG_ERR, "%s:%d failed to get invalid service list", kModule, __LINE__);
        if (on)
            UpdateApplyProgress(0, APPLY_STAGE_START_SERVICE, kErrSystem);
    } else {
        const size_t count = scripts.size();
        // Stopping walks the sorted list backwards so that higher-numbered services, which
        // depend on lower-numbered ones, stop first; starting walks it forwards.  Every
        // script counts towards the step, skipped ones included.
        for (size_t n = 0; n < count; ++n) {
            const std::string& path = scripts[on ? n : count - 1 - n];
            if (kyto::SkippedOnRestartAll(invalid, path)) {
                syslog(LOG_ERR, "%s:%d skip invalid service %s%s", kModule, __LINE__, path.c_str(),
                       kyto::LastErrorText().c_str());
                continue;
            }
            KLIBCExec(path.c_str(), on ? "start" : "stop", nullptr, nullptr, nullptr);
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
        const std::string path = std::string(kyto::kRcDir) + "/" + script;
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
    kyto::LineBuffer line;
    ssize_t len;
    while ((len = line.Read(list.get())) >= 0) {
        std::string name(line.data, static_cast<size_t>(len));
        size_t end = name.find_last_not_of(" \t\f\v\n\r");
        name.erase(end == std::string::npos ? 0 : end + 1);
        invalid.push_back(std::string(kyto::kRcDir) + "/" + name);
    }
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
