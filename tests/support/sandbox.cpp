// Shared test helpers for code that runs inside the kyto-sandbox root.
#include "sandbox.h"
#include "scoped.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <ftw.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cmath>
#include <set>
#include <sstream>
#include <thread>

#include <kytoplatform/klibc.h>

namespace kytotest {
namespace {

constexpr const char* kMarkerFile = "/.kyto-sandbox";
constexpr long kOverlayMagic = 0x794c7630;
constexpr const char* kSyslogFile = "/var/log/sandbox.syslog";
constexpr const char* kSyslogSocket = "/dev/log";
constexpr const char* kFlushTag = "kyto-sandbox-flush";
constexpr const char* kCallsLog = "/var/log/kyto-calls.log";

// Byte offset in the syslog file before which lines are forgotten (ClearSyslog).
size_t g_syslogStart = 0;

std::string FdTarget(int fd) {
    char link[64], target[4096];
    snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
    ssize_t n = readlink(link, target, sizeof target - 1);
    if (n < 0)
        return "?";
    return std::string(target, static_cast<size_t>(n));
}

// Descriptors that libraries keep open for the life of the process on purpose and that are
// not a leak of the code under test: the random device a crypto library may cache.
bool IsLongLivedLibraryFd(int fd) {
    std::string target = FdTarget(fd);
    return target == "/dev/urandom" || target == "/dev/random";
}

std::vector<std::string> SplitLines(const std::string& text) {
    std::vector<std::string> lines;
    std::string line;
    std::istringstream in(text);
    while (std::getline(in, line))
        lines.push_back(line);
    return lines;
}

// Undoes the catcher's escaping of backslash and newline.
std::string Unescape(const std::string& s) {
    std::string out;
    out.reserve(s.size());
    for (size_t i = 0; i < s.size(); ++i) {
        if (s[i] == '\\' && i + 1 < s.size()) {
            ++i;
            out += s[i] == 'n' ? '\n' : s[i];
        } else {
            out += s[i];
        }
    }
    return out;
}

bool IsDigit(char c) {
    return std::isdigit(static_cast<unsigned char>(c)) != 0;
}

// Length of a leading syslog timestamp ("Nov 22 03:10:00 " or an RFC 3339 one), else 0.
size_t TimestampLength(const std::string& s, size_t pos) {
    const std::string rest = s.substr(pos);
    if (rest.size() >= 16 && std::isalpha(static_cast<unsigned char>(rest[0])) && rest[3] == ' ' &&
        rest[6] == ' ' && rest[9] == ':' && rest[12] == ':' && rest[15] == ' ')
        return 16;
    if (rest.size() >= 20 && IsDigit(rest[0]) && IsDigit(rest[3]) && rest[4] == '-' &&
        rest[10] == 'T') {
        size_t sp = rest.find(' ');
        return sp == std::string::npos ? 0 : sp + 1;
    }
    return 0;
}

LogLine ParseLogLine(const std::string& raw) {
    LogLine line;
    std::string s = Unescape(raw);
    size_t pos = 0;
    if (!s.empty() && s[0] == '<') {
        size_t close = s.find('>');
        if (close != std::string::npos && close > 1) {
            line.priority = atoi(s.substr(1, close - 1).c_str()) & LOG_PRIMASK;
            pos = close + 1;
        }
    }
    pos += TimestampLength(s, pos);
    size_t colon = s.find(": ", pos);
    if (colon != std::string::npos && s.find(' ', pos) >= colon) {
        line.tag = s.substr(pos, colon - pos);
        line.message = s.substr(colon + 2);
    } else {
        line.message = s.substr(pos);
    }
    return line;
}

// Sends a unique marker to the catcher and waits until it is in the file, so every message
// sent before it has been written.  Returns the file's content from the last Clear on, or
// nullopt when the catcher did not answer.
std::optional<std::string> FlushSyslog() {
    static unsigned counter = 0;
    char marker[128];
    snprintf(marker, sizeof marker, "<15>%s: %d-%u", kFlushTag, static_cast<int>(getpid()),
             ++counter);
    std::string token = std::string(marker).substr(4);

    int sock = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (sock < 0) {
        ADD_FAILURE() << "cannot create a socket: " << strerror(errno);
        return std::nullopt;
    }
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    strcpy(addr.sun_path, kSyslogSocket);
    ssize_t sent =
        sendto(sock, marker, strlen(marker), 0, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    int err = errno;
    close(sock);
    if (sent < 0) {
        ADD_FAILURE() << "cannot send to " << kSyslogSocket << ": " << strerror(err);
        return std::nullopt;
    }
    for (int i = 0; i < 5000; ++i) {
        std::string all = ReadFile(kSyslogFile).value_or("");
        if (all.find(token + "\n") != std::string::npos)
            return all.size() > g_syslogStart ? all.substr(g_syslogStart) : std::string();
        struct timespec ts = {0, 2 * 1000 * 1000};
        nanosleep(&ts, nullptr);
    }
    ADD_FAILURE() << "the syslog catcher did not write the flush marker within 10 s";
    return std::nullopt;
}

void MakeDirs(const std::string& path) {
    for (size_t pos = 1; pos <= path.size(); ++pos) {
        if (pos != path.size() && path[pos] != '/')
            continue;
        std::string part = path.substr(0, pos);
        if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST)
            ADD_FAILURE() << "cannot create folder " << part << ": " << strerror(errno);
    }
}

std::string ParentOf(const std::string& path) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos)
        return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

// Splits "key=value" / key="value"; false for blank lines, comments and lines without '='.
bool SplitKeyValue(const std::string& line, std::string* key, std::string* value) {
    if (line.empty() || line[0] == '#')
        return false;
    size_t eq = line.find('=');
    if (eq == std::string::npos || eq == 0)
        return false;
    *key = line.substr(0, eq);
    *value = line.substr(eq + 1);
    if (value->size() >= 2 && value->front() == '"' && value->back() == '"')
        *value = value->substr(1, value->size() - 2);
    return true;
}

}  // namespace

// ---- Sandbox ----------------------------------------------------------------------------

bool InSandbox() {
    struct stat st;
    struct statfs fs;
    if (lstat(kMarkerFile, &st) != 0 || !S_ISREG(st.st_mode))
        return false;
    if (statfs("/", &fs) != 0)
        return false;
    return static_cast<long>(fs.f_type) == kOverlayMagic;
}

// glibc keeps the /dev/log socket of syslog() open after the first message; it is closed
// before the descriptor sets are taken so the library's logging never counts as a leak.
void SandboxTest::SetUp() {
    ASSERT_TRUE(InSandbox()) << "this test must run inside tests/kyto-sandbox (use ctest)";
    closelog();
    fds_at_start_ = OpenFds();
}

void SandboxTest::TearDown() {
    closelog();
    std::vector<int> now = OpenFds();
    std::set<int> before(fds_at_start_.begin(), fds_at_start_.end());
    std::string leaked;
    for (int fd : now) {
        if (before.count(fd) != 0 || IsLongLivedLibraryFd(fd))
            continue;
        leaked += " " + std::to_string(fd) + " -> " + FdTarget(fd) + ";";
    }
    EXPECT_TRUE(leaked.empty()) << "descriptors left open by the test:" << leaked;

    std::vector<pid_t> children = LiveChildren();
    std::string left;
    for (pid_t pid : children) {
        std::string comm = ReadFile("/proc/" + std::to_string(pid) + "/comm").value_or("?\n");
        left += " " + std::to_string(pid) + " (" + comm.substr(0, comm.size() - 1) + ")";
    }
    EXPECT_TRUE(children.empty()) << "child processes left behind:" << left;
}

// ---- Syslog -----------------------------------------------------------------------------

std::vector<LogLine> SyslogLines() {
    std::vector<LogLine> lines;
    std::optional<std::string> text = FlushSyslog();
    if (!text)
        return lines;
    for (const std::string& raw : SplitLines(*text)) {
        LogLine line = ParseLogLine(raw);
        if (line.tag == kFlushTag)
            continue;
        lines.push_back(std::move(line));
    }
    return lines;
}

std::vector<std::string> SyslogMessages(int priority) {
    std::vector<std::string> messages;
    for (const LogLine& line : SyslogLines()) {
        if (priority < 0 || line.priority == priority)
            messages.push_back(line.message);
    }
    return messages;
}

testing::AssertionResult Has(const std::string& text, const std::string& part) {
    if (text.find(part) != std::string::npos)
        return testing::AssertionSuccess();
    return testing::AssertionFailure() << "no \"" << part << "\" in:\n" << text;
}

bool SyslogContains(const std::string& text, int priority) {
    for (const std::string& message : SyslogMessages(priority)) {
        if (message.find(text) != std::string::npos)
            return true;
    }
    return false;
}

void ClearSyslog() {
    if (FlushSyslog())
        g_syslogStart = ReadFile(kSyslogFile).value_or("").size();
}

// ---- Files ------------------------------------------------------------------------------

std::optional<std::string> ReadFile(const std::string& path) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return std::nullopt;
    std::string content;
    char buf[65536];
    for (;;) {
        ssize_t n = read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0) {
            close(fd);
            return std::nullopt;
        }
        if (n == 0)
            break;
        content.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    return content;
}

void WriteFile(const std::string& path, const std::string& content, mode_t mode) {
    MakeDirs(ParentOf(path));
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    if (fd < 0) {
        ADD_FAILURE() << "cannot write " << path << ": " << strerror(errno);
        return;
    }
    bool ok = kyto::WriteAll(fd, content) && fchmod(fd, mode) == 0;
    int err = errno;
    close(fd);
    if (!ok)
        ADD_FAILURE() << "cannot write " << path << ": " << strerror(err);
}

bool PathExists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

bool IsDirectory(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

void RemoveTree(const std::string& path) {
    if (!PathExists(path))
        return;
    // Depth first, no symbolic links followed.  FTW_MOUNT is not usable here: on the
    // sandbox's overlay root, files copied up or left in the lower layer report another
    // device number than their folder.
    nftw(
        path.c_str(),
        [](const char* p, const struct stat*, int, struct FTW*) {
            remove(p);
            return 0;
        },
        16, FTW_DEPTH | FTW_PHYS);
    if (PathExists(path))
        ADD_FAILURE() << "cannot remove " << path;
}

std::vector<std::string> ListDir(const std::string& path) {
    std::vector<std::string> names;
    DIR* dir = opendir(path.c_str());
    if (dir == nullptr)
        return names;
    while (dirent* entry = readdir(dir)) {
        std::string name = entry->d_name;
        if (name != "." && name != "..")
            names.push_back(name);
    }
    closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

std::map<std::string, std::string> ReadKeyValueFile(const std::string& path) {
    std::map<std::string, std::string> values;
    std::optional<std::string> text = ReadFile(path);
    if (!text)
        return values;
    for (const std::string& line : SplitLines(*text)) {
        std::string key, value;
        if (SplitKeyValue(line, &key, &value))
            values.emplace(key, value);  // first one wins
    }
    return values;
}

void SetKeyValue(const std::string& path, const std::string& key,
                 const std::optional<std::string>& value) {
    std::string out;
    bool done = false;
    for (const std::string& line : SplitLines(ReadFile(path).value_or(""))) {
        std::string k, v;
        if (SplitKeyValue(line, &k, &v) && k == key) {
            if (value && !done)
                out += key + "=\"" + *value + "\"\n";
            done = true;
            continue;
        }
        out += line + "\n";
    }
    if (value && !done)
        out += key + "=\"" + *value + "\"\n";
    struct stat st;
    mode_t mode = stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0644;
    WriteFile(path, out, mode);
}

std::vector<std::string> FileLines(const std::string& path, const std::string& onlyWith) {
    std::vector<std::string> out;
    for (const std::string& line : SplitLines(ReadFile(path).value_or(""))) {
        if (line.find(onlyWith) != std::string::npos)
            out.push_back(line);
    }
    return out;
}

std::vector<std::string> StampedLines(const std::string& path) {
    std::vector<std::string> out;
    for (const std::string& line : FileLines(path)) {
        struct tm tm = {};
        const char* rest = strptime(line.c_str(), "%Y/%m/%d %H:%M:%S", &tm);
        if (line.size() < 20 || line[4] != '/' || rest != line.c_str() + 19 || *rest != '\t')
            continue;
        tm.tm_isdst = -1;
        if (std::abs(difftime(time(nullptr), mktime(&tm))) <= 120.0)
            out.push_back(rest + 1);
    }
    return out;
}

mode_t ModeOf(const std::string& path) {
    struct stat st {};
    if (stat(path.c_str(), &st) != 0) {
        ADD_FAILURE() << "cannot stat " << path << ": " << strerror(errno);
        return 0;
    }
    return st.st_mode & 07777;
}

Json::Value ParseJson(const std::string& text) {
    Json::Value value;
    if (!Json::Reader().parse(text, value, false))
        ADD_FAILURE() << "not JSON: " << text;
    return value;
}

std::string Md5Of(const std::string& path) {
    std::string out;
    if (!PathExists(path) || Shell("md5sum < '" + path + "'", &out) != 0 || out.size() < 32)
        return "";
    return out.substr(0, 32);
}

// ---- Volumes ----------------------------------------------------------------------------

void MountVolume(const std::string& mountPoint, unsigned long long sizeBytes, bool readOnly) {
    MakeDirs(mountPoint);
    std::string options = "size=" + std::to_string(sizeBytes) + ",mode=0755";
    unsigned long flags = MS_NOSUID | MS_NODEV | (readOnly ? MS_RDONLY : 0);
    if (mount("kytovolume", mountPoint.c_str(), "tmpfs", flags, options.c_str()) != 0)
        ADD_FAILURE() << "cannot mount a tmpfs volume at " << mountPoint << ": " << strerror(errno);
}

void UnmountVolume(const std::string& mountPoint) {
    if (umount2(mountPoint.c_str(), MNT_DETACH) != 0)
        ADD_FAILURE() << "cannot unmount " << mountPoint << ": " << strerror(errno);
    rmdir(mountPoint.c_str());
}

// ---- Processes and commands -------------------------------------------------------------

pid_t Spawn(const std::function<int()>& fn) {
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        int rc = fn();
        fflush(nullptr);
        _exit(rc);
    }
    if (pid < 0)
        ADD_FAILURE() << "cannot fork: " << strerror(errno);
    return pid;
}

pid_t SpawnIdle() {
    return Spawn([] {
        for (;;)
            pause();
        return 0;
    });
}

int Wait(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) {
            ADD_FAILURE() << "cannot wait for " << pid << ": " << strerror(errno);
            return -1;
        }
    }
    if (WIFEXITED(status))
        return WEXITSTATUS(status);
    if (WIFSIGNALED(status))
        return 128 + WTERMSIG(status);
    return -1;
}

int Shell(const std::string& command, std::string* output) {
    int pipefd[2] = {-1, -1};
    if (output != nullptr && pipe2(pipefd, O_CLOEXEC) != 0) {
        ADD_FAILURE() << "cannot create a pipe: " << strerror(errno);
        return -1;
    }
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        int devnull = open("/dev/null", O_RDONLY);
        if (devnull >= 0)
            dup2(devnull, 0);
        if (output != nullptr) {
            dup2(pipefd[1], 1);
            dup2(pipefd[1], 2);
        }
        execl("/bin/sh", "sh", "-c", command.c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    if (output != nullptr) {
        close(pipefd[1]);
        output->clear();
        char buf[4096];
        for (;;) {
            ssize_t n = read(pipefd[0], buf, sizeof buf);
            if (n < 0 && errno == EINTR)
                continue;
            if (n <= 0)
                break;
            output->append(buf, static_cast<size_t>(n));
        }
        close(pipefd[0]);
    }
    if (pid < 0) {
        ADD_FAILURE() << "cannot fork: " << strerror(errno);
        return -1;
    }
    return Wait(pid);
}

bool WaitFor(const std::function<bool()>& cond, int timeoutMs) {
    for (int waited = 0; waited < timeoutMs; waited += 20) {
        if (cond())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return cond();
}

void ClearLastError() {
    KLIBCErrSetEx(0, "", 0);
}

std::vector<pid_t> LiveChildren() {
    std::vector<pid_t> children;
    pid_t self = getpid();
    for (const std::string& name : ListDir("/proc")) {
        if (!std::all_of(name.begin(), name.end(), IsDigit))
            continue;
        std::optional<std::string> stat = ReadFile("/proc/" + name + "/stat");
        if (!stat)
            continue;
        // "pid (comm) state ppid ...": comm may hold spaces and parentheses.
        size_t close = stat->rfind(')');
        if (close == std::string::npos)
            continue;
        char state = 0;
        int ppid = 0;
        if (sscanf(stat->c_str() + close + 1, " %c %d", &state, &ppid) == 2 && ppid == self)
            children.push_back(static_cast<pid_t>(atoi(name.c_str())));
    }
    std::sort(children.begin(), children.end());
    return children;
}

std::vector<int> OpenFds() {
    std::vector<int> fds;
    DIR* dir = opendir("/proc/self/fd");
    if (dir == nullptr) {
        ADD_FAILURE() << "cannot list /proc/self/fd: " << strerror(errno);
        return fds;
    }
    int own = dirfd(dir);
    while (dirent* entry = readdir(dir)) {
        if (!IsDigit(entry->d_name[0]))
            continue;
        int fd = atoi(entry->d_name);
        if (fd != own)
            fds.push_back(fd);
    }
    closedir(dir);
    std::sort(fds.begin(), fds.end());
    return fds;
}

// ---- Recorded calls ---------------------------------------------------------------------

std::vector<std::vector<std::string>> RecordedCalls() {
    std::vector<std::vector<std::string>> calls;
    for (const std::string& line : SplitLines(ReadFile(kCallsLog).value_or(""))) {
        std::vector<std::string> fields;
        size_t start = 0;
        for (;;) {
            size_t tab = line.find('\t', start);
            fields.push_back(line.substr(start, tab - start));
            if (tab == std::string::npos)
                break;
            start = tab + 1;
        }
        calls.push_back(std::move(fields));
    }
    return calls;
}

void ClearRecordedCalls() {
    if (unlink(kCallsLog) != 0 && errno != ENOENT)
        ADD_FAILURE() << "cannot remove " << kCallsLog << ": " << strerror(errno);
}

int RaceReaderAgainstWriter(int writes, const std::function<bool(int)>& write,
                            const std::function<int()>& check) {
    const std::string stopMarker = "/tmp/race_writer_done";
    RemoveTree(stopMarker);
    pid_t reader = Spawn([&] {
        long reads = 0;
        for (bool done = false; !done; ++reads) {
            done = access(stopMarker.c_str(), F_OK) == 0;  // one last read after the writer
            if (int bad = check())
                return bad;
        }
        return reads > 1 ? 0 : 99;
    });
    int failed = 0;
    for (int i = 1; i <= writes; ++i)
        failed += write(i) ? 0 : 1;
    WriteFile(stopMarker, "");
    EXPECT_EQ(0, failed) << "writes that failed";
    return Wait(reader);
}

bool AnyEntryStartsWith(const std::string& folder, const std::string& prefix) {
    for (const std::string& name : ListDir(folder)) {
        if (name.rfind(prefix, 0) == 0)
            return true;
    }
    return false;
}

void WriteOrRemove(const std::string& path, const char* content) {
    RemoveTree(path);
    if (content)
        WriteFile(path, content);
}

}  // namespace kytotest
