// Status poll benchmark (run by hand through bench/reader_bench.sh, inside the sandbox).
//
// The interface polls the three status readers about once a second while a download or
// an apply runs; each poll should cost little more than the file reads it cannot avoid.
// Every reader is timed against one open+read+close of the status file it reads, in the
// same run, and the ratio is printed beside its goal:
//   VyxUpdate::GetDownloadStatus   mid-download: the status file as the download writes
//                                  it, the live wget's pid in the pid file and its real
//                                  progress log (bench/reader_bench.sh starts that wget);
//                                  about 8 reads, goal 10 times one open+read+close;
//   SmallUpdate::GetDownloadStatus the small update's status file, about 3 reads, goal 3.75;
//   SmallUpdate::GetApplyStage     the apply status file, about 3 reads, goal 3.75;
//   KLIBCFileGetKeyValue           one key of the small update's status file: the
//                                  platform's key read that every reader above repeats,
//                                  one read, goal 1.25.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include <kytoplatform/klibc.h>

#include "bench_ratio.h"
#include "smallupdate.h"
#include "vyxupdate.h"

namespace {

const char* const kDownloadStatusFile = "/var/run/downloadVYX.status";
const char* const kApplyStatusFile = "/var/run/applySmallUpd@te.status";
const char* const kPidFile = "/var/run/downloadVYX.pid";
const char* const kProgressLog = "/var/run/downloadprogress";
const char* const kImage = "/volume1/@autoupdate/vyx.img";

// The baseline: what one read of a small file costs at the least.
void OpenReadClose(const char* path) {
    char buf[4096];
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return;
    ssize_t n = read(fd, buf, sizeof buf);
    benchmark::DoNotOptimize(n);
    close(fd);
}

// The status files as the engines write them mid-way, through the library's own writers.
bool WriteVyxStatus() {
    unlink(kDownloadStatusFile);
    return VyxUpdate::UpdateProgressFile("updateType", "vyxupdate") &&
           VyxUpdate::UpdateProgressFile("downloadStatus", "downloading") &&
           VyxUpdate::UpdateProgressFile("downloadCount", "1") &&
           VyxUpdate::UpdateProgressFile("patchPath", kImage) &&
           VyxUpdate::UpdateProgressFile("downloadNum", "1");
}

bool WriteSmallStatus() {
    unlink(kDownloadStatusFile);
    return SmallUpdate::UpdateDownloadProgress(42, SmallUpdate::DOWNLOAD_STATUS_DOWNLOADING) == 1;
}

bool WriteApplyStatus() {
    return SmallUpdate::UpdateApplyProgress(40, SmallUpdate::APPLY_STAGE_PROGRAM, "");
}

void BaselineVyx(benchmark::State& state) {
    if (!WriteVyxStatus())
        state.SkipWithError("cannot write the download status file");
    for (auto _ : state)
        OpenReadClose(kDownloadStatusFile);
}

void PollVyx(benchmark::State& state) {
    if (!WriteVyxStatus())
        state.SkipWithError("cannot write the download status file");
    int percentage = -1;
    VyxUpdate::VYX_DOWNLOAD_STATUS status = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    if (!VyxUpdate::GetDownloadStatus(percentage, status) ||
        status != VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING || percentage < 0 || percentage > 100)
        state.SkipWithError("the reader does not see a running download");
    for (auto _ : state) {
        VyxUpdate::GetDownloadStatus(percentage, status);
        benchmark::DoNotOptimize(percentage);
    }
}

void BaselineSmall(benchmark::State& state) {
    if (!WriteSmallStatus())
        state.SkipWithError("cannot write the download status file");
    for (auto _ : state)
        OpenReadClose(kDownloadStatusFile);
}

void PollSmall(benchmark::State& state) {
    if (!WriteSmallStatus())
        state.SkipWithError("cannot write the download status file");
    SmallUpdate update;
    int percentage = -1;
    std::string word;
    update.GetDownloadStatus(percentage, word);
    if (percentage != 42 || word != "downloading")
        state.SkipWithError("the reader does not see the download at 42%");
    for (auto _ : state) {
        update.GetDownloadStatus(percentage, word);
        benchmark::DoNotOptimize(percentage);
    }
}

void KeyRead(benchmark::State& state) {
    if (!WriteSmallStatus())
        state.SkipWithError("cannot write the download status file");
    char buf[16];
    if (KLIBCFileGetKeyValue(kDownloadStatusFile, "downloadStatus", buf, sizeof buf, 0) != 1)
        state.SkipWithError("the key is not there");
    for (auto _ : state) {
        int n = KLIBCFileGetKeyValue(kDownloadStatusFile, "downloadStatus", buf, sizeof buf, 0);
        benchmark::DoNotOptimize(n);
    }
}

void BaselineApply(benchmark::State& state) {
    if (!WriteApplyStatus())
        state.SkipWithError("cannot write the apply status file");
    for (auto _ : state)
        OpenReadClose(kApplyStatusFile);
}

void PollApply(benchmark::State& state) {
    if (!WriteApplyStatus())
        state.SkipWithError("cannot write the apply status file");
    int percentage = -1;
    std::string stage, error;
    SmallUpdate::GetApplyStage(percentage, stage, error);
    if (percentage != 40 || stage != "program" || !error.empty())
        state.SkipWithError("the reader does not see the apply at 40%");
    for (auto _ : state) {
        SmallUpdate::GetApplyStage(percentage, stage, error);
        benchmark::DoNotOptimize(percentage);
    }
}

// The download the vyx reader must see: a live pid in the pid file and wget's log with
// the announced length.
bool DownloadRunning() {
    int pid = 0;
    FILE* f = fopen(kPidFile, "re");
    if (f != nullptr) {
        if (fscanf(f, "%d", &pid) != 1)
            pid = 0;
        fclose(f);
    }
    if (pid <= 0 || kill(pid, 0) != 0) {
        fprintf(stderr, "status_poll_bench: no live download process in %s\n", kPidFile);
        return false;
    }
    char line[512];
    bool announced = false;
    f = fopen(kProgressLog, "re");
    while (f != nullptr && !announced && fgets(line, sizeof line, f) != nullptr)
        announced = strncmp(line, "Length: ", 8) == 0;
    if (f != nullptr)
        fclose(f);
    if (!announced)
        fprintf(stderr, "status_poll_bench: %s holds no \"Length:\" line yet\n", kProgressLog);
    return announced;
}

}  // namespace

int main(int argc, char** argv) {
    if (!kytobench::InsideSandbox("status_poll_bench") || !DownloadRunning())
        return 2;
    struct Pair {
        const char* reader;
        const char* baseline;
        void (*poll)(benchmark::State&);
        void (*read)(benchmark::State&);
        double goal;
    };
    const Pair pairs[] = {
        {"VyxUpdate::GetDownloadStatus", "open+read+close download status (vyx)", PollVyx,
         BaselineVyx, 10.0},
        {"SmallUpdate::GetDownloadStatus", "open+read+close download status (small)", PollSmall,
         BaselineSmall, 3.75},
        {"SmallUpdate::GetApplyStage", "open+read+close apply status", PollApply, BaselineApply,
         3.75},
        {"KLIBCFileGetKeyValue", "open+read+close download status (small)", KeyRead, nullptr, 1.25},
    };
    for (const Pair& p : pairs) {
        benchmark::RegisterBenchmark(p.reader, p.poll)->Unit(benchmark::kMicrosecond);
        if (p.read != nullptr)  // else the baseline of an earlier row serves
            benchmark::RegisterBenchmark(p.baseline, p.read)->Unit(benchmark::kMicrosecond);
    }
    kytobench::RatioReporter reporter;
    kytobench::RunWithDefaults(argc, argv, reporter);

    // Real time is what a poller waits; CPU time (this process's, kernel included) is
    // less disturbed by whatever else runs on the machine.
    printf(
        "\nmedians of the repetitions, microseconds per poll\n%-32s %8s %8s %6s %8s %8s %6s %6s\n",
        "reader", "poll", "1 read", "ratio", "poll cpu", "1 rd cpu", "ratio", "goal");
    for (const Pair& p : pairs) {
        double poll = reporter.Median(p.reader);
        double read = reporter.Median(p.baseline);
        double pollCpu = reporter.MedianCpu(p.reader);
        double readCpu = reporter.MedianCpu(p.baseline);
        if (poll <= 0 || read <= 0 || pollCpu <= 0 || readCpu <= 0)
            continue;
        printf("%-32s %8.2f %8.2f %6.2f %8.2f %8.2f %6.2f %6.2f\n", p.reader, poll, read,
               poll / read, pollCpu, readCpu, pollCpu / readCpu, p.goal);
    }
    return 0;
}
