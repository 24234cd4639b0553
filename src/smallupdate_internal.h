// What the small-update engine's files share: the module name of their log lines, the
// engine's own paths and programs, the widths of the fixed buffers its reads use, and the
// words the interface's poller is given for the download states and apply stages.
// Internal header: not installed.
#ifndef KYTOINSTALLCPP_SMALLUPDATE_INTERNAL_H
#define KYTOINSTALLCPP_SMALLUPDATE_INTERNAL_H

#include <stddef.h>

#include <iterator>

#include "smallupdate.h"

namespace kyto::small {

// First field of every log line of the engine.
constexpr const char* kModule = "smallupdate";

// ---- Paths and programs ----

// Created by CancelDownload (in any process); a running download stops when it appears.
constexpr const char* kStopMarker = "/tmp/stop_download_smallfix";
// Start-up scripts (one name a line) that a restart of all services must never touch.
constexpr const char* kInvalidRestartList = "/usr/kyto/etc.defaults/invalid_restart_service";
// The add-on package control program.
constexpr const char* kPkgCtl = "/usr/kyto/bin/kytopkg";

// Extraction folders of the flash and small-update packages, and the staging folder that
// survives until the next boot.
constexpr const char* kFlashTempFolder = "/flashUpd@teTempFolder";
constexpr const char* kSmallTempFolder = "/smallUpd@teTempFolder";
constexpr const char* kStagingFolder = "/smallupd@te/";
constexpr const char* kStagingPrefix = "/smallupd@te//";
// Payloads inside the extracted packages: the boot-time installer's folder, the
// configuration updater, the flash updater.
constexpr const char* kBootUpdaterDir = "/smallupd@ter";
constexpr const char* kConfigUpdate = "/configupdate";
constexpr const char* kFlashUpdater = "/updater";

// Removal and unpack-time moves use relative program names: the caller's working
// directory is the root folder on the appliance.
constexpr const char* kRmRelative = "bin/rm";
constexpr const char* kMvRelative = "bin/mv";
constexpr const char* kMvAbsolute = "/bin/mv";

// ---- Apply status file ----

constexpr const char* kKeyStage = "stage";
constexpr const char* kKeyErrMsg = "ErrMsg";
// ErrMsg of a failed apply, and what the reader reports for an unreadable file.
constexpr const char* kErrSystem = "err_system";

// ---- Field widths: the fixed buffers each read or formatted text uses ----

enum FieldWidth : size_t {
    // A number of a status file (percentage, download state, apply stage), read or written.
    kStatusNumberWidth = 16,
    // The apply status file's ErrMsg as the reader takes it.
    kErrMsgWidth = 256,
    // The temporary file's path next to the apply status file.
    kStatusTempPathWidth = 128,
    // "smallfixnumber" as the lookup compares it with the record's fix.
    kInstalledFixWidth = 32,
    // "smallfixnumber" as the apply logs the installed one and writes the new one.
    kApplyFixWidth = 8,
    // "debDir" of the passive marker file, read by the apply's clean-up.
    kPassiveDirWidth = 4095,
    // The shell command that counts the patch lists in an archive, and its one output line.
    kArchiveCommandWidth = 512,
    kArchiveCountLineWidth = 256,
    // The display name "VYX <major>.<minor>-<build> update <fix>" (63 characters shown).
    kFullVersionWidth = 64,
    // A path of the file system: wget's output file, the caller's working folder.
    kPathWidth = 4096,
};

// ---- Words given to the interface's poller ----

// GetDownloadStatus's word of each DOWNLOAD_STATUS.
inline constexpr const char* kDownloadWords[] = {
    "none", "init", "downloading", "finished", "failed", "stopped",
};
static_assert(std::size(kDownloadWords) ==
                  static_cast<size_t>(SmallUpdate::DOWNLOAD_STATUS_STOPPED) + 1,
              "one word for each DOWNLOAD_STATUS");

// GetApplyStage's word of each APPLY_STAGE.
inline constexpr const char* kStageWords[] = {
    "none", "waiting_remote_upgrading", "analying", "program", "startService", "finished", "reboot",
};
static_assert(std::size(kStageWords) == static_cast<size_t>(SmallUpdate::APPLY_STAGE_REBOOT) + 1,
              "one word for each APPLY_STAGE");

}  // namespace kyto::small

#endif
