// Signed updates: with public keys in the trust folder, what download, apply, auto and
// import are about to hand on is checked against the vendor's signatures (kytotrust) before
// it is reported done or applied.  A refused download is removed so that neither the
// installer nor a later apply can use it; the reason goes to standard error and the system
// log.  Without a trust folder (missing, or no *.pub in it) nothing is checked and one
// notice says so.
//
// Each check returns -1 when the update may be handed on (signed by a trusted key, or no
// trust folder), else kExitRefused after removing the download.
#ifndef KYTOUPDATE_TRUST_H
#define KYTOUPDATE_TRUST_H

#include <string>
#include <vector>

#include "kytotrust.h"
#include "smallupdate.h"
#include "systemupdate.h"

namespace kytoupdate {

constexpr const char* kTrustDir = "/etc/kytoupdate/trusted.d";

// After a download of either kind by su's check: for a small update the patch list (fetched
// again with its signature, and yielding the record that was downloaded) and every package
// (its signature fetched into the package folder); for a full release the image and the feed
// that named it with its MD5.
int TrustDownload(const SystemUpdate& su);
// Before an apply, and after an import: every file in u's package folder against the
// signature stored beside it.
int TrustPackageFolder(const SmallUpdate& u);

// Fetches url into folder under its base name with the library's own fetch; false when the
// server had nothing (the file is then absent).
bool FetchInto(const std::string& url, const std::string& folder);

// ---- Shared by kytoupdate_trust.cpp and kytoupdate_trust_release.cpp ----

// The trust folder as read once per run: checking is false without a trust folder (the
// notice was given); error names why a folder with *.pub files gave no usable key.
struct Trust {
    bool checking = false;
    std::vector<kytotrust::PublicKey> keys;
    std::string error;
};
const Trust& TrustedKeys();

// Verifies folder/name against folder/name.minisig under the name; why names the file.
bool VerifyIn(const std::string& folder, const std::string& name, std::string& why);

// What a refusal removes besides the info files; vyx tells which kind's status to fail.
struct Removal {
    bool vyx = false;
    std::string debDir;
    std::vector<std::string> images;
};
// Removes the download, says why on standard error and in the system log; kExitRefused.
int Refuse(const std::string& why, const Removal& removal);

// The full release's half of TrustDownload.
int TrustRelease(const VyxUpdate& checked);

}  // namespace kytoupdate

#endif
