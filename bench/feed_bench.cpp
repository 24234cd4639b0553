// Release feed benchmark (run by hand through bench/reader_bench.sh, inside the sandbox).
//
// Generates a feed of 10,000 items with 50 model elements each (about 107 MB), every item
// newer than the running system and installable over it, this device's model only in the
// last model element of the last item: the reader has to look at every model element of
// the file.  Times VyxUpdate::ParseRssFile on it against "grep -c '<model>'" over the same
// file (a child process whose output is read through a pipe: GNU grep stops at the first
// match when its output is /dev/null) and prints both throughputs and their ratio; goal:
// the reader at a third of grep's throughput or better.
#include <fcntl.h>
#include <spawn.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "bench_ratio.h"
#include "vyxupdate.h"

extern char** environ;

namespace {

const char* const kRssFile = "/var/run/autoupdate_tmp_file_RSS";
constexpr int kItems = 10000;
constexpr int kModels = 50;
const char* const kParseName = "VyxUpdate::ParseRssFile";
const char* const kGrepName = "grep -c '<model>'";

std::string Link(int build, const std::string& model) {
    return "http://update.kyto.local/releases/5.3.0/" + std::to_string(build) + "/VYX_" + model +
           "_5.3.0_" + std::to_string(build) + ".img";
}

std::string Checksum(unsigned& seed) {
    static const char kHex[] = "0123456789abcdef";
    std::string sum;
    for (int i = 0; i < 32; ++i) {
        seed = seed * 1103515245u + 12345u;
        sum.push_back(kHex[(seed >> 16) & 15]);
    }
    return sum;
}

// Writes the feed; gives back its size and the values the reader must find.
bool WriteFeed(const char* deviceModel, size_t& bytes, std::string& link, std::string& sum) {
    FILE* f = fopen(kRssFile, "we");
    if (f == nullptr)
        return false;
    unsigned seed = 1;
    fputs(
        "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<rss version=\"2.0\">\n<channel>\n"
        "\t<title>VYX releases</title>\n\t<link>http://update.kyto.local/</link>\n"
        "\t<pubDate>Thu, 01 Oct 2026 00:00:00 GMT</pubDate>\n"
        "\t<copyright>Kyto</copyright>\n",
        f);
    for (int item = 0; item < kItems; ++item) {
        const int build = 6000 + item;
        fprintf(f,
                "\t<item>\n\t\t<title>VYX 5.3.0 build %d</title>\n\t\t<MajorVer>5</MajorVer>\n"
                "\t\t<MinorVer>3</MinorVer>\n\t\t<BuildPhase>GM</BuildPhase>\n"
                "\t\t<BuildNum>%d</BuildNum>\n\t\t<BuildDate>2026/11/01</BuildDate>\n"
                "\t\t<ReqMajorVer>5</ReqMajorVer>\n\t\t<ReqMinorVer>0</ReqMinorVer>\n"
                "\t\t<ReqBuildPhase>GM</ReqBuildPhase>\n\t\t<ReqBuildNum>4000</ReqBuildNum>\n"
                "\t\t<ReqBuildDate>2025/01/01</ReqBuildDate>\n",
                build, build);
        for (int m = 1; m <= kModels; ++m) {
            char name[32];
            snprintf(name, sizeof name, "model_%02d", m);
            std::string model = item == kItems - 1 && m == kModels ? deviceModel : name;
            std::string modelLink = Link(build, model);
            std::string modelSum = Checksum(seed);
            fprintf(f,
                    "\t\t<model>\n\t\t\t<mUnique>%s</mUnique>\n\t\t\t<mLink>%s</mLink>\n"
                    "\t\t\t<mCheckSum>%s</mCheckSum>\n\t\t</model>\n",
                    model.c_str(), modelLink.c_str(), modelSum.c_str());
            if (model == deviceModel) {
                link = modelLink;
                sum = modelSum;
            }
        }
        fputs("\t</item>\n", f);
    }
    fputs("</channel>\n</rss>\n", f);
    long end = ftell(f);
    bool ok = end > 0 && fclose(f) == 0;
    bytes = ok ? static_cast<size_t>(end) : 0;
    return ok;
}

_tag_vyxinfo_ g_current;
size_t g_bytes = 0;

void Parse(benchmark::State& state) {
    for (auto _ : state) {
        bool found = false;
        _tag_vyxinfo_ release;
        memset(&release, 0, sizeof release);
        if (VyxUpdate::ParseRssFile(false, g_current, found, release) != 1 || !found)
            state.SkipWithError("the reader did not find this device's release");
        benchmark::DoNotOptimize(release);
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * g_bytes));
}

// Runs grep -c over the feed, its output read through a pipe; the count it printed, or
// -1 when it could not run.
long GrepCount() {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0)
        return -1;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, fds[1], 1);
    char grep[] = "grep";
    char count[] = "-c";
    char pattern[] = "<model>";
    char path[64];
    snprintf(path, sizeof path, "%s", kRssFile);
    char* argv[] = {grep, count, pattern, path, nullptr};
    pid_t pid = -1;
    int rc = posix_spawn(&pid, "/bin/grep", &actions, nullptr, argv, environ);
    posix_spawn_file_actions_destroy(&actions);
    close(fds[1]);
    char out[64] = {0};
    ssize_t n = rc == 0 ? read(fds[0], out, sizeof out - 1) : -1;
    close(fds[0]);
    int status = 0;
    if (rc != 0 || waitpid(pid, &status, 0) != pid || !WIFEXITED(status) ||
        WEXITSTATUS(status) != 0 || n <= 0)
        return -1;
    return strtol(out, nullptr, 10);
}

void Grep(benchmark::State& state) {
    for (auto _ : state) {
        if (GrepCount() != static_cast<long>(kItems) * kModels)
            state.SkipWithError("grep did not count every model element");
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * g_bytes));
}

}  // namespace

int main(int argc, char** argv) {
    if (!kytobench::InsideSandbox("feed_bench"))
        return 2;
    memset(&g_current, 0, sizeof g_current);
    if (!VyxUpdate::GetVyxInfo(g_current)) {
        fprintf(stderr, "feed_bench: cannot read the running version\n");
        return 2;
    }
    std::string link, sum;
    if (!WriteFeed(g_current.unique, g_bytes, link, sum)) {
        fprintf(stderr, "feed_bench: cannot write %s\n", kRssFile);
        return 2;
    }
    // The answer the reader must give, checked once before anything is timed.
    bool found = false;
    _tag_vyxinfo_ release;
    memset(&release, 0, sizeof release);
    if (VyxUpdate::ParseRssFile(false, g_current, found, release) != 1 || !found ||
        strcmp(release.buildNum, "15999") != 0 || strcmp(release.unique, g_current.unique) != 0 ||
        link != release.link || sum != release.checksum) {
        fprintf(stderr, "feed_bench: the reader did not pick the last item's model\n");
        return 1;
    }
    printf("feed: %s, %zu bytes, %d items x %d models\n", kRssFile, g_bytes, kItems, kModels);

    benchmark::RegisterBenchmark(kParseName, Parse)->Unit(benchmark::kMillisecond)->UseRealTime();
    benchmark::RegisterBenchmark(kGrepName, Grep)->Unit(benchmark::kMillisecond)->UseRealTime();
    kytobench::RatioReporter reporter;
    kytobench::RunWithDefaults(argc, argv, reporter);

    double parse = reporter.Median(kParseName);
    double grep = reporter.Median(kGrepName);
    unlink(kRssFile);
    if (parse <= 0 || grep <= 0)
        return 1;
    const double mb = static_cast<double>(g_bytes) / 1e6;
    printf(
        "\nParseRssFile %.1f ms (%.0f MB/s), grep -c %.1f ms (%.0f MB/s): the reader runs at "
        "%.2f of grep's throughput (goal 0.33 or more)\n",
        parse, mb / (parse / 1e3), grep, mb / (grep / 1e3), grep / parse);
    return 0;
}
