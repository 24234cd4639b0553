// Signed updates (kytoupdate_trust.h): the trust folder's keys, the refusal that removes a
// download, and the checks of a small update's patch list and packages.  The full release's
// image and feed are checked in kytoupdate_trust_release.cpp.
#include "kytoupdate_trust.h"

#include <fcntl.h>
#include <glob.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <dirent.h>

#include <algorithm>
#include <memory>

#include <kytoplatform/kytoconf.h>

#include "kyto_paths.h"
#include "kytotrust.h"
#include "kytoupdate_common.h"
#include "smallupdate_plan.h"
#include "update_cpputil.h"
#include "vyxupdate.h"
#include "scoped.h"

namespace kytoupdate {

namespace {

constexpr const char* kSigSuffix = ".minisig";

Trust LoadTrust() {
    Trust t;
    glob_t g{};
    const bool anyKey =
        glob((std::string(kTrustDir) + "/*.pub").c_str(), 0, nullptr, &g) == 0 && g.gl_pathc > 0;
    globfree(&g);
    if (!anyKey) {
        Note(std::string("no trusted keys in ") + kTrustDir + ": signatures are not checked");
        return t;
    }
    t.checking = true;
    std::string why;
    if (!kytotrust::LoadTrustFolder(kTrustDir, t.keys, why))
        t.error = why;
    else if (!why.empty())
        Note(why);  // some keys were skipped; the others are used
    return t;
}

bool EndsWith(const std::string& s, const std::string& tail) {
    return s.size() >= tail.size() && s.compare(s.size() - tail.size(), tail.size(), tail) == 0;
}

// Regular files of folder that are not signatures, sorted; false when it cannot be read.
bool SignedFilesOf(const std::string& folder, std::vector<std::string>& names) {
    std::unique_ptr<DIR, int (*)(DIR*)> d(opendir(folder.c_str()), closedir);
    if (!d)
        return false;
    while (const dirent* e = readdir(d.get())) {
        const std::string name = e->d_name;
        struct stat st {};
        if (!EndsWith(name, kSigSuffix) && stat((folder + "/" + name).c_str(), &st) == 0 &&
            S_ISREG(st.st_mode))
            names.push_back(name);
    }
    std::sort(names.begin(), names.end());
    return true;
}

// The downloaded patch list's address on this device, as the library's lookup builds it.
std::string PatchListAddress(const SmallUpdate& checked) {
    _tag_vyxinfo_ current{};
    VyxUpdate::GetVyxInfo(current);
    return kyto::PatchListUrl(KytoConf().Def("small_info_path", kyto::kDefaultSmallInfoPath),
                              current.buildNum, checked.m_unique);
}

// The patch list fetched again with its signature, verified, and read as the library
// reads it: it must yield the record that was downloaded.  "" or the reason.
std::string CheckPatchList(const SmallUpdate& checked) {
    const kyto::ScopedTempDir tmp("/tmp/kytoupdate-trust.XXXXXX");
    const std::string url = PatchListAddress(checked);
    std::string why;
    if (!tmp.Made())
        return "cannot make a temporary folder";
    FetchInto(url, tmp.Path());
    FetchInto(url + kSigSuffix, tmp.Path());
    if (!VerifyIn(tmp.Path(), kyto::kPatchListName, why))
        return why;
    SmallUpdate signedList = checked;
    if (!signedList.SetUpdateList(tmp.Path() + "/" + kyto::kPatchListName) ||
        !signedList.Equal(checked))
        return std::string("the signed ") + kyto::kPatchListName +
               " does not name the update that was downloaded";
    return "";
}

// The status file tells every poller that the download failed, never that it finished.
void MarkDownloadFailed(const Removal& removal) {
    if (!removal.vyx) {
        SmallUpdate::UpdateDownloadProgress(0, SmallUpdate::DOWNLOAD_STATUS_FAILED);
        return;
    }
    const std::string path = removal.images.empty() ? "" : removal.images.front();
    const char* const keys[][2] = {{kyto::kKeyUpdateType, kyto::kTypeVyx},
                                   {kyto::kKeyPatchPath, path.c_str()},
                                   {kyto::kKeyDownloadStatus, "failed"},
                                   {kyto::kKeyDownloadCount, "1"},
                                   {kyto::kKeyDownloadNum, "1"}};
    for (const auto& kv : keys)
        VyxUpdate::UpdateProgressFile(kv[0], kv[1]);
}

}  // namespace

const Trust& TrustedKeys() {
    static const Trust trust = LoadTrust();
    return trust;
}

bool FetchInto(const std::string& url, const std::string& folder) {
    // wget's log (its standard error) belongs to a download a person watches; a signature
    // or a list fetched again for checking is not one, so the log goes to /dev/null.
    const kyto::UniqueFd saved(fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 0));
    const kyto::UniqueFd null(open("/dev/null", O_WRONLY | O_CLOEXEC));
    const bool quiet = saved.valid() && null.valid() && dup2(null.get(), STDERR_FILENO) >= 0;
    const bool fetched = SmallUpdate::ExecWgetP(url, folder);
    if (quiet)
        dup2(saved.get(), STDERR_FILENO);
    return fetched;
}

bool VerifyIn(const std::string& folder, const std::string& name, std::string& why) {
    const std::string path = folder + "/" + name;
    if (kytotrust::VerifyFile(TrustedKeys().keys, path, path + kSigSuffix, name, why))
        return true;
    why = name + ": " + why;
    return false;
}

int Refuse(const std::string& why, const Removal& removal) {
    for (const std::string& image : removal.images)
        unlink(image.c_str());
    if (!removal.debDir.empty())
        UpdateUtil::RemoveFolder(removal.debDir);
    unlink(kyto::kAutoUpdateInfoFile);
    unlink(kyto::kPassiveInfoFile);
    MarkDownloadFailed(removal);
    const std::string text =
        "refused: not signed by a trusted key: " + why + "; the download was removed";
    openlog("kytoupdate", LOG_PID, LOG_USER);
    syslog(LOG_ERR, "%s", text.c_str());
    closelog();
    return Fail(text, kExitRefused);
}

int TrustDownload(const SystemUpdate& su) {
    if (su.m_updateType == UpdateUtil::PATCH_TYPE_VYX)
        return TrustRelease(su.m_vyxUpdate);
    const Trust& trust = TrustedKeys();
    if (!trust.checking)
        return -1;
    SmallUpdate done;
    Removal removal;
    removal.debDir = done.ImportInfoFile(kyto::kAutoUpdateInfoFile) ? done.m_debDir : "";
    if (!trust.error.empty())
        return Refuse(trust.error, removal);
    if (removal.debDir.empty())
        return Refuse("the downloaded update's record cannot be read", removal);
    std::string why = CheckPatchList(su.m_smallUpdate);
    for (const std::string& link : kyto::SmallUpdateDownloadLinks(su.m_smallUpdate)) {
        if (!why.empty())
            break;
        FetchInto(link + kSigSuffix, removal.debDir);
        VerifyIn(removal.debDir, kytotrust::SignedName(link), why);
    }
    return why.empty() ? -1 : Refuse(why, removal);
}

int TrustPackageFolder(const SmallUpdate& u) {
    const Trust& trust = TrustedKeys();
    if (!trust.checking)
        return -1;
    Removal removal;
    removal.debDir = u.m_debDir;
    if (!trust.error.empty())
        return Refuse(trust.error, removal);
    std::vector<std::string> names;
    if (!SignedFilesOf(u.m_debDir, names) || names.empty())
        return Refuse("no signed files in the package folder " + u.m_debDir, removal);
    std::string why;
    for (const std::string& name : names) {
        if (!VerifyIn(u.m_debDir, name, why))
            return Refuse(why, removal);
    }
    return -1;
}

}  // namespace kytoupdate
