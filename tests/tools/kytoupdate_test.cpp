// The kytoupdate program as a script or a person runs it, against the loopback update
// server: exit codes and standard output of every command, status and plan as JSON, the
// progress bar on a pseudo-terminal, a cancel from a second kytoupdate, bad arguments.
#include <fcntl.h>
#include <pty.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "kytoupdate_fixture.h"
#include "sandbox.h"

using namespace kytotest;

namespace {

TEST_F(KytoupdateTest, BadArgumentsAreNamedAndHelp) {
    ExpectRuns({{"", 64, "", "A subcommand is required"},
                {"bogus", 64, "", "kytoupdate: unknown command 'bogus'"},
                {"services", 64, "", "ACTION is required"},
                {"services restart", 64, "", "restart not in {stop,start}"},
                {"import", 64, "", "ARCHIVE is required"},
                {"import /nonexistent.tar", 64, "", "File does not exist: /nonexistent.tar"},
                {"status --interval 0", 64, "", "--interval: Value 0 not in range"},
                {"check --json", 64, "", "not expected: --json"}});
    EXPECT_EQ(0, Shell(Kyto() + " services --help >/tmp/h && grep -q Usage: /tmp/h"));
    EXPECT_TRUE(server->Requests().empty());
}

TEST_F(KytoupdateTest, CheckTellsKindVersionOrWhyNot) {
    // Nothing newer, no patch list.
    ExpectRuns({{"check", 3, "none\n", ""},
                {"download", 3, "none\n", ""},
                {"plan", 3, "none\n", ""},
                {"plan --json", 3, "{}\n", ""},
                {"auto", 0, "none\n", ""},
                {"cancel", 1, "", "nothing to cancel"}});
    PublishSmallFix(*server);
    ExpectRuns({{"check", 0, "smallupdate VYX 5.2-5644 update 1\n", ""}});
    Release(1 << 20);  // a full release wins over the small update
    ExpectRuns({{"check", 0, "vyx VYX 5.2-5700\n", ""}});
    server->FailPath(UpdateServer::PatchListPath(5644, "demo_model"), 500);
    ExpectRuns({{"plan", 2, "", "could not ask the update server"}});
    for (const char* key : {"rss_server", "small_info_path"})  // the server is unreachable
        SetKeyValue("/etc.defaults/kytoinfo.conf", key, "http://127.0.0.1:1/x");
    for (const char* cmd : {"check", "download", "auto", "plan"})
        ExpectRuns({{cmd, 2, "", "could not ask the update server"}});
}

TEST_F(KytoupdateTest, SmallUpdateDownloadStatusPlanApply) {
    PublishSmallFix(*server);
    Outcome r = Cmd("download");
    ASSERT_EQ(0, r.rc) << r.err;
    // Not a terminal: plain lines, the last one tells what was downloaded.
    EXPECT_TRUE(Has(r.out, "100%  package 2 of 2"));
    EXPECT_TRUE(Has(r.out, "downloaded smallupdate VYX 5.2-5644 update 1\n"));
    EXPECT_FALSE(Has(r.out, "\r"));

    // Both engines and the apply as the interface's back end reads them.
    EXPECT_EQ(ParseJson(R"({"installed":{"version":"5.2-5644","smallfix":0},
        "downloading":"","downloaded":"smallupdate",
        "vyxupdate":{"status":"none","percentage":0,"image":0,"images":0,"path":""},
        "smallupdate":{"status":"finished","percentage":100},
        "apply":{"stage":"none","percentage":0,"error":""}})"),
              ParseJson(Cmd("status --json").out));

    server->ClearRequests();
    Json::Value plan = ParseJson(R"({"version":"VYX 5.2-5644 update 1",
        "install":["kyto-tool-fix_1.0-5644-s1_all.deb"], "unpack":"", "flash":"",
        "configUpdate":false, "restart":"partial", "packages":["DemoApp"], "services":[
        {"script":"S01iptables.sh","known":true,"section":"helptoc","key":"system_network"}]})");
    for (const std::string& deb : {SmallFixDeb(), std::string("kyto-su_5.2-5644-s1_all.deb")})
        plan["download"].append(server->Url("/debs/" + deb));
    r = Cmd("plan --json");
    EXPECT_EQ(0, r.rc) << r.err;
    EXPECT_EQ(plan, ParseJson(r.out));
    EXPECT_TRUE(Has(Cmd("plan").out,
                    "restart: partial\n  service S01iptables.sh  section "
                    "helptoc key system_network\n  package DemoApp\n"));
    EXPECT_TRUE(server->RequestsFor("/debs/" + SmallFixDeb()).empty());  // nothing downloaded

    ClearRecordedCalls();
    ExpectRuns({{"apply", 0, "applied VYX 5.2-5644 update 1\n", "starting services"}});
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    const std::vector<std::vector<std::string>> calls = {{"S01iptables.sh", "stop"},
                                                         {"kytopkg", "stop", "DemoApp"},
                                                         {"S01iptables.sh", "start"},
                                                         {"kytopkg", "start", "DemoApp"}};
    EXPECT_EQ(calls, RecordedCalls());
    EXPECT_TRUE(Has(Cmd("status").out, "installed: 5.2-5644, small fix 1\n"));
    EXPECT_TRUE(Has(Cmd("status").out, "apply: finished 100%"));
    ExpectRuns({{"apply", 1, "", "no downloaded update"}});  // consumed
}

TEST_F(KytoupdateTest, ImportServicesAndApplyOfALocalArchive) {
    const std::string dir = "/tmp/patch";
    BuildDeb(SmallFixPackage(), dir);
    WriteFile(dir + "/VYX-Security.json", SmallFixList(*server));
    ASSERT_EQ(0, Shell("tar -cf /tmp/patch.tar -C " + dir + " VYX-Security.json " + SmallFixDeb()));
    WriteFile("/tmp/other.tar", "not an archive");
    ExpectRuns({{"services stop", 1, "", "no downloaded update"},  // nothing imported yet
                {"import /tmp/other.tar", 1, "", "not a small-update archive"},
                {"import /tmp/patch.tar", 0, "imported VYX 5.2-5644 update 1\n",
                 "kytoupdate: no trusted keys in /etc/kytoupdate/trusted.d: signatures are not "
                 "checked\n"}});
    ClearRecordedCalls();
    ExpectRuns({{"services stop", 0, "services stopped: partial\n", ""}});
    const std::vector<std::vector<std::string>> stopped = {{"S01iptables.sh", "stop"},
                                                           {"kytopkg", "stop", "DemoApp"}};
    EXPECT_EQ(stopped, RecordedCalls());
    EXPECT_EQ(0, Cmd("apply").rc);
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    EXPECT_TRUE(server->Requests().empty());  // a local import needs no server
}

TEST_F(KytoupdateTest, AutoAppliesASmallUpdateAndLeavesAReleaseForTheInstaller) {
    PublishSmallFix(*server);
    Outcome r = Cmd("auto");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_TRUE(Has(r.out, "applied VYX 5.2-5644 update 1\n"));
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    Release(3 << 20);
    r = Cmd("auto");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_TRUE(Has(r.out, "downloaded vyx VYX 5.2-5700 /volume1/@autoupdate/vyx.img\n"));
    ExpectRuns({{"apply", 1, "", "full release"}});  // the installer's business
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
    // The bar, image n of m, a rate, the time left, the end, the result.
    for (const char* part :
         {"\r[#", "%  image 1 of 1", "/s", " left", "] 100%", "downloaded vyx VYX 5.2-5700"})
        EXPECT_TRUE(Has(screen, part));
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
    ExpectRuns({{"download", 1, "", "a download is already running"},  // one at a time
                {"cancel", 0, "cancelled\n", ""}});
    EXPECT_EQ(4, Wait(download));
    EXPECT_TRUE(Has(ReadFile("/tmp/d.err").value_or(""), "stopped"));
    EXPECT_FALSE(PathExists("/autoupd@te.info"));  // no half download left to apply
    EXPECT_TRUE(WaitFor([] { return Watched().back() != "downloading"; }));  // then its end
    kill(watch, SIGTERM);
    EXPECT_EQ(0, Wait(watch));
}

// A cancelled small update stops after the package it is fetching; until its process has
// ended a new download is refused, so that two never write one package folder.
TEST_F(KytoupdateTest, ANewDownloadWaitsForACancelledOneToEnd) {
    PublishSmallFix(*server);
    server->SlowPath("/debs/" + SmallFixDeb(), 512);
    const pid_t first = Spawn([] { return Shell(Kyto() + " download >/dev/null 2>&1"); });
    ASSERT_TRUE(WaitFor([&] { return !server->RequestsFor("/debs/" + SmallFixDeb()).empty(); }));
    ExpectRuns({{"cancel", 0, "cancelled\n", ""},
                {"download", 1, "", "a cancelled download is still stopping"}});
    EXPECT_EQ(4, Wait(first));
    server->SlowPath("/debs/" + SmallFixDeb(), 0);
    EXPECT_EQ(0, Cmd("download").rc);
}

}  // namespace
