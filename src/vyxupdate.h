// VyxUpdate: the full-system update: version records, the release feed, the release
// check, the download location, the release download and its progress and cancellation.
#ifndef KYTOINSTALLCPP_VYXUPDATE_H
#define KYTOINSTALLCPP_VYXUPDATE_H

#include <string>

#include <json/json.h>

#include "kyto_export.h"

// Version record of one release: fixed-size NUL-terminated text fields.  Callers zero
// the whole record before use.
struct _tag_vyxinfo_ {
    char major[64];
    char minor[64];
    char buildPhase[64];
    char buildNum[64];
    char buildDate[64];
    char reqMajor[64];
    char reqMinor[64];
    char reqBuildPhase[64];
    char reqBuildNum[64];
    char reqBuildDate[64];
    char unique[256];
    char link[4096];
    char checksum[256];
};

// Tag kinds of the release feed; 0 means no kind.
enum _tag_rss_tag_type_ {
    RSS_TAG_NONE = 0,
    RSS_TAG_RSS = 1,
    RSS_TAG_CHANNEL = 2,
    RSS_TAG_TITLE = 3,
    RSS_TAG_LINK = 4,
    RSS_TAG_PUBDATE = 5,
    RSS_TAG_COPYRIGHT = 6,
    RSS_TAG_ITEM = 7,
    RSS_TAG_ITEM_TITLE = 8,
    RSS_TAG_MAJOR_VER = 9,
    RSS_TAG_MINOR_VER = 10,
    RSS_TAG_BUILD_PHASE = 11,
    RSS_TAG_BUILD_NUM = 12,
    RSS_TAG_BUILD_DATE = 13,
    RSS_TAG_REQ_MAJOR_VER = 14,
    RSS_TAG_REQ_MINOR_VER = 15,
    RSS_TAG_REQ_BUILD_PHASE = 16,
    RSS_TAG_REQ_BUILD_NUM = 17,
    RSS_TAG_REQ_BUILD_DATE = 18,
    RSS_TAG_MODEL = 19,
    RSS_TAG_M_UNIQUE = 20,
    RSS_TAG_M_LINK = 21,
    RSS_TAG_M_CHECKSUM = 22,
};

// Steps of the installer progress line written to "/tmp/update.progress".
enum _tag_update_step_ {
    UPDATE_STEP_U = 2,
    UPDATE_STEP_A = 3,
    UPDATE_STEP_P = 4,
    UPDATE_STEP_C = 5,
    UPDATE_STEP_R = 6,
};

class KYTO_EXPORT VyxUpdate {
  public:
    // In-memory download state of the full release (never written to a file as a number).
    enum VYX_DOWNLOAD_STATUS {
        VYX_DOWNLOAD_STATUS_NONE = 0,
        VYX_DOWNLOAD_STATUS_DOWNLOADING = 1,
        VYX_DOWNLOAD_STATUS_FINISHED = 2,
        VYX_DOWNLOAD_STATUS_STOPPED = 3,
        VYX_DOWNLOAD_STATUS_FAILED = 4,
    };

    VyxUpdate();
    ~VyxUpdate();

    // ---- Version records and release feed ----
    static int GetVyxInfo(_tag_vyxinfo_& info);
    static void SetVyxInfo(const _tag_rss_tag_type_& type, const char* value, _tag_vyxinfo_& info);
    static void ConvertTagNameToTagType(std::string name, _tag_rss_tag_type_& type);
    static bool ParseTagValue(const std::string& line, std::string& name, std::string& value,
                              _tag_rss_tag_type_& type);
    static int ParseRssFile(bool hotfixOnly, const _tag_vyxinfo_& current, bool& found,
                            _tag_vyxinfo_& release);
    static int IsVersionNewer(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate);
    static int IsHotfix(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate);
    static int SatisfyReqVersion(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate);

    // ---- Release check ----
    static int GetRssFile();
    static int GetAutoUpdateInfo(bool& have, Json::Value& info);
    int CheckVyxRelease();
    int CheckNewRelease(bool& haveNew);
    int PreCheckDownload(bool& canStart);
    static bool CheckPatchAndUpdateType(bool& isNewer, Json::Value& info);
    std::string GetFullVersion();

    // ---- Download location ----
    static int IsPathSufficient(const char* path, bool& sufficient);
    static int FindDownloadVolume(std::string& path);
    static int PrepareDownloadEnv(std::string& folder);
    static int GetVolumePathForPatch(std::string& path, bool& sufficient);
    static bool GetOutputFilePath(std::string url, std::string folder, std::string& outputPath);
    static bool GetDownloadedPatchPath(bool& have, std::string& path);

    // ---- Release download ----
    int DownloadVyx();
    static bool ExecWgetP(std::string outputPath, std::string url, bool& cancelled);
    static bool ExecWgetWithRetry(std::string outputPath, std::string url, bool& cancelled);
    static int VerifyChecksum(const char* expected, const char* path);
    static bool WriteDownloadPidFile();
    int SendNotification(bool success, const std::string& patchPath);
    // Exported for programs built against earlier releases that still call it; the work
    // it once did is done by the installer now, so it does nothing.
    static void UpdateVyx(const char* reserved1, const char* reserved2, bool reserved3);

    // ---- Download progress and cancellation ----
    static bool UpdateProgressFile(const char* key, const char* value);
    static bool GetDownloadPercentage(const char* patchPath, int& percentage);
    static bool GetDownloadStatus(int& percentage, VYX_DOWNLOAD_STATUS& status);
    static std::string DownloadStatusToString(VYX_DOWNLOAD_STATUS& status);
    static bool CancelDownloadVyx();
    static bool CleanDownloadResult(std::string path);
    static bool ReportProgress(_tag_update_step_ step, int number, const char* text);

    // State of the release check.
    bool m_checked;
    bool m_haveNew;
    bool m_hybridDL;
    std::string m_partnerUnique;
    _tag_vyxinfo_ m_release;
    _tag_vyxinfo_ m_partnerRelease;

  private:
    // The download keys of the status file, as read by the status reader.
    struct StatusFileKeys {
        char patchPath[4096] = {0};
        char downloadStatus[64] = {0};
        char downloadCount[64] = {0};
        char downloadNum[64] = {0};
    };
    // Steps of GetDownloadStatus.  Whether "/autoupd@te.info" records a finished download
    // newer than the running system; false (logged) when that cannot be told.
    static bool FinishedDownloadOnRecord(bool& finished);
    // 1 the status file describes a full-release download (keys read), 0 it does not, -1
    // a key could not be read (logged).
    static int ReadStatusFileKeys(StatusFileKeys& keys);
    // Status of a download the status file does not call stopped or failed: the process
    // in the pid file decides, and the progress log gives the percentage.
    static bool RunningDownloadStatus(const StatusFileKeys& keys, int& percentage,
                                      VYX_DOWNLOAD_STATUS& status);
    // Steps 1-9 of DownloadVyx; the caller runs the end steps.  Fills the result record.
    int DownloadImages(Json::Value& record, bool& cancelled);
    // Fetches and verifies one image of the download (number 1: this device's, 2: the
    // partner's) into folder, recording its path under recordKey.  1 fetched and verified
    // (or cancelled, with cancelled set), 0 failed.
    static int FetchImage(const _tag_vyxinfo_& release, const std::string& folder, int number,
                          const char* recordKey, Json::Value& record, bool& cancelled);
    // Sets one status key and logs the platform error when that fails.
    static bool SetStatusKey(const char* key, const char* value);
    // True unless the configured upgrade type is exactly "all".
    static bool IsHotfixOnly();
};

#endif
