#include "update_server.h"

#include <errno.h>
#include <fcntl.h>
#include <ftw.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include <gtest/gtest.h>
#include <json/json.h>

#include "sandbox.h"
#include "scoped.h"

namespace kytotest {
namespace {

const char* const kControlFile = "/.control.json";
const char* const kRequestLog = "/.requests.log";

void MakeParents(const std::string& path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
        mkdir(path.substr(0, pos).c_str(), 0755);
    }
}

int RemoveEntry(const char* path, const struct stat*, int, struct FTW*) {
    return remove(path);
}

Json::Value ReadJson(const std::string& path) {
    Json::Value root;
    std::ifstream in(path);
    if (in) {
        Json::Reader reader;
        if (!reader.parse(in, root, false))
            root = Json::Value();
    }
    return root;
}

}  // namespace

UpdateServer::UpdateServer() {
    Start();
}

void UpdateServer::Start() {
    char tmpl[] = "/tmp/kyto-update-server-XXXXXX";
    if (!mkdtemp(tmpl))
        GTEST_FAIL() << "mkdtemp: " << strerror(errno);
    root_ = tmpl;

    const std::string script = std::string(KYTO_TEST_SUPPORT_DIR) + "/update_server.py";
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0)
        GTEST_FAIL() << "pipe2: " << strerror(errno);
    const pid_t parent = getpid();
    pid_t pid = fork();
    if (pid < 0) {
        close(fds[0]);
        close(fds[1]);
        GTEST_FAIL() << "fork: " << strerror(errno);
    }
    if (pid == 0) {
        // Dies with the test process even when that one crashes.
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent)
            _exit(126);
        dup2(fds[1], STDOUT_FILENO);
        execl("/usr/bin/python3", "python3", script.c_str(), root_.c_str(),
              static_cast<char*>(nullptr));
        _exit(127);
    }
    pid_ = pid;
    close(fds[1]);

    // The server prints its port once it listens.
    std::string line;
    while (line.find('\n') == std::string::npos) {
        struct pollfd p = {fds[0], POLLIN, 0};
        int r = poll(&p, 1, 15000);
        if (r < 0 && errno == EINTR)
            continue;
        if (r <= 0)
            break;
        char buf[64];
        ssize_t n = read(fds[0], buf, sizeof(buf));
        if (n <= 0)
            break;
        line.append(buf, static_cast<size_t>(n));
    }
    close(fds[0]);
    port_ = atoi(line.c_str());
    if (port_ <= 0)
        GTEST_FAIL() << "update server did not start (output: '" << line << "')";
}

UpdateServer::~UpdateServer() {
    if (pid_ > 0) {
        kill(pid_, SIGKILL);
        while (waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
        }
    }
    if (!root_.empty())
        nftw(root_.c_str(), RemoveEntry, 16, FTW_DEPTH | FTW_PHYS);
}

std::string UpdateServer::BaseUrl() const {
    return "http://127.0.0.1:" + std::to_string(port_);
}

std::string UpdateServer::Url(const std::string& path) const {
    return BaseUrl() + path;
}

void UpdateServer::PutFile(const std::string& urlPath, const std::string& content) {
    const std::string local = root_ + urlPath;
    MakeParents(local);
    int fd = open(local.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    ASSERT_GE(fd, 0) << local << ": " << strerror(errno);
    bool ok = kyto::WriteAll(fd, content.data(), content.size());
    close(fd);
    ASSERT_TRUE(ok) << "write " << local;
}

std::string UpdateServer::PutFileOfSize(const std::string& urlPath, unsigned long long bytes) {
    const std::string local = root_ + urlPath;
    MakeParents(local);
    // One pseudo-random block (xorshift, fixed seed), each copy stamped with its index so
    // that no two blocks of the file are equal.
    std::string block(1 << 20, '\0');
    unsigned long long x = 0x9E3779B97F4A7C15ULL;
    for (size_t i = 0; i < block.size(); i += 8) {
        x ^= x << 13;
        x ^= x >> 7;
        x ^= x << 17;
        memcpy(&block[i], &x, 8);
    }
    int fd = open(local.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    EXPECT_GE(fd, 0) << local << ": " << strerror(errno);
    if (fd < 0)
        return local;
    bool ok = true;
    for (unsigned long long done = 0, index = 0; ok && done < bytes; ++index) {
        memcpy(&block[0], &index, sizeof(index));
        size_t n = static_cast<size_t>(std::min<unsigned long long>(block.size(), bytes - done));
        ok = kyto::WriteAll(fd, block.data(), n);
        done += n;
    }
    close(fd);
    EXPECT_TRUE(ok) << "write " << local;
    return local;
}

namespace {

void WriteControl(const std::string& root, const Json::Value& control) {
    const std::string path = root + kControlFile;
    const std::string tmp = path + ".tmp";
    {
        std::ofstream out(tmp, std::ios::trunc);
        out << Json::FastWriter().write(control);
    }
    // Replaced atomically: the server reads it on every request.
    ASSERT_EQ(rename(tmp.c_str(), path.c_str()), 0) << strerror(errno);
}

}  // namespace

void UpdateServer::FailPath(const std::string& urlPath, int status, int times) {
    Json::Value control = ReadJson(root_ + kControlFile);
    control["fail"][urlPath]["status"] = status;
    control["fail"][urlPath]["times"] = times;
    WriteControl(root_, control);
}

void UpdateServer::SlowPath(const std::string& urlPath, long bytesPerSecond) {
    Json::Value control = ReadJson(root_ + kControlFile);
    control["slow"][urlPath] = static_cast<Json::Int64>(bytesPerSecond);
    WriteControl(root_, control);
}

void UpdateServer::TruncatePath(const std::string& urlPath, long bytes) {
    Json::Value control = ReadJson(root_ + kControlFile);
    control["truncate"][urlPath] = static_cast<Json::Int64>(bytes);
    WriteControl(root_, control);
}

void UpdateServer::StallPath(const std::string& urlPath, long bytes) {
    Json::Value control = ReadJson(root_ + kControlFile);
    control["stall"][urlPath] = static_cast<Json::Int64>(bytes);
    WriteControl(root_, control);
}

std::vector<UpdateServer::Request> UpdateServer::Requests() const {
    std::vector<Request> out;
    std::ifstream in(root_ + kRequestLog);
    std::string line;
    Json::Reader reader;
    while (std::getline(in, line)) {
        Json::Value v;
        if (line.empty() || !reader.parse(line, v, false) || !v.isObject())
            continue;
        Request r;
        r.method = v["method"].asString();
        r.path = v["path"].asString();
        r.query = v["query"].asString();
        r.userAgent = v["user_agent"].asString();
        r.status = v["status"].asInt();
        out.push_back(r);
    }
    return out;
}

std::vector<UpdateServer::Request> UpdateServer::RequestsFor(const std::string& urlPath) const {
    std::vector<Request> out;
    for (const Request& r : Requests()) {
        if (r.path == urlPath)
            out.push_back(r);
    }
    return out;
}

void UpdateServer::ClearRequests() {
    if (truncate((root_ + kRequestLog).c_str(), 0) != 0 && errno != ENOENT) {
        ADD_FAILURE() << "truncate request log: " << strerror(errno);
    }
}

void UpdateServer::PointRssServerHere() const {
    SetKeyValue("/etc.defaults/kytoinfo.conf", "rss_server", Url("/autoupdate/genRSS.php"));
}

void UpdateServer::PublishRelease(const std::string& build, const std::string& imagePath,
                                  unsigned long long bytes, long bytesPerSecond) {
    const std::string md5 = Md5Of(PutFileOfSize(imagePath, bytes));
    if (bytesPerSecond)
        SlowPath(imagePath, bytesPerSecond);
    PutFile("/autoupdate/genRSS.php",
            FeedDocument(FeedItem("5", "2", build, {{"demo_model", Url(imagePath), md5}})));
}

void UpdateServer::PointSmallInfoPathHere() const {
    SetKeyValue("/etc.defaults/kytoinfo.conf", "small_info_path", Url("/smallupdate"));
}

std::string UpdateServer::PatchListPath(int build, const std::string& unique) {
    return "/smallupdate/" + std::to_string(build) + "/" + unique + "/VYX-Security.json";
}

std::string PatchListJson(int build, const std::string& unique,
                          const std::vector<PatchEntry>& entries) {
    Json::Value root(Json::objectValue);
    root["vyxversion"] = build;
    root["unique"] = unique;
    root["smallupdate"] = Json::Value(Json::arrayValue);
    for (const PatchEntry& e : entries) {
        Json::Value entry(Json::objectValue);
        entry["version"] = e.version;
        entry["flash_upgrade"] = e.flash;
        entry["config_upgrade"] = e.config;
        entry["proj"] = Json::Value(Json::arrayValue);
        for (const auto& p : e.proj) {
            Json::Value item(Json::objectValue);
            item["name"] = p.first;
            item["url"] = p.second;
            entry["proj"].append(item);
        }
        Json::Reader().parse(e.restart, entry["restart"], false);
        root["smallupdate"].append(entry);
    }
    return Json::FastWriter().write(root);
}

void UpdateServerTest::SetUp() {
    SandboxTest::SetUp();
    server = std::make_unique<UpdateServer>();
    server->PointSmallInfoPathHere();
    MountVolume("/volume1", 300ULL << 20);
}

void UpdateServerTest::TearDown() {
    server.reset();
    SandboxTest::TearDown();
}

std::string SmallFixDebName(const std::string& name, int fix, int build) {
    return name + "_6.1-" + std::to_string(build) + "-s" + std::to_string(fix) + "_all.deb";
}

std::string FeedItem(const std::string& major, const std::string& minor, const std::string& build,
                     const std::vector<FeedModel>& models, const std::string& extra) {
    std::string s = "  <item>\n    <title>VYX</title>\n    <MajorVer>" + major +
                    "</MajorVer>\n    <MinorVer>" + minor + "</MinorVer>\n    <BuildNum>" + build +
                    "</BuildNum>\n" + extra;
    for (const FeedModel& m : models) {
        s += "    <model>\n      <mUnique>" + m.unique + "</mUnique>\n      <mLink>" + m.link +
             "</mLink>\n      <mCheckSum>" + m.sum + "</mCheckSum>\n    </model>\n";
    }
    return s + "  </item>\n";
}

std::string FeedDocument(const std::string& items) {
    return "<rss>\n<channel>\n<title>feed</title>\n\n" + items + "</channel>\n</rss>\n";
}

}  // namespace kytotest
