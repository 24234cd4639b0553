// kytoupdate-cgi: the back end of the sample update page (www/), run as CGI by fcgiwrap
// behind nginx.  GET /api/status answers the JSON of `kytoupdate status --json` with the
// installed version, the last check's answer and the last action's end; POST
// /api/check|download|cancel|apply runs `kytoupdate <action>` (never through a shell, only
// these four names).  A download runs detached from the request (its own session, output
// appended to download.log in the state folder) and survives the browser closing.  Only
// the page's own origin may post.  Settings come from the server's CGI variables:
// KYTOUPDATE (the program, default /usr/bin/kytoupdate) and KYTO_PAGE_STATE (the state
// folder, default /run/kyto-page).
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <iostream>
#include <sstream>
#include <string>
#include <vector>

#include <json/json.h>

namespace {

// Owns one descriptor.
class Fd {
  public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    ~Fd() { Reset(); }
    int Get() const { return fd_; }
    void Reset() {
        if (fd_ >= 0)
            close(fd_);
        fd_ = -1;
    }

  private:
    int fd_;
};

struct Config {
    std::string program = "/usr/bin/kytoupdate";
    std::string state = "/run/kyto-page";
};

struct Result {
    int exit = -1;
    std::string out, err;
};

std::string Env(const char* name) {
    const char* v = getenv(name);
    return v ? v : "";
}

std::string ReadFile(const std::string& path) {
    std::ifstream in(path);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

// Write-temp-then-rename, so that a reader sees the old file or the new one.
void WriteFile(const std::string& path, const std::string& text) {
    const std::string tmp = path + ".tmp." + std::to_string(getpid());
    {
        Fd fd(open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
        if (fd.Get() < 0 || write(fd.Get(), text.data(), text.size()) != (ssize_t)text.size()) {
            unlink(tmp.c_str());
            return;
        }
    }
    rename(tmp.c_str(), path.c_str());
}

std::string Compact(const Json::Value& v) {
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    return Json::writeString(b, v);
}

Json::Value ParseJson(const std::string& text) {
    Json::Value v;
    Json::CharReaderBuilder b;
    std::string errors;
    std::istringstream in(text);
    if (!Json::parseFromStream(b, in, &v, &errors))
        return Json::Value(Json::nullValue);
    return v;
}

// The last "kytoupdate: ..." note of a program's standard error, without the prefix.
std::string LastNote(const std::string& err) {
    std::istringstream in(err);
    std::string line, note;
    while (std::getline(in, line))
        if (line.rfind("kytoupdate: ", 0) == 0)
            note = line.substr(12);
    return note;
}

// The last line of a program's output that is not a note ("downloaded smallupdate ...").
std::string LastLine(const std::string& text) {
    std::istringstream in(text);
    std::string line, last;
    while (std::getline(in, line))
        if (!line.empty() && line.rfind("kytoupdate: ", 0) != 0)
            last = line;
    return last;
}

std::string Trim(std::string s) {
    while (!s.empty() && (s.back() == '\n' || s.back() == ' '))
        s.pop_back();
    return s;
}

// In a child: standard input from /dev/null, out and err onto the given descriptors, every
// other descriptor closed, then the program with one or two fixed words.
[[noreturn]] void ExecChild(const Config& c, const char* word, const char* flag, int out, int err) {
    int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
    if (null < 0 || dup2(null, 0) < 0 || dup2(out, 1) < 0 || dup2(err, 2) < 0)
        _exit(127);
    close_range(3, ~0U, 0);
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
    while (open > 0 && poll(p, 2, -1) > 0) {
        for (int i = 0; i < 2; ++i) {
            if (p[i].fd < 0 || !(p[i].revents & (POLLIN | POLLHUP | POLLERR)))
                continue;
            ssize_t n = read(p[i].fd, buf, sizeof(buf));
            if (n > 0) {
                dest[i]->append(buf, n);
            } else {
                p[i].fd = -1;
                --open;
            }
        }
    }
}

// Runs the program with its output captured; waits for it.
Result Run(const Config& c, const char* word, const char* flag = nullptr) {
    Result r;
    int o[2], e[2];
    if (pipe2(o, O_CLOEXEC) != 0)
        return r;
    Fd oRead(o[0]), oWrite(o[1]);
    if (pipe2(e, O_CLOEXEC) != 0)
        return r;
    Fd eRead(e[0]), eWrite(e[1]);
    pid_t pid = fork();
    if (pid < 0)
        return r;
    if (pid == 0)
        ExecChild(c, word, flag, oWrite.Get(), eWrite.Get());
    oWrite.Reset();
    eWrite.Reset();
    Drain(oRead.Get(), eRead.Get(), r.out, r.err);
    int status = 0;
    waitpid(pid, &status, 0);
    r.exit = ExitCode(status);
    return r;
}

Json::Value ActionRecord(const char* action, const Result& r) {
    Json::Value v(Json::objectValue);
    v["action"] = action;
    v["exit"] = r.exit;
    v["output"] = Trim(r.out);
    v["message"] = LastNote(r.err);
    v["running"] = false;
    v["time"] = static_cast<Json::Int64>(time(nullptr));
    return v;
}

// In the detached process: runs the download, appends its output to the log, and records
// its end as the last action.
[[noreturn]] void Supervise(const Config& c) {
    int p[2];
    if (pipe2(p, O_CLOEXEC) != 0)
        _exit(1);
    Fd pRead(p[0]), pWrite(p[1]);
    Fd log(
        open((c.state + "/download.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
    pid_t pid = fork();
    if (pid == 0)
        ExecChild(c, "download", nullptr, pWrite.Get(), pWrite.Get());
    pWrite.Reset();
    Result r;
    char buf[4096];
    ssize_t n;
    while ((n = read(pRead.Get(), buf, sizeof(buf))) > 0) {
        r.err.append(buf, n);
        if (log.Get() >= 0 && write(log.Get(), buf, n) != n)
            log.Reset();
    }
    int status = 0;
    if (pid > 0)
        waitpid(pid, &status, 0);
    r.exit = pid > 0 ? ExitCode(status) : 127;
    Json::Value rec = ActionRecord("download", r);
    rec["output"] = LastLine(r.err);
    WriteFile(c.state + "/last.json", Compact(rec));
    _exit(0);
}

// Starts the download in its own session (double fork) and waits up to a second for a
// quick end, such as the library refusing a second download.
Json::Value StartDownload(const Config& c) {
    Json::Value running(Json::objectValue);
    running["action"] = "download";
    running["running"] = true;
    running["time"] = static_cast<Json::Int64>(time(nullptr));
    const std::string last = c.state + "/last.json";
    WriteFile(last, Compact(running));
    pid_t pid = fork();
    if (pid == 0) {
        setsid();
        signal(SIGHUP, SIG_IGN);
        if (fork() != 0)
            _exit(0);
        Supervise(c);
    }
    if (pid > 0)
        waitpid(pid, nullptr, 0);
    for (int i = 0; i < 10; ++i) {
        struct timespec ts {
            0, 100 * 1000 * 1000
        };
        nanosleep(&ts, nullptr);
        Json::Value now = ParseJson(ReadFile(last));
        if (now.isObject() && !now["running"].asBool())
            return now;
    }
    return running;
}

// The installed version and small-fix level from the appliance's version file.
Json::Value Installed() {
    std::istringstream in(ReadFile("/etc.defaults/VERSION"));
    std::string line;
    Json::Value keys(Json::objectValue);
    while (std::getline(in, line)) {
        size_t eq = line.find('=');
        if (eq == std::string::npos)
            continue;
        std::string value = line.substr(eq + 1);
        if (value.size() >= 2 && value.front() == '"' && value.back() == '"')
            value = value.substr(1, value.size() - 2);
        keys[line.substr(0, eq)] = value;
    }
    Json::Value v(Json::objectValue);
    v["version"] = keys["majorversion"].asString() + "." + keys["minorversion"].asString() + "-" +
                   keys["buildnumber"].asString();
    v["smallfix"] = atoi(keys.get("smallfixnumber", "0").asString().c_str());
    return v;
}

Json::Value Status(const Config& c) {
    Result r = Run(c, "status", "--json");
    Json::Value v(Json::objectValue);
    v["status"] = ParseJson(r.out);
    if (r.exit != 0)
        v["error"] = LastNote(r.err).empty() ? "the status could not be read" : LastNote(r.err);
    v["installed"] = Installed();
    v["check"] = ParseJson(ReadFile(c.state + "/check.json"));
    v["last"] = ParseJson(ReadFile(c.state + "/last.json"));
    // The download's last progress line ("33%  package 2 of 3  532.7 KiB/s  0:03 left").
    std::string log = ReadFile(c.state + "/download.log");
    v["progress"] = LastLine(log.size() > 4096 ? log.substr(log.size() - 4096) : log);
    return v;
}

Json::Value Act(const Config& c, const std::string& action) {
    if (action == "download")
        return StartDownload(c);
    Json::Value rec = ActionRecord(action.c_str(), Run(c, action.c_str()));
    if (action == "check" || (action == "apply" && rec["exit"].asInt() == 0))
        WriteFile(c.state + "/check.json", action == "check" ? Compact(rec) : "null");
    WriteFile(c.state + "/last.json", Compact(rec));
    return rec;
}

void Reply(int code, const char* reason, const Json::Value& body, const char* extra = "") {
    std::cout << "Status: " << code << " " << reason << "\r\n"
              << "Content-Type: application/json\r\n"
              << "Cache-Control: no-store\r\n"
              << extra << "\r\n"
              << Compact(body) << "\n";
}

void ReplyError(int code, const char* reason, const std::string& text, const char* extra = "") {
    Json::Value v(Json::objectValue);
    v["error"] = text;
    Reply(code, reason, v, extra);
}

// A post must come from the page itself: Sec-Fetch-Site, when sent, says same-origin, and
// Origin, which is required, is the page's origin (KYTO_PAGE_ORIGIN, set by the server from
// the request's scheme and Host).
bool SameOrigin() {
    const std::string site = Env("HTTP_SEC_FETCH_SITE");
    if (!site.empty() && site != "same-origin")
        return false;
    const std::string origin = Env("HTTP_ORIGIN"), page = Env("KYTO_PAGE_ORIGIN");
    return !origin.empty() && origin == page;
}

int Serve(const Config& c) {
    const std::string method = Env("REQUEST_METHOD");
    std::string path = Env("DOCUMENT_URI");
    const std::string prefix = "/api/";
    const std::string name = path.rfind(prefix, 0) == 0 ? path.substr(prefix.size()) : "";
    const bool action =
        name == "check" || name == "download" || name == "cancel" || name == "apply";
    if (name == "status") {
        if (method != "GET" && method != "HEAD")
            ReplyError(405, "Method Not Allowed", "status is read with GET", "Allow: GET\r\n");
        else
            Reply(200, "OK", Status(c));
    } else if (!action) {
        ReplyError(404, "Not Found", "no such action");
    } else if (method != "POST") {
        ReplyError(405, "Method Not Allowed", "actions are posted", "Allow: POST\r\n");
    } else if (!SameOrigin()) {
        ReplyError(403, "Forbidden", "only the update page itself may post");
    } else {
        Reply(200, "OK", Act(c, name));
    }
    return 0;
}

}  // namespace

int main() {
    Config c;
    if (!Env("KYTOUPDATE").empty())
        c.program = Env("KYTOUPDATE");
    if (!Env("KYTO_PAGE_STATE").empty())
        c.state = Env("KYTO_PAGE_STATE");
    mkdir(c.state.c_str(), 0755);
    return Serve(c);
}
