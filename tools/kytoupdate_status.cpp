#include "kytoupdate_status.h"

#include <stdlib.h>

#include <sstream>

#include <kytoplatform/klibc.h>

#include "smallupdate.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

namespace kytoupdate {

namespace {
const char* const kDownloadStatusFile = "/var/run/downloadVYX.status";
}

bool StatusSnapshot::operator==(const StatusSnapshot& o) const {
    return downloading == o.downloading && vyxReadable == o.vyxReadable &&
           vyxStatus == o.vyxStatus && vyxPercentage == o.vyxPercentage && image == o.image &&
           images == o.images && imagePath == o.imagePath && smallStatus == o.smallStatus &&
           smallPercentage == o.smallPercentage && applyStage == o.applyStage &&
           applyPercentage == o.applyPercentage && applyError == o.applyError &&
           downloaded == o.downloaded;
}

std::string DownloadStatusKey(const char* key) {
    char buf[4096] = {0};
    if (KLIBCFileGetKeyValue(kDownloadStatusFile, key, buf, sizeof(buf), 0) <= 0)
        return "";
    return buf;
}

StatusSnapshot TakeSnapshot() {
    StatusSnapshot s;
    s.downloading = DownloadStatusKey("updateType");

    VyxUpdate::VYX_DOWNLOAD_STATUS vyx = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    s.vyxReadable = VyxUpdate::GetDownloadStatus(s.vyxPercentage, vyx);
    s.vyxStatus = s.vyxReadable ? VyxUpdate::DownloadStatusToString(vyx) : "unknown";
    if (s.downloading == "vyxupdate") {
        // Image n of m and its path, as the full-release download writes them.
        s.images = atoi(DownloadStatusKey("downloadCount").c_str());
        s.image = atoi(DownloadStatusKey("downloadNum").c_str());
        s.imagePath = DownloadStatusKey("patchPath");
    }

    // The reader is a member; a scratch engine keeps the record it loads to itself.
    SmallUpdate small;
    small.GetDownloadStatus(s.smallPercentage, s.smallStatus);

    SmallUpdate::GetApplyStage(s.applyPercentage, s.applyStage, s.applyError);

    UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_NONE;
    UpdateUtil::CheckDownloadedPatchType(type);
    s.downloaded = type == UpdateUtil::PATCH_TYPE_VYX     ? "vyxupdate"
                   : type == UpdateUtil::PATCH_TYPE_SMALL ? "smallupdate"
                                                          : "";
    return s;
}

Json::Value ToJson(const StatusSnapshot& s) {
    Json::Value root(Json::objectValue);
    root["downloading"] = s.downloading;
    root["downloaded"] = s.downloaded;
    Json::Value& vyx = root["vyxupdate"];
    vyx["status"] = s.vyxStatus;
    vyx["percentage"] = s.vyxPercentage;
    vyx["image"] = s.image;
    vyx["images"] = s.images;
    vyx["path"] = s.imagePath;
    Json::Value& small = root["smallupdate"];
    small["status"] = s.smallStatus;
    small["percentage"] = s.smallPercentage;
    Json::Value& apply = root["apply"];
    apply["stage"] = s.applyStage;
    apply["percentage"] = s.applyPercentage;
    apply["error"] = s.applyError;
    return root;
}

std::string ToText(const StatusSnapshot& s) {
    std::ostringstream out;
    out << "full release download: " << s.vyxStatus;
    if (s.vyxStatus == "downloading" || s.vyxStatus == "finished")
        out << " " << s.vyxPercentage << "%";
    if (s.images > 0)
        out << " (image " << s.image << " of " << s.images << ")";
    out << "\nsmall update download: " << s.smallStatus;
    if (s.smallStatus != "none")
        out << " " << s.smallPercentage << "%";
    if (!s.downloading.empty())
        out << "\nstatus file written by: " << s.downloading;
    if (!s.downloaded.empty())
        out << "\ndownloaded and ready: " << s.downloaded;
    out << "\napply: " << s.applyStage;
    if (s.applyStage != "none")
        out << " " << s.applyPercentage << "%";
    if (!s.applyError.empty())
        out << " (error: " << s.applyError << ")";
    out << "\n";
    return out.str();
}

}  // namespace kytoupdate
