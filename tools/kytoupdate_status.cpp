#include "kytoupdate_status.h"

#include <stdio.h>
#include <stdlib.h>

#include <initializer_list>
#include <sstream>
#include <utility>

#include <kytoplatform/klibc.h>

#include "kyto_paths.h"
#include "kytoupdate_common.h"
#include "smallupdate.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

namespace kytoupdate {

bool StatusSnapshot::operator==(const StatusSnapshot& o) const {
    return installed == o.installed && smallFix == o.smallFix && downloading == o.downloading &&
           vyxReadable == o.vyxReadable && vyxStatus == o.vyxStatus &&
           vyxPercentage == o.vyxPercentage && image == o.image && images == o.images &&
           imagePath == o.imagePath && smallStatus == o.smallStatus &&
           smallPercentage == o.smallPercentage && applyStage == o.applyStage &&
           applyPercentage == o.applyPercentage && applyError == o.applyError &&
           downloaded == o.downloaded;
}

namespace {

std::string FileKey(const char* file, const char* key) {
    char buf[4096] = {0};
    if (KLIBCFileGetKeyValue(file, key, buf, sizeof(buf), 0) <= 0)
        return "";
    return buf;
}

}  // namespace

std::string DownloadStatusKey(const char* key) {
    return FileKey(kyto::kDownloadStatusFile, key);
}

std::string VersionKey(const char* key) {
    return FileKey(kyto::kVersionFile, key);
}

StatusSnapshot TakeSnapshot() {
    StatusSnapshot s;
    s.installed = VersionKey("majorversion") + "." + VersionKey("minorversion") + "-" +
                  VersionKey("buildnumber");
    s.smallFix = atoi(VersionKey("smallfixnumber").c_str());
    s.downloading = DownloadStatusKey(kyto::kKeyUpdateType);

    VyxUpdate::VYX_DOWNLOAD_STATUS vyx = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    s.vyxReadable = VyxUpdate::GetDownloadStatus(s.vyxPercentage, vyx);
    s.vyxStatus = s.vyxReadable ? VyxUpdate::DownloadStatusToString(vyx) : "unknown";
    if (s.downloading == kyto::kTypeVyx) {
        // Image n of m and its path, as the full-release download writes them.
        s.images = atoi(DownloadStatusKey(kyto::kKeyDownloadCount).c_str());
        s.image = atoi(DownloadStatusKey(kyto::kKeyDownloadNum).c_str());
        s.imagePath = DownloadStatusKey(kyto::kKeyPatchPath);
    }

    // The reader is a member; a scratch engine keeps the record it loads to itself.
    SmallUpdate small;
    small.GetDownloadStatus(s.smallPercentage, s.smallStatus);

    SmallUpdate::GetApplyStage(s.applyPercentage, s.applyStage, s.applyError);

    UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_NONE;
    UpdateUtil::CheckDownloadedPatchType(type);
    s.downloaded = type == UpdateUtil::PATCH_TYPE_VYX     ? kyto::kTypeVyx
                   : type == UpdateUtil::PATCH_TYPE_SMALL ? kyto::kTypeSmall
                                                          : "";
    return s;
}

namespace {

// An object of the given members, in the given order.
Json::Value Object(std::initializer_list<std::pair<const char*, Json::Value>> members) {
    Json::Value object(Json::objectValue);
    for (const auto& [key, value] : members)
        object[key] = value;
    return object;
}

}  // namespace

Json::Value ToJson(const StatusSnapshot& s) {
    return Object({
        {"installed", Object({{"version", s.installed}, {"smallfix", s.smallFix}})},
        {"downloading", s.downloading},
        {"downloaded", s.downloaded},
        {"vyxupdate", Object({{"status", s.vyxStatus},
                              {"percentage", s.vyxPercentage},
                              {"image", s.image},
                              {"images", s.images},
                              {"path", s.imagePath}})},
        {"smallupdate", Object({{"status", s.smallStatus}, {"percentage", s.smallPercentage}})},
        {"apply", Object({{"stage", s.applyStage},
                          {"percentage", s.applyPercentage},
                          {"error", s.applyError}})},
    });
}

std::string ToText(const StatusSnapshot& s) {
    std::ostringstream out;
    out << "installed: " << s.installed << ", small fix " << s.smallFix << "\n";
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

int CmdStatus(bool json, bool watch, double interval) {
    if (watch)
        CatchStopSignals();
    StatusSnapshot last;
    bool first = true;
    do {
        const StatusSnapshot now = TakeSnapshot();
        if (first || now != last) {
            if (json)
                printf("%s", Json::FastWriter().write(ToJson(now)).c_str());
            else
                printf("%s%s", first ? "" : "\n", ToText(now).c_str());
            fflush(stdout);
            last = now;
            first = false;
        }
        if (watch)
            SleepMs(static_cast<long>(interval * 1000));
    } while (watch && !g_interrupted);
    return kExitOk;
}

}  // namespace kytoupdate
