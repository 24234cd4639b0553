// VyxUpdate: the download location.  A release image is large: the download goes to the
// first data volume with room (the root file system as the last resort), into a private
// "@autoupdate" folder; other programs may ask where to put an image they supply.
#include "vyxupdate.h"

#include <errno.h>
#include <mntent.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <syslog.h>

#include <memory>
#include <string>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>
#include <kytoplatform/kytoconf.h>

#include "file_system.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "vyxupdate_internal.h"

using namespace kyto::vyx;

namespace {

const char* const kDownloadFolderName = "@autoupdate";
constexpr unsigned long long kSufficientFreeSpace = 524288000ULL;  // 500 MiB

struct MntentClose {
    void operator()(FILE* f) const { endmntent(f); }
};

}  // namespace

int VyxUpdate::IsPathSufficient(const char* path, bool& sufficient) {
    if (path == nullptr) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, kModule, __LINE__);
        return 0;
    }
    unsigned long long avail = 0;
    if (kyto::AvailableBytes(path, avail) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to do statfs to [%s]. reason: [%m]", kModule, __LINE__, path);
        return 0;
    }
    if (avail < kyto::kMinDownloadFreeBytes) {
        syslog(LOG_ERR, "%s:%d Theres is no sufficient free space on [%s]", kModule, __LINE__,
               path);
        return 0;
    }
    sufficient = avail > kSufficientFreeSpace;
    return 1;
}

int VyxUpdate::FindDownloadVolume(std::string& path) {
    KYTO_VOLUME_INFO volume;
    memset(&volume, 0, sizeof(volume));
    int ret = VolumeAvailGet(0, kyto::kMinDownloadFreeBytes, &volume, 1);
    if (ret < 0) {
        syslog(LOG_ERR, "%s:%d Fail to get available volume with size greater than [%llu] bytes",
               kModule, __LINE__, static_cast<unsigned long long>(kyto::kMinDownloadFreeBytes));
        return false;
    }
    if (ret > 0) {
        path = volume.szMountPath;
        return true;
    }
    // No data volume qualifies: the root file system is the last resort.
    unsigned long long rootAvail = 0;
    if (kyto::AvailableBytes("/", rootAvail) != 0) {
        syslog(LOG_ERR, "%s:%d Fail to do statfs to [%s]. reason=%s", kModule, __LINE__, "/",
               strerror(errno));
        return false;
    }
    if (rootAvail < kyto::kMinDownloadFreeBytes)
        return false;
    path = "/";
    return true;
}

int VyxUpdate::PrepareDownloadEnv(std::string& folder) {
    std::string volume;
    if (!FindDownloadVolume(volume)) {
        syslog(LOG_ERR, "%s:%d No enough free space to download VYX", kModule, __LINE__);
        return 0;
    }
    // Joined as plain text: the root fallback gives "//@autoupdate", which is fine.
    folder = volume + "/" + kDownloadFolderName;
    if (!CleanDownloadResult(folder)) {
        syslog(LOG_ERR, "%s:%d Fail to clean download result", kModule, __LINE__);
        return 0;
    }
    if (KYTOFSMkdirP(folder.c_str(), 0700) < 0) {
        syslog(LOG_ERR, "%s:%d Fail to mkdir [%s]. %s", kModule, __LINE__, folder.c_str(),
               kyto::LastErrorText().c_str());
        return 0;
    }
    return 1;
}

int VyxUpdate::GetVolumePathForPatch(std::string& path, bool& sufficient) {
    KytoConf conf;
    std::string supportRaid = conf.Def("supportraid", "no");
    std::string buildinStorage = conf.Def("support_buildin_storage", "no");
    std::string maxDisks = conf.Def("maxdisks", "");
    std::string chosen;

    if (strcasecmp(supportRaid.c_str(), "yes") == 0 ||
        strcasecmp(buildinStorage.c_str(), "yes") == 0) {
        if (!IsPathSufficient("/", sufficient))
            return 0;
        // Tell the installer whether the image lives on the system volume (0) or on
        // built-in storage (1).
        int rc =
            system(strcasecmp(supportRaid.c_str(), "yes") == 0 ? "/bin/echo 0 > /.upgrade_vol"
                                                               : "/bin/echo 1 > /.upgrade_vol");
        (void)rc;
        chosen = "/";
    } else if (strcasecmp(maxDisks.c_str(), "0") != 0) {
        kyto::UniqueMountVolList list(KYTOMountVolInfoEnum(0));
        PKYTO_MOUNT_VOL_INFO vol =
            kyto::FirstVolumeWithRoom(list.get(), kyto::kMinDownloadFreeBytes, kModule, true);
        if (vol != nullptr) {
            // 4 GiB or more is always sufficient; being above the comfortable free space
            // already says so.
            sufficient = vol->ullFreeBytes > kSufficientFreeSpace;
            chosen = vol->szMountPath;
        }
        if (chosen.empty())
            return 0;
    } else {
        // A device without internal disks: the first usable USB mount.
        std::unique_ptr<FILE, MntentClose> mounts(setmntent("/proc/mounts", "re"));
        if (!mounts) {
            syslog(LOG_ERR, "%s:%d Failed to open /proc/mounts, errno=%m", kModule, __LINE__);
            return 0;
        }
        struct mntent* entry;
        while ((entry = getmntent(mounts.get())) != nullptr) {
            if (strncmp(entry->mnt_dir, "/volumeUSB", 10) != 0)
                continue;
            if (strcmp(entry->mnt_type, "aufs") == 0)
                continue;
            if (IsPathSufficient(entry->mnt_dir, sufficient) == 1) {
                chosen = entry->mnt_dir;
                break;
            }
        }
        if (chosen.empty())
            return 0;
    }

    syslog(LOG_INFO, "%s:%d We get %s to upgrade.", kModule, __LINE__, chosen.c_str());
    path = chosen.substr(0, 63);
    return 1;
}

bool VyxUpdate::GetOutputFilePath(std::string url, std::string folder, std::string& outputPath) {
    size_t slash = url.rfind('/');
    if (slash == std::string::npos) {
        syslog(LOG_ERR, "%s:%d Wrong download link [%s]", kModule, __LINE__, url.c_str());
        return false;
    }
    char path[kPathSize];
    snprintf(path, sizeof(path), "%s/%s", folder.c_str(), url.c_str() + slash + 1);
    outputPath = path;
    return true;
}

bool VyxUpdate::GetDownloadedPatchPath(bool& have, std::string& path) {
    Json::Value info;
    if (!GetAutoUpdateInfo(have, info)) {
        syslog(LOG_ERR, "%s:%d Fail to get auto update info", kModule, __LINE__);
        return false;
    }
    if (have)
        path = kyto::MemberText(info, "patchPath");
    return true;
}
