// kytosite init and release: an empty site, and a release image published with its item in
// the release feed (newest release first), which the appliance's own feed reader must find
// for every model before the feed is renamed into place.
#include <stdio.h>
#include <string.h>
#include <time.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "kytosite_site.h"
#include "vyxupdate.h"
#include "vyxupdate_internal.h"
#include "kytotrust.h"

namespace kytosite {

namespace {

const char* const kFeedHead = "<rss>\n<channel>\n<title>VYX releases</title>\n";
const char* const kFeedTail = "</channel>\n</rss>\n";

struct Version {
    std::string major, minor, build;
    std::string Text() const { return major + "." + minor + "-" + build; }
};

// A decimal number as the feed reader converts it: no leading zero (it would read octal).
bool Number(const std::string& s) {
    return !s.empty() && s.size() < 10 && s.find_first_not_of("0123456789") == std::string::npos &&
           (s.size() == 1 || s[0] != '0');
}

// MAJOR.MINOR-BUILD.
bool ParseVersion(const std::string& text, Version& v) {
    const size_t dot = text.find('.'), dash = text.find('-');
    if (dot == std::string::npos || dash == std::string::npos || dash < dot)
        return false;
    v = {text.substr(0, dot), text.substr(dot + 1, dash - dot - 1), text.substr(dash + 1)};
    return Number(v.major) && Number(v.minor) && Number(v.build);
}

// The feed: the lines before the first item, each item (from its "<item>" line to its
// "</item>" line), and the rest.
struct Feed {
    std::string head, tail;
    std::vector<std::string> items;
    std::string Text() const {
        std::string text = head;
        for (const std::string& item : items)
            text += item;
        return text + tail;
    }
};

Feed SplitFeed(const std::string& text) {
    Feed feed;
    std::string* into = &feed.head;
    size_t pos = 0;
    while (pos < text.size()) {
        size_t end = text.find('\n', pos);
        end = end == std::string::npos ? text.size() : end + 1;
        const std::string line = text.substr(pos, end - pos);
        pos = end;
        if (line.find("<item>") != std::string::npos) {
            feed.items.push_back(feed.tail + line);  // lines between items stay with the next
            feed.tail.clear();
            into = &feed.items.back();
        } else if (line.find("</item>") != std::string::npos && into != &feed.head) {
            *into += line;
            into = &feed.tail;
        } else {
            *into += line;
        }
    }
    const size_t close = feed.head.find("</channel>");
    if (feed.items.empty() && close != std::string::npos) {  // items go before the channel's end
        const size_t lineStart = feed.head.rfind('\n', close);
        const size_t cut = lineStart == std::string::npos ? 0 : lineStart + 1;
        feed.tail = feed.head.substr(cut);
        feed.head.erase(cut);
    }
    return feed;
}

// An item's version fields, read with the feed reader's own line rule.
_tag_vyxinfo_ ItemRecord(const std::string& item) {
    _tag_vyxinfo_ rec;
    memset(&rec, 0, sizeof rec);
    size_t pos = 0;
    while (pos < item.size()) {
        size_t end = item.find('\n', pos);
        end = end == std::string::npos ? item.size() : end;
        std::string name, value;
        _tag_rss_tag_type_ type = RSS_TAG_NONE;
        if (VyxUpdate::ParseTagValue(item.substr(pos, end - pos), name, value, type) &&
            type >= RSS_TAG_MAJOR_VER && type <= RSS_TAG_REQ_BUILD_DATE)
            VyxUpdate::SetVyxInfo(type, value.c_str(), rec);
        pos = end + 1;
    }
    return rec;
}

_tag_vyxinfo_ Record(const Version& v) {
    _tag_vyxinfo_ rec;
    memset(&rec, 0, sizeof rec);
    snprintf(rec.major, sizeof rec.major, "%s", v.major.c_str());
    snprintf(rec.minor, sizeof rec.minor, "%s", v.minor.c_str());
    snprintf(rec.buildNum, sizeof rec.buildNum, "%s", v.build.c_str());
    return rec;
}

std::string Element(const char* indent, const std::string& tag, const std::string& value) {
    return indent + ("<" + tag + ">") + value + "</" + tag + ">\n";
}

std::string ItemText(const ReleaseOptions& o, const Version& v, const Version* req,
                     const std::string& link, const std::string& md5) {
    std::string s = "  <item>\n" + Element("    ", "title", "VYX " + v.Text()) +
                    Element("    ", "MajorVer", v.major) + Element("    ", "MinorVer", v.minor) +
                    Element("    ", "BuildPhase", o.phase) + Element("    ", "BuildNum", v.build) +
                    Element("    ", "BuildDate", o.date);
    if (req) {
        s += Element("    ", "ReqMajorVer", req->major) +
             Element("    ", "ReqMinorVer", req->minor) +
             Element("    ", "ReqBuildNum", req->build);
    }
    for (const std::string& model : o.models) {
        s += "    <model>\n" + Element("      ", "mUnique", model) +
             Element("      ", "mLink", link) + Element("      ", "mCheckSum", md5) +
             "    </model>\n";
    }
    return s + "  </item>\n";
}

// Puts the item before the first older release; refuses a release already in the feed.
bool InsertItem(Feed& feed, const std::string& item, const Version& v, std::string& why) {
    const _tag_vyxinfo_ rec = Record(v);
    size_t at = 0;
    for (; at < feed.items.size(); ++at) {
        const _tag_vyxinfo_ old = ItemRecord(feed.items[at]);
        if (!VyxUpdate::IsVersionNewer(old, rec) && !VyxUpdate::IsVersionNewer(rec, old)) {
            why = "release " + v.Text() + " is already in the feed";
            return false;
        }
        if (VyxUpdate::IsVersionNewer(old, rec))
            break;
    }
    feed.items.insert(feed.items.begin() + static_cast<long>(at), item);
    return true;
}

// Whether a device of the model at version `older` reads the feed file and is offered the
// release with its link and MD5, in either of the reader's modes (any release, or only
// releases of its own MAJOR.MINOR as the hot-fix check asks).
bool Offered(const std::string& feedPath, const Version& v, const Version& older,
             const std::string& model, const std::string& link, const std::string& md5,
             std::string& why) {
    DeviceScope device;
    _tag_vyxinfo_ current;
    memset(&current, 0, sizeof current);
    if (!device.Lend({older.major, older.minor, older.build, "0", model}, why))
        return false;
    if (VyxUpdate::GetVyxInfo(current) != 1) {
        why = "cannot describe a device of model " + model;
        return false;
    }
    for (bool hotfixOnly : {false, true}) {
        bool found = false;
        _tag_vyxinfo_ r;
        memset(&r, 0, sizeof r);
        if (kyto::vyx::ReadFeed(feedPath.c_str(), hotfixOnly, current, found, r) == 1 && found &&
            v.major == r.major && v.minor == r.minor && v.build == r.buildNum && link == r.link &&
            md5 == r.checksum)
            return true;
    }
    why = "a device of model " + model + " at " + older.Text() + " would not be offered " +
          v.Text() + " by the new feed (a newer release listed for it comes first)";
    return false;
}

bool Today(std::string& date) {
    const time_t now = time(nullptr);
    struct tm tm;
    char buf[32];
    if (localtime_r(&now, &tm) == nullptr || strftime(buf, sizeof buf, "%Y/%m/%d", &tm) == 0)
        return false;
    date = buf;
    return true;
}

// The checks of release's command line that need no file: a message, or "".
std::string BadReleaseArguments(ReleaseOptions& o, Version& v, Version& req) {
    if (!ParseVersion(o.version, v))
        return "--version: '" + o.version + "' is not MAJOR.MINOR-BUILD";
    if (!o.requirement.empty() && !ParseVersion(o.requirement, req))
        return "--requires: '" + o.requirement + "' is not MAJOR.MINOR-BUILD";
    if (!o.requirement.empty() && !VyxUpdate::IsVersionNewer(Record(req), Record(v)))
        return "--requires: " + o.requirement + " is not older than " + v.Text();
    if (o.requirement.empty() && v.build == "0")
        return "--version: build 0 has no older build to update from";
    for (const std::string& m : o.models) {
        if (!SafeName(m))
            return "--model: '" + m + "' is not a model identity";
    }
    if (!SafeName(o.phase))
        return "--phase: '" + o.phase + "' is not a build phase";
    if (o.date.empty() && !Today(o.date))
        return "cannot tell today's date";
    if (o.date.size() != 10 || o.date[4] != '/' || o.date[7] != '/' ||
        o.date.find_first_not_of("0123456789/") != std::string::npos)
        return "--date: '" + o.date + "' is not YYYY/MM/DD";
    return "";
}

}  // namespace

int CmdInit(const std::string& root, const std::string& baseUrl) {
    std::string base = baseUrl, why;
    while (!base.empty() && base.back() == '/')
        base.pop_back();
    if ((base.compare(0, 7, "http://") != 0 && base.compare(0, 8, "https://") != 0) ||
        base.find_first_of(" \t\n<>\"'") != std::string::npos)
        return Fail("--base-url: '" + baseUrl + "' is not an http:// or https:// address",
                    kExitUsage);
    if (Exists(root + "/" + kSettingsName))
        return Fail(root + " is a site already");
    Json::Value settings;
    settings["base_url"] = base;
    if (!MakeFolders(root + "/autoupdate", why) || !MakeFolders(root + "/smallupdate", why) ||
        !MakeFolders(root + "/images", why) ||
        !WriteAtomically(root + "/" + kFeedRel, std::string(kFeedHead) + kFeedTail, why) ||
        !WriteAtomically(root + "/" + kSettingsName, settings.toStyledString(), why))
        return Fail(why);
    return kExitOk;
}

int CmdRelease(const ReleaseOptions& options) {
    ReleaseOptions o = options;
    Version v, req;
    std::string why = BadReleaseArguments(o, v, req), feedText, md5;
    if (!why.empty())
        return Fail(why, kExitUsage);
    const std::string name = kytotrust::SignedName(o.image);
    Site site;
    if (!SafeName(name))
        return Fail("the image's file name '" + name + "' cannot stand in a link as it is");
    if (!OpenSite(o.site, site, why) || !ReadText(site.Path(kFeedRel), feedText, why))
        return Fail(why);
    const std::string rel = "images/" + v.Text() + "/" + name, link = site.Url(rel);
    Feed feed = SplitFeed(feedText);
    MadeFolders folders;
    StagedFile image, feedFile;
    if (!InsertItem(feed, "", v, why) || !folders.Make(site.Path("images/" + v.Text()), why) ||
        !image.Open(site.Path(rel), why) || !CopyWithMd5(o.image, image, md5, name.c_str(), why))
        return Fail(why);
    feed = SplitFeed(feedText);
    const Version older = o.requirement.empty()
                              ? Version{v.major, v.minor, std::to_string(std::stol(v.build) - 1)}
                              : req;
    InsertItem(feed, ItemText(o, v, o.requirement.empty() ? nullptr : &req, link, md5), v, why);
    if (!feedFile.Open(site.Path(kFeedRel), why) || !feedFile.Write(feed.Text(), why))
        return Fail(why);
    for (const std::string& model : o.models) {
        if (!Offered(feedFile.TempPath(), v, older, model, link, md5, why))
            return Fail("refused: " + why);
    }
    if (!image.Commit(why) || !feedFile.Commit(why))
        return Fail(why);
    folders.Keep();
    printf("released %s: %s md5 %s\n", v.Text().c_str(), link.c_str(), md5.c_str());
    return kExitOk;
}

}  // namespace kytosite
