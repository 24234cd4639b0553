// kytosite check: the command line, the run (work folder, device description, both halves of
// the site) and the report, as text or as one JSON document.
#include "kytosite_check.h"

#include <stdio.h>

#include <iostream>
#include <mutex>
#include <string>

#include <curl/curl.h>
#include <json/json.h>

#include "kytosite_check_internal.h"
#include "version_file.h"
#include "scoped.h"

namespace kytosite {

namespace {

constexpr int kExitOk = 0, kExitProblem = 1, kExitUnreachable = 2, kExitUsage = 64;

int Fail(const std::string& text, int code) {
    fprintf(stderr, "kytosite: check: %s\n", text.c_str());
    return code;
}

// "MAJOR.MINOR": two decimal numbers.
bool IsMajorMinor(const std::string& v) {
    const size_t dot = v.find('.');
    auto digits = [](const std::string& s) {
        return !s.empty() && s.find_first_not_of("0123456789") == std::string::npos;
    };
    return dot != std::string::npos && digits(v.substr(0, dot)) && digits(v.substr(dot + 1));
}

void PrintText(const check::Report& r) {
    if (!r.release.empty())
        printf("release %s\n", r.release.c_str());
    if (!r.smallupdate.empty())
        printf("smallupdate %s\n", r.smallupdate.c_str());
    if (r.release.empty() && r.smallupdate.empty())
        printf("none\n");
    for (const check::Report::File& f : r.files)
        printf("file %s %llu%s\n", f.url.c_str(), f.size,
               f.signedState == 1 ? " signed" : (f.signedState == 0 ? " refused" : ""));
    for (const std::string& p : r.problems)
        printf("problem: %s\n", p.c_str());
}

void PrintJson(const check::Report& r) {
    Json::Value doc(Json::objectValue);
    Json::Value& offered = doc["offered"] = Json::Value(Json::objectValue);
    offered["release"] = r.release.empty() ? Json::Value() : Json::Value(r.release);
    offered["smallupdate"] = r.smallupdate.empty() ? Json::Value() : Json::Value(r.smallupdate);
    doc["files"] = Json::Value(Json::arrayValue);
    for (const check::Report::File& f : r.files) {
        Json::Value file(Json::objectValue);
        file["url"] = f.url;
        file["size"] = Json::UInt64(f.size);
        file["signed"] = f.signedState < 0 ? Json::Value() : Json::Value(f.signedState == 1);
        doc["files"].append(file);
    }
    doc["problems"] = Json::Value(Json::arrayValue);
    for (const std::string& p : r.problems)
        doc["problems"].append(p);
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "  ";
    std::cout << Json::writeString(writer, doc) << std::endl;
}

}  // namespace

CLI::App* AddCheckCommand(CLI::App& app, CheckOptions& o) {
    CLI::App* check = app.add_subcommand(
        "check", "Read a site as an appliance of the given model, build and fix level would");
    check->add_option("URL", o.url, "The site's base URL")->required();
    check->add_option("--model", o.model, "The appliance's model identity")->required();
    check->add_option("--build", o.build, "Its running build number")->required();
    check->add_option("--smallfix", o.smallfix, "Its installed small-fix number (default 0)");
    check->add_option("--version", o.version,
                      "Its version, MAJOR.MINOR; without it the release feed is not read");
    check->add_option("--trust", o.trustDir, "Check signatures against the *.pub keys in DIR");
    check->add_flag("--json", o.json, "One JSON document on standard output");
    check->footer(
        "Prints what the appliance would be offered (release, small update or none), each file "
        "it\nwould fetch with its size, and one \"problem:\" line per problem found.\n"
        "Exit codes: 0 a consistent update or none, 1 problems found, 2 site not reachable,\n"
        "64 bad command line (also a --version that is not MAJOR.MINOR, a --trust folder "
        "without keys).");
    return check;
}

int RunCheck(const CheckOptions& given) {
    CheckOptions o = given;
    if (!o.version.empty() && !IsMajorMinor(o.version))
        return Fail("--version must be MAJOR.MINOR, not '" + o.version + "'", kExitUsage);
    while (!o.url.empty() && o.url.back() == '/')
        o.url.pop_back();
    check::Site site{o, "", false, {}, {}, 0};
    if (!o.trustDir.empty()) {
        std::string why;
        if (!kytotrust::LoadTrustFolder(o.trustDir, site.keys, why))
            return Fail(why, kExitUsage);
        if (!why.empty())
            fprintf(stderr, "kytosite: check: %s\n", why.c_str());
        site.trust = true;
    }
    const kyto::ScopedTempDir dir("/tmp/kytosite-check.XXXXXX");
    std::string versionFile, infoFile;
    if (!dir.Made() || !check::WriteDevice(o, dir.Path(), versionFile, infoFile))
        return Fail("cannot write the device description under /tmp", kExitProblem);
    site.dir = dir.Path();
    static std::once_flag once;
    std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
    {
        kyto::ScopedDeviceDescription device(versionFile, infoFile);
        if (o.version.empty())
            fprintf(stderr, "kytosite: check: no --version: the release feed is not read\n");
        else
            check::CheckRelease(site);
        check::CheckFixes(site);
    }
    if (site.report.unreachable && !site.report.answered)
        return Fail("cannot reach " + o.url + ": " + site.report.unreachableWhy, kExitUnreachable);
    o.json ? PrintJson(site.report) : PrintText(site.report);
    return site.report.problems.empty() ? kExitOk : kExitProblem;
}

}  // namespace kytosite
