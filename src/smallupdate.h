// SmallUpdate: the record of one small update (hot-fix) and the operations that carry it
// from discovery to installation: its info file, the download status writer, the apply
// status file, and the flash, unpack, configuration and package steps.
#ifndef KYTOINSTALLCPP_SMALLUPDATE_H
#define KYTOINSTALLCPP_SMALLUPDATE_H

#include <string>
#include <vector>

#include <json/json.h>
#include <kytoplatform/kytoconf.h>

#include "kyto_export.h"

class KYTO_EXPORT SmallUpdate {
  public:
    // Download state, written as a number into "/var/run/downloadVYX.status".
    enum DOWNLOAD_STATUS {
        DOWNLOAD_STATUS_NONE = 0,
        DOWNLOAD_STATUS_INIT = 1,
        DOWNLOAD_STATUS_DOWNLOADING = 2,
        DOWNLOAD_STATUS_FINISHED = 3,
        DOWNLOAD_STATUS_FAILED = 4,
        DOWNLOAD_STATUS_STOPPED = 5,
    };

    // Apply stage, written as a number into "/var/run/applySmallUpd@te.status".
    enum APPLY_STAGE {
        APPLY_STAGE_NONE = 0,
        APPLY_STAGE_WAITING_REMOTE_UPGRADING = 1,
        APPLY_STAGE_ANALYING = 2,
        APPLY_STAGE_PROGRAM = 3,
        APPLY_STAGE_START_SERVICE = 4,
        APPLY_STAGE_FINISHED = 5,
        APPLY_STAGE_REBOOT = 6,
    };

    // Reason of the last failure, kept in m_errno and read by GetErrno.
    enum ERROR_CODE {
        ERROR_CODE_NONE = 0,
        ERROR_CODE_SERVER_STATUS = 1,   // the server answered neither 200 nor 404
        ERROR_CODE_NO_ROOM = 2,         // no volume has room for the download
        ERROR_CODE_BAD_INPUT = 3,       // bad argument, unreadable build, invalid info file
        ERROR_CODE_BUILD_MISMATCH = 4,  // the info file is for another build (or unchecked)
        ERROR_CODE_BAD_FIX_NUMBER = 5,  // small-fix number below 1, or a list for another build
        ERROR_CODE_DOWNGRADE = 6,       // older than the small fix already installed
        ERROR_CODE_OTHER_MODEL = 7,     // the patch list is for another device model
    };

    SmallUpdate();
    explicit SmallUpdate(const std::string& unique);

    // ---- Record and info file ----
    int GetErrno();
    bool Equal(const SmallUpdate& other) const;
    bool ImportInfoFile(const char* path);
    bool DumpToInfoFile(bool blPassive);

    // ---- Patch list lookup ----
    // Fetches this build's and model's patch list from the update server and fills the
    // record from it.
    bool LookUpServer();
    // Fetches the patch list into outPath; a 404 answer (no list) fails without a log line.
    bool DownloadJson(const std::string& outPath);
    // Validates a patch-list file (model, build) and fills the record with the merge of
    // its entries newer than the installed fix.
    bool SetUpdateList(const std::string& path);
    // True when the record's fix is newer than the installed one.
    bool CheckHaveSmallFix();
    bool HaveNewFix();
    // isSmallUpdate tells whether the archive holds a patch list.
    static bool CheckPatchIsSmallUpdate(const std::string& archive, bool& isSmallUpdate);
    // Imports a locally supplied patch archive (patch list and packages) as if downloaded.
    bool ImportSmallPatch(const std::string& archive, const std::string& folderName,
                          bool blPassive);
    bool ImportSmallPatch(const std::string& archive);
    // "VYX <major>.<minor>-<build> update <fix>", or "" when the record holds no fix.
    std::string GetFullVersion();

    // ---- Small-update download ----
    // One wget attempt of link into folder; a partial file never stays.
    static bool ExecWgetP(const std::string& link, const std::string& folder);
    // Up to ten attempts; true at once when the stop marker appears.
    static bool ExecWgetWithRetry(const std::string& link, const std::string& folder);
    // Fetches every package of the record into m_debDir; stopped tells a stop by marker.
    bool DownloadFiles(bool& stopped);
    bool Download(bool blDump, const std::string& folderName, bool blPassive);
    bool Download(bool blDump);
    // Percentage and state word of the download, for the interface's poller.
    void GetDownloadStatus(int& percentage, std::string& status);
    // Asks a running download (in any process) to stop.
    bool CancelDownload();
    // True when a downloaded update's packages are in place.
    bool IsReadyApply();

    // ---- Apply ----
    // Flash, unpack, configuration, packages, the new small-fix number; true when installed.
    bool Apply();

    // ---- Download status file (writer) ----
    static int UpdateDownloadProgress(int percentage, DOWNLOAD_STATUS status);

    // ---- Apply status file ----
    static bool UpdateApplyProgress(int percentage, APPLY_STAGE stage, const std::string& errMsg);
    void HASetApplyProgressErr(const std::string& errMsg) const;
    static void GetApplyStage(int& percentage, std::string& stage, std::string& errMsg);

    // ---- Unpack and install ----
    bool UpdateFlash() const;
    bool UnpackSmallUpdate() const;
    bool UpdateConfig() const;
    bool InstallDeb(int startPercentage, APPLY_STAGE stage);
    bool GetSourceDir(std::string& folder, const std::string& name);
    static bool FilesExist(const std::string& folder, const std::string& name);
    static bool FilesExist(const std::string& folder, const std::vector<std::string>& names);

    // ---- Service restart around an apply (called by the driving program) ----
    // false stops, true starts the services the update touches: all of them through the
    // platform for a reboot-type update, every start-up script for a restart-all update,
    // else only the listed scripts and packages.
    void SwitchServices(bool on) const;
    void SwitchAllService(bool on) const;
    void SwitchPartialServices(bool on) const;
    // Full paths of the start-up scripts a restart-all must never touch; false when the
    // list file cannot be read.
    static bool GetInvalidRestartService(std::vector<std::string>& invalid);
    void GetRestartServiceList(std::vector<std::string>& vyxServices,
                               std::vector<std::string>& packages) const;
    // 0 nothing (or no update ready), 1 partial, 2 all start-up scripts, 3 reboot-type.
    int GetServiceRestartType();

    // The record.
    int m_errno;  // an ERROR_CODE
    KytoConf m_conf;
    std::string m_unique;
    int m_newSmallFixNumber;
    int m_buildNumber;
    bool m_blConfigUpdate;
    bool m_blFlashUpdate;
    std::string m_debDir;
    std::string m_smallUpdateDeb;
    std::string m_smallUpdateDebLink;
    std::string m_flashUpdateDeb;
    std::string m_flashUpdateDebLink;
    std::vector<std::string> m_installDebs;
    std::vector<std::string> m_installDebLinks;
    bool m_blRestartAllService;
    bool m_blNeedReboot;
    std::vector<std::string> m_vyxServiceRestartList;
    std::vector<std::string> m_pkgRestartList;

  private:
    // Steps of ImportInfoFile: the fields taken from a complete info file of this build.
    bool StoreInfoFields(const Json::Value& info);
    // Steps of DumpToInfoFile: the document, the package check (logged), the target path
    // (and the passive marker file).
    Json::Value InfoDocument(bool blPassive) const;
    bool InfoPackagesAreConsistent() const;
    bool InfoFileTarget(bool blPassive, std::string& target) const;
};

#endif
