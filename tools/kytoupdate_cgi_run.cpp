// kytoupdate-cgi's runs of kytoupdate: fixed argument words only, never a shell; a check,
// cancel or apply waited for with its output captured, a download started detached.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <memory>
#include <sstream>

#include "json_members.h"
#include "kytoupdate_cgi.h"
#include "kytoupdate_exit.h"
#include "scoped.h"

namespace kytoupdate::cgi {

namespace {

// The start of kytoupdate's notes and errors on standard error.
const std::string kNotePrefix = "kytoupdate: ";

// How long a request waits for a download to begin or be refused (the check comes first).
constexpr int kStartWaitMs = 30 * 1000;
constexpr int kPollMs = 100;

// What a supervisor keeps of a download's output for its record: the end is what counts.
constexpr size_t kKeptOutput = 64 * 1024;

// In a child: standard input from /dev/null, output and errors onto the given descriptors,
// every other descriptor closed, then the program with its fixed words.
[[noreturn]] void ExecChild(const Config& c, const char* word, const char* flag, int out, int err) {
    const int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
    if (null < 0 || dup2(null, 0) < 0 || dup2(out, 1) < 0 || dup2(err, 2) < 0)
        _exit(127);
    close_range(3, ~0U, 0);
    signal(SIGPIPE, SIG_DFL);
    const char* argv[] = {c.program.c_str(), word, flag, nullptr};
    execv(c.program.c_str(), const_cast<char* const*>(argv));
    _exit(127);
}

int ExitCode(int status) {
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// Reads two pipes to their ends.
void Drain(int outFd, int errFd, std::string& out, std::string& err) {
    struct pollfd p[2] = {{outFd, POLLIN, 0}, {errFd, POLLIN, 0}};
    std::string* dest[2] = {&out, &err};
    int open = 2;
    char buf[4096];
    while (open > 0) {
        if (poll(p, 2, -1) < 0) {
            if (errno == EINTR)
                continue;
            return;
        }
        for (int i = 0; i < 2; ++i) {
            if (p[i].fd < 0 || !(p[i].revents & (POLLIN | POLLHUP | POLLERR)))
                continue;
            const ssize_t n = kyto::ReadRetry(p[i].fd, buf, sizeof(buf));
            if (n > 0) {
                dest[i]->append(buf, static_cast<size_t>(n));
            } else {
                p[i].fd = -1;
                --open;
            }
        }
    }
}

bool Pipe(kyto::UniqueFd& read, kyto::UniqueFd& write) {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0)
        return false;
    read.reset(fds[0]);
    write.reset(fds[1]);
    return true;
}

Json::Value RunningRecord() {
    Json::Value v(Json::objectValue);
    v["action"] = "download";
    v["running"] = true;
    v["time"] = static_cast<Json::Int64>(time(nullptr));
    return v;
}

// Sends one record to the request that started the download, once; a request that has
// stopped waiting is no harm.
void Report(kyto::UniqueFd& report, const Json::Value& record) {
    if (!report.valid())
        return;
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    kyto::WriteAll(report.get(), Json::writeString(b, record));
    report.reset();
}

// True when download.json names a running download of another, live, process.
bool AnotherDownloadRuns(const Config& c) {
    const Json::Value record = DownloadRecord(c);
    return record.isObject() && record["running"].asBool() && record["pid"].asInt64() != getpid();
}

// In the detached process: runs the download with its output appended to the log.  Once
// kytoupdate says it is downloading, the running record (with this process's pid) goes to
// download.json and to the request; at the end, the end goes to download.json, unless the download
// never began because another is running (whose record stays), and to a request still
// waiting (a refusal, an up-to-date system, an unreachable server).
[[noreturn]] void Supervise(const Config& c, kyto::UniqueFd report) {
    signal(SIGPIPE, SIG_IGN);
    kyto::UniqueFd read, write;
    if (!Pipe(read, write))
        _exit(1);
    kyto::UniqueFd log(
        open(c.Path("download.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    const pid_t pid = fork();
    if (pid == 0)
        ExecChild(c, "download", nullptr, write.get(), write.get());
    write.reset();
    Result r;
    bool started = false;
    char buf[4096];
    ssize_t n;
    while ((n = kyto::ReadRetry(read.get(), buf, sizeof(buf))) > 0) {
        r.err.append(buf, static_cast<size_t>(n));
        if (log.valid() && !kyto::WriteAll(log.get(), buf, static_cast<size_t>(n)))
            log.reset();
        if (!started && r.err.find(kNotePrefix + "downloading ") != std::string::npos) {
            started = true;
            Json::Value running = RunningRecord();
            running["pid"] = static_cast<Json::Int64>(getpid());
            WriteJson(c.Path("download.json"), running);
            Report(report, running);
        }
        if (r.err.size() > 2 * kKeptOutput)
            r.err.erase(0, r.err.size() - kKeptOutput);
    }
    int status = 0;
    r.exit = pid > 0 && kyto::WaitForChild(pid, &status) == pid ? ExitCode(status) : 127;
    Json::Value end = ActionRecord("download", r);
    end["output"] = LastLine(r.err);
    if (started || !AnotherDownloadRuns(c))
        WriteJson(c.Path("download.json"), end);
    Report(report, end);
    _exit(0);
}

}  // namespace

Result Run(const Config& c, const char* word, const char* flag) {
    Result r;
    kyto::UniqueFd outRead, outWrite, errRead, errWrite;
    if (!Pipe(outRead, outWrite) || !Pipe(errRead, errWrite))
        return r;
    const pid_t pid = fork();
    if (pid < 0)
        return r;
    if (pid == 0)
        ExecChild(c, word, flag, outWrite.get(), errWrite.get());
    outWrite.reset();
    errWrite.reset();
    Drain(outRead.get(), errRead.get(), r.out, r.err);
    int status = 0;
    if (kyto::WaitForChild(pid, &status) == pid)
        r.exit = ExitCode(status);
    return r;
}

Json::Value ActionRecord(const char* action, const Result& r) {
    Json::Value v(Json::objectValue);
    v["action"] = action;
    v["exit"] = r.exit;
    v["words"] = ExitWords(r.exit);
    std::string out = r.out;
    while (!out.empty() && (out.back() == '\n' || out.back() == ' '))
        out.pop_back();
    v["output"] = out;
    v["message"] = LastNote(r.err);
    v["running"] = false;
    v["time"] = static_cast<Json::Int64>(time(nullptr));
    return v;
}

Json::Value StartDownload(const Config& c) {
    kyto::UniqueFd reportRead, reportWrite;
    if (!Pipe(reportRead, reportWrite))
        return ActionRecord("download", Result());
    const pid_t pid = fork();
    if (pid == 0) {
        // Away from the request: no terminal, no hang-up, and none of the server's pipes
        // held open (the server waits for their end before it answers).
        setsid();
        signal(SIGHUP, SIG_IGN);
        reportRead.reset();
        const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
        if (null < 0 || dup2(null, 0) < 0 || dup2(null, 1) < 0 || dup2(null, 2) < 0)
            _exit(1);
        if (fork() != 0)
            _exit(0);
        Supervise(c, std::move(reportWrite));
    }
    reportWrite.reset();
    if (pid < 0)
        return ActionRecord("download", Result());
    kyto::WaitForChild(pid, nullptr);
    // The first record: running, or the end of a download that never began.
    std::string text;
    struct pollfd p = {reportRead.get(), POLLIN, 0};
    char buf[4096];
    for (int waited = 0; waited < kStartWaitMs && poll(&p, 1, kPollMs) >= 0; waited += kPollMs) {
        if (!(p.revents & (POLLIN | POLLHUP | POLLERR)))
            continue;
        const ssize_t n = kyto::ReadRetry(reportRead.get(), buf, sizeof(buf));
        if (n <= 0)
            break;
        text.append(buf, static_cast<size_t>(n));
    }
    Json::Value first;
    Json::CharReaderBuilder builder;
    const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    if (!reader->parse(text.data(), text.data() + text.size(), &first, nullptr) ||
        !first.isObject())
        return RunningRecord();  // still checking: the page's polling shows what comes
    return first;
}

Json::Value DownloadRecord(const Config& c) {
    Json::Value record = ReadJson(c.Path("download.json"));
    if (!record.isObject() || !record["running"].asBool() || !record["pid"].isIntegral())
        return record;
    const pid_t pid = static_cast<pid_t>(record["pid"].asInt64());
    if (pid > 0 && kill(pid, 0) != 0 && errno == ESRCH) {
        record["running"] = false;
        record["exit"] = kExitFailed;
        record["words"] = "The download ended without a word (its process is gone).";
    }
    return record;
}

std::string LastNote(const std::string& text) {
    std::istringstream in(text);
    std::string line, note;
    while (std::getline(in, line))
        if (line.compare(0, kNotePrefix.size(), kNotePrefix) == 0)
            note = line.substr(kNotePrefix.size());
    return note;
}

std::string LastLine(const std::string& text) {
    std::istringstream in(text);
    std::string line, last;
    while (std::getline(in, line))
        if (!line.empty() && line.compare(0, kNotePrefix.size(), kNotePrefix) != 0)
            last = line;
    return last;
}

Json::Value ReadJson(const std::string& path) {
    std::ifstream in(path);
    Json::Value v;
    Json::CharReaderBuilder builder;
    std::string errors;
    if (!in || !Json::parseFromStream(builder, in, &v, &errors))
        return Json::Value(Json::nullValue);
    return v;
}

void WriteJson(const std::string& path, const Json::Value& value) {
    kyto::DumpJsonAtomically(path.c_str(), value, false);
}

}  // namespace kytoupdate::cgi
