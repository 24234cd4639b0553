// Fuzz target: an arbitrary info file ("/autoupd@te.info") through
// SmallUpdate::ImportInfoFile and the small-update status reader that trusts it, then
// through the full-system readers of the same file (VyxUpdate::GetDownloadedPatchPath,
// GetDownloadStatus, CheckPatchAndUpdateType).  An accepted file leaves error code 0 and
// reads as a finished download; a refused one leaves code 3 (bad document) or 4 (other
// build).  The full-system readers never throw: a document that is not JSON fails them,
// any other shape is used or set aside.  Last, the facade's readers: a fresh SystemUpdate
// imports no kind from any file and applies nothing, and UpdateUtil's kind reader names a
// full release only for an object whose "updateType" is "vyxupdate".
#include <exception>
#include <sstream>
#include <string>

#include "fuzz_common.h"
#include "smallupdate.h"
#include "systemupdate.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

namespace {
constexpr const char* kInfo = "/autoupd@te.info";

void CheckSmallUpdateReaders(const uint8_t* data, size_t size) {
    kytofuzz::WriteWhole(kInfo, data, size);
    SmallUpdate update;
    const bool ok = update.ImportInfoFile(kInfo);
    const int code = update.GetErrno();
    if (ok)
        KYTO_FUZZ_CHECK(code == 0);
    else
        KYTO_FUZZ_CHECK(code == 3 || code == 4);

    SmallUpdate poller;
    int percentage = -7;
    std::string status = "unset";
    poller.GetDownloadStatus(percentage, status);
    if (ok)
        KYTO_FUZZ_CHECK(percentage == 100 && status == "finished");
    else
        KYTO_FUZZ_CHECK(percentage == -7 && status == "none");  // no status file
}

// A full-system record: an object whose "updateType", when present, is "vyxupdate", with
// the four members the installer needs.
bool IsVyxRecord(const Json::Value& root) {
    if (!root.isObject())
        return false;
    if (root.isMember("updateType") &&
        (!root["updateType"].isString() || root["updateType"].asString() != "vyxupdate"))
        return false;
    for (const char* key : {"buildnumber", "majorversion", "minorversion", "patchPath"}) {
        if (!root.isMember(key))
            return false;
    }
    return true;
}

// The document as the library's reader takes it (comments not collected); false when it is
// not JSON or the parser gives up.
bool ParseDocument(const std::string& text, Json::Value& root) {
    try {
        std::istringstream stream(text);
        return Json::Reader().parse(stream, root, false);
    } catch (const std::exception&) {
        return false;
    }
}

void CheckVyxReaders(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    Json::Value root;
    const bool parses = ParseDocument(text, root);

    kytofuzz::WriteWhole(kInfo, text);
    bool have = true;
    std::string path = "unset";
    const bool read = VyxUpdate::GetDownloadedPatchPath(have, path);
    KYTO_FUZZ_CHECK(read == parses);
    KYTO_FUZZ_CHECK(have == (parses && IsVyxRecord(root)));
    if (have)
        KYTO_FUZZ_CHECK(path == (root["patchPath"].isConvertibleTo(Json::stringValue)
                                     ? root["patchPath"].asString()
                                     : std::string()));

    kytofuzz::WriteWhole(kInfo, text);
    int percentage = -7;
    VyxUpdate::VYX_DOWNLOAD_STATUS status = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED;
    const bool polled = VyxUpdate::GetDownloadStatus(percentage, status);
    KYTO_FUZZ_CHECK(polled == parses);
    KYTO_FUZZ_CHECK((percentage == 0 && status == VyxUpdate::VYX_DOWNLOAD_STATUS_NONE) ||
                    (percentage == 100 && status == VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED));

    bool isNewer = false;
    const Json::Value before = root;
    KYTO_FUZZ_CHECK(VyxUpdate::CheckPatchAndUpdateType(isNewer, root));
    KYTO_FUZZ_CHECK(root == before);
}

void CheckFacadeReaders(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    Json::Value root;
    const bool parses = ParseDocument(text, root);

    kytofuzz::WriteWhole(kInfo, text);
    KYTO_FUZZ_CHECK(SystemUpdate().ImportInfoFile() == 0);
    kytofuzz::WriteWhole(kInfo, text);
    KYTO_FUZZ_CHECK(SystemUpdate().Apply() == 0);

    kytofuzz::WriteWhole(kInfo, text);
    UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_NONE;
    UpdateUtil::CheckDownloadedPatchType(type);
    const bool vyx = parses && root.isObject() && root["updateType"].isString() &&
                     root["updateType"].asString() == "vyxupdate";
    if (vyx)
        KYTO_FUZZ_CHECK(type == UpdateUtil::PATCH_TYPE_VYX);
    else
        KYTO_FUZZ_CHECK(type != UpdateUtil::PATCH_TYPE_VYX);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    unlink("/var/run/downloadVYX.status");
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    CheckSmallUpdateReaders(data, size);
    CheckVyxReaders(data, size);
    CheckFacadeReaders(data, size);
    kytofuzz::CheckDescriptors();
    return 0;
}
