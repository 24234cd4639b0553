// Signed updates (kytoupdate_trust.h): a downloaded full release.  Each image must be
// signed under its link's name, and the signed feed, read by the library's own feed reader,
// must offer this device that image with the MD5 the download was checked against.
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <json/json.h>
#include <kytoplatform/kytoconf.h>

#include "kytotrust.h"
#include "kytoupdate_common.h"
#include "kytoupdate_trust.h"
#include "scoped.h"
#include "vyxupdate.h"
#include "vyxupdate_plan.h"

namespace kytoupdate {

namespace {

// One downloaded image: its path, the release record the check chose, the model it is for
// ("" for this device).
struct Image {
    std::string path;
    const _tag_vyxinfo_* release;
    std::string unique;
};

// A text member of the info file's record; "" for anything else (member lookups on a
// document that is not an object would throw).
std::string TextMember(const Json::Value& info, const char* key) {
    if (!info.isObject() || !info[key].isString())
        return "";
    return info[key].asString();
}

// The image against "<link>.minisig", fetched into a private folder.  "" or the reason.
std::string CheckImage(const Image& image) {
    const kyto::ScopedTempDir tmp("/tmp/kytoupdate-trust.XXXXXX");
    if (!tmp.Made())
        return "cannot make a temporary folder";
    const std::string name = kytotrust::SignedName(image.release->link);
    FetchInto(std::string(image.release->link) + ".minisig", tmp.Path());
    std::string why;
    if (kytotrust::VerifyFile(TrustedKeys().keys, image.path, tmp.Path() + "/" + name + ".minisig",
                              name, why))
        return "";
    return name + ": " + why;
}

// Whether the feed at the reader's fixed path offers image, as the check would read it.
bool FeedOffers(const Image& image) {
    _tag_vyxinfo_ current{};
    if (!VyxUpdate::GetVyxInfo(current))
        return false;
    if (!image.unique.empty())
        snprintf(current.unique, sizeof(current.unique), "%s", image.unique.c_str());
    const bool hotfixOnly = kyto::HotfixOnly();
    bool found = false;
    _tag_vyxinfo_ offered{};
    return VyxUpdate::ParseRssFile(hotfixOnly, current, found, offered) == 1 && found &&
           strcmp(offered.link, image.release->link) == 0 &&
           strcasecmp(offered.checksum, image.release->checksum) == 0;
}

// The feed fetched again with its signature, verified, then read by the library's feed
// reader on its fixed path (removed afterwards).  "" or the reason.
std::string CheckFeed(const std::vector<Image>& images) {
    const kyto::ScopedTempDir tmp(
        "/var/run/kytoupdate-feed.XXXXXX");  // same file system as kyto::kRssFile
    if (!tmp.Made())
        return "cannot make a temporary folder";
    const std::string url = KytoConf().Def("rss_server", kyto::kDefaultRssServer);
    const std::string name = kytotrust::SignedName(url);
    FetchInto(url, tmp.Path());
    FetchInto(url + ".minisig", tmp.Path());
    std::string why;
    if (!VerifyIn(tmp.Path(), name, why))
        return why;
    const kyto::ScopedUnlink feedCleanup(kyto::kRssFile);
    if (rename((tmp.Path() + "/" + name).c_str(), kyto::kRssFile) != 0)
        return "cannot hand the signed feed to the feed reader";
    for (const Image& image : images) {
        if (!FeedOffers(image))
            return "the signed feed " + name + " does not offer " + image.release->link +
                   " with MD5 " + image.release->checksum;
    }
    return "";
}

}  // namespace

int TrustRelease(const VyxUpdate& checked) {
    const Trust& trust = TrustedKeys();
    if (!trust.checking)
        return -1;
    bool have = false;
    Json::Value info;
    VyxUpdate::GetAutoUpdateInfo(have, info);
    std::vector<Image> images = {{TextMember(info, "patchPath"), &checked.m_release, ""}};
    if (checked.m_hybridDL)
        images.push_back({TextMember(info, "passivePatchPath"), &checked.m_partnerRelease,
                          checked.m_partnerUnique});
    Removal removal;
    removal.vyx = true;
    for (const Image& image : images) {
        if (!image.path.empty())
            removal.images.push_back(image.path);
    }
    if (!trust.error.empty())
        return Refuse(trust.error, removal);
    if (!have || removal.images.size() != images.size())
        return Refuse("the downloaded release's record cannot be read", removal);
    std::string why;
    for (const Image& image : images) {
        if (why.empty())
            why = CheckImage(image);
    }
    if (why.empty())
        why = CheckFeed(images);
    return why.empty() ? -1 : Refuse(why, removal);
}

}  // namespace kytoupdate
