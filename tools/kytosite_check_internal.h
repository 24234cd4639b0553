// What the files of `kytosite check` share: the private work folder, one HTTP fetch, the
// report being built and the reader of one site file (fetch, size, signature).
#ifndef KYTOSITE_CHECK_INTERNAL_H
#define KYTOSITE_CHECK_INTERNAL_H

#include <string>
#include <vector>

#include "kytosite_check.h"
#include "kytotrust.h"

namespace kytosite {
namespace check {

// One GET of a URL into a file.
struct Fetched {
    long status = 0;              // the HTTP answer; 0: no answer came back
    unsigned long long size = 0;  // bytes of the body
    std::string md5;              // lower-case hex MD5 of the body
    std::string error;            // why the transfer failed ("" when it did not)
};
// Fetches url into path, following redirects when asked (the appliance's wget follows
// them; its patch-list lookup does not).
Fetched Fetch(const std::string& url, const std::string& path, bool followRedirects);

// What the check found.  signedState: -1 not checked (no trust folder), 0 refused, 1 good.
struct Report {
    struct File {
        std::string url;
        unsigned long long size = 0;
        int signedState = -1;
    };
    std::string release;      // "VYX 5.2-5700" when a release is offered
    std::string smallupdate;  // "VYX 5.2-5644 update 2" when a fix is offered
    std::vector<File> files;
    std::vector<std::string> problems;
    bool answered = false;     // some request got an HTTP answer
    bool unreachable = false;  // some request got none
    std::string unreachableWhy;
};

// The state of one check: the options, the work folder, the trusted keys and the report.
struct Site {
    const CheckOptions& options;
    std::string dir;
    bool trust = false;
    std::vector<kytotrust::PublicKey> keys;
    Report report;
    int files = 0;  // numbers the local copies

    // Fetches url into the work folder.  True when it answered 200: the file is listed (and
    // its signature checked with a trust folder); path and what came back are set.  A 404
    // is a problem only when missingIsProblem; other answers and failed transfers always.
    bool Get(const std::string& url, bool followRedirects, bool missingIsProblem, std::string& path,
             Fetched& got);
    void Problem(const std::string& text) { report.problems.push_back(text); }
};

// Writes the files that describe the appliance (version file and information file) into
// dir; false when one cannot be written.
bool WriteDevice(const CheckOptions& o, const std::string& dir, std::string& versionFile,
                 std::string& infoFile);
// The release feed as the appliance reads it, and the image of the release it offers.
// Runs with the device description in place; skipped without a version.
void CheckRelease(Site& site);
// The patch list of the appliance's build and model, the fix it offers and its packages.
void CheckFixes(Site& site);

}  // namespace check
}  // namespace kytosite

#endif
