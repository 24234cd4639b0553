// CustomBugFix: folds the entries of a small-update patch list into one result.
//
// The patch list comes from the network, so every JSON access first checks the value's
// type: jsoncpp throws on conversions it cannot make (asInt of a text, operator[] or
// isMember on an array or a scalar), and nothing may escape from here.  A value that
// cannot be used is refused with the message of the check it fails; where jsoncpp can
// convert a value without throwing (a number or boolean where text is expected, a number
// where a boolean is expected) its conversion is used.
#include "custombugfix.h"

#include <syslog.h>

#include "debian_lib.h"
#include "json_members.h"

namespace {

constexpr const char* kModule = "custombugfix";

// Small-fix number of a held package name; an empty or unreadable name counts as none.
int HeldFixNumber(const std::string& held) {
    return held.empty() ? -1 : DebianLib::FindSmallFixNumfromDeb(held);
}

// Appends every element of names (already known to convert to text) to list unless it is
// there already.
void AppendUnique(const Json::Value& names, std::vector<std::string>& list) {
    for (Json::ArrayIndex i = 0; i < names.size(); ++i) {
        std::string name = names[i].asString();
        if (!CustomBugFix::Find(list, name))
            list.push_back(name);
    }
}

// True when every element of the array converts to text.  Numbers and booleans take
// jsoncpp's text form; arrays and objects have none.
bool AllConvertToText(const Json::Value& names) {
    for (Json::ArrayIndex i = 0; i < names.size(); ++i) {
        if (!names[i].isConvertibleTo(Json::stringValue))
            return false;
    }
    return true;
}

}  // namespace

CustomBugFix::CustomBugFix(int curSmallFixNumber)
    : m_smallFixNumber(-1),
      m_blConfigUpdate(false),
      m_blFlashUpdate(false),
      m_blRestartAllService(false),
      m_blNeedReboot(false),
      m_curSmallFixNumber(curSmallFixNumber) {}

int CustomBugFix::Merge(const Json::Value& entry) {
    // An entry that is not an object has none of the keys; a "version" that is not an
    // integer (a text, a container, a number out of int range) is refused the same way.
    if (!entry.isObject() || !entry.isMember("version") || !entry.isMember("proj") ||
        !entry.isMember("flash_upgrade") || !entry.isMember("config_upgrade") ||
        !entry.isMember("restart") || !entry["version"].isConvertibleTo(Json::intValue)) {
        syslog(LOG_ERR, "%s:%d bad json format!", kModule, __LINE__);
        return 0;
    }
    const int version = entry["version"].asInt();

    if (m_curSmallFixNumber < version) {
        if (kyto::MemberBool(entry, "flash_upgrade"))
            m_blFlashUpdate = true;
        if (kyto::MemberBool(entry, "config_upgrade"))
            m_blConfigUpdate = true;
        if (!MergeServiceList(entry["restart"])) {
            syslog(LOG_ERR, "%s:%d failed to merge 'restart' status", kModule, __LINE__);
            return 0;
        }
        if (!MergeProjList(entry["proj"], version)) {
            syslog(LOG_ERR, "%s:%d failed to merge 'proj'", kModule, __LINE__);
            return 0;
        }
    }

    // Older entries raise the number too: the caller compares the highest number in the
    // list with the installed one.
    if (m_smallFixNumber < version)
        m_smallFixNumber = version;
    return 1;
}

int CustomBugFix::MergeProjList(const Json::Value& proj, int version) {
    if (version < 1)
        return 0;
    // size() is 0 for null and scalars, so anything without elements is "empty".
    if (proj.size() == 0) {
        syslog(LOG_ERR, "%s:%d empty array", kModule, __LINE__);
        return 0;
    }
    // A non-empty object is not a list of packages.
    if (!proj.isArray()) {
        syslog(LOG_ERR, "%s:%d nothing can be parsed from 'proj' array", kModule, __LINE__);
        return 0;
    }

    for (Json::ArrayIndex i = 0; i < proj.size(); ++i) {
        const Json::Value& item = proj[i];
        if (!item.isObject() || !item["name"].isString() || !item["url"].isString()) {
            syslog(LOG_ERR, "%s:%d nothing can be parsed from 'proj' array", kModule, __LINE__);
            return 0;
        }
        const std::string name = item["name"].asString();
        const std::string link = item["url"].asString();

        size_t slash = link.rfind('/');
        if (slash == std::string::npos) {
            syslog(LOG_ERR, "%s:%d invalid debian url [%s]", kModule, __LINE__, link.c_str());
            return 0;
        }
        const std::string debName = link.substr(slash + 1);

        int debVersion = DebianLib::FindSmallFixNumfromDeb(debName);
        if (debVersion <= 0) {
            syslog(LOG_ERR, "%s:%d failed to parse [%s] to get smallfixnum [%d]", kModule, __LINE__,
                   debName.c_str(), debVersion);
            return 0;
        }
        if (debVersion != version) {
            syslog(LOG_ERR, "%s:%d proj [%s] debversion [%d] not match smallfixverion[%d]", kModule,
                   __LINE__, name.c_str(), debVersion, version);
            return 0;
        }

        if (name == "smallupdate") {
            if (debVersion > HeldFixNumber(m_smallUpdateDeb)) {
                m_smallUpdateDeb = debName;
                m_smallUpdateDebLink = link;
            }
        } else if (name == "flashupdate") {
            if (debVersion > HeldFixNumber(m_flashUpdateDeb)) {
                m_flashUpdateDeb = debName;
                m_flashUpdateDebLink = link;
            }
        } else {
            m_installDebLinks.push_back(link);
            m_installDebs.push_back(debName);
        }
    }
    return 1;
}

int CustomBugFix::MergeServiceList(const Json::Value& restart) {
    if (restart.isString()) {
        const std::string value = restart.asString();
        if (value == "reboot") {
            m_blNeedReboot = true;
        } else if (value == "all_service") {
            m_blRestartAllService = true;
        } else if (value != "none") {
            syslog(LOG_ERR, "%s:%d bad value in 'restart'", kModule, __LINE__);
            return 0;
        }
        return 1;
    }

    if (restart.isObject()) {
        const Json::Value& services = restart["vyx_service"];
        const Json::Value& pkgs = restart["pkg"];
        if (!services.isArray() || !pkgs.isArray()) {
            syslog(LOG_ERR, "%s:%d bad format in 'restart'", kModule, __LINE__);
            return 0;
        }
        if (services.empty() && pkgs.empty()) {
            syslog(LOG_ERR, "%s:%d no data in pkg or vyx_service", kModule, __LINE__);
            return 0;
        }
        // Names that have no text form (arrays, objects) are refused before anything is
        // appended.
        if (!AllConvertToText(services) || !AllConvertToText(pkgs)) {
            syslog(LOG_ERR, "%s:%d bad format in 'restart'", kModule, __LINE__);
            return 0;
        }
        AppendUnique(services, m_vyxServiceRestartList);
        AppendUnique(pkgs, m_pkgRestartList);
        return 1;
    }

    syslog(LOG_ERR, "%s:%d wrong type of json format at 'restart' object", kModule, __LINE__);
    return 0;
}

int CustomBugFix::Find(const std::vector<std::string>& list, const std::string& item) {
    for (const std::string& element : list) {
        if (element == item)
            return 1;
    }
    return 0;
}
