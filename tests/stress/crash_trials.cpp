// Crash-consistency trials: the downloading process (small update and full release) and
// the applying process are killed with SIGKILL at a random moment; after each kill the
// program records what was left (status answers, info file, package folder, temporary
// files, the installed fix number, the package database) and checks that
//   - the status readers give answers of their vocabularies (never a torn file),
//   - an info file that exists is a complete one the apply accepts,
//   - the full-release status does not stay "downloading" once the download's tool has
//     ended (the reader sees the dead pid and says failed),
//   - the next check and download (or apply) succeed from what was left.
//
//   kyto-sandbox crash_trials [--trials=N] [--seed=S] [--kinds=small,full,apply]
//
// A loopback update server (tests/support/update_server.py) publishes a patch list of three
// real packages and a release feed with an 8 MiB image, sent slowly so that a kill lands in
// the middle of a transfer.  Prints one line per kind with the counts of what was left.
#include <dirent.h>
#include <poll.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <time.h>

#include <map>
#include <set>
#include <string>
#include <vector>

#include <kytoplatform/klibc.h>

#include "smallupdate.h"
#include "stress_common.h"
#include "systemupdate.h"
#include "vyxupdate.h"

namespace {

using kytostress::Exists;
using kytostress::WriteText;

constexpr const char* kStatus = "/var/run/downloadVYX.status";
constexpr const char* kApplyStatus = "/var/run/applySmallUpd@te.status";
constexpr const char* kInfo = "/autoupd@te.info";
constexpr const char* kVersion = "/etc.defaults/VERSION";
constexpr const char* kServed = "/tmp/stress-server";
const char* const kPackages[] = {"kytostressa", "kytostressb", "kytostressc"};

std::string g_base;  // http://127.0.0.1:<port>
std::string g_versionFile;
int g_problems = 0;
FILE* g_report = stderr;

void Problem(const std::string& what) {
    ++g_problems;
    fprintf(g_report, "crash_trials: %s; last system log lines:\n", what.c_str());
    // The sandbox's syslog catcher writes every message to this file.
    FILE* log = popen("tail -n 6 /var/log/sandbox.syslog", "r");
    char line[1024];
    while (log && fgets(line, sizeof line, log))
        fprintf(g_report, "    %s", line);
    if (log)
        pclose(log);
}

int Sh(const std::string& cmd) {
    int st = system(cmd.c_str());
    return WIFEXITED(st) ? WEXITSTATUS(st) : 128;
}

std::string DebName(const char* pkg) {
    return std::string(pkg) + "_6.1-5644-s1_all.deb";
}

bool StartServer() {
    mkdir(kServed, 0755);
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0)
        return false;
    pid_t pid = fork();
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        dup2(fds[1], STDOUT_FILENO);
        execl("/usr/bin/python3", "python3", KYTO_UPDATE_SERVER, kServed, (char*)nullptr);
        _exit(127);
    }
    close(fds[1]);
    std::string line;
    char buf[64];
    struct pollfd p = {fds[0], POLLIN, 0};
    while (line.find('\n') == std::string::npos && poll(&p, 1, 15000) > 0) {
        ssize_t n = read(fds[0], buf, sizeof buf);
        if (n <= 0)
            break;
        line.append(buf, static_cast<size_t>(n));
    }
    close(fds[0]);
    int port = atoi(line.c_str());
    g_base = "http://127.0.0.1:" + std::to_string(port);
    return port > 0;
}

void SetSlow(bool slow) {
    std::string control = "{}";
    if (slow) {
        control = "{\"slow\": {\"/img/vyx.img\": 4194304";
        for (const char* p : kPackages)
            control += ", \"/debs/" + DebName(p) + "\": 400000";
        control += "}}";
    }
    WriteText(std::string(kServed) + "/.control.json", control);
}

bool Publish() {
    std::string proj;
    for (const char* p : kPackages) {
        std::string dir = std::string("/tmp/stress-pkg/") + p;
        std::string cmd = "mkdir -p " + dir + "/DEBIAN " + dir + "/usr/share/kytostress && " +
                          "head -c 307200 /dev/urandom > " + dir + "/usr/share/kytostress/" + p +
                          " && printf 'Package: " + p +
                          "\\nVersion: 6.1-5644-s1\\nArchitecture: all\\nMaintainer: t <t@t>\\n"
                          "Description: stress\\n' > " +
                          dir + "/DEBIAN/control && mkdir -p " + kServed +
                          "/debs && dpkg-deb -Zgzip --build " + dir + " " + kServed + "/debs/" +
                          DebName(p) + " >/dev/null";
        if (Sh(cmd) != 0)
            return false;
        if (!proj.empty())
            proj += ",";
        // The first package is the small-update package itself, the others further ones.
        const std::string name = p == kPackages[0] ? "smallupdate" : DebName(p);
        proj += "{\"name\":\"" + name + "\",\"url\":\"" + g_base + "/debs/" + DebName(p) + "\"}";
    }
    std::string list =
        "{\"vyxversion\":5644,\"unique\":\"demo_model\",\"smallupdate\":[{\"version\":1,"
        "\"flash_upgrade\":false,\"config_upgrade\":false,\"proj\":[" +
        proj + "],\"restart\":\"none\"}]}";
    std::string listDir = std::string(kServed) + "/smallupdate/5644/demo_model";
    if (Sh("mkdir -p " + listDir + " " + kServed + "/img " + kServed + "/autoupdate") != 0 ||
        !WriteText(listDir + "/VYX-Security.json", list) ||
        Sh(std::string("head -c 8388608 /dev/urandom > ") + kServed + "/img/vyx.img") != 0)
        return false;
    FILE* md5 = popen((std::string("md5sum ") + kServed + "/img/vyx.img").c_str(), "r");
    char sum[64] = {0};
    if (!md5 || fscanf(md5, "%32s", sum) != 1)
        return false;
    pclose(md5);
    std::string feed =
        "<rss>\n<channel>\n<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n"
        "<BuildNum>5700</BuildNum>\n<model>\n<mUnique>demo_model</mUnique>\n<mLink>" +
        g_base + "/img/vyx.img</mLink>\n<mCheckSum>" + sum +
        "</mCheckSum>\n</model>\n</item>\n</channel>\n</rss>\n";
    return WriteText(std::string(kServed) + "/autoupdate/genRSS.php", feed) &&
           KLIBCFileSetKeyValue("/etc.defaults/kytoinfo.conf", "rss_server",
                                (g_base + "/autoupdate/genRSS.php").c_str(), nullptr) == 1 &&
           KLIBCFileSetKeyValue("/etc.defaults/kytoinfo.conf", "small_info_path",
                                (g_base + "/smallupdate").c_str(), nullptr) == 1;
}

// Processes of the sandbox (other than this one) whose command name is `name`.
int CountProcs(const char* name) {
    int count = 0;
    DIR* d = opendir("/proc");
    if (!d)
        return 0;
    while (struct dirent* e = readdir(d)) {
        int pid = atoi(e->d_name);
        if (pid <= 0 || pid == getpid())
            continue;
        char path[64], comm[64] = {0};
        snprintf(path, sizeof path, "/proc/%d/comm", pid);
        FILE* f = fopen(path, "re");
        if (f && fgets(comm, sizeof comm, f) && strncmp(comm, name, strlen(name)) == 0)
            ++count;
        if (f)
            fclose(f);
    }
    closedir(d);
    return count;
}

// Waits (up to 60 s) until no orphaned tool of the killed process runs any more.
void WaitForOrphans() {
    for (int i = 0; i < 600 && (CountProcs("wget") || CountProcs("dpkg")); ++i)
        usleep(100000);
}

// Entries of "/" and "/var/run" that look like a temporary file a writer left behind.
int LeftoverTemporaries() {
    int n = 0;
    for (const char* dir : {"/", "/var/run"}) {
        DIR* d = opendir(dir);
        while (d && (errno = 0, true)) {
            struct dirent* e = readdir(d);
            if (!e)
                break;
            std::string name = e->d_name;
            if ((name.rfind(".autoupd@te.info", 0) == 0 || name.rfind("autoupd@te.info.", 0) == 0 ||
                 name.rfind(".downloadVYX.status.", 0) == 0 ||
                 name.rfind("applySmallUpd@te.status_", 0) == 0 ||
                 name.rfind(".applySmallUpd@te.status_", 0) == 0))
                ++n;
        }
        if (d)
            closedir(d);
    }
    return n;
}

// Kills a forked child running fn after a random delay below maxMs; true when the kill
// landed (the child had not ended by itself).
template <typename Fn>
bool RunAndKill(Fn fn, int maxMs) {
    pid_t pid = fork();
    if (pid == 0)
        _exit(fn() ? 0 : 1);
    usleep(static_cast<useconds_t>(rand() % (maxMs + 1)) * 1000);
    bool landed = kill(pid, SIGKILL) == 0;
    int st = 0;
    waitpid(pid, &st, 0);
    return landed && WIFSIGNALED(st);
}

std::map<std::string, int> g_tally;
void Tally(const std::string& kind, const std::string& what) {
    ++g_tally[kind + ": " + what];
}

std::string SmallAnswer() {
    SmallUpdate reader;
    int p = -1;
    std::string word;
    reader.GetDownloadStatus(p, word);
    return word;
}

void CheckInfoFile(const std::string& kind) {
    if (!Exists(kInfo)) {
        Tally(kind, "no info file");
        return;
    }
    SmallUpdate u;
    Json::Value ignored;
    bool small = u.ImportInfoFile(kInfo);
    bool have = false;
    bool full = VyxUpdate::GetAutoUpdateInfo(have, ignored) == 1 && have;
    Tally(kind, "complete info file");
    if (!small && !full)
        Problem(kind + ": an info file that neither engine accepts");
}

bool InstalledFix(std::string& fix) {
    char buf[16] = {0};
    int r = KLIBCFileGetKeyValue(kVersion, "smallfixnumber", buf, sizeof buf, 0);
    fix = buf;
    return r > 0;
}

void ResetInstalled() {
    WriteText(kVersion, g_versionFile);
    std::string cmd = "dpkg --purge";
    for (const char* p : kPackages)
        cmd += std::string(" ") + p;
    Sh(cmd + " >/dev/null 2>&1");
}

void SmallTrial() {
    ResetInstalled();  // a fix installed by an apply trial would not be offered again
    unlink(kStatus);
    unlink(kInfo);
    unlink("/tmp/stop_download_smallfix");
    SetSlow(true);
    bool landed = RunAndKill([] { return SmallUpdate().Download(true); }, 2500);
    Tally("small", landed ? "killed" : "ended before the kill");
    std::string word = SmallAnswer();
    Tally("small", "reader says " + word);
    if (word != "none" && word != "init" && word != "downloading" && word != "finished" &&
        word != "failed")
        Problem("small: reader answered " + word);
    CheckInfoFile("small");
    Tally("small", Exists(kStatus) ? "status file left" : "no status file");
    if (int n = LeftoverTemporaries())
        Tally("small", std::to_string(n) + " temporary file(s) left");
    WaitForOrphans();
    SetSlow(false);
    SmallUpdate next;
    bool ok = next.Download(true);
    std::string after = SmallAnswer();
    if (!ok || after != "finished" || Exists(kStatus))
        Problem("small: the next download: result " + std::to_string(ok) + ", reader " + after +
                ", errno " + std::to_string(next.GetErrno()) +
                (Exists(kStatus) ? ", status file left" : ""));
}

std::string FullAnswer(bool& ok) {
    int p = 0;
    VyxUpdate::VYX_DOWNLOAD_STATUS st = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    ok = VyxUpdate::GetDownloadStatus(p, st);
    return VyxUpdate::DownloadStatusToString(st);
}

void FullTrial() {
    for (const char* f : {kStatus, kInfo, "/var/run/downloadVYX.pid", "/var/run/downloadprogress"})
        unlink(f);
    Sh("rm -rf /volume1/@autoupdate");
    SetSlow(true);
    bool landed = RunAndKill([] { return VyxUpdate().DownloadVyx() == 1; }, 2500);
    Tally("full", landed ? "killed" : "ended before the kill");
    bool ok = false;
    std::string word = FullAnswer(ok);
    Tally("full", "reader right after the kill says " + (ok ? word : "error"));
    WaitForOrphans();
    word = FullAnswer(ok);
    Tally("full", "reader once the tool ended says " + (ok ? word : "error"));
    if (ok && word == "downloading")
        Problem("full: still downloading after the download's tool ended");
    CheckInfoFile("full");
    if (int n = LeftoverTemporaries())
        Tally("full", std::to_string(n) + " temporary file(s) left");
    SetSlow(false);
    SystemUpdate facade;
    bool have = false;
    facade.CheckNewUpdate(have);
    Tally("full", std::string("next check: ") + (have ? "update offered" : "nothing offered"));
    VyxUpdate next;
    if (next.DownloadVyx() != 1 || FullAnswer(ok) != "finished")
        Problem("full: the next download did not finish");
}

void ApplyTrial() {
    ResetInstalled();
    unlink(kInfo);
    SetSlow(false);
    if (!SmallUpdate().Download(true)) {
        Problem("apply: could not download the update to apply");
        return;
    }
    bool landed = RunAndKill(
        [] {
            SmallUpdate u;
            return u.ImportInfoFile(kInfo) && u.Apply();
        },
        700);
    Tally("apply", landed ? "killed" : "ended before the kill");
    int p = -1;
    std::string stage = "unset", err = "unset";
    SmallUpdate::GetApplyStage(p, stage, err);
    Tally("apply", "stage " + stage + (err == "unset" ? "" : " [" + err + "]"));
    // "none" with the caller's error text untouched: no apply status file yet (the check
    // before the download deletes an old one, and the kill came before the first write).
    // "none" with "err_system" would be a file whose keys could not be read.
    if (stage == "unset" || (stage == "none" && err != "unset"))
        Problem("apply: apply status unreadable after the kill: " + stage + " [" + err + "]");
    WaitForOrphans();
    std::string fix;
    Tally("apply", InstalledFix(fix) ? "smallfixnumber " + fix : "no smallfixnumber");
    CheckInfoFile("apply");
    Tally("apply",
          Exists("/volume1/@smallupd@te_deb") ? "package folder left" : "package folder gone");
    std::string audit;
    if (FILE* a = popen("dpkg --audit 2>&1", "r")) {
        char line[256];
        while (fgets(line, sizeof line, a))
            audit += line;
        pclose(a);
    }
    Tally("apply", audit.empty() ? "package database consistent" : "dpkg --audit reports packages");
    if (int n = LeftoverTemporaries())
        Tally("apply", std::to_string(n) + " temporary file(s) left");
    // The next check: an installed fix is not offered again; otherwise the update is
    // downloaded and applied again from scratch.
    SmallUpdate check;
    bool offered = check.HaveNewFix();
    Tally("apply", std::string("next check: ") + (offered ? "fix offered" : "fix not offered"));
    if (offered == (fix == "1"))
        Problem("apply: next check offered=" + std::to_string(offered) + " with fix " + fix);
    if (offered) {
        SmallUpdate again;
        if (!again.Download(true) || !again.ImportInfoFile(kInfo) || !again.Apply())
            Problem("apply: the next download and apply failed");
    }
    if (Sh("test -z \"$(dpkg --audit 2>&1)\"") != 0)
        Problem("apply: the package database stays inconsistent after the next apply");
}

}  // namespace

int main(int argc, char** argv) {
    kytostress::RequireSandbox(argv[0]);
    // The library's tools (wget, dpkg) write to the inherited output; keep only the report.
    FILE* report = fdopen(fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 3), "w");
    int quiet = open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (!report || quiet < 0 || dup2(quiet, STDOUT_FILENO) < 0 || dup2(quiet, STDERR_FILENO) < 0)
        return 1;
    close(quiet);
    setvbuf(report, nullptr, _IOLBF, 0);
    g_report = report;
    const long trials = kytostress::LongArg(argc, argv, "trials", 20);
    const long seed = kytostress::LongArg(argc, argv, "seed", static_cast<long>(time(nullptr)));
    std::string kinds = "small,full,apply";
    for (int i = 1; i < argc; ++i) {
        if (strncmp(argv[i], "--kinds=", 8) == 0)
            kinds = argv[i] + 8;
    }
    srand(static_cast<unsigned>(seed));
    fprintf(report, "crash_trials: %ld trials per kind (%s), seed %ld\n", trials, kinds.c_str(),
            seed);

    mkdir("/volume1", 0755);
    if (mount("tmpfs", "/volume1", "tmpfs", 0, "size=419430400") != 0 || !StartServer() ||
        !Publish()) {
        fprintf(stderr, "crash_trials: cannot set up the volume, server or published files\n");
        return 1;
    }
    FILE* v = fopen(kVersion, "re");
    char chunk[4096];
    size_t n;
    while (v && (n = fread(chunk, 1, sizeof chunk, v)) > 0)
        g_versionFile.append(chunk, n);
    if (v)
        fclose(v);

    for (long t = 0; t < trials; ++t) {
        if (kinds.find("small") != std::string::npos)
            SmallTrial();
        if (kinds.find("full") != std::string::npos)
            FullTrial();
        if (kinds.find("apply") != std::string::npos)
            ApplyTrial();
    }
    for (const auto& [what, count] : g_tally)
        fprintf(report, "  %-60s %d\n", what.c_str(), count);
    fprintf(report, "crash_trials: %d problem(s)\n", g_problems);
    return g_problems == 0 ? 0 : 1;
}
