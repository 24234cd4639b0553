// VyxUpdate: the release check.  The feed is fetched once per object, read against the
// running system (and, on a pair in hybrid download mode, against the partner's model),
// and reconciled with an earlier download recorded in "/autoupd@te.info".
#include "vyxupdate.h"

#include <libgen.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_system.h>
#include <kytoplatform/kytoconf.h>

#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "update_cpputil.h"
#include "vyxupdate_internal.h"
#include "version_file.h"

using namespace kyto::vyx;

VyxUpdate::VyxUpdate() : m_checked(false), m_haveNew(false), m_hybridDL(false) {
    ClearRecord(m_release);
    ClearRecord(m_partnerRelease);
    if (KYTOHAIsRunning()) {
        char partner[kVersionFieldSize];
        memset(partner, 0, sizeof(partner));
        int ret = KYTOHAIsHybridDL(partner, sizeof(partner));
        if (ret == -1) {
            syslog(LOG_ERR, "%s:%d KYTOHAIsHybridDL() error", kModule, __LINE__);
        } else if (ret == 1) {
            m_hybridDL = true;
            m_partnerUnique = partner;
        }
    }
}

VyxUpdate::~VyxUpdate() {}

bool VyxUpdate::IsHotfixOnly() {
    return kyto::HotfixOnly();
}

int VyxUpdate::GetRssFile() {
    char server[kPathSize];
    char timezone[kVersionFieldSize];
    memset(server, 0, sizeof(server));
    memset(timezone, 0, sizeof(timezone));

    int ret = KLIBCFileGetKeyValue(kyto::InfoConfFile(), "rss_server", server, sizeof(server), 0);
    if (ret < 0) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, "rss_server",
               kyto::InfoConfFile(), kyto::LastErrorText().c_str());
        return 0;
    }
    if (ret == 0)
        snprintf(server, sizeof(server), "%s", kyto::kDefaultRssServer);

    if (KLIBCFileGetKeyValue(kyto::InfoConfFile(), "timezone", timezone, sizeof(timezone), 0) < 1) {
        syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, "timezone",
               kyto::InfoConfFile(), kyto::LastErrorText().c_str());
        return 0;
    }

    std::string agent;
    if (!UpdateUtil::GetUserAgent(agent)) {
        syslog(LOG_ERR, "%s:%d Fail to get user agent", kModule, __LINE__);
        return 0;
    }

    // The values go into the command as they stand; the configuration is trusted.
    // The command is bounded like a kPathSize buffer: an over-long URL is cut, and the
    // fetch then fails.
    std::string command = std::string(kyto::kWget) + " --user-agent='" + agent + "' -O " +
                          kyto::kRssFile + " " + server + "?tz=" + timezone + " 2> /dev/null";
    if (command.size() > kPathSize - 1)
        command.resize(kPathSize - 1);
    if (system(command.c_str()) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to exec command [%s]. %s", kModule, __LINE__, command.c_str(),
               kyto::LastErrorText().c_str());
        return 0;
    }
    return 1;
}

int VyxUpdate::GetAutoUpdateInfo(bool& have, Json::Value& info) {
    have = false;
    if (!KLIBCFileExist(kyto::kAutoUpdateInfoFile))
        return 1;

    Json::Value root;
    if (!UpdateUtil::ParseJsonRootFromFile(kyto::kAutoUpdateInfoFile, root)) {
        syslog(LOG_ERR, "%s:%d Fail to get download info", kModule, __LINE__);
        return 0;
    }
    if (root.empty())
        return 1;
    if (root.isObject()) {
        // A small update's info file is left alone.
        if (root.isMember("updateType") &&
            (!root["updateType"].isString() || root["updateType"].asString() != kyto::kTypeVyx)) {
            return 1;
        }
        if (root.isMember("buildnumber") && root.isMember("majorversion") &&
            root.isMember("minorversion") && root.isMember("patchPath")) {
            info = root;
            have = true;
            return 1;
        }
    }
    syslog(LOG_DEBUG, "%s:%d [%s] does not contain correct format", kModule, __LINE__,
           kyto::kAutoUpdateInfoFile);
    unlink(kyto::kAutoUpdateInfoFile);
    return 1;
}

namespace {

// One reading of the fetched feed for the model in current.unique: the release it offers
// into release (cleared when it offers none), haveNew set as the reader found.  0 (logged,
// release untouched) when the feed cannot be read.
int ChooseRelease(bool hotfixOnly, const _tag_vyxinfo_& current, bool& haveNew,
                  _tag_vyxinfo_& release) {
    _tag_vyxinfo_ work;
    ClearRecord(work);
    if (!VyxUpdate::ParseRssFile(hotfixOnly, current, haveNew, work)) {
        syslog(LOG_ERR, "%s:%d Fail to parse RSS file", kModule, __LINE__);
        return 0;
    }
    if (haveNew) {
        release = work;
    } else {
        ClearRecord(release);
    }
    return 1;
}

// An earlier download recorded in the info file for another build than the new release
// belongs to an outdated release: its record and state files are cleared (the image
// stays).  0 (logged) when the info file cannot be read or the clean-up fails.
int ReconcileEarlierDownload(bool haveNew, const _tag_vyxinfo_& release) {
    bool have = false;
    Json::Value info;
    if (!VyxUpdate::GetAutoUpdateInfo(have, info)) {
        syslog(LOG_ERR, "%s:%d Fail to get auto update info", kModule, __LINE__);
        return 0;
    }
    if (!have || !haveNew)
        return 1;
    char folder[kPathSize];
    snprintf(folder, sizeof(folder), "%s", kyto::MemberText(info, "patchPath").c_str());
    std::string dir = dirname(folder);
    if (ToNumber(kyto::MemberText(info, "buildnumber").c_str()) != ToNumber(release.buildNum) &&
        !VyxUpdate::CleanDownloadResult(dir)) {
        syslog(LOG_ERR, "%s:%d Fail to clean download result", kModule, __LINE__);
        return 0;
    }
    return 1;
}

// The object's release check, run unless it has completed once.  0 (logged) when it fails.
int EnsureChecked(VyxUpdate& update) {
    if (!update.m_checked && !update.CheckVyxRelease()) {
        syslog(LOG_ERR, "%s:%d Fail to get latest VYX info", kModule, __LINE__);
        return 0;
    }
    return 1;
}

}  // namespace

int VyxUpdate::CheckVyxRelease() {
    bool hotfixOnly = IsHotfixOnly();
    // The fetched feed never outlives the check.
    kyto::ScopedUnlink feedCleanup(kyto::kRssFile);

    if (!GetRssFile()) {
        syslog(LOG_ERR, "%s:%d Fail to get RSS file", kModule, __LINE__);
        return 0;
    }
    _tag_vyxinfo_ current;
    ClearRecord(current);
    if (!GetVyxInfo(current)) {
        syslog(LOG_ERR, "%s:%d Fail to get current VYX info", kModule, __LINE__);
        return 0;
    }
    if (!ChooseRelease(hotfixOnly, current, m_haveNew, m_release))
        return 0;
    if (m_hybridDL && m_haveNew) {
        // The partner's model must be offered in the same item; this second reading
        // decides whether the pair has a new release.
        snprintf(current.unique, sizeof(current.unique), "%s", m_partnerUnique.c_str());
        if (!ChooseRelease(hotfixOnly, current, m_haveNew, m_partnerRelease))
            return 0;
    }
    if (!ReconcileEarlierDownload(m_haveNew, m_release))
        return 0;
    m_checked = true;
    return 1;
}

int VyxUpdate::CheckNewRelease(bool& haveNew) {
    if (!EnsureChecked(*this))
        return 0;
    haveNew = m_haveNew;
    return 1;
}

int VyxUpdate::PreCheckDownload(bool& canStart) {
    if (!EnsureChecked(*this))
        return 0;
    if (!m_haveNew) {
        syslog(LOG_ERR, "%s:%d Current VYX version is latest", kModule, __LINE__);
        return 0;
    }
    int percentage = 0;
    VYX_DOWNLOAD_STATUS status = VYX_DOWNLOAD_STATUS_NONE;
    if (!GetDownloadStatus(percentage, status)) {
        syslog(LOG_ERR, "%s:%d Fail to check download status", kModule, __LINE__);
        return 0;
    }
    canStart = (status != VYX_DOWNLOAD_STATUS_DOWNLOADING);
    return 1;
}

bool VyxUpdate::CheckPatchAndUpdateType(bool& isNewer, Json::Value& info) {
    bool hotfixOnly = IsHotfixOnly();
    _tag_vyxinfo_ current;
    _tag_vyxinfo_ candidate;
    ClearRecord(current);
    ClearRecord(candidate);
    if (!GetVyxInfo(current)) {
        syslog(LOG_ERR, "%s:%d Fail to get current VYX info", kModule, __LINE__);
        return false;
    }
    snprintf(candidate.major, sizeof(candidate.major), "%s",
             kyto::MemberText(info, "majorversion").c_str());
    snprintf(candidate.minor, sizeof(candidate.minor), "%s",
             kyto::MemberText(info, "minorversion").c_str());
    snprintf(candidate.buildNum, sizeof(candidate.buildNum), "%s",
             kyto::MemberText(info, "buildnumber").c_str());
    int newer = hotfixOnly ? IsHotfix(current, candidate) : IsVersionNewer(current, candidate);
    if (newer == 1)
        isNewer = true;
    return true;
}

std::string VyxUpdate::GetFullVersion() {
    if (!m_checked || !m_haveNew)
        return std::string();
    char text[kIdentityFieldSize];
    snprintf(text, sizeof(text), "VYX %.63s.%.63s-%.63s", m_release.major, m_release.minor,
             m_release.buildNum);
    return text;
}
