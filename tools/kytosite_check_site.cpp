// The two halves of `kytosite check`, each judged by the library's own readers under the
// device description: the release feed and its image, the patch list and its packages.
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include "debian_lib.h"
#include "kytosite_check_internal.h"
#include "smallupdate.h"
#include "smallupdate_plan.h"
#include "update_cpputil.h"
#include "vyxupdate.h"
#include "vyxupdate_internal.h"

namespace kytosite {
namespace check {

namespace {

// What every Debian package starts with: the archive's magic and its first member's name.
constexpr char kDebHead[] = "!<arch>\ndebian-binary";
constexpr size_t kDebHeadSize = sizeof(kDebHead) - 1;

struct FileCloser {
    void operator()(FILE* f) const { fclose(f); }
};

bool IsDebianPackage(const std::string& path) {
    std::unique_ptr<FILE, FileCloser> file(fopen(path.c_str(), "re"));
    char head[kDebHeadSize];
    return file && fread(head, 1, kDebHeadSize, file.get()) == kDebHeadSize &&
           memcmp(head, kDebHead, kDebHeadSize) == 0;
}

void CheckPackage(Site& site, const std::string& link) {
    std::string path;
    Fetched got;
    if (!site.Get(link, true, true, path, got))
        return;
    if (!IsDebianPackage(path))
        site.Problem("not a Debian package: " + link);
    unlink(path.c_str());
}

// Names, for a list the merge refused, the packages of the fixes newer than the installed
// one whose names the package rules reject or give to another fix.  The library's log
// carries the merge's own reason.
int NamePackagesRefused(Site& site, const std::string& path) {
    Json::Value root;
    if (UpdateUtil::ParseJsonRootFromFile(path.c_str(), root) != 1 || !root.isObject() ||
        !root["smallupdate"].isArray())
        return 0;
    int named = 0;
    for (const Json::Value& entry : root["smallupdate"]) {
        if (!entry.isObject() || !entry["version"].isInt() || !entry["proj"].isArray() ||
            entry["version"].asInt() <= site.options.smallfix)
            continue;
        const int version = entry["version"].asInt();
        for (const Json::Value& package : entry["proj"]) {
            if (!package.isObject() || !package["url"].isString())
                continue;
            const std::string name = kytotrust::SignedName(package["url"].asString());
            const int fix = DebianLib::FindSmallFixNumfromDeb(name);
            if (fix < 1)
                site.Problem("package name rejected by the rules: " + name);
            else if (fix != version)
                site.Problem("package " + name + " belongs to fix " + std::to_string(fix) +
                             ", listed under fix " + std::to_string(version));
            named += fix != version;
        }
    }
    return named;
}

void ListRefused(Site& site, const SmallUpdate& fix, const std::string& url,
                 const std::string& path) {
    if (fix.m_errno == SmallUpdate::ERROR_CODE_OTHER_MODEL)
        site.Problem("patch list " + url + " is for another model");
    else if (fix.m_errno == SmallUpdate::ERROR_CODE_BAD_FIX_NUMBER)
        site.Problem("patch list " + url + " is for another build");
    else if (NamePackagesRefused(site, path) == 0)
        site.Problem("patch list " + url + " refused by the rules (the system log says why)");
}

}  // namespace

void CheckRelease(Site& site) {
    const std::string feedUrl = site.options.url + "/autoupdate/genRSS.php";
    std::string path;
    Fetched got;
    if (!site.Get(feedUrl, true, true, path, got))
        return;
    _tag_vyxinfo_ current, release;
    kyto::vyx::ClearRecord(current);
    kyto::vyx::ClearRecord(release);
    bool found = false;
    if (VyxUpdate::GetVyxInfo(current) != 1 ||
        kyto::vyx::ReadFeed(path.c_str(), false, current, found, release) != 1) {
        site.Problem("cannot read the release feed " + feedUrl);
        return;
    }
    unlink(path.c_str());
    if (!found)
        return;
    site.report.release =
        std::string("VYX ") + release.major + "." + release.minor + "-" + release.buildNum;
    const std::string link = release.link;
    if (link.empty()) {
        site.Problem("release " + site.report.release + " names no image for " +
                     site.options.model);
        return;
    }
    if (!site.Get(link, true, true, path, got))
        return;
    unlink(path.c_str());
    if (got.md5 != release.checksum)
        site.Problem("wrong MD5 of " + link + ": " + got.md5 + ", the feed says " +
                     release.checksum);
}

void CheckFixes(Site& site) {
    const CheckOptions& o = site.options;
    const std::string listUrl =
        kyto::PatchListUrl(o.url + "/smallupdate", std::to_string(o.build), o.model);
    std::string path;
    Fetched got;
    // A 404 is the ordinary answer when there is no fix for this build and model.
    if (!site.Get(listUrl, false, false, path, got))
        return;
    SmallUpdate fix(o.model);
    if (!fix.SetUpdateList(path)) {
        ListRefused(site, fix, listUrl, path);
        return;
    }
    if (fix.m_newSmallFixNumber <= o.smallfix)
        return;
    const std::string number = std::to_string(fix.m_newSmallFixNumber);
    site.report.smallupdate = o.version.empty()
                                  ? "build " + std::to_string(o.build) + " update " + number
                                  : fix.GetFullVersion();
    const std::vector<std::string> links = kyto::SmallUpdateDownloadLinks(fix);
    if (links.empty())
        site.Problem("fix " + number +
                     ": nothing to download (a small-update package alone, without a "
                     "configuration update or further packages)");
    for (const std::string& link : links) {
        if (link.empty())
            site.Problem("fix " + number + ": a configuration or flash update without its package");
        else
            CheckPackage(site, link);
    }
}

}  // namespace check
}  // namespace kytosite
