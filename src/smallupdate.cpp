// SmallUpdate: the small-update record (constructors, GetErrno, Equal) and its info file
// "/autoupd@te.info", which a download or a local import writes for the apply and the
// interface's poller reads.
#include "smallupdate.h"

#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <tuple>
#include <vector>

#include <json/json.h>
#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>

#include "debian_lib.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "smallupdate_internal.h"
#include "version_file.h"
#include "update_cpputil.h"

using kyto::small::kModule;

SmallUpdate::SmallUpdate()
    : m_errno(0),
      m_conf(),
      m_unique(),
      m_newSmallFixNumber(-1),
      m_buildNumber(-1),
      m_blConfigUpdate(false),
      m_blFlashUpdate(false),
      m_blRestartAllService(false),
      m_blNeedReboot(false) {
    m_unique = m_conf.Def("unique", "");
}

SmallUpdate::SmallUpdate(const std::string& unique) : SmallUpdate() {
    if (!unique.empty()) {
        m_unique = unique;
    }
}

int SmallUpdate::GetErrno() {
    return m_errno;
}

bool SmallUpdate::Equal(const SmallUpdate& other) const {
    // The identity (model, build, error code) and the links of the single packages do not
    // count; the lists are compared without regard to their order.
    auto scalars = [](const SmallUpdate& u) {
        return std::tie(u.m_blConfigUpdate, u.m_blFlashUpdate, u.m_newSmallFixNumber, u.m_debDir,
                        u.m_smallUpdateDeb, u.m_flashUpdateDeb, u.m_blRestartAllService,
                        u.m_blNeedReboot);
    };
    auto sameList = [&other, this](std::vector<std::string> SmallUpdate::*list) {
        return UpdateUtil::CompareVector(this->*list, other.*list) == 1;
    };
    return scalars(*this) == scalars(other) && sameList(&SmallUpdate::m_installDebLinks) &&
           sameList(&SmallUpdate::m_installDebs) &&
           sameList(&SmallUpdate::m_vyxServiceRestartList) &&
           sameList(&SmallUpdate::m_pkgRestartList);
}

namespace {

// Whether a parsed info file has the members an apply needs, with the right types: a
// small update's type word, the build and fix numbers, the package folder, at least one
// package, and the restart behaviour stated.
bool InfoDocumentIsComplete(const Json::Value& info) {
    // Member access on anything but an object would throw inside jsoncpp.
    if (!info.isObject())
        return false;
    if (!info["updateType"].isString() || info["updateType"].asString() != kyto::kTypeSmall)
        return false;
    if (!info["buildnumber"].isInt() || !info["newSmallFixNumber"].isInt() ||
        !info["debDir"].isString()) {
        return false;
    }
    const bool namesPackage = info.isMember("installDeb") || info["smallupdateDeb"].isString() ||
                              info["flashupdateDeb"].isString();
    const bool statesRestart =
        info["blNeedReboot"].isBool() || info["blRestartAllService"].isBool() ||
        (info.isMember("vyxServiceRestartList") && info.isMember("pkgRestartList"));
    return namesPackage && statesRestart;
}

// Whether the info file was made for the build this system runs; false also when the
// running build cannot be read.
bool InfoBuildIsRunning(const Json::Value& info) {
    const kyto::VersionKey<16> build("buildnumber");
    return build.result >= 0 && strtol(build.text, nullptr, 10) == info["buildnumber"].asInt();
}

// Package names as the package tool's wrapper reads them: every one must carry a small-fix
// number for the running build.
bool PackageNamesAreValid(const std::vector<std::string>& names) {
    for (const std::string& name : names) {
        if (DebianLib::FindSmallFixNumfromDeb(name) < 0) {
            syslog(LOG_ERR, "%s:%d format error of debian [%s]", kModule, __LINE__, name.c_str());
            return false;
        }
    }
    return true;
}

Json::Value StringArray(const std::vector<std::string>& items) {
    Json::Value array(Json::arrayValue);
    UpdateUtil::StringVector2JsonArray(items, array);
    return array;
}

}  // namespace

bool SmallUpdate::ImportInfoFile(const char* path) {
    m_errno = ERROR_CODE_BAD_INPUT;
    if (path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, __FILE__, __LINE__);
        syslog(LOG_ERR, "%s:%d bad parameter!", kModule, __LINE__);
        return false;
    }
    if (!KLIBCFileExist(path))
        return false;
    Json::Value info;
    if (UpdateUtil::ParseJsonRootFromFile(path, info) != 1 || !InfoDocumentIsComplete(info))
        return false;
    m_errno = ERROR_CODE_BUILD_MISMATCH;
    if (!InfoBuildIsRunning(info))
        return false;
    m_errno = ERROR_CODE_BAD_INPUT;
    if (!StoreInfoFields(info))
        return false;
    m_errno = ERROR_CODE_NONE;
    return true;
}

bool SmallUpdate::StoreInfoFields(const Json::Value& info) {
    // Fields assigned before a failure keep their new values: callers re-import or give
    // the record up.
    m_buildNumber = info["buildnumber"].asInt();
    m_newSmallFixNumber = info["newSmallFixNumber"].asInt();
    m_debDir = info["debDir"].asString();
    m_smallUpdateDeb = kyto::MemberText(info, "smallupdateDeb");
    m_blConfigUpdate = kyto::MemberBool(info, "configUpdate");
    m_flashUpdateDeb = kyto::MemberText(info, "flashupdateDeb");
    if (!m_flashUpdateDeb.empty())
        m_blFlashUpdate = true;
    m_blNeedReboot = kyto::MemberBool(info, "blNeedReboot");
    m_blRestartAllService = kyto::MemberBool(info, "blRestartAllService");

    std::vector<std::string> installDebs;
    if (!kyto::MemberStringList(info, "installDeb", installDebs) ||
        !PackageNamesAreValid(installDebs)) {
        return false;
    }
    m_installDebs = installDebs;
    return kyto::MemberStringList(info, "vyxServiceRestartList", m_vyxServiceRestartList) &&
           kyto::MemberStringList(info, "pkgRestartList", m_pkgRestartList);
}

Json::Value SmallUpdate::InfoDocument(bool blPassive) const {
    Json::Value root(Json::objectValue);
    root["updateType"] = kyto::kTypeSmall;
    root["buildnumber"] = m_buildNumber;
    root["newSmallFixNumber"] = m_newSmallFixNumber;
    root["debDir"] = blPassive ? std::string(kyto::kDefaultDebDirName) : m_debDir;
    if (m_blNeedReboot) {
        root["blNeedReboot"] = true;
    } else if (m_blRestartAllService) {
        root["blRestartAllService"] = true;
    } else {
        // Both lists are written even when empty, so that the reader sees the restart
        // behaviour stated.
        root["vyxServiceRestartList"] = StringArray(m_vyxServiceRestartList);
        root["pkgRestartList"] = StringArray(m_pkgRestartList);
    }
    if (m_blConfigUpdate)
        root["configUpdate"] = true;
    if (!m_smallUpdateDeb.empty())
        root["smallupdateDeb"] = m_smallUpdateDeb;
    if (!m_flashUpdateDeb.empty())
        root["flashupdateDeb"] = m_flashUpdateDeb;
    if (!m_installDebs.empty())
        root["installDeb"] = StringArray(m_installDebs);
    return root;
}

bool SmallUpdate::InfoPackagesAreConsistent() const {
    if (m_flashUpdateDeb.empty() && m_smallUpdateDeb.empty() && m_installDebs.empty()) {
        syslog(LOG_ERR, "%s:%d no flash and smallupdate or others debian file%s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    // A package name without its link (or the reverse) means the patch list was merged
    // wrongly; such a record must not reach the apply.
    if (m_smallUpdateDeb.empty() != m_smallUpdateDebLink.empty()) {
        syslog(LOG_ERR, "%s:%d bad smallupdate debian [%s][%s]%s", kModule, __LINE__,
               m_smallUpdateDeb.c_str(), m_smallUpdateDebLink.c_str(),
               kyto::LastErrorText().c_str());
        return false;
    }
    if (m_flashUpdateDeb.empty() != m_flashUpdateDebLink.empty()) {
        syslog(LOG_ERR, "%s:%d bad flashupdate debian[%s][%s]", kModule, __LINE__,
               m_flashUpdateDeb.c_str(), m_flashUpdateDebLink.c_str());
        return false;
    }
    return true;
}

bool SmallUpdate::InfoFileTarget(bool blPassive, std::string& target) const {
    if (!blPassive) {
        target = kyto::kAutoUpdateInfoFile;
        return true;
    }
    // The passive node's apply finds the info file through the marker file.
    target = m_debDir + kyto::kAutoUpdateInfoFile;
    unlink(kyto::kPassiveInfoFile);
    if (KLIBCFileSetKeyValue(kyto::kPassiveInfoFile, "debDir", m_debDir.c_str(), nullptr) < 1) {
        // KEPT: the message's last conversion is a number where the marker file is meant; the
        // log readers expect this form.  Passing the char* itself to %d would be
        // undefined, so the pointer value is passed as an int.
        syslog(LOG_ERR, "%s:%d failed to set debDri=%s into %d", kModule, __LINE__,
               m_debDir.c_str(), (int)(intptr_t)kyto::kPassiveInfoFile);
        return false;
    }
    return true;
}

bool SmallUpdate::DumpToInfoFile(bool blPassive) {
    std::string target;
    bool ok = InfoPackagesAreConsistent() && InfoFileTarget(blPassive, target);
    if (ok) {
        // Written next to the target and renamed over it: the interface polls this file
        // and deletes one it cannot parse, so it must never see half a record, nor a
        // moment without one.  An old record the new one could not replace goes.
        ok = kyto::DumpJsonAtomically(target.c_str(), InfoDocument(blPassive), true) == 1;
        if (!ok) {
            unlink(target.c_str());
            syslog(LOG_ERR, "%s:%d failed to dump json to file [%s]", kModule, __LINE__,
                   target.c_str());
        }
    }
    if (!ok) {
        // No half-made download is left for the apply: both fixed files go, also when
        // the target was under the package folder.
        unlink(kyto::kAutoUpdateInfoFile);
        unlink(kyto::kPassiveInfoFile);
    }
    return ok;
}
