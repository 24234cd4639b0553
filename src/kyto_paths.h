// Fixed paths of the appliance and the constants that more than one module uses.
// Internal header: not installed.
#ifndef KYTOINSTALLCPP_KYTO_PATHS_H
#define KYTOINSTALLCPP_KYTO_PATHS_H

namespace kyto {

constexpr const char* kVersionFile = "/etc.defaults/VERSION";
constexpr const char* kInfoConfFile = "/etc.defaults/kytoinfo.conf";
constexpr const char* kDownloadStatusFile = "/var/run/downloadVYX.status";
constexpr const char* kAutoUpdateInfoFile = "/autoupd@te.info";
constexpr const char* kPassiveInfoFile = "/passive_upd@te.info";
constexpr const char* kApplyStatusFile = "/var/run/applySmallUpd@te.status";
constexpr const char* kDpkgLog = "/var/log/dpkg_upgrade.log";
constexpr const char* kUpdateLog = "/var/log/kytoupdate.log";
constexpr const char* kWget = "/usr/kyto/bin/wget";
// Package folder of a small update when the caller names none (and on a passive node).
constexpr const char* kDefaultDebDirName = "/@smallupd@te_deb";

// Free space below which no download place is used by either engine: 200 MiB.
constexpr unsigned long kMinDownloadFreeBytes = 209715200UL;

// Keys and values of the download status file.
constexpr const char* kKeyUpdateType = "updateType";
constexpr const char* kKeyPercentage = "percentage";
constexpr const char* kKeyDownloadStatus = "downloadStatus";
constexpr const char* kKeyDownloadCount = "downloadCount";
constexpr const char* kKeyDownloadNum = "downloadNum";
constexpr const char* kKeyPatchPath = "patchPath";
constexpr const char* kTypeVyx = "vyxupdate";
constexpr const char* kTypeSmall = "smallupdate";

// Line form of a quoted key=value line.
constexpr const char* kQuotedLineFormat = "%s=\"%s\"\n";

}  // namespace kyto

#endif
