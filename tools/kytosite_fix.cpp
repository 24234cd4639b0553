// kytosite fix: packages published as a small-update fix of a build, under the names the
// appliance's package rules require, and the fix appended to each model's patch list.  The
// appliance's own rules judge first (the package-name rule on every name, the patch list's
// validation and merge for a device of each model one fix behind, the download's link
// order); anything they refuse is refused here with nothing written.
#include <stdio.h>

#include <map>
#include <string>
#include <vector>

#include <json/json.h>

#include "debian_lib.h"
#include "json_members.h"
#include "kytosite_site.h"
#include "scoped.h"
#include "smallupdate.h"
#include "smallupdate_plan.h"

namespace kytosite {

namespace {

struct Package {
    std::string path;       // the file given
    std::string role;       // "smallupdate", "flashupdate" or the package's own name
    std::string published;  // its file name on the site
};

// "<package>_<version>-<build>-s<fix>_<arch>.deb" from the package's control fields (the
// version as it is when it already ends with "-<build>-s<fix>"; an epoch is left out, as
// in the file names of Debian archives).
bool PublishedName(Package& p, const FixOptions& o, std::string& why) {
    std::string out;
    if (!RunCapture({"/usr/bin/dpkg-deb", "-f", p.path, "Package", "Version", "Architecture"},
                    out)) {
        why = p.path + " is not a Debian package";
        return false;
    }
    std::map<std::string, std::string> fields;
    size_t pos = 0;
    while (pos < out.size()) {
        size_t end = out.find('\n', pos);
        end = end == std::string::npos ? out.size() : end;
        const std::string line = out.substr(pos, end - pos);
        const size_t colon = line.find(": ");
        if (colon != std::string::npos)
            fields[line.substr(0, colon)] = line.substr(colon + 2);
        pos = end + 1;
    }
    std::string version = fields["Version"];
    version = version.substr(version.find(':') == std::string::npos ? 0 : version.find(':') + 1);
    const std::string suffix = "-" + std::to_string(o.build) + "-s" + std::to_string(o.fix);
    if (version.size() < suffix.size() ||
        version.compare(version.size() - suffix.size(), suffix.size(), suffix) != 0)
        version += suffix;
    if (p.role.empty())
        p.role = fields["Package"];
    p.published = fields["Package"] + "_" + version + "_" + fields["Architecture"] + ".deb";
    if (fields["Package"].empty() || fields["Architecture"].empty()) {
        why = p.path + " is not a Debian package (no Package or Architecture field)";
        return false;
    }
    return true;
}

// The appliance's package-name rule, for a device of that build.
bool NameAccepted(const Package& p, const FixOptions& o, std::string& why) {
    int read = -1;
    if (SafeName(p.published))
        read = DebianLib::FindSmallFixNumfromDeb(p.published);
    if (read == o.fix)
        return true;
    why = p.path + " would be published as '" + p.published +
          "', which the appliance's package rules reject for build " + std::to_string(o.build) +
          " fix " + std::to_string(o.fix) + " (they read " + std::to_string(read) + ")";
    return false;
}

std::vector<Package> Packages(const FixOptions& o) {
    std::vector<Package> packages;
    if (!o.smallupdate.empty())
        packages.push_back({o.smallupdate, "smallupdate", ""});
    if (!o.flash.empty())
        packages.push_back({o.flash, "flashupdate", ""});
    for (const std::string& deb : o.debs)
        packages.push_back({deb, "", ""});
    return packages;
}

Json::Value FixEntry(const FixOptions& o, const std::vector<Package>& packages,
                     const std::string& debsUrl) {
    Json::Value entry(Json::objectValue), proj(Json::arrayValue);
    entry["version"] = o.fix;
    for (const Package& p : packages) {
        Json::Value item;
        item["name"] = p.role;
        item["url"] = debsUrl + "/" + p.published;
        proj.append(item);
    }
    entry["proj"] = proj;
    entry["flash_upgrade"] = !o.flash.empty();
    entry["config_upgrade"] = o.config;
    if (o.reboot) {
        entry["restart"] = "reboot";
    } else if (o.restartAll) {
        entry["restart"] = "all_service";
    } else if (o.services.empty() && o.packages.empty()) {
        entry["restart"] = "none";
    } else {
        Json::Value restart(Json::objectValue);
        restart["vyx_service"] = Json::Value(Json::arrayValue);
        restart["pkg"] = Json::Value(Json::arrayValue);
        for (const std::string& s : o.services)
            restart["vyx_service"].append(s);
        for (const std::string& s : o.packages)
            restart["pkg"].append(s);
        entry["restart"] = restart;
    }
    return entry;
}

// A model's patch list (a new one when there is none) and the number of its last fix.
bool LoadList(const std::string& path, const FixOptions& o, const std::string& model,
              Json::Value& list, int& last, std::string& why) {
    std::string text;
    last = 0;
    if (!Exists(path)) {
        list = Json::Value(Json::objectValue);
        list["vyxversion"] = o.build;
        list["unique"] = model;
        list["smallupdate"] = Json::Value(Json::arrayValue);
        return true;
    }
    if (!ReadText(path, text, why))
        return false;
    if (!kyto::ParseJsonText(text, list) || !list.isObject() || !list["smallupdate"].isArray() ||
        !list["vyxversion"].isInt() || list["vyxversion"].asInt() != o.build ||
        kyto::MemberText(list, "unique") != model) {
        why =
            path + " is not the patch list of build " + std::to_string(o.build) + " model " + model;
        return false;
    }
    const Json::Value& entries = list["smallupdate"];
    if (!entries.empty() && entries[entries.size() - 1]["version"].isInt())
        last = entries[entries.size() - 1]["version"].asInt();
    return true;
}

// The list as a device of the model on this build at fix `last` judges it: the library's
// validation and merge must accept it, yield this fix, and leave a link for everything the
// download fetches.
bool DeviceTakes(const Json::Value& list, const FixOptions& o, const std::string& model, int last,
                 std::string& why) {
    DeviceScope device;
    if (!device.Lend({"1", "0", std::to_string(o.build), std::to_string(last), model}, why))
        return false;
    const std::string path = device.Folder() + "/" + kyto::kPatchListName;
    kyto::ScopedUnlink remove(path);
    if (!WriteAtomically(path, list.toStyledString(), why))
        return false;
    SmallUpdate u(model);
    const std::string who = "a device of model " + model + " on build " + std::to_string(o.build) +
                            " at fix " + std::to_string(last);
    if (!u.SetUpdateList(path) || u.m_newSmallFixNumber != o.fix) {
        why = who + " would refuse the resulting patch list (its merge fails)";
        return false;
    }
    for (const std::string& link : kyto::SmallUpdateDownloadLinks(u)) {
        if (link.empty()) {
            why = who + " could not download fix " + std::to_string(o.fix) +
                  " as published: further packages and a configuration update come only "
                  "with a small-update package (--smallupdate)";
            return false;
        }
    }
    return true;
}

// Every package's published name, judged by the rule of a device of that build.
bool NamePackages(std::vector<Package>& packages, const FixOptions& o, std::string& why) {
    DeviceScope device;
    if (!device.Lend({"1", "0", std::to_string(o.build), "0", o.models.front()}, why))
        return false;
    std::map<std::string, std::string> seen;
    for (Package& p : packages) {
        if (!PublishedName(p, o, why) || !NameAccepted(p, o, why))
            return false;
        if (!seen.emplace(p.published, p.path).second) {
            why =
                p.path + " and " + seen[p.published] + " would both be published as " + p.published;
            return false;
        }
    }
    return true;
}

// A package already published under that name must be the same file.
bool Unchanged(const std::string& published, const std::string& given, std::string& why) {
    std::string a, b;
    if (!Exists(published))
        return true;
    if (ReadText(published, a, why) && ReadText(given, b, why) && a == b)
        return true;
    why = published + " is published already with other content";
    return false;
}

struct Plan {
    std::vector<Package> packages;
    std::vector<std::pair<std::string, Json::Value>> lists;  // site path, new list
};

bool Judge(const Site& site, const FixOptions& o, Plan& plan, std::string& why) {
    const std::string build = std::to_string(o.build);
    for (const std::string& m : o.models) {
        if (!SafeName(m)) {
            why = "--model: '" + m + "' is not a model identity";
            return false;
        }
    }
    if ((plan.packages = Packages(o)).empty()) {
        why = "nothing to publish: give --smallupdate, --flash or packages";
        return false;
    }
    if (!NamePackages(plan.packages, o, why))
        return false;
    for (const Package& p : plan.packages) {
        if (!Unchanged(site.Path("smallupdate/" + build + "/debs/" + p.published), p.path, why))
            return false;
    }
    const Json::Value entry =
        FixEntry(o, plan.packages, site.Url("smallupdate/" + build + "/debs"));
    for (const std::string& model : o.models) {
        const std::string path = site.Path(kyto::PatchListUrl("smallupdate", build, model));
        Json::Value list;
        int last = 0;
        if (!LoadList(path, o, model, list, last, why))
            return false;
        if (o.fix <= last) {
            why = "fix " + std::to_string(o.fix) + " is not above fix " + std::to_string(last) +
                  ", the last in " + path;
            return false;
        }
        list["smallupdate"].append(entry);
        if (!DeviceTakes(list, o, model, last, why))
            return false;
        plan.lists.emplace_back(path, list);
    }
    return true;
}

}  // namespace

int CmdFix(const FixOptions& o) {
    Site site;
    Plan plan;
    std::string why, md5;
    if (!OpenSite(o.site, site, why) || !Judge(site, o, plan, why))
        return Fail(why);
    const std::string debs = site.Path("smallupdate/" + std::to_string(o.build) + "/debs");
    MadeFolders folders;
    std::vector<std::unique_ptr<StagedFile>> staged;
    if (!folders.Make(debs, why))
        return Fail(why);
    for (const Package& p : plan.packages) {
        staged.emplace_back(new StagedFile);
        if (!staged.back()->Open(debs + "/" + p.published, why) ||
            !CopyWithMd5(p.path, *staged.back(), md5, nullptr, why))
            return Fail(why);
    }
    for (const auto& list : plan.lists) {
        staged.emplace_back(new StagedFile);
        const std::string folder = list.first.substr(0, list.first.rfind('/'));
        if (!folders.Make(folder, why) || !staged.back()->Open(list.first, why) ||
            !staged.back()->Write(list.second.toStyledString(), why))
            return Fail(why);
    }
    for (const auto& file : staged) {
        if (!file->Commit(why))
            return Fail(why);
    }
    folders.Keep();
    printf("published fix %d of build %d: %zu package(s), %zu patch list(s)\n", o.fix, o.build,
           plan.packages.size(), plan.lists.size());
    return kExitOk;
}

}  // namespace kytosite
