// Release check and release download with the real wget and openssl against a loopback
// update server; download status, progress and cancellation as a second process sees them.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "update_server.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
using Calls = std::vector<std::vector<std::string>>;
using Status = VyxUpdate::VYX_DOWNLOAD_STATUS;
constexpr Status kNone = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE,
                 kFailed = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED,
                 kStopped = VyxUpdate::VYX_DOWNLOAD_STATUS_STOPPED,
                 kFinished = VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED;
const char *kFeedPath = "/autoupdate/genRSS.php", *kStatus = "/var/run/downloadVYX.status",
           *kPid = "/var/run/downloadVYX.pid", *kInfo = "/autoupd@te.info";
const std::string kFolder = "/volume1/@autoupdate", kSlow = kFolder + "/slow.img";

Calls Notification(bool ok) {
    return {{"kytovyxnotify", "@administrators",
             ok ? "update:update_download_noti_title" : "update:update_download_noti_title_err",
             "<a style='font-size:12px;text-decoration:underline;' href=javascript:KYTO.QVS."
             "AppLaunch('KYTO.QVS.ControlPanel.Instance',{fn:'KYTO.QVS.ControlPanel.Upgrade.Main'"
             "})> {0} </a>",
             "update:update_download_noti_link"}};
}
bool EventLogged(const std::string& text) {
    return ReadFile("/var/log/kytoevent.log").value_or("").find(text) != std::string::npos;
}
std::pair<Status, int> DownloadStatus(bool expectOk = true) {
    std::pair<Status, int> got{kFailed, -1};
    EXPECT_EQ(expectOk, VyxUpdate::GetDownloadStatus(got.second, got.first));
    return got;
}

class VyxServerTest : public SandboxTest {
  protected:
    struct Model {
        std::string unique, link, sum;
    };
    void SetUp() override {
        SandboxTest::SetUp();
        server = std::make_unique<UpdateServer>();
        server->PointRssServerHere();
        MountVolume("/volume1", 300ULL << 20);
    }
    void TearDown() override {
        server.reset();
        SandboxTest::TearDown();
    }
    // Publishes one item, 5.2 build 5700, holding one model element per entry.
    void ServeFeed(const std::vector<Model>& models) {
        std::string feed =
            "<rss><channel>\n<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n"
            "<BuildNum>5700</BuildNum>\n";
        for (const Model& m : models) {
            feed += "<model>\n<mUnique>" + m.unique + "</mUnique>\n<mLink>" + m.link +
                    "</mLink>\n<mCheckSum>" + m.sum + "</mCheckSum>\n</model>\n";
        }
        server->PutFile(kFeedPath, feed + "</item>\n</channel></rss>\n");
    }
    // Serves an image at urlPath and returns the feed entry for it with its MD5.
    Model Image(const std::string& unique, const std::string& urlPath, unsigned long long bytes) {
        return {unique, server->Url(urlPath), Md5Of(server->PutFileOfSize(urlPath, bytes))};
    }
    // A download of a slowly served image in a second process, once bytes have arrived.
    pid_t StartSlowDownload(unsigned long long bytes) {
        ServeFeed({Image("demo_model", "/img/slow.img", bytes)});
        server->SlowPath("/img/slow.img", 64 << 10);
        pid_t pid = Spawn([] { return VyxUpdate().DownloadVyx(); });
        struct stat st;
        EXPECT_TRUE(WaitFor([&] {
            return KLIBCReadPidFile(kPid) > 0 && stat(kSlow.c_str(), &st) == 0 && st.st_size > 0;
        }));
        return pid;
    }
    std::unique_ptr<UpdateServer> server;
};

TEST_F(VyxServerTest, CheckFindsNewerReleaseOnceAndIdentifiesTheDevice) {
    ServeFeed({{"demo_model", "http://h/demo.img", "00ff"}});
    VyxUpdate vyx;
    EXPECT_EQ("", vyx.GetFullVersion());
    bool haveNew = false, canStart = false;
    ASSERT_EQ(1, vyx.CheckNewRelease(haveNew));
    EXPECT_TRUE(haveNew);
    EXPECT_EQ("VYX 5.2-5700", vyx.GetFullVersion());
    EXPECT_STREQ("http://h/demo.img", vyx.m_release.link);
    EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));
    EXPECT_EQ(1, vyx.PreCheckDownload(canStart));
    EXPECT_TRUE(canStart);
    auto requests = server->RequestsFor(kFeedPath);
    ASSERT_EQ(1u, requests.size());  // the answer is reused
    EXPECT_EQ("tz=Europe/Berlin demo_model VYX5.2 5644 (autoupgrade)",
              requests[0].query + " " + requests[0].userAgent);
}

TEST_F(VyxServerTest, FeedThatCannotBeFetchedFailsTheCheck) {
    // The default server's name resolves from the hosts file to loopback, where nothing
    // listens on port 80: the test never depends on the machine's name service.
    WriteFile("/etc/hosts", "127.0.0.1 localhost\n127.0.0.1 update.kyto.local\n");
    // rss_server ("" removes the key): the default, a 404, a server that is down.
    for (std::string rss : {std::string(), server->Url(kFeedPath),
                            std::string("http://127.0.0.1:1/autoupdate/genRSS.php")}) {
        SCOPED_TRACE(rss);
        ClearSyslog();
        SetKeyValue("/etc.defaults/kytoinfo.conf", "rss_server",
                    rss.empty() ? std::nullopt : std::optional<std::string>(rss));
        VyxUpdate vyx;
        bool haveNew = false;
        EXPECT_EQ(0, vyx.CheckNewRelease(haveNew));
        EXPECT_FALSE(vyx.m_checked);
        EXPECT_TRUE(SyslogContains(
            "Fail to exec command [/usr/kyto/bin/wget --user-agent='demo_model VYX5.2 5644 "
            "(autoupgrade)' -O /var/run/autoupdate_tmp_file_RSS " +
            (rss.empty() ? "http://update.kyto.local/autoupdate/genRSS.php" : rss) +
            "?tz=Europe/Berlin 2> /dev/null]. [0x"));
        EXPECT_TRUE(SyslogContains("Fail to get RSS file"));
        EXPECT_TRUE(SyslogContains("Fail to get latest VYX info"));
        EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));
    }
    EXPECT_EQ(1u, server->Requests().size());  // the 404
}

TEST_F(VyxServerTest, CheckReconcilesAnEarlierDownload) {
    const std::string image = "/volume9/@autoupdate/old.img",
                      versions = R"("majorversion":"5","minorversion":"2","patchPath":")" + image;
    // clang-format off
    struct Case { std::string info; bool infoKept, progressCleared; } cases[] = {
        {R"({"updateType":"vyxupdate","buildnumber":"100",)" + versions + "\"}", false, true},
        {R"({"buildnumber":"0x1644",)" + versions + "\"}", true, false},  // same build in hex
        {R"({"updateType":"smallupdate","buildnumber":"1"})", true, false},
        {R"({"updateType":"vyxupdate","buildnumber":"5700"})", false, false}};  // no patchPath
    // clang-format on
    ServeFeed({{"demo_model", "http://h/demo.img", "00ff"}});
    for (const Case& c : cases) {
        SCOPED_TRACE(c.info);
        WriteFile(kInfo, c.info);
        WriteFile(image, "partial");
        WriteFile("/var/run/downloadprogress", "Length: 7");
        bool haveNew = false;
        ASSERT_EQ(1, VyxUpdate().CheckNewRelease(haveNew));
        EXPECT_EQ(c.infoKept, PathExists(kInfo));
        EXPECT_TRUE(PathExists(image));  // images are never deleted by the check
        EXPECT_EQ(c.progressCleared, !PathExists("/var/run/downloadprogress"));
    }
}

TEST_F(VyxServerTest, RunningDownloadReportsProgressThenRecordsTheImageAndNotifies) {
    pid_t downloader = StartSlowDownload(256 << 10);
    EXPECT_EQ((std::map<std::string, std::string>{{"updateType", "vyxupdate"},
                                                  {"downloadStatus", "downloading"},
                                                  {"downloadCount", "1"},
                                                  {"downloadNum", "1"},
                                                  {"patchPath", kSlow}}),
              ReadKeyValueFile(kStatus));
    int wget = KLIBCReadPidFile(kPid);
    EXPECT_NE(downloader, wget);
    EXPECT_EQ(0, kill(wget, 0));
    std::pair<Status, int> seen;
    EXPECT_TRUE(WaitFor([&] { return (seen = DownloadStatus()).second > 0; }));
    EXPECT_EQ(VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING, seen.first);
    EXPECT_LT(seen.second, 100);

    EXPECT_EQ(1, Wait(downloader));
    EXPECT_EQ(256u << 10, ReadFile(kSlow).value_or("").size());
    EXPECT_EQ(ParseJson(R"({"patchPath":")" + kSlow + R"(","buildnumber":"5700",
                  "majorversion":"5","minorversion":"2","updateType":"vyxupdate"})"),
              ParseJson(ReadFile(kInfo).value_or("")));
    for (const char* gone : {kStatus, kPid, "/var/run/downloadprogress"})
        EXPECT_FALSE(PathExists(gone)) << gone;
    EXPECT_EQ(Notification(true), RecordedCalls());
    EXPECT_TRUE(EventLogged("1 1 0x11B01021 " + kSlow));
    EXPECT_EQ(std::make_pair(kFinished, 100), DownloadStatus());
}

// A cancel from another process kills the running wget, on the first attempt or on a retry
// after a failed one (the pid file names the attempt that runs now), and ends the retries.
TEST_F(VyxServerTest, CancelFromAnotherProcessEndsTheRetries) {
    for (int failedBefore : {0, 1}) {
        SCOPED_TRACE(failedBefore);
        ClearSyslog();
        server->ClearRequests();
        RemoveTree(kSlow);  // bytes on disk must come from this download
        if (failedBefore)
            server->FailPath("/img/slow.img", 503, failedBefore);
        pid_t downloader = StartSlowDownload(4 << 20);
        // Hold the downloader still so that the canceller's "stopped" can be seen before
        // the downloader clears the status file.
        ASSERT_EQ(0, kill(downloader, SIGSTOP));
        EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
        EXPECT_FALSE(PathExists(kPid));
        EXPECT_EQ("stopped", ReadKeyValueFile(kStatus)["downloadStatus"]);
        EXPECT_EQ(kStopped, DownloadStatus().first);
        ASSERT_EQ(0, kill(downloader, SIGCONT));

        EXPECT_EQ(1, Wait(downloader));
        EXPECT_TRUE(SyslogContains("Download process is cancelled"));
        EXPECT_FALSE(SyslogContains("Fail to kill download VYX process"));
        EXPECT_FALSE(PathExists(kStatus) || PathExists(kInfo));
        EXPECT_TRUE(PathExists(kSlow));        // the partial image stays
        EXPECT_TRUE(RecordedCalls().empty());  // no notification
        // No further attempt.  The server logs a request once its connection ends.
        const size_t attempts = failedBefore + 1;
        auto requests = [&] { return server->RequestsFor("/img/slow.img").size(); };
        EXPECT_TRUE(WaitFor([&] { return requests() >= attempts; }));
        EXPECT_EQ(attempts, requests());
    }
}

TEST_F(VyxServerTest, TenAttemptsAtMost) {
    for (int failures : {9, 10}) {
        const std::string path = "/images/f" + std::to_string(failures) + ".img";
        ClearRecordedCalls();
        ServeFeed({Image("demo_model", path, 4096)});
        server->FailPath(path, 503, failures);
        EXPECT_EQ(failures < 10 ? 1 : 0, VyxUpdate().DownloadVyx()) << failures;
        EXPECT_EQ(10u, server->RequestsFor(path).size()) << failures;
    }
    // No image was complete, so the failure event carries no path.
    EXPECT_TRUE(SyslogContains("Fail to download patch file"));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_EQ(Notification(false), RecordedCalls());
    EXPECT_TRUE(EventLogged("1 3 0x11B01022    \n"));
}

TEST_F(VyxServerTest, ChecksumMustMatchExactlyAndHybridPairFetchesBothImages) {
    Model image = Image("demo_model", "/images/vyx.img", 8192);
    for (char& ch : image.sum)
        ch = static_cast<char>(toupper(ch));
    ServeFeed({image});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Checksum not match") && SyslogContains("Fail to verify checksum"));
    EXPECT_TRUE(PathExists(kFolder + "/vyx.img"));  // the image stays
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_TRUE(EventLogged("1 3 0x11B01022 " + kFolder + "/vyx.img"));

    WriteFile("/var/run/kytoha.status",
              "running=\"yes\"\nhybrid_dl=\"yes\"\npartner_unique=\"partner_model\"\n");
    ServeFeed(
        {Image("demo_model", "/a/mine.img", 4096), Image("partner_model", "/b/partner.img", 8192)});
    ASSERT_EQ(1, VyxUpdate().DownloadVyx());
    Json::Value info = ParseJson(ReadFile(kInfo).value_or(""));
    EXPECT_EQ(kFolder + "/mine.img " + kFolder + "/partner.img",
              info["patchPath"].asString() + " " + info["passivePatchPath"].asString());
    EXPECT_EQ(8192u, ReadFile(kFolder + "/partner.img").value_or("").size());
}

TEST_F(VyxServerTest, NothingToDownloadOrAlreadyRunning) {
    ServeFeed({{"other_model", server->Url("/images/vyx.img"), "00"}});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Current VYX version is latest"));
    EXPECT_TRUE(SyslogContains("Fail to do pre check download"));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_EQ(Notification(false), RecordedCalls());

    // A live download (this process stands in for its wget) refuses a second one, which
    // still reports success and clears the shared files.
    ClearRecordedCalls();
    ServeFeed({{"demo_model", server->Url("/images/vyx.img"), "00"}});
    WriteFile(kStatus,
              "updateType=\"vyxupdate\"\ndownloadStatus=\"downloading\"\n"
              "downloadCount=\"1\"\ndownloadNum=\"1\"\npatchPath=\"/volume1/part.img\"\n");
    WriteFile("/volume1/part.img", "part");
    WriteFile("/var/run/downloadprogress", "Length: 100 [x]\n");
    WriteFile(kPid, std::to_string(getpid()));
    EXPECT_EQ(1, VyxUpdate().DownloadVyx());
    EXPECT_EQ(0u, server->RequestsFor("/images/vyx.img").size());
    EXPECT_FALSE(PathExists(kStatus) || PathExists(kPid));
    EXPECT_EQ(Notification(true), RecordedCalls());
}

// Status, percentage and cancel as other processes see them, from files set up by hand.
using VyxStatusTest = SandboxTest;

TEST_F(VyxStatusTest, StatusFileDecisions) {
    pid_t dead = Spawn([] { return 0; });
    Wait(dead);
    const std::string base =
        "updateType=\"vyxupdate\"\npatchPath=\"/tmp/img\"\n"
        "downloadCount=\"2\"\ndownloadNum=\"2\"\ndownloadStatus=";
    // status and pid file ("": none), result, status, percentage.
    // clang-format off
    struct Case { std::string status, pid; bool ok; Status expect; int percentage; } cases[] = {
        {"", "", true, kNone, 0}, {"updateType=smallupdate\ndownloadStatus=2\n", "", true, kNone, 0},
        {base + "stopped\n", "", true, kStopped, 0}, {base + "failed\n", "1", true, kFailed, 0},
        {base + "downloading\n", "", true, kFailed, 0},
        {base + "downloading\n", std::to_string(dead), true, kFailed, 0},
        {base + "downloading\n", std::to_string(getpid()), true,
         VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING, 75},  // second image half done
        {base + "finish\n", "junk", false, kNone, 0},
        {"updateType=vyxupdate\npatchPath=/x\ndownloadStatus=failed\n", "", false, kNone, 0}};
    // clang-format on
    // Half of the second image (any page size up to 512 KiB allocates it exactly).
    WriteFile("/var/run/downloadprogress",
              "--2026-01-01--  http://h/img\nLength: 1,048,576 (1M)\n");
    WriteFile("/tmp/img", std::string(512 << 10, 'x'));
    for (const Case& c : cases) {
        SCOPED_TRACE(c.status + " pid " + c.pid);
        RemoveTree(kStatus);
        RemoveTree(kPid);
        if (!c.status.empty())
            WriteFile(kStatus, c.status);
        if (!c.pid.empty())
            WriteFile(kPid, c.pid);
        EXPECT_EQ(std::make_pair(c.expect, c.percentage), DownloadStatus(c.ok));
    }
    EXPECT_TRUE(SyslogContains("Invalid pid [0] in pid file [/var/run/downloadVYX.pid]"));
    EXPECT_TRUE(SyslogContains("Fail to get [patchPath] from [/var/run/downloadVYX.status]"));
    // A complete newer download wins over whatever the status file says.
    WriteFile(kInfo, R"({"updateType":"vyxupdate","buildnumber":"5700",
        "majorversion":"5","minorversion":"2","patchPath":"/tmp/img"})");
    EXPECT_EQ(std::make_pair(kFinished, 100), DownloadStatus());
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
        WriteFile("/var/run/downloadprogress", c.log);
        WriteFile("/tmp/img", c.sparse ? "" : std::string(c.bytes, 'x'));
        if (c.sparse) {
            ASSERT_EQ(0, truncate("/tmp/img", static_cast<off_t>(c.bytes)));
        }
        int percentage = -1;
        ASSERT_TRUE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
        EXPECT_EQ(c.percentage, percentage);
    }
    int percentage = 0;
    EXPECT_FALSE(VyxUpdate::GetDownloadPercentage("/tmp/none", percentage));
    EXPECT_TRUE(SyslogContains("Fail to do stat to [/tmp/none]"));
    unlink("/var/run/downloadprogress");
    EXPECT_FALSE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
    EXPECT_TRUE(SyslogContains("Fail to open file [/var/run/downloadprogress] for reading"));
}

TEST_F(VyxStatusTest, CancelWithoutDownloadAndInstallerProgress) {
    WriteFile(kStatus, "downloadStatus=\"downloading\"\n");
    EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
    EXPECT_EQ("downloading", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_TRUE(SyslogContains("[/var/run/downloadVYX.pid] dose not exist", LOG_INFO));
    WriteFile(kPid, "0");
    EXPECT_FALSE(VyxUpdate::CancelDownloadVyx());
    EXPECT_FALSE(VyxUpdate::UpdateProgressFile("downloadStatus", nullptr));
    EXPECT_EQ(0x0D00, KLIBCErrGet());
    EXPECT_TRUE(VyxUpdate::ReportProgress(UPDATE_STEP_U, -1, "unpacking"));
    EXPECT_EQ("U:unpacking\n", ReadFile("/tmp/update.progress"));
    EXPECT_TRUE(VyxUpdate::ReportProgress(UPDATE_STEP_U, 30, "ignored"));
    EXPECT_EQ("U:30:\n", ReadFile("/tmp/update.progress"));
    EXPECT_TRUE(VyxUpdate::ReportProgress(UPDATE_STEP_R, -1, "ignored"));
    EXPECT_EQ("R:-1:\n", ReadFile("/tmp/update.progress"));
    // A text longer than the command buffer makes a command the shell refuses, nothing more.
    EXPECT_FALSE(VyxUpdate::ReportProgress(UPDATE_STEP_U, -1, std::string(200, 't').c_str()));
}

}  // namespace
