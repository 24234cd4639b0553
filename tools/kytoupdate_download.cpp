// check, download and cancel: the download runs in a child process while this one shows
// its progress (kytoupdate_progress) from the library's status file.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <glob.h>

#include <algorithm>
#include <string>

#include "kyto_paths.h"
#include "kytoupdate_common.h"
#include "kytoupdate_progress.h"
#include "kytoupdate_status.h"
#include "kytoupdate_trust.h"
#include "scoped.h"
#include "smallupdate_plan.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

namespace kytoupdate {

namespace {

enum class DownloadEnd { kDownloaded, kFailed, kStopped };

// What the progress display follows: the kind, and for a small update the package count
// and the folder the packages land in.
struct DownloadWatch {
    bool vyx = false;
    int items = 0;
    std::string folder;
};

double Now() {
    struct timespec ts {};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec + ts.tv_nsec / 1e9;
}

bool SmallDownloadWord(int& pct) {
    std::string word;
    SmallUpdate().GetDownloadStatus(pct, word);
    return word == "init" || word == "downloading";
}

// Held by the process of a download (and the child it forks) from start to end.
const char* const kDownloadLock = "/var/run/kytoupdate-download.lock";

// True when a download of either kind is under way (in any process).
bool DownloadRunning() {
    int pct = 0;
    VyxUpdate::VYX_DOWNLOAD_STATUS vyx = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    if (VyxUpdate::GetDownloadStatus(pct, vyx) && vyx == VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING)
        return true;
    return SmallDownloadWord(pct) && DownloadStatusKey(kyto::kKeyUpdateType) == kyto::kTypeSmall;
}

unsigned long long FolderBytes(const std::string& folder) {
    unsigned long long total = 0;
    glob_t g{};
    if (!folder.empty() && glob((folder + "/*").c_str(), 0, nullptr, &g) == 0) {
        for (size_t i = 0; i < g.gl_pathc; ++i) {
            struct stat st {};
            if (stat(g.gl_pathv[i], &st) == 0 && S_ISREG(st.st_mode))
                total += static_cast<unsigned long long>(st.st_size);
        }
    }
    globfree(&g);
    return total;
}

bool ReadVyxProgress(ProgressSample& sample) {
    int pct = 0;
    VyxUpdate::VYX_DOWNLOAD_STATUS st = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    if (!VyxUpdate::GetDownloadStatus(pct, st) || st != VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING)
        return false;
    sample.percentage = pct;
    sample.item = atoi(DownloadStatusKey(kyto::kKeyDownloadNum).c_str());
    sample.items = atoi(DownloadStatusKey(kyto::kKeyDownloadCount).c_str());
    struct stat fst {};
    const std::string path = DownloadStatusKey(kyto::kKeyPatchPath);
    sample.bytes = stat(path.c_str(), &fst) == 0 ? static_cast<unsigned long long>(fst.st_size) : 0;
    return true;
}

// Reads the progress of the running download from the status file into sample; false
// while the file says nothing about it (not started yet, between two writes).
bool ReadProgress(const DownloadWatch& w, ProgressSample& sample) {
    if (w.vyx)
        return ReadVyxProgress(sample);
    int pct = 0;
    if (!SmallDownloadWord(pct))
        return false;
    sample.percentage = pct;
    sample.items = w.items;
    // The status file counts finished packages; the one on the wire is the next.
    const int done = w.items > 0 ? (pct * w.items + 50) / 100 : 0;
    sample.item = w.items > 0 ? std::min(w.items, done + 1) : 0;
    sample.bytes = FolderBytes(w.folder);
    return true;
}

int TerminalWidth() {
    struct winsize ws {};
    return ioctl(STDOUT_FILENO, TIOCGWINSZ, &ws) == 0 && ws.ws_col > 0 ? ws.ws_col : 80;
}

// Starts the facade's download of the update found by su's check in a child process; its
// pid, or -1.  The cancel reaches the child through the library, not by a signal.
pid_t StartDownloadChild(SystemUpdate& su) {
    fflush(stdout);
    fflush(stderr);
    const pid_t pid = fork();
    if (pid != 0)
        return pid;
    signal(SIGINT, SIG_IGN);
    signal(SIGTERM, SIG_IGN);
    {
        // The download tool's own chatter would tear the display apart: the library logs
        // to syslog, so nothing of value is lost.
        const kyto::UniqueFd devNull(open("/dev/null", O_WRONLY | O_CLOEXEC));
        if (devNull.valid()) {
            dup2(devNull.get(), STDOUT_FILENO);
            dup2(devNull.get(), STDERR_FILENO);
        }
    }
    _exit(su.Download() == 1 ? 0 : 1);
}

// Shows the child's progress until it ends; SIGINT or SIGTERM here cancels the download.
DownloadEnd WatchDownload(pid_t pid, const DownloadWatch& w) {
    const bool terminal = isatty(STDOUT_FILENO) == 1;
    ProgressView view(stdout, terminal, terminal ? TerminalWidth() : 80,
                      w.vyx ? "image" : "package");
    const double start = Now();
    bool cancelSent = false;
    int status = 0;
    ProgressSample last;
    last.items = w.items;
    for (pid_t r; (r = waitpid(pid, &status, WNOHANG)) != pid && (r >= 0 || errno == EINTR);) {
        if (g_interrupted && !cancelSent) {
            cancelSent = true;
            view.Finish();
            Note(w.vyx ? "stopping the download"
                       : "stopping the download after the current package");
            SystemUpdate().CancelDownload();
        }
        ProgressSample sample;
        if (ReadProgress(w, sample)) {
            sample.seconds = Now() - start;
            view.Update(sample);
            last = sample;
        }
        SleepMs(200);
    }
    const bool exitedOk = WIFEXITED(status) && WEXITSTATUS(status) == 0;
    UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_NONE;
    UpdateUtil::CheckDownloadedPatchType(type);
    const bool complete =
        exitedOk && type == (w.vyx ? UpdateUtil::PATCH_TYPE_VYX : UpdateUtil::PATCH_TYPE_SMALL);
    if (complete) {
        last.seconds = Now() - start;
        last.percentage = 100;
        last.item = last.items;
        view.Update(last);
    }
    view.Finish();
    if (complete)
        return DownloadEnd::kDownloaded;
    return exitedOk || cancelSent ? DownloadEnd::kStopped : DownloadEnd::kFailed;
}

DownloadEnd RunDownload(SystemUpdate& su) {
    DownloadWatch w;
    w.vyx = su.m_updateType == UpdateUtil::PATCH_TYPE_VYX;
    if (!w.vyx) {
        w.items = static_cast<int>(kyto::SmallUpdateDownloadLinks(su.m_smallUpdate).size());
        SmallUpdate probe = su.m_smallUpdate;
        probe.GetSourceDir(w.folder, kyto::kDefaultDebDirName);
    }
    const pid_t pid = StartDownloadChild(su);
    if (pid < 0) {
        Note("cannot start the download process");
        return DownloadEnd::kFailed;
    }
    return WatchDownload(pid, w);
}

// Asks for an update of either kind; an exit code, or -1 when su found one.
int Check(SystemUpdate& su) {
    bool have = false;
    if (su.CheckNewUpdate(have) != 1)
        return Fail("could not ask the update server", kExitCannotCheck);
    if (!have) {
        printf("none\n");
        return kExitUpToDate;
    }
    return -1;
}

}  // namespace

int CmdCheck() {
    SystemUpdate su;
    const int rc = Check(su);
    if (rc >= 0)
        return rc;
    printf("%s %s\n", su.GetUpdateType().c_str(), su.GetFullVersion().c_str());
    return kExitOk;
}

int CheckAndDownload(SystemUpdate& su) {
    if (DownloadRunning())
        return Fail("a download is already running (kytoupdate status, kytoupdate cancel)");
    // A cancelled small update stops only after the package it is fetching, while its status
    // already reads stopped: the lock, held until this download's process has ended, keeps a
    // new download out of the package folder until then.
    kyto::UniqueFd lock;
    if (const int locked = TryLock(
            kDownloadLock, "a cancelled download is still stopping; try again in a moment", lock);
        locked >= 0)
        return locked;
    const int rc = Check(su);
    if (rc >= 0)
        return rc;
    Note("downloading " + KindWord(su.m_updateType) + " " + su.GetFullVersion());
    switch (RunDownload(su)) {
        case DownloadEnd::kStopped:
            return Fail("the download was stopped", kExitStopped);
        case DownloadEnd::kFailed:
            return Fail("the download failed");
        case DownloadEnd::kDownloaded:
            break;
    }
    const int refused = TrustDownload(su);
    if (refused >= 0)
        return refused;
    std::string where;
    if (su.m_updateType == UpdateUtil::PATCH_TYPE_VYX) {
        bool have = false;
        VyxUpdate::GetDownloadedPatchPath(have, where);
    }
    printf("downloaded %s %s%s%s\n", KindWord(su.m_updateType).c_str(), su.GetFullVersion().c_str(),
           where.empty() ? "" : " ", where.c_str());
    return -1;
}

int CmdDownload() {
    CatchStopSignals();
    SystemUpdate su;
    const int rc = CheckAndDownload(su);
    return rc < 0 ? kExitOk : rc;
}

int CmdCancel() {
    if (SystemUpdate().CancelDownload() != 1)
        return Fail("nothing to cancel, or the cancel failed (see the system log)");
    printf("cancelled\n");
    return kExitOk;
}

}  // namespace kytoupdate
