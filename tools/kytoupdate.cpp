// kytoupdate: the program that drives updates of the appliance through libkytoinstallcpp,
// for an administrator's shell, the interface's back end (status --json, cancel) and the
// scheduled auto-update job (auto).  Standard output carries only what a script reads;
// notes and errors go to standard error.  See kytoupdate(1) for commands and exit codes.
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <glob.h>

#include <algorithm>
#include <functional>
#include <iostream>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>
#include <json/json.h>

#include "kytoupdate_progress.h"
#include "kytoupdate_status.h"
#include "smallupdate.h"
#include "systemupdate.h"
#include "update_cpputil.h"
#include "vyxupdate.h"

// The volume list walk of UpdateUtil::IsThereAvailVolPath keeps the nodes before its stop
// on purpose (see the library); a sanitizer build of this program must not count them.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:IsThereAvailVolPath\n";
}

namespace {

using namespace kytoupdate;

// Exit codes (kytoupdate(1)).
constexpr int kExitOk = 0;           // done; for check: an update is available
constexpr int kExitFailed = 1;       // the operation failed
constexpr int kExitCannotCheck = 2;  // the update server could not be asked
constexpr int kExitUpToDate = 3;     // no update: the system is up to date
constexpr int kExitStopped = 4;      // the download was stopped by a cancel
constexpr int kExitUsage = 64;       // bad command line

const char* const kDebFolderName = "/@smallupd@te_deb";
const char* const kRcFolder = "/usr/kyto/etc/rc.d";
const char* const kAutoLock = "/var/run/kytoupdate-auto.lock";

volatile sig_atomic_t g_interrupted = 0;

// Owns one descriptor.
class Fd {
  public:
    explicit Fd(int fd) : fd_(fd) {}
    ~Fd() {
        if (fd_ >= 0)
            close(fd_);
    }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }

  private:
    int fd_;
};

void OnSignal(int) {
    g_interrupted = 1;
}

void CatchStopSignals() {
    struct sigaction sa {};
    sa.sa_handler = OnSignal;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGINT, &sa, nullptr);
    sigaction(SIGTERM, &sa, nullptr);
}

void Note(const std::string& text) {
    fprintf(stderr, "kytoupdate: %s\n", text.c_str());
}

int Fail(const std::string& text, int code = kExitFailed) {
    Note(text);
    return code;
}

void SleepMs(long ms) {
    struct timespec ts {
        ms / 1000, (ms % 1000) * 1000000L
    };
    nanosleep(&ts, nullptr);  // an interrupting signal only shortens the wait
}

double Now() {
    struct timespec ts {};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec + ts.tv_nsec / 1e9;
}

std::string SmallErrnoText(int code) {
    switch (code) {
        case 1:
            return "the update server answered with an error";
        case 2:
            return "no volume has room for the download";
        case 3:
            return "bad or unreadable update information";
        case 4:
            return "the update was made for another build";
        case 5:
            return "bad small-fix number, or a patch list for another build";
        case 6:
            return "the update is older than the installed small fix";
        case 7:
            return "the patch list is for another device model";
        default:
            return "no small update";
    }
}

std::string KindWord(int updateType) {
    return updateType == 1 ? "vyx" : "smallupdate";
}

// ---- What a small update fetches and restarts ------------------------------------------

// Links the download fetches, in its order: the further packages; the small-update
// package only together with a configuration update or further packages; the flash
// package when a flash update is asked for.
std::vector<std::string> DownloadLinks(const SmallUpdate& u) {
    std::vector<std::string> links = u.m_installDebLinks;
    if (u.m_blConfigUpdate || !u.m_installDebLinks.empty())
        links.push_back(u.m_smallUpdateDebLink);
    if (u.m_blFlashUpdate)
        links.push_back(u.m_flashUpdateDebLink);
    return links;
}

const char* RestartWord(int type) {
    switch (type) {
        case 1:
            return "partial";
        case 2:
            return "all";
        case 3:
            return "reboot";
        default:
            return "none";
    }
}

// Start-up scripts a restart of the given type switches (full paths), in start order.
std::vector<std::string> RestartScripts(const SmallUpdate& u, int type, bool& listReadable) {
    std::vector<std::string> scripts;
    listReadable = true;
    if (type == 1) {
        std::vector<std::string> packages;
        u.GetRestartServiceList(scripts, packages);
        for (std::string& s : scripts)
            s = std::string(kRcFolder) + "/" + s;
    } else if (type == 2) {
        std::vector<std::string> invalid;
        listReadable = SmallUpdate::GetInvalidRestartService(invalid);
        glob_t g{};
        if (listReadable &&
            glob((std::string(kRcFolder) + "/S*.sh").c_str(), GLOB_ERR, nullptr, &g) == 0) {
            for (size_t i = 0; i < g.gl_pathc; ++i) {
                if (std::find(invalid.begin(), invalid.end(), g.gl_pathv[i]) == invalid.end())
                    scripts.push_back(g.gl_pathv[i]);
            }
        }
        globfree(&g);
    }
    return scripts;
}

std::string BaseName(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

// ---- Download with a progress display ----------------------------------------------------

enum class DownloadEnd { kDownloaded, kFailed, kStopped };

// True when a download of either kind is under way (in any process).
bool DownloadRunning() {
    int pct = 0;
    VyxUpdate::VYX_DOWNLOAD_STATUS vyx = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    if (VyxUpdate::GetDownloadStatus(pct, vyx) && vyx == VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING)
        return true;
    std::string word;
    SmallUpdate().GetDownloadStatus(pct, word);
    return DownloadStatusKey("updateType") == "smallupdate" &&
           (word == "init" || word == "downloading");
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

// Reads the progress of the running download from the status file into sample; false
// while the file says nothing about it (not started yet, between two writes).
bool ReadProgress(bool vyx, int items, const std::string& folder, ProgressSample& sample) {
    if (vyx) {
        int pct = 0;
        VyxUpdate::VYX_DOWNLOAD_STATUS st = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
        if (!VyxUpdate::GetDownloadStatus(pct, st) ||
            st != VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING)
            return false;
        sample.percentage = pct;
        sample.item = atoi(DownloadStatusKey("downloadNum").c_str());
        sample.items = atoi(DownloadStatusKey("downloadCount").c_str());
        struct stat fst {};
        const std::string path = DownloadStatusKey("patchPath");
        sample.bytes =
            stat(path.c_str(), &fst) == 0 ? static_cast<unsigned long long>(fst.st_size) : 0;
        return true;
    }
    int pct = 0;
    std::string word;
    SmallUpdate().GetDownloadStatus(pct, word);
    if (word != "init" && word != "downloading")
        return false;
    sample.percentage = pct;
    sample.items = items;
    // The status file counts finished packages; the one on the wire is the next.
    const int done = items > 0 ? (pct * items + 50) / 100 : 0;
    sample.item = items > 0 ? std::min(items, done + 1) : 0;
    sample.bytes = FolderBytes(folder);
    return true;
}

int TerminalWidth() {
    struct winsize ws {};
    return ioctl(STDOUT_FILENO, TIOCGWINSZ, &ws) == 0 && ws.ws_col > 0 ? ws.ws_col : 80;
}

// Runs the facade's download of the update found by su's check in a child process while
// this process shows the progress; SIGINT or SIGTERM here cancels the download.
DownloadEnd RunDownload(SystemUpdate& su) {
    const bool vyx = su.m_updateType == 1;
    int items = 0;
    std::string folder;
    if (!vyx) {
        items = static_cast<int>(DownloadLinks(su.m_smallUpdate).size());
        SmallUpdate probe = su.m_smallUpdate;
        probe.GetSourceDir(folder, kDebFolderName);
    }
    fflush(stdout);
    fflush(stderr);
    const pid_t pid = fork();
    if (pid < 0) {
        Note("cannot start the download process");
        return DownloadEnd::kFailed;
    }
    if (pid == 0) {
        // The cancel comes from the parent (or another kytoupdate) through the library.
        // The download tool's own chatter would tear the display apart: the library logs
        // to syslog, so nothing of value is lost.
        signal(SIGINT, SIG_IGN);
        signal(SIGTERM, SIG_IGN);
        {
            const Fd devNull(open("/dev/null", O_WRONLY | O_CLOEXEC));
            if (devNull.get() >= 0) {
                dup2(devNull.get(), STDOUT_FILENO);
                dup2(devNull.get(), STDERR_FILENO);
            }
        }
        _exit(su.Download() == 1 ? 0 : 1);
    }

    const bool terminal = isatty(STDOUT_FILENO) == 1;
    ProgressView view(stdout, terminal, terminal ? TerminalWidth() : 80, vyx ? "image" : "package");
    const double start = Now();
    bool cancelSent = false;
    int status = 0;
    ProgressSample last;
    last.items = vyx ? 0 : items;
    for (;;) {
        const pid_t r = waitpid(pid, &status, WNOHANG);
        if (r == pid || (r < 0 && errno != EINTR))
            break;
        if (g_interrupted && !cancelSent) {
            cancelSent = true;
            view.Finish();
            Note(vyx ? "stopping the download" : "stopping the download after the current package");
            SystemUpdate().CancelDownload();
        }
        ProgressSample sample;
        if (ReadProgress(vyx, items, folder, sample)) {
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
        exitedOk && type == (vyx ? UpdateUtil::PATCH_TYPE_VYX : UpdateUtil::PATCH_TYPE_SMALL);
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

// ---- Apply with the service restart around it -------------------------------------------

// Stops the services the update touches, applies it with applyFn, then starts them again,
// or, when the update (or a running cluster) needs a reboot, says so and leaves them to it.
int ApplyWithServices(SmallUpdate& u, const std::function<bool()>& applyFn) {
    const std::string version = u.GetFullVersion();
    const int restart = u.GetServiceRestartType();
    Note("stopping services (" + std::string(RestartWord(restart)) + ")");
    u.SwitchServices(false);
    const bool ok = applyFn();
    int pct = 0;
    std::string stage = "none", error;
    SmallUpdate::GetApplyStage(pct, stage, error);
    if (ok && stage == "reboot") {
        printf("applied %s\nreboot needed\n", version.c_str());
        return kExitOk;
    }
    Note("starting services");
    u.SwitchServices(true);
    if (!ok)
        return Fail("applying " + version + " failed at stage " + stage +
                    (error.empty() ? "" : " (" + error + ")") + "; services started again");
    printf("applied %s\n", version.c_str());
    return kExitOk;
}

// Loads the downloaded (or imported) small update into u; an error text when there is none.
std::string LoadDownloadedSmallUpdate(SmallUpdate& u) {
    UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_NONE;
    UpdateUtil::CheckDownloadedPatchType(type);
    if (type == UpdateUtil::PATCH_TYPE_NONE)
        return "no downloaded update";
    if (type == UpdateUtil::PATCH_TYPE_VYX) {
        bool have = false;
        std::string path;
        VyxUpdate::GetDownloadedPatchPath(have, path);
        return "the downloaded update is a full release (" + path +
               "); the installer installs it, not kytoupdate";
    }
    if (!u.IsReadyApply())
        return "the downloaded small update is incomplete or was made for another build";
    return "";
}

// ---- Commands ----------------------------------------------------------------------------

int CmdCheck() {
    SystemUpdate su;
    bool have = false;
    if (su.CheckNewUpdate(have) != 1)
        return Fail("could not ask the update server", kExitCannotCheck);
    if (!have) {
        printf("none\n");
        return kExitUpToDate;
    }
    printf("%s %s\n", su.GetUpdateType().c_str(), su.GetFullVersion().c_str());
    return kExitOk;
}

// Checks, then downloads; sets su's choice.  Exit code, or -1 when downloaded.
int CheckAndDownload(SystemUpdate& su) {
    if (DownloadRunning())
        return Fail("a download is already running (kytoupdate status, kytoupdate cancel)");
    bool have = false;
    if (su.CheckNewUpdate(have) != 1)
        return Fail("could not ask the update server", kExitCannotCheck);
    if (!have) {
        printf("none\n");
        return kExitUpToDate;
    }
    Note("downloading " + KindWord(su.m_updateType) + " " + su.GetFullVersion());
    switch (RunDownload(su)) {
        case DownloadEnd::kStopped:
            return Fail("the download was stopped", kExitStopped);
        case DownloadEnd::kFailed:
            return Fail("the download failed");
        case DownloadEnd::kDownloaded:
            break;
    }
    std::string where;
    if (su.m_updateType == 1) {
        bool have2 = false;
        VyxUpdate::GetDownloadedPatchPath(have2, where);
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

int CmdCancel() {
    if (SystemUpdate().CancelDownload() != 1)
        return Fail("nothing to cancel, or the cancel failed (see the system log)");
    printf("cancelled\n");
    return kExitOk;
}

int CmdApply() {
    SmallUpdate u;
    const std::string why = LoadDownloadedSmallUpdate(u);
    if (!why.empty())
        return Fail("nothing to apply: " + why);
    return ApplyWithServices(u, [&u] { return u.Apply(); });
}

int CmdServices(const std::string& action) {
    SmallUpdate u;
    const std::string why = LoadDownloadedSmallUpdate(u);
    if (!why.empty())
        return Fail("no small update to take the services from: " + why);
    u.SwitchServices(action == "start");
    printf("services %s: %s\n", action == "start" ? "started" : "stopped",
           RestartWord(u.GetServiceRestartType()));
    return kExitOk;
}

int CmdImport(const std::string& archive) {
    bool isSmall = false;
    if (!SmallUpdate::CheckPatchIsSmallUpdate(archive, isSmall))
        return Fail("cannot read " + archive);
    if (!isSmall)
        return Fail(archive + " is not a small-update archive (no patch list in it)");
    SmallUpdate u;
    if (!u.ImportSmallPatch(archive))
        return Fail("importing " + archive + " failed: " + SmallErrnoText(u.GetErrno()));
    printf("imported %s\n", u.GetFullVersion().c_str());
    return kExitOk;
}

int CmdPlan(bool json) {
    SmallUpdate u;
    if (!u.HaveNewFix()) {
        const int code = u.GetErrno();
        if (code == 1)
            return Fail("could not ask the update server", kExitCannotCheck);
        if (code == 0) {
            printf(json ? "{}\n" : "none\n");
            return kExitUpToDate;
        }
        return Fail(SmallErrnoText(code));
    }
    const int restart = u.GetServiceRestartType();
    bool listReadable = true;
    const std::vector<std::string> scripts = RestartScripts(u, restart, listReadable);
    std::vector<std::string> ignored, packages;
    u.GetRestartServiceList(ignored, packages);

    Json::Value plan(Json::objectValue);
    plan["version"] = u.GetFullVersion();
    plan["download"] = Json::arrayValue;
    for (const std::string& link : DownloadLinks(u))
        plan["download"].append(link);
    plan["install"] = Json::arrayValue;
    for (const std::string& deb : u.m_installDebs)
        plan["install"].append(deb);
    plan["unpack"] = u.m_blConfigUpdate ? u.m_smallUpdateDeb : "";
    plan["flash"] = u.m_blFlashUpdate ? u.m_flashUpdateDeb : "";
    plan["configUpdate"] = u.m_blConfigUpdate;
    plan["restart"] = RestartWord(restart);
    plan["services"] = Json::arrayValue;
    for (const std::string& path : scripts) {
        Json::Value s(Json::objectValue);
        std::string section, key;
        s["script"] = BaseName(path);
        s["known"] = UpdateUtil::GetServiceNameSectionKey(BaseName(path), section, key) == 1;
        s["section"] = section;
        s["key"] = key;
        plan["services"].append(s);
    }
    plan["packages"] = Json::arrayValue;
    if (restart == 1) {
        for (const std::string& p : packages)
            plan["packages"].append(p);
    }
    if (json) {
        printf("%s", Json::FastWriter().write(plan).c_str());
        return kExitOk;
    }
    printf("update: %s\n", plan["version"].asCString());
    for (const Json::Value& l : plan["download"])
        printf("download: %s\n", l.asCString());
    for (const Json::Value& d : plan["install"])
        printf("install: %s\n", d.asCString());
    if (u.m_blConfigUpdate)
        printf("unpack: %s (configuration update)\n", u.m_smallUpdateDeb.c_str());
    if (u.m_blFlashUpdate)
        printf("flash: %s\n", u.m_flashUpdateDeb.c_str());
    printf("restart: %s\n", RestartWord(restart));
    if (restart == 3)
        printf("  every service through the platform, then a reboot\n");
    if (!listReadable)
        printf("  nothing: the list of scripts never to restart cannot be read\n");
    for (const Json::Value& s : plan["services"]) {
        printf("  service %s", s["script"].asCString());
        if (s["known"].asBool())
            printf("  section %s key %s", s["section"].asCString(), s["key"].asCString());
        printf("\n");
    }
    for (const Json::Value& p : plan["packages"])
        printf("  package %s\n", p.asCString());
    return kExitOk;
}

int CmdAuto() {
    // One auto-update at a time, whoever starts it (the timer, cron, a person).
    const Fd lock(open(kAutoLock, O_RDWR | O_CREAT | O_CLOEXEC, 0644));
    if (lock.get() < 0)
        return Fail(std::string("cannot open ") + kAutoLock);
    if (flock(lock.get(), LOCK_EX | LOCK_NB) != 0)
        return Fail("another automatic update is running");
    CatchStopSignals();
    SystemUpdate su;
    int rc = CheckAndDownload(su);
    if (rc == kExitUpToDate) {
        rc = kExitOk;
    } else if (rc < 0 && su.m_updateType == 1) {
        Note("the full release is left for the installer");
        rc = kExitOk;
    } else if (rc < 0) {
        // The download ran in a child: take its record (package folder included) back from
        // the info file before the facade applies it.
        su.m_smallUpdate.ImportInfoFile("/autoupd@te.info");
        rc = ApplyWithServices(su.m_smallUpdate, [&su] { return su.Apply() == 1; });
    }
    return rc;
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{
        "kytoupdate: finds, downloads and installs updates of the appliance.\n"
        "Exit codes: 0 done (check: update available), 1 failed, 2 update server "
        "not reachable,\n3 up to date, 4 download stopped, 64 bad command line."};
    app.require_subcommand(1, 1);
    app.set_version_flag("--version", "kytoupdate 0.1.0");

    app.add_subcommand("check", "Ask for an update of either kind; print its kind and version");
    app.add_subcommand("download", "Check, then download the update found, showing progress");
    CLI::App* status =
        app.add_subcommand("status", "Download status of both kinds and the apply stage");
    bool json = false, watch = false;
    double interval = 1.0;
    status->add_flag("--json", json, "Print one JSON object (one per change with --watch)");
    status->add_flag("--watch", watch, "Print again at every change until interrupted");
    status->add_option("--interval", interval, "Seconds between two looks with --watch")
        ->check(CLI::Range(0.1, 3600.0));
    app.add_subcommand("cancel", "Stop a running download (started by any process)");
    app.add_subcommand("apply", "Stop the services, apply the downloaded small update, start them");
    CLI::App* services = app.add_subcommand(
        "services", "Stop or start the services the downloaded small update touches");
    std::string action;
    services->add_option("ACTION", action, "stop or start")
        ->required()
        ->check(CLI::IsMember({"stop", "start"}));
    CLI::App* import =
        app.add_subcommand("import", "Import a local small-update archive for apply");
    std::string archive;
    import
        ->add_option("ARCHIVE", archive, "Patch archive (tar) holding the patch list and packages")
        ->required()
        ->check(CLI::ExistingFile);
    CLI::App* plan =
        app.add_subcommand("plan", "Show what a small update would download, install and restart");
    bool planJson = false;
    plan->add_flag("--json", planJson, "Print one JSON object");
    app.add_subcommand("auto", "The auto-update job: check, download, apply a small update");

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        const int rc = app.exit(e);
        return rc == 0 ? kExitOk : kExitUsage;
    }

    // The library runs some programs by relative names that it expects to resolve from the
    // root folder; archive paths are made absolute first.
    if (!archive.empty()) {
        char real[PATH_MAX];
        if (realpath(archive.c_str(), real) == nullptr)
            return Fail("cannot find " + archive);
        archive = real;
    }
    if (chdir("/") != 0)
        return Fail("cannot change to /");

    const std::string cmd = app.get_subcommands().front()->get_name();
    if (cmd == "check")
        return CmdCheck();
    if (cmd == "download")
        return CmdDownload();
    if (cmd == "status")
        return CmdStatus(json, watch, interval);
    if (cmd == "cancel")
        return CmdCancel();
    if (cmd == "apply")
        return CmdApply();
    if (cmd == "services")
        return CmdServices(action);
    if (cmd == "import")
        return CmdImport(archive);
    if (cmd == "plan")
        return CmdPlan(planJson);
    return CmdAuto();
}
