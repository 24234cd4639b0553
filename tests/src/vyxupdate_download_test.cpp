// Release check and release download with the real wget and openssl against a loopback
// update server; download status, progress and cancellation as a second process sees them.
#include <signal.h>
#include <unistd.h>

#include <kytoplatform/klibc.h>

#include "engine_fixtures.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
const char *kFeedPath = "/autoupdate/genRSS.php", *kStatus = "/var/run/downloadVYX.status",
           *kPid = "/var/run/downloadVYX.pid", *kInfo = "/autoupd@te.info",
           *kProgress = "/var/run/downloadprogress";
const std::string kFolder = "/volume1/@autoupdate", kSlow = kFolder + "/slow.img";

using VyxServerTest = ReleaseServerTest;

TEST_F(VyxServerTest, CheckAsksOnceAndTheDefaultServerWithoutSetting) {
    ServeFeed({{"demo_model", "http://h/demo.img", "00ff"}});
    VyxUpdate vyx;
    bool haveNew = false, canStart = false;
    ASSERT_EQ(1, vyx.CheckNewRelease(haveNew));
    EXPECT_TRUE(haveNew && vyx.PreCheckDownload(canStart) == 1 && canStart);
    auto requests = server->RequestsFor(kFeedPath);
    ASSERT_EQ(1u, requests.size());  // the answer is reused
    EXPECT_EQ("tz=Europe/Berlin demo_model VYX5.2 5644 (autoupgrade)",
              requests[0].query + " " + requests[0].userAgent);

    // Without rss_server the default server is asked (resolved from the hosts file, never
    // the machine's name service; nothing listens there).  A refusing server of the facade's
    // test takes the same path.
    WriteFile("/etc/hosts", "127.0.0.1 localhost\n127.0.0.1 update.kyto.local\n");
    SetKeyValue("/etc.defaults/kytoinfo.conf", "rss_server", std::nullopt);
    EXPECT_EQ(0, VyxUpdate().CheckNewRelease(haveNew));
    EXPECT_TRUE(SyslogContains(
        "Fail to exec command [/usr/kyto/bin/wget --user-agent='demo_model VYX5.2 5644 "
        "(autoupgrade)' -O /var/run/autoupdate_tmp_file_RSS "
        "http://update.kyto.local/autoupdate/genRSS.php?tz=Europe/Berlin 2> /dev/null]. [0x"));
}

TEST_F(VyxServerTest, CheckReconcilesAnEarlierDownload) {
    const std::string image = "/volume9/@autoupdate/old.img",
                      versions = R"("majorversion":"5","minorversion":"2","patchPath":")" + image;
    // clang-format off
    struct Case { std::string info; bool infoKept, progressCleared; } cases[] = {
        {R"({"updateType":"vyxupdate","buildnumber":"100",)" + versions + "\"}", false, true},
        {R"({"buildnumber":"0x1644",)" + versions + "\"}", true, false},  // same build in hex
        {R"({"updateType":"smallupdate","buildnumber":"1"})", true, false},
        {R"({"updateType":"vyxupdate","buildnumber":"5700"})", false, false},  // no patchPath
        // Documents that are not objects: an empty one is nothing to read, others are
        // unusable and removed like an object without the members.
        {"[]", true, false}, {R"("x")", false, false}, {"7", false, false},
        {"true", false, false}};
    // clang-format on
    ServeFeed({{"demo_model", "http://h/demo.img", "00ff"}});
    for (const Case& c : cases) {
        SCOPED_TRACE(c.info);
        WriteFile(kInfo, c.info);
        WriteFile(image, "partial");
        WriteFile(kProgress, "Length: 7");
        bool haveNew = false;
        ASSERT_EQ(1, VyxUpdate().CheckNewRelease(haveNew));
        EXPECT_EQ(c.infoKept, PathExists(kInfo));
        EXPECT_TRUE(PathExists(image));  // images are never deleted by the check
        EXPECT_EQ(c.progressCleared, !PathExists(kProgress));
    }
}

TEST_F(VyxServerTest, RunningDownloadReportsProgressThenRecordsTheImageAndNotifies) {
    pid_t downloader = StartSlowDownload(256 << 10);
    // clang-format off
    EXPECT_EQ((std::map<std::string, std::string>{{"updateType", "vyxupdate"}, {"patchPath", kSlow},
        {"downloadStatus", "downloading"}, {"downloadCount", "1"}, {"downloadNum", "1"}}),
        ReadKeyValueFile(kStatus));
    // clang-format on
    EXPECT_NE(downloader, KLIBCReadPidFile(kPid));  // wget's own pid
    std::string seen;
    EXPECT_TRUE(WaitFor([&] { return (seen = VyxStatusSeen()) != "downloading 0"; }));
    EXPECT_EQ("downloading ", seen.substr(0, 12));
    EXPECT_LT(atoi(seen.c_str() + 12), 100) << seen;

    EXPECT_EQ(1, Wait(downloader));
    EXPECT_EQ(256u << 10, ReadFile(kSlow).value_or("").size());
    EXPECT_EQ(ParseJson(R"({"patchPath":")" + kSlow + R"(","buildnumber":"5700",
                  "majorversion":"5","minorversion":"2","updateType":"vyxupdate"})"),
              ParseJson(ReadFile(kInfo).value_or("")));
    EXPECT_FALSE(PathExists(kStatus) || PathExists(kPid) || PathExists(kProgress));
    EXPECT_EQ(DownloadNotification(true), RecordedCalls());
    EXPECT_TRUE(EventLogged("1 1 0x11B01021 " + kSlow));
    EXPECT_EQ("finished 100", VyxStatusSeen());
}

// A cancel from another process kills the running wget, here on the retry after a failed
// attempt (the pid file names the attempt that runs now), and ends the retries.  A cancel
// of a first attempt is part of the facade's test.
TEST_F(VyxServerTest, CancelBetweenRetriesEndsThem) {
    server->FailPath("/img/slow.img", 503, 1);
    pid_t downloader = StartSlowDownload(4 << 20);
    // Held still so that the canceller's "stopped" is seen before the downloader clears
    // the status file.
    ASSERT_EQ(0, kill(downloader, SIGSTOP));
    EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
    EXPECT_FALSE(PathExists(kPid));
    EXPECT_EQ("stopped 0", VyxStatusSeen());
    ASSERT_EQ(0, kill(downloader, SIGCONT));
    EXPECT_EQ(1, Wait(downloader));
    EXPECT_TRUE(SyslogContains("Download process is cancelled"));
    EXPECT_FALSE(PathExists(kStatus) || PathExists(kInfo));
    EXPECT_TRUE(PathExists(kSlow));        // the partial image stays
    EXPECT_TRUE(RecordedCalls().empty());  // no notification
    // No third attempt.  The server logs a request once its connection ends.
    auto requests = [&] { return server->RequestsFor("/img/slow.img").size(); };
    EXPECT_TRUE(WaitFor([&] { return requests() >= 2; }));
    EXPECT_EQ(2u, requests());
}

TEST_F(VyxServerTest, FailedDownloadsNotifyAndLogTheEvent) {
    // Ten failed attempts are the fault test's case; the tenth attempt may still succeed.
    ServeFeed({Image("demo_model", "/images/f9.img", 4096)});
    server->FailPath("/images/f9.img", 503, 9);
    EXPECT_EQ(1, VyxUpdate().DownloadVyx());
    EXPECT_EQ(10u, server->RequestsFor("/images/f9.img").size());
    ClearRecordedCalls();

    FeedModel image = Image("demo_model", "/images/vyx.img", 8192);
    for (char& ch : image.sum)
        ch = static_cast<char>(toupper(ch));  // the checksum must match exactly
    ServeFeed({image});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Checksum not match") && SyslogContains("Fail to verify checksum"));
    EXPECT_TRUE(PathExists(kFolder + "/vyx.img"));  // the image stays
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_TRUE(EventLogged("1 3 0x11B01022 " + kFolder + "/vyx.img"));

    ClearRecordedCalls();
    ServeFeed({{"other_model", server->Url("/images/vyx.img"), "00"}});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Current VYX version is latest") &&
                SyslogContains("Fail to do pre check download"));
    EXPECT_EQ(DownloadNotification(false), RecordedCalls());
}

TEST_F(VyxServerTest, HybridPairFetchesBothImagesAndALiveDownloadIsNotRepeated) {
    WriteFile("/var/run/kytoha.status",
              "running=\"yes\"\nhybrid_dl=\"yes\"\npartner_unique=\"partner_model\"\n");
    ServeFeed(
        {Image("demo_model", "/a/mine.img", 4096), Image("partner_model", "/b/partner.img", 8192)});
    ASSERT_EQ(1, VyxUpdate().DownloadVyx());
    Json::Value info = ParseJson(ReadFile(kInfo).value_or(""));
    EXPECT_EQ(kFolder + "/mine.img " + kFolder + "/partner.img",
              info["patchPath"].asString() + " " + info["passivePatchPath"].asString());
    EXPECT_EQ(8192u, ReadFile(kFolder + "/partner.img").value_or("").size());

    // A live download (this process stands in for its wget) refuses a second one, which
    // still reports success and clears the shared files.
    ClearRecordedCalls();
    Shell("rm /var/run/kytoha.status /autoupd@te.info");
    ServeFeed({{"demo_model", server->Url("/images/vyx.img"), "00"}});
    WriteLiveVyxDownload();
    EXPECT_EQ(1, VyxUpdate().DownloadVyx());
    EXPECT_EQ(0u, server->RequestsFor("/images/vyx.img").size());
    EXPECT_FALSE(PathExists(kStatus) || PathExists(kPid));
    EXPECT_EQ(DownloadNotification(true), RecordedCalls());
}

// Status, percentage, cancel and installer progress as other processes see them, from files
// set up by hand.
using VyxStatusTest = SandboxTest;

TEST_F(VyxStatusTest, StatusFileDecisions) {
    pid_t dead = Spawn([] { return 0; });
    Wait(dead);
    const std::string base =
        "updateType=\"vyxupdate\"\npatchPath=\"/tmp/img\"\n"
        "downloadCount=\"2\"\ndownloadNum=\"2\"\ndownloadStatus=";
    // status and pid file ("": none), what a poller sees.
    // clang-format off
    struct Case { std::string status, pid, seen; } cases[] = {
        {"", "", "none 0"}, {"updateType=smallupdate\ndownloadStatus=2\n", "", "none 0"},
        {base + "stopped\n", "", "stopped 0"}, {base + "failed\n", "1", "failed 0"},
        {base + "downloading\n", std::to_string(dead), "failed 0"},
        {base + "downloading\n", std::to_string(getpid()), "downloading 75"},  // 2nd half done
        {base + "finish\n", "junk", "refused none 0"},
        {"updateType=vyxupdate\npatchPath=/x\ndownloadStatus=failed\n", "", "refused none 0"}};
    // clang-format on
    // Half of the second image (any page size up to 512 KiB allocates it exactly).
    WriteFile(kProgress, "--2026-01-01--  http://h/img\nLength: 1,048,576 (1M)\n");
    WriteFile("/tmp/img", std::string(512 << 10, 'x'));
    for (const Case& c : cases) {
        SCOPED_TRACE(c.status + " pid " + c.pid);
        WriteOrRemove(kStatus, c.status.empty() ? nullptr : c.status.c_str());
        WriteOrRemove(kPid, c.pid.empty() ? nullptr : c.pid.c_str());
        EXPECT_EQ(c.seen, VyxStatusSeen());
    }
    // A complete newer download wins over whatever the status file says.
    WriteFile(kInfo, R"({"updateType":"vyxupdate","buildnumber":"5700",
        "majorversion":"5","minorversion":"2","patchPath":"/tmp/img"})");
    EXPECT_EQ("finished 100", VyxStatusSeen());
}

// The share of the announced length that is allocated on disk.  Sizes are multiples of
// 64 KiB so that no page size matters, except where the page of a short file is the point.
TEST_F(VyxStatusTest, PercentageOfOneImage) {
    // clang-format off
    struct Case { std::string log; size_t bytes; bool sparse; int percentage; } cases[] = {
        {"no size line here\n", 65536, false, 0},
        {"Length: 131,072 (128K) [application/octet-stream]\n", 131072, false, 100},
        {"Length: 1,310,720 (1.2M)\n", 655360, false, 50},
        {"Length: 1,310,720 (1.2M)\n", 1310720, true, 0},  // the length only, nothing allocated
        {"Length: 1,000 (1K)\n", 1000, false, static_cast<int>(sysconf(_SC_PAGESIZE) / 10)}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(c.log);
        WriteFile(kProgress, c.log);
        WriteFile("/tmp/img", c.sparse ? "" : std::string(c.bytes, 'x'));
        ASSERT_EQ(0, truncate("/tmp/img", static_cast<off_t>(c.bytes)));
        int percentage = -1;
        ASSERT_TRUE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
        EXPECT_EQ(c.percentage, percentage);
    }
    int percentage = 0;
    unlink(kProgress);
    EXPECT_FALSE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
    EXPECT_TRUE(SyslogContains("Fail to open file [/var/run/downloadprogress] for reading"));
}

// A cancel without a pid file is the facade's case.
TEST_F(VyxStatusTest, CancelWithoutDownloadAndInstallerProgress) {
    WriteFile(kPid, "0");
    EXPECT_FALSE(VyxUpdate::CancelDownloadVyx());
    // clang-format off
    struct Case { _tag_update_step_ step; int number; std::string text, line; } cases[] = {
        {UPDATE_STEP_U, -1, "unpacking", "U:unpacking\n"}, {UPDATE_STEP_U, 30, "x", "U:30:\n"},
        {UPDATE_STEP_R, -1, "x", "R:-1:\n"}};
    // clang-format on
    for (const Case& c : cases) {
        EXPECT_TRUE(VyxUpdate::ReportProgress(c.step, c.number, c.text.c_str()));
        EXPECT_EQ(c.line, ReadFile("/tmp/update.progress"));
    }
    // A text longer than the command buffer makes a command the shell refuses, nothing more.
    EXPECT_FALSE(VyxUpdate::ReportProgress(UPDATE_STEP_U, -1, std::string(200, 't').c_str()));
}

}  // namespace
