// SmallUpdate: finding a small update.  The patch list "VYX-Security.json" that the update
// server publishes for this build and model (or that a local patch archive carries) is
// fetched, validated and merged into the record; the record's fix is then compared with
// the one installed.
#include "smallupdate.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <mutex>
#include <string>

#include <curl/curl.h>
#include <json/json.h>
#include <kytoplatform/klibc.h>

#include "custombugfix.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "smallupdate_internal.h"
#include "smallupdate_plan.h"
#include "version_file.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

using namespace kyto::small;

namespace {

// Base address of the patch lists when "small_info_path" is not configured.

// libcurl's global state is set up once per process, before the first handle.  It is
// never torn down: the library may be unloaded while its host still uses libcurl.
void InitCurlOnce() {
    static std::once_flag once;
    std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

// Owns one easy handle.
class CurlEasy {
  public:
    CurlEasy() : handle_(curl_easy_init()) {}
    ~CurlEasy() {
        if (handle_)
            curl_easy_cleanup(handle_);
    }
    CurlEasy(const CurlEasy&) = delete;
    CurlEasy& operator=(const CurlEasy&) = delete;
    CURL* get() const { return handle_; }

  private:
    CURL* handle_;
};

// Installed small-fix number: "smallfixnumber" of the version file, 0 when it yields nothing.
int InstalledSmallFixNumber() {
    char buf[kInstalledFixWidth] = {0};
    if (KLIBCFileGetKeyValue(kyto::VersionFile(), "smallfixnumber", buf, sizeof(buf), 0) <= 0) {
        return 0;
    }
    return static_cast<int>(strtol(buf, nullptr, 10));
}

// Fetches url into out on the handle; true on an answer 200.  A 404 fails quietly (nothing
// is published for this build and model); any other answer is logged and sets err.
bool PerformTransfer(CURL* curl, const std::string& url, FILE* out, int& err) {
    // The body goes straight into the file through libcurl's default writer.  Redirects
    // are not followed and no time-out is set: the appliance's own check waits for the
    // server as long as the connection lives.  The error buffer only feeds the log.
    char errorText[CURL_ERROR_SIZE] = {0};
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, out);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, errorText);

    const CURLcode rc = curl_easy_perform(curl);
    if (rc != CURLE_OK) {
        syslog(LOG_ERR, "%s:%d failed to exec curl command", kModule, __LINE__);
        syslog(LOG_ERR, "%s:%d %s", kModule, __LINE__,
               errorText[0] ? errorText : curl_easy_strerror(rc));
        return false;
    }
    // A failed query of the code leaves 200: the transfer itself succeeded.
    long code = 200;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &code);
    if (code == 200) {
        return true;
    }
    if (code != 404) {
        syslog(LOG_ERR, "%s:%d Error server %s", kModule, __LINE__, url.c_str());
        err = SmallUpdate::ERROR_CODE_SERVER_STATUS;
    }
    return false;
}

// Empties every field a patch list fills; the package folder, the model and the error
// code stay.
void ClearListFields(SmallUpdate& u) {
    u.m_buildNumber = -1;
    u.m_newSmallFixNumber = -1;
    u.m_smallUpdateDeb.clear();
    u.m_smallUpdateDebLink.clear();
    u.m_flashUpdateDeb.clear();
    u.m_flashUpdateDebLink.clear();
    u.m_blConfigUpdate = false;
    u.m_blFlashUpdate = false;
    u.m_blRestartAllService = false;
    u.m_blNeedReboot = false;
    u.m_installDebLinks.clear();
    u.m_installDebs.clear();
    u.m_vyxServiceRestartList.clear();
    u.m_pkgRestartList.clear();
}

// Whether the patch list has its three members, logged when not.  A document that is not an
// object has none of them (and jsoncpp's member lookup would throw on it).
bool HasListMembers(const Json::Value& root) {
    if (root.isObject() && root.isMember("smallupdate") && root.isMember("vyxversion") &&
        root.isMember("unique")) {
        return true;
    }
    syslog(LOG_ERR, "%s:%d lack of smallUpdate/vyxversion/%s in Json", kModule, __LINE__, "unique");
    return false;
}

// Folds every entry into merger, first to last; false at the first refusal.
bool MergeEntries(const Json::Value& entries, CustomBugFix& merger) {
    for (Json::ArrayIndex i = 0; i < entries.size(); ++i) {
        if (merger.Merge(entries[i]) != 1) {
            return false;
        }
    }
    return true;
}

// Takes the merge of a list for build listBuild into the record.
void TakeMerge(SmallUpdate& u, const CustomBugFix& merger, int listBuild) {
    u.m_buildNumber = listBuild;
    u.m_smallUpdateDeb = merger.m_smallUpdateDeb;
    u.m_smallUpdateDebLink = merger.m_smallUpdateDebLink;
    u.m_flashUpdateDeb = merger.m_flashUpdateDeb;
    u.m_flashUpdateDebLink = merger.m_flashUpdateDebLink;
    u.m_newSmallFixNumber = merger.m_smallFixNumber;
    u.m_blConfigUpdate = merger.m_blConfigUpdate;
    u.m_blFlashUpdate = merger.m_blFlashUpdate;
    u.m_installDebLinks = merger.m_installDebLinks;
    u.m_installDebs = merger.m_installDebs;
    // The strongest restart demand wins: reboot, then restart of all services, then the lists.
    if (merger.m_blNeedReboot) {
        u.m_blNeedReboot = true;
    } else if (merger.m_blRestartAllService) {
        u.m_blRestartAllService = true;
    } else {
        u.m_vyxServiceRestartList = merger.m_vyxServiceRestartList;
        u.m_pkgRestartList = merger.m_pkgRestartList;
    }
}

}  // namespace

bool SmallUpdate::DownloadJson(const std::string& outPath) {
    const std::string base = m_conf.Def("small_info_path", kyto::kDefaultSmallInfoPath);
    if (outPath.empty()) {
        syslog(LOG_ERR, "%s:%d bad parameter", kModule, __LINE__);
        m_errno = ERROR_CODE_BAD_INPUT;
        return false;
    }
    const kyto::VersionKey<64> build("buildnumber");
    if (build.result < 0) {
        syslog(LOG_ERR, "%s:%d Get buildnumber Fail%s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        m_errno = ERROR_CODE_BAD_INPUT;
        return false;
    }
    const std::string url = kyto::PatchListUrl(base, build.text, m_unique);

    InitCurlOnce();
    CurlEasy curl;
    if (!curl.get()) {
        syslog(LOG_ERR, "%s:%d failed to init curl", kModule, __LINE__);
        return false;
    }
    kyto::UniqueFile out(fopen(outPath.c_str(), "we"));
    if (!out) {
        syslog(LOG_ERR, "%s:%d failed to open %s", kModule, __LINE__, outPath.c_str());
        return false;
    }

    bool ok = PerformTransfer(curl.get(), url, out.get(), m_errno);
    // A failed close (the disk filled up while the body was written) fails the fetch too.
    if (out.close() != 0) {
        ok = false;
    }
    if (!ok) {
        unlink(outPath.c_str());
    }
    return ok;
}

bool SmallUpdate::SetUpdateList(const std::string& path) {
    if (path.empty()) {
        syslog(LOG_ERR, "%s:%d bad file name", kModule, __LINE__);
        return false;
    }
    ClearListFields(*this);

    Json::Value root;
    if (UpdateUtil::ParseJsonRootFromFile(path.c_str(), root) != 1) {
        syslog(LOG_ERR, "%s:%d failed to parse json file %s", kModule, __LINE__, path.c_str());
        return false;
    }
    if (!HasListMembers(root)) {
        return false;
    }
    const std::string listUnique = kyto::MemberText(root, "unique");
    if (listUnique != m_unique) {
        m_errno = ERROR_CODE_OTHER_MODEL;
        syslog(LOG_ERR, "%s:%d unique not match [%s] unique in json[%s]", kModule, __LINE__,
               m_unique.c_str(), listUnique.c_str());
        return false;
    }

    const kyto::VersionKey<32> build("buildnumber");
    if (build.result < 0) {
        syslog(LOG_ERR, "%s:%d Get buildnumber Fail%s", kModule, __LINE__,
               kyto::LastErrorText().c_str());
        return false;
    }
    const int runningBuild = static_cast<int>(strtol(build.text, nullptr, 10));
    const int installedFix = InstalledSmallFixNumber();

    const Json::Value& entries = root["smallupdate"];
    if (!entries.isArray()) {
        syslog(LOG_ERR, "%s:%d data[%s] is not array", kModule, __LINE__, "smallupdate");
        return false;
    }
    // A "vyxversion" that is not a number (or out of int range) belongs to no build.
    const Json::Value& versionValue = root["vyxversion"];
    const bool versionIsInt = versionValue.isConvertibleTo(Json::intValue);
    const int listBuild = versionIsInt ? versionValue.asInt() : -1;
    if (!versionIsInt || listBuild != runningBuild) {
        m_errno = ERROR_CODE_BAD_FIX_NUMBER;
        // KEPT: "verison" is the text log readers search for.
        syslog(LOG_ERR, "%s:%d verison not match, original buildnumber[%d], json buildnumber[%d]",
               kModule, __LINE__, runningBuild, listBuild);
        return false;
    }

    CustomBugFix merger(installedFix);
    if (!MergeEntries(entries, merger)) {
        return false;
    }

    TakeMerge(*this, merger, listBuild);
    return true;
}

bool SmallUpdate::LookUpServer() {
    const std::string listPath = "/tmp/smallupd@te_" + m_unique + ".json";
    // The downloaded copy is only read here.
    kyto::ScopedUnlink removeList(listPath);
    return DownloadJson(listPath) && SetUpdateList(listPath);
}

bool SmallUpdate::CheckHaveSmallFix() {
    m_errno = ERROR_CODE_NONE;
    if (m_newSmallFixNumber < 1) {
        syslog(LOG_ERR, "%s:%d bad version", kModule, __LINE__);
        m_errno = ERROR_CODE_BAD_FIX_NUMBER;
        return false;
    }
    const int installed = InstalledSmallFixNumber();
    if (m_newSmallFixNumber == installed) {
        return false;
    }
    if (m_newSmallFixNumber < installed) {
        syslog(LOG_ERR, "%s:%d small fix can't downgrade, org_version[%d], new_version[%d]",
               kModule, __LINE__, installed, m_newSmallFixNumber);
        m_errno = ERROR_CODE_DOWNGRADE;
        return false;
    }
    // An old apply result must not show for the new fix.
    unlink(kyto::kApplyStatusFile);
    return true;
}

bool SmallUpdate::HaveNewFix() {
    if (!LookUpServer()) {
        return false;
    }
    return CheckHaveSmallFix();
}

bool SmallUpdate::CheckPatchIsSmallUpdate(const std::string& archive, bool& isSmallUpdate) {
    char command[kArchiveCommandWidth] = {0};
    snprintf(command, sizeof(command), "/bin/tar -tf %s | /bin/grep '%s' | wc -l", archive.c_str(),
             kyto::kPatchListName);
    kyto::UniqueFile pipe(popen(command, "re"), kyto::UniqueFile::kPopen);
    if (!pipe) {
        return false;
    }
    char line[kArchiveCountLineWidth] = {0};
    if (fgets(line, sizeof(line), pipe.get()) == nullptr) {
        return false;
    }
    isSmallUpdate = strtol(line, nullptr, 10) != 0;
    return true;
}

bool SmallUpdate::ImportSmallPatch(const std::string& archive, const std::string& folderName,
                                   bool blPassive) {
    if (!KLIBCFileExist(archive.c_str())) {
        syslog(LOG_ERR, "%s:%d [%s] does not exist!", kModule, __LINE__, archive.c_str());
        return false;
    }
    if (!GetSourceDir(m_debDir, folderName)) {
        syslog(LOG_ERR, "%s:%d failed to get source dir", kModule, __LINE__);
        return false;
    }
    if (UpdateUtil::CleanFolder(m_debDir) != 1) {
        return false;
    }
    if (UpdateUtil::UntarFile(archive, m_debDir) != 1) {
        syslog(LOG_ERR, "%s:%d failed to untar file %s", kModule, __LINE__, archive.c_str());
        return false;
    }
    if (!SetUpdateList(m_debDir + "/" + kyto::kPatchListName)) {
        syslog(LOG_ERR, "%s:%d failed to set update list", kModule, __LINE__);
        return false;
    }
    if (!CheckHaveSmallFix()) {
        syslog(LOG_ERR, "%s:%d check small fix version[%d] error.", kModule, __LINE__,
               m_newSmallFixNumber);
        return false;
    }
    if (!DumpToInfoFile(blPassive)) {
        syslog(LOG_ERR, "%s:%d failed to dump info file", kModule, __LINE__);
        return false;
    }
    return true;
}

bool SmallUpdate::ImportSmallPatch(const std::string& archive) {
    return ImportSmallPatch(archive, kyto::kDefaultDebDirName, false);
}

std::string SmallUpdate::GetFullVersion() {
    if (m_newSmallFixNumber < 1) {
        return std::string();
    }
    _tag_vyxinfo_ info;
    memset(&info, 0, sizeof(info));
    if (!VyxUpdate::GetVyxInfo(info)) {
        syslog(LOG_ERR, "%s:%d Fail to get VYX info", kModule, __LINE__);
        return std::string();
    }
    // The display text is cut to 63 characters, as the interface shows it.
    char text[kFullVersionWidth] = {0};
    if (snprintf(text, sizeof(text), "VYX %s.%s-%s update %d", info.major, info.minor,
                 info.buildNum, m_newSmallFixNumber) < 0) {
        return std::string();
    }
    return text;
}
