// Fuzz target: both download status readers (SmallUpdate::GetDownloadStatus and
// VyxUpdate::GetDownloadStatus) on arbitrary download status files.  The input carries up
// to four files separated by "\n@@\n": the status file, wget's progress log, the pid file
// and the info file; the first byte says which of the optional ones exist and whether the
// pid file names a live process (this one).  The answers must stay within each reader's
// vocabulary whatever the files hold.
#include <signal.h>
#include <stdio.h>

#include <string>

#include "fuzz_common.h"
#include "smallupdate.h"
#include "vyxupdate.h"

namespace {

constexpr const char* kStatus = "/var/run/downloadVYX.status";
constexpr const char* kProgress = "/var/run/downloadprogress";
constexpr const char* kPid = "/var/run/downloadVYX.pid";
constexpr const char* kInfo = "/autoupd@te.info";

void Place(const char* path, bool present, const std::string& content) {
    if (present)
        kytofuzz::WriteWhole(path, content);
    else
        unlink(path);
}

bool SmallWord(const std::string& s) {
    return s == "none" || s == "init" || s == "downloading" || s == "finished" || s == "failed" ||
           s == "stopped";
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0)
        return 0;
    const uint8_t how = data[0];
    std::vector<std::string> files = kytofuzz::SplitInput(data + 1, size - 1, "\n@@\n", 4);
    Place(kStatus, !(how & 1), files[0]);
    Place(kProgress, how & 2, files[1]);
    if (how & 4)
        kytofuzz::WriteWhole(kPid, std::to_string(getpid()));  // a live download
    else
        Place(kPid, how & 8, files[2]);
    Place(kInfo, how & 16, files[3]);

    SmallUpdate update;
    int percentage = -7;
    std::string word = "unset";
    update.GetDownloadStatus(percentage, word);
    KYTO_FUZZ_CHECK(SmallWord(word));
    if ((how & 1) && !(how & 16))  // neither status file nor info file: no download
        KYTO_FUZZ_CHECK(word == "none" && percentage == -7);

    int vyxPercentage = -7;
    VyxUpdate::VYX_DOWNLOAD_STATUS vyxStatus = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED;
    const bool ok = VyxUpdate::GetDownloadStatus(vyxPercentage, vyxStatus);
    KYTO_FUZZ_CHECK(vyxStatus >= VyxUpdate::VYX_DOWNLOAD_STATUS_NONE &&
                    vyxStatus <= VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED);
    KYTO_FUZZ_CHECK(!VyxUpdate::DownloadStatusToString(vyxStatus).empty());
    if (ok && vyxStatus != VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING &&
        vyxStatus != VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED)
        KYTO_FUZZ_CHECK(vyxPercentage == 0);
    kytofuzz::CheckDescriptors();
    return 0;
}
