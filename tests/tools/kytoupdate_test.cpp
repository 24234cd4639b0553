// The kytoupdate program as a script or a person runs it, against the loopback update
// server: exit codes and standard output of every command, status and plan as JSON, the
// progress bar on a pseudo-terminal, a cancel from a second kytoupdate, bad arguments.
#include <fcntl.h>
#include <pty.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <string>

#include "deb_builder.h"
#include "sandbox.h"
#include "update_server.h"

using namespace kytotest;

namespace {

const char* const kInfo = "/autoupd@te.info";
const char* const kFeed = "/autoupdate/genRSS.php";

// The program built beside this test program (build/tests/.. -> build/tools/kytoupdate).
std::string Kyto() {
    char self[4096] = {0};
    const ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
    std::string dir = std::string(self, n > 0 ? static_cast<size_t>(n) : 0);
    return dir.substr(0, dir.rfind('/')) + "/../tools/kytoupdate";
}

struct Result {
    int rc;
    std::string out, err;
};

Result Cmd(const std::string& args) {
    const int rc = Shell(Kyto() + " " + args + " >/tmp/k.out 2>/tmp/k.err");
    return {rc, ReadFile("/tmp/k.out").value_or(""), ReadFile("/tmp/k.err").value_or("")};
}

class KytoupdateTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        server = std::make_unique<UpdateServer>();
        server->PointRssServerHere();
        server->PointSmallInfoPathHere();
        MountVolume("/volume1", 400ULL << 20);
        Feed(5644, "");  // nothing newer than the running build
    }
    void TearDown() override {
        server.reset();
        SandboxTest::TearDown();
    }
    void Feed(int build, const std::string& link, const std::string& md5 = "0") {
        server->PutFile(kFeed,
                        "<rss><channel>\n<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n"
                        "<BuildNum>" +
                            std::to_string(build) +
                            "</BuildNum>\n<model>\n"
                            "<mUnique>demo_model</mUnique>\n<mLink>" +
                            link + "</mLink>\n<mCheckSum>" + md5 +
                            "</mCheckSum>\n</model>\n</item>\n"
                            "</channel></rss>\n");
    }
    // Serves release 5.2-5700 with an image of the given size, sent at bytesPerSecond.
    void Release(unsigned long long bytes, long bytesPerSecond = 0) {
        const std::string md5 = Md5Of(server->PutFileOfSize("/img/vyx.img", bytes));
        if (bytesPerSecond)
            server->SlowPath("/img/vyx.img", bytesPerSecond);
        Feed(5700, server->Url("/img/vyx.img"), md5);
    }
    // Publishes fix 1: a further package and the small-update package, restarting
    // S01iptables.sh and the add-on "DemoApp".
    void SmallFix() {
        DebPackage pkg = MakeDebPackage("kyto-tool-fix", SmallFixVersion("1.0", 5644, 1));
        pkg.files["/usr/share/kyto-tool-fix/x"] = "x\n";
        BuildDeb(pkg, server->Root() + "/debs");
        BuildDeb(MakeDebPackage("kyto-su", SmallFixVersion("5.2", 5644, 1)),
                 server->Root() + "/debs");
        server->PutFile(UpdateServer::PatchListPath(5644, "demo_model"), PatchList());
    }
    std::string PatchList() const {
        return R"({"vyxversion":5644,"unique":"demo_model","smallupdate":[{"version":1,
            "proj":[{"name":"kyto-tool-fix","url":")" +
               server->Url("/debs/" + Deb()) + R"("},
                    {"name":"smallupdate","url":")" +
               server->Url("/debs/kyto-su_5.2-5644-s1_all.deb") + R"("}],
            "flash_upgrade":false,"config_upgrade":false,
            "restart":{"vyx_service":["S01iptables.sh"],"pkg":["DemoApp"]}}]})";
    }
    static std::string Deb() { return "kyto-tool-fix_1.0-5644-s1_all.deb"; }
    std::unique_ptr<UpdateServer> server;
};

TEST_F(KytoupdateTest, BadArgumentsAreNamedAndHelp) {
    const std::pair<const char*, const char*> bad[] = {  // arguments, what the error names
        {"", "A subcommand is required"},
        {"bogus", "kytoupdate: unknown command 'bogus'"},
        {"services", "ACTION is required"},
        {"services restart", "restart not in {stop,start}"},
        {"import", "ARCHIVE is required"},
        {"import /nonexistent.tar", "File does not exist: /nonexistent.tar"},
        {"status --interval 0", "--interval: Value 0 not in range"},
        {"check --json", "not expected: --json"}};
    for (const auto& [args, error] : bad) {
        SCOPED_TRACE(args);
        const Result r = Cmd(args);
        EXPECT_EQ(64, r.rc);
        EXPECT_EQ("", r.out);
        EXPECT_NE(std::string::npos, r.err.find(error)) << r.err;
    }
    for (const char* cmd : {"", "check", "download", "status", "cancel", "apply", "services",
                            "import", "plan", "auto"}) {
        SCOPED_TRACE(cmd);
        const Result r = Cmd(std::string(cmd) + " --help");
        EXPECT_EQ(0, r.rc);
        EXPECT_NE(std::string::npos, r.out.find("Usage:")) << r.out;
    }
    EXPECT_TRUE(server->Requests().empty());
}

TEST_F(KytoupdateTest, CheckTellsKindVersionOrWhyNot) {
    for (const char* cmd : {"check", "download", "plan"}) {  // nothing newer, no patch list
        const Result r = Cmd(cmd);
        EXPECT_EQ(3, r.rc) << cmd;
        EXPECT_EQ("none\n", r.out) << cmd;
    }
    Result r = Cmd("cancel");  // nothing runs
    EXPECT_EQ(1, r.rc);
    SmallFix();
    r = Cmd("check");
    EXPECT_EQ(0, r.rc) << r.err;
    EXPECT_EQ("smallupdate VYX 5.2-5644 update 1\n", r.out);
    Release(1 << 20);
    r = Cmd("check");  // a full release wins over the small update
    EXPECT_EQ(0, r.rc) << r.err;
    EXPECT_EQ("vyx VYX 5.2-5700\n", r.out);
    for (const char* key : {"rss_server", "small_info_path"})  // the server is unreachable
        SetKeyValue("/etc.defaults/kytoinfo.conf", key, "http://127.0.0.1:1/x");
    for (const char* cmd : {"check", "download", "auto", "plan"}) {
        r = Cmd(cmd);
        EXPECT_EQ(2, r.rc) << cmd;
        EXPECT_EQ("", r.out);
        EXPECT_NE("", r.err);
    }
    server->FailPath(UpdateServer::PatchListPath(5644, "demo_model"), 500);
    r = Cmd("plan");
    EXPECT_EQ(2, r.rc);
}

TEST_F(KytoupdateTest, SmallUpdateDownloadStatusPlanApply) {
    SmallFix();
    Result r = Cmd("download");
    ASSERT_EQ(0, r.rc) << r.err;
    // Not a terminal: plain lines, the last one tells what was downloaded.
    EXPECT_NE(std::string::npos, r.out.find("100%  package 2 of 2")) << r.out;
    EXPECT_NE(std::string::npos, r.out.find("downloaded smallupdate VYX 5.2-5644 update 1\n"));
    EXPECT_EQ(std::string::npos, r.out.find('\r'));
    EXPECT_TRUE(PathExists(kInfo));

    r = Cmd("status --json");
    ASSERT_EQ(0, r.rc);
    Json::Value status = ParseJson(r.out);
    EXPECT_EQ("smallupdate", status["downloaded"].asString());
    EXPECT_EQ("finished", status["smallupdate"]["status"].asString());
    EXPECT_EQ(100, status["smallupdate"]["percentage"].asInt());
    EXPECT_EQ("none", status["vyxupdate"]["status"].asString());
    EXPECT_EQ("none", status["apply"]["stage"].asString());

    server->ClearRequests();
    r = Cmd("plan --json");
    ASSERT_EQ(0, r.rc) << r.err;
    Json::Value plan = ParseJson(r.out);
    EXPECT_EQ("VYX 5.2-5644 update 1", plan["version"].asString());
    ASSERT_EQ(2u, plan["download"].size());
    EXPECT_EQ(server->Url("/debs/" + Deb()), plan["download"][0].asString());
    EXPECT_EQ(Deb(), plan["install"][0].asString());
    EXPECT_EQ("partial", plan["restart"].asString());
    ASSERT_EQ(1u, plan["services"].size());
    EXPECT_EQ("S01iptables.sh", plan["services"][0]["script"].asString());
    EXPECT_EQ("helptoc", plan["services"][0]["section"].asString());
    EXPECT_EQ("system_network", plan["services"][0]["key"].asString());
    EXPECT_EQ("DemoApp", plan["packages"][0].asString());
    EXPECT_TRUE(server->RequestsFor("/debs/" + Deb()).empty());  // nothing downloaded

    ClearRecordedCalls();
    r = Cmd("apply");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_EQ("applied VYX 5.2-5644 update 1\n", r.out);
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    EXPECT_EQ("1", ReadKeyValueFile("/etc.defaults/VERSION")["smallfixnumber"]);
    const std::vector<std::vector<std::string>> calls = {{"S01iptables.sh", "stop"},
                                                         {"kytopkg", "stop", "DemoApp"},
                                                         {"S01iptables.sh", "start"},
                                                         {"kytopkg", "start", "DemoApp"}};
    EXPECT_EQ(calls, RecordedCalls());
    EXPECT_FALSE(PathExists(kInfo));
    r = Cmd("status");
    EXPECT_NE(std::string::npos, r.out.find("apply: finished 100%")) << r.out;
    r = Cmd("apply");  // consumed
    EXPECT_EQ(1, r.rc);
    EXPECT_EQ("", r.out);
    EXPECT_NE(std::string::npos, r.err.find("no downloaded update"));
}

TEST_F(KytoupdateTest, ImportServicesAndApplyOfALocalArchive) {
    EXPECT_EQ(1, Cmd("services stop").rc);  // nothing downloaded or imported
    DebPackage pkg = MakeDebPackage("kyto-tool-fix", SmallFixVersion("1.0", 5644, 1));
    const std::string dir = "/tmp/patch";
    BuildDeb(pkg, dir);
    WriteFile(dir + "/VYX-Security.json", PatchList());
    ASSERT_EQ(0, Shell("tar -cf /tmp/patch.tar -C " + dir + " VYX-Security.json " + Deb()));
    WriteFile("/tmp/other.tar", "not an archive");
    Result r = Cmd("import /tmp/other.tar");
    EXPECT_EQ(1, r.rc);
    EXPECT_EQ("", r.out);
    r = Cmd("import /tmp/patch.tar");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_EQ("imported VYX 5.2-5644 update 1\n", r.out);
    ClearRecordedCalls();
    r = Cmd("services stop");
    EXPECT_EQ(0, r.rc);
    EXPECT_EQ("services stopped: partial\n", r.out);
    const std::vector<std::vector<std::string>> stopped = {{"S01iptables.sh", "stop"},
                                                           {"kytopkg", "stop", "DemoApp"}};
    EXPECT_EQ(stopped, RecordedCalls());
    EXPECT_EQ(0, Cmd("apply").rc);
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    EXPECT_TRUE(server->Requests().empty());  // a local import needs no server
}

TEST_F(KytoupdateTest, AutoAppliesASmallUpdateAndLeavesAReleaseForTheInstaller) {
    Result r = Cmd("auto");
    EXPECT_EQ(0, r.rc) << r.err;
    EXPECT_EQ("none\n", r.out);
    SmallFix();
    r = Cmd("auto");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_NE(std::string::npos, r.out.find("applied VYX 5.2-5644 update 1\n")) << r.out;
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    Release(3 << 20);
    r = Cmd("auto");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_NE(std::string::npos,
              r.out.find("downloaded vyx VYX 5.2-5700 /volume1/@autoupdate/vyx.img\n"))
        << r.out;
    EXPECT_EQ(Md5Of(server->Root() + "/img/vyx.img"), Md5Of("/volume1/@autoupdate/vyx.img"));
    EXPECT_EQ("1", ReadKeyValueFile("/etc.defaults/VERSION")["smallfixnumber"]);
    r = Cmd("apply");  // the installer's business
    EXPECT_EQ(1, r.rc);
    EXPECT_NE(std::string::npos, r.err.find("full release")) << r.err;
}

TEST_F(KytoupdateTest, ProgressBarOnATerminal) {
    Release(2 << 20, 512 << 10);
    int master = -1;
    const pid_t pid = forkpty(&master, nullptr, nullptr, nullptr);
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        execl(Kyto().c_str(), "kytoupdate", "download", static_cast<char*>(nullptr));
        _exit(127);
    }
    std::string screen;
    char buf[4096];
    for (ssize_t n; (n = read(master, buf, sizeof buf)) > 0;)  // EIO once the child is gone
        screen.append(buf, static_cast<size_t>(n));
    close(master);
    EXPECT_EQ(0, Wait(pid)) << screen;
    EXPECT_NE(std::string::npos, screen.find("\r[#")) << screen;
    EXPECT_NE(std::string::npos, screen.find("%  image 1 of 1")) << screen;
    EXPECT_NE(std::string::npos, screen.find("/s")) << screen;  // a rate
    EXPECT_NE(std::string::npos, screen.find(" left")) << screen;
    EXPECT_NE(std::string::npos, screen.find("] 100%")) << screen;
    EXPECT_NE(std::string::npos, screen.find("downloaded vyx VYX 5.2-5700")) << screen;
}

// Statuses of the full-release download that a watcher printed, in order.
std::vector<std::string> Watched() {
    std::vector<std::string> seen;
    for (const std::string& line : FileLines("/tmp/w.out"))
        seen.push_back(ParseJson(line)["vyxupdate"]["status"].asString());
    return seen;
}

TEST_F(KytoupdateTest, CancelFromASecondKytoupdateWhileAThirdWatches) {
    Release(8 << 20, 256 << 10);
    const pid_t watch = Spawn([] {  // its own pid: stopped below by a signal, as a person would
        const int fd = open("/tmp/w.out", O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        dup2(fd, STDOUT_FILENO);
        execl(Kyto().c_str(), "kytoupdate", "status", "--watch", "--json", "--interval", "0.1",
              static_cast<char*>(nullptr));
        return 127;
    });
    const pid_t download =
        Spawn([] { return Shell(Kyto() + " download >/dev/null 2>/tmp/d.err"); });
    ASSERT_TRUE(WaitFor([] {
        const std::vector<std::string> seen = Watched();
        return std::find(seen.begin(), seen.end(), "downloading") != seen.end();
    }));
    EXPECT_EQ(1, Cmd("download").rc);  // one download at a time
    const Result r = Cmd("cancel");
    EXPECT_EQ(0, r.rc) << r.err;
    EXPECT_EQ("cancelled\n", r.out);
    EXPECT_EQ(4, Wait(download));
    EXPECT_NE(std::string::npos, ReadFile("/tmp/d.err").value_or("").find("stopped"));
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_TRUE(WaitFor([] { return Watched().back() != "downloading"; }));  // then its end
    kill(watch, SIGTERM);
    EXPECT_EQ(0, Wait(watch));
}

}  // namespace
