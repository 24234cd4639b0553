// What kytoupdate reads back from the library's state files: the download status of both
// engines, the apply stage of a small update, and what a finished download left behind.
// Every reader here is one the library exports for pollers in other processes, so the
// snapshot is the same one the administration interface's back end would take.
#ifndef KYTOUPDATE_STATUS_H
#define KYTOUPDATE_STATUS_H

#include <string>

#include <json/json.h>

namespace kytoupdate {

struct StatusSnapshot {
    // The installed system from the version file: "major.minor-build" and the small-fix
    // level (0 before the first small update).
    std::string installed;
    int smallFix = 0;
    // "updateType" of the shared download status file: which engine is (or was last)
    // downloading; "" when there is no status file.
    std::string downloading;
    // Full-release engine: its status word, overall percentage, image number and count and
    // the image being fetched.  readable is false when the engine could not answer.
    bool vyxReadable = false;
    std::string vyxStatus = "none";
    int vyxPercentage = 0;
    int image = 0;
    int images = 0;
    std::string imagePath;
    // Small-update engine: status word and percentage.
    std::string smallStatus = "none";
    int smallPercentage = 0;
    // Apply of a small update: stage word, percentage, error text.
    std::string applyStage = "none";
    int applyPercentage = 0;
    std::string applyError;
    // Kind of the finished download described by the info file: "vyxupdate", "smallupdate"
    // or "".
    std::string downloaded;

    bool operator==(const StatusSnapshot& o) const;
    bool operator!=(const StatusSnapshot& o) const { return !(*this == o); }
};

StatusSnapshot TakeSnapshot();
Json::Value ToJson(const StatusSnapshot& s);
// Lines for a person: installed, full release, small update, apply.
std::string ToText(const StatusSnapshot& s);

// Reads one key of the shared download status file or of the version file; "" when it is
// missing.
std::string DownloadStatusKey(const char* key);
std::string VersionKey(const char* key);

}  // namespace kytoupdate

#endif
