// Torn-read stress: one process rewrites the download status file and the apply status
// file the way the engines do while downloading and applying, and poller processes read
// them through the library at the same time.  Every answer must be made of values that
// were written: a value never written (a torn read) or a key read as missing while the
// file always holds it (a missing read) is counted as a failure.
//
//   kyto-sandbox torn_reads [--rewrites=N] [--pollers=P]
//
// Two phases of N/2 rewrites each.  Small update: SmallUpdate::UpdateDownloadProgress with
// the states init, downloading, finished and stopped (never failed, so that a "failed"
// answer can only mean a missing key) against SmallUpdate::GetDownloadStatus.  Full
// release, mid-download of two images with a live pid: VyxUpdate::UpdateProgressFile
// setting "patchPath" and "downloadNum" one key at a time, as the download does between
// its images, against VyxUpdate::GetDownloadStatus.  Throughout, one
// SmallUpdate::UpdateApplyProgress per rewrite against SmallUpdate::GetApplyStage.  The
// engines never delete the files in the middle of a download, so neither does the writer.
// Output: polls, rewrites, failures; the number of answers that combine keys of two
// different rewrites is printed for information (each key is set by its own call).
#include <signal.h>
#include <sys/mman.h>
#include <sys/wait.h>

#include <atomic>
#include <set>
#include <string>

#include "smallupdate.h"
#include "stress_common.h"
#include "vyxupdate.h"

namespace {

constexpr const char* kDownloadStatus = "/var/run/downloadVYX.status";
constexpr const char* kApplyStatus = "/var/run/applySmallUpd@te.status";
constexpr const char* kPidFile = "/var/run/downloadVYX.pid";
constexpr const char* kProgressLog = "/var/run/downloadprogress";
const char* const kImages[2] = {"/var/run/stress-image-1", "/var/run/stress-image-2"};
constexpr long kImageTotal = 1048576;  // the size wget announced for both images

const SmallUpdate::DOWNLOAD_STATUS kSmallStates[] = {
    SmallUpdate::DOWNLOAD_STATUS_INIT, SmallUpdate::DOWNLOAD_STATUS_DOWNLOADING,
    SmallUpdate::DOWNLOAD_STATUS_FINISHED, SmallUpdate::DOWNLOAD_STATUS_STOPPED};
const SmallUpdate::APPLY_STAGE kStages[] = {SmallUpdate::APPLY_STAGE_WAITING_REMOTE_UPGRADING,
                                            SmallUpdate::APPLY_STAGE_ANALYING,
                                            SmallUpdate::APPLY_STAGE_PROGRAM,
                                            SmallUpdate::APPLY_STAGE_START_SERVICE,
                                            SmallUpdate::APPLY_STAGE_FINISHED,
                                            SmallUpdate::APPLY_STAGE_REBOOT};
const char* const kStageWords[] = {
    "waiting_remote_upgrading", "analying", "program", "startService", "finished", "reboot"};
const char* const kErrTexts[] = {"", "remote node busy"};

struct Shared {
    std::atomic<int> phase;  // 0 small, 1 full, 2 done
    std::atomic<long> rewrites;
    std::atomic<long> polls;
    std::atomic<long> failures;
    std::atomic<long> mixed;
    std::atomic<long> parked;  // pollers waiting between the phases
};

int SmallPercentage(long i) {
    return static_cast<int>((i * 7) % 101);
}
int ApplyPercentage(long i) {
    return static_cast<int>((i * 13) % 101);
}

// Percentages the full-release reader can give: any image number with either image's
// path (the two keys are set one after the other).
std::set<int> g_fullPercentages;

void Fail(Shared* s, const char* what, const std::string& detail) {
    if (s->failures.fetch_add(1) < 10)
        fprintf(stderr, "torn read: %s: %s\n", what, detail.c_str());
}

void PollOnce(Shared* s, int phase) {
    int p = -1;
    std::string stage = "caller", err = "caller";
    SmallUpdate::GetApplyStage(p, stage, err);
    bool stageOk = false;
    for (const char* w : kStageWords)
        stageOk = stageOk || stage == w;
    if (!stageOk || p < 0 || p > 100 || (err != "caller" && err != kErrTexts[1]))
        Fail(s, "apply status", stage + " " + std::to_string(p) + " [" + err + "]");
    else if ((err == kErrTexts[1]) != (stage == kStageWords[0]))
        s->mixed.fetch_add(1);

    if (phase == 0) {
        SmallUpdate reader;
        int percentage = -1;
        std::string word;
        reader.GetDownloadStatus(percentage, word);
        if ((word != "init" && word != "downloading" && word != "finished" && word != "stopped") ||
            percentage < 0 || percentage > 100)
            Fail(s, "small download status", word + " " + std::to_string(percentage));
    } else if (phase == 1) {
        int percentage = -1;
        VyxUpdate::VYX_DOWNLOAD_STATUS status = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
        bool ok = VyxUpdate::GetDownloadStatus(percentage, status);
        if (!ok || status != VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING ||
            g_fullPercentages.count(percentage) == 0)
            Fail(s, "full download status",
                 std::to_string(ok) + " " + std::to_string(status) + " " +
                     std::to_string(percentage));
    }
    s->polls.fetch_add(1);
}

bool WriteSmall(long i) {
    return SmallUpdate::UpdateDownloadProgress(SmallPercentage(i), kSmallStates[i % 4]) == 1;
}

bool WriteFull(long i) {
    int image = static_cast<int>(i % 2);
    return VyxUpdate::UpdateProgressFile("patchPath", kImages[image]) &&
           VyxUpdate::UpdateProgressFile("downloadNum", image == 0 ? "1" : "2");
}

bool WriteApply(long i) {
    return SmallUpdate::UpdateApplyProgress(ApplyPercentage(i), kStages[i % 6],
                                            kErrTexts[i % 6 == 0 ? 1 : 0]);
}

// Files of the full-release phase: the status keys that do not change, the writer's pid
// as the live download, wget's log and two partly downloaded images.
bool PrepareFull(std::string& why) {
    if (!VyxUpdate::UpdateProgressFile("updateType", "vyxupdate") ||
        !VyxUpdate::UpdateProgressFile("downloadStatus", "downloading") ||
        !VyxUpdate::UpdateProgressFile("downloadCount", "2") || !WriteFull(0)) {
        why = "cannot write the full-release status";
        return false;
    }
    std::string log = "Length: 1,048,576 (1.0M) [application/octet-stream]\n";
    std::string first(kImageTotal / 4, 'a'), second(kImageTotal / 2, 'b');
    if (!kytostress::WriteText(kPidFile, std::to_string(getpid())) ||
        !kytostress::WriteText(kProgressLog, log) || !kytostress::WriteText(kImages[0], first) ||
        !kytostress::WriteText(kImages[1], second)) {
        why = "cannot write the pid file, the log or the images";
        return false;
    }
    return true;
}

void ComputeFullPercentages() {
    for (const char* image : kImages) {
        int current = 0;
        if (!VyxUpdate::GetDownloadPercentage(image, current)) {
            fprintf(stderr, "cannot compute the image percentage of %s\n", image);
            exit(1);
        }
        for (int num = 1; num <= 2; ++num)
            g_fullPercentages.insert(static_cast<int>((num - 1) * 50.0 + current / 2.0));
    }
}

}  // namespace

int main(int argc, char** argv) {
    kytostress::RequireSandbox(argv[0]);
    const long rewrites = kytostress::LongArg(argc, argv, "rewrites", 100000);
    const long pollers = kytostress::LongArg(argc, argv, "pollers", 2);

    auto* s = static_cast<Shared*>(
        mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    if (s == MAP_FAILED)
        return 1;
    new (s) Shared{};
    unlink(kDownloadStatus);
    if (!WriteSmall(0) || !WriteApply(0)) {
        fprintf(stderr, "cannot write the first status files\n");
        return 1;
    }

    pid_t children[64];
    long started = 0;
    for (; started < pollers && started < 64; ++started) {
        pid_t pid = fork();
        if (pid == 0) {
            int phase;
            while ((phase = s->phase.load()) != 2) {
                if (phase == 3) {  // the writer switches engines: no poll may straddle that
                    s->parked.fetch_add(1);
                    while (s->phase.load() == 3)
                        usleep(1000);
                    continue;
                }
                if (phase == 1 && g_fullPercentages.empty())
                    ComputeFullPercentages();
                PollOnce(s, phase);
            }
            _exit(0);
        }
        if (pid < 0)
            return 1;
        children[started] = pid;
    }

    bool writeOk = true;
    for (long i = 1; i <= rewrites / 2 && writeOk; ++i) {
        writeOk = WriteSmall(i) && WriteApply(i);
        s->rewrites.fetch_add(1);
    }
    std::string why;
    // While the writer switches engines the pollers wait, so that no poll of one engine's
    // reader sees the other engine's file.
    s->phase.store(3);
    while (s->parked.load() < started)
        usleep(1000);
    if (writeOk && !PrepareFull(why)) {
        fprintf(stderr, "%s\n", why.c_str());
        writeOk = false;
    }
    s->phase.store(1);
    for (long i = 1; i <= rewrites - rewrites / 2 && writeOk; ++i) {
        writeOk = WriteFull(i) && WriteApply(i);
        s->rewrites.fetch_add(1);
    }
    s->phase.store(2);
    int bad = 0;
    for (long i = 0; i < started; ++i) {
        int st = 0;
        waitpid(children[i], &st, 0);
        if (!WIFEXITED(st) || WEXITSTATUS(st) != 0)
            ++bad;
    }
    printf(
        "torn_reads: %ld rewrites, %ld polls by %ld pollers, %ld failures, %ld answers "
        "combining two rewrites%s%s\n",
        s->rewrites.load(), s->polls.load(), started, s->failures.load(), s->mixed.load(),
        writeOk ? "" : ", A WRITE FAILED", bad ? ", A POLLER CRASHED" : "");
    return (s->failures.load() == 0 && writeOk && bad == 0) ? 0 : 1;
}
