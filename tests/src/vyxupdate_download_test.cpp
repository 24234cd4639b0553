// Release check and release download with the real wget and openssl against a loopback
// update server, and the download status, progress and cancellation as a second process
// sees them.
#include <ctype.h>
#include <signal.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>
#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "update_server.h"
#include "vyxupdate.h"

namespace {

using kytotest::PathExists;
using kytotest::ReadKeyValueFile;
using kytotest::RecordedCalls;
using kytotest::SyslogContains;
using Calls = std::vector<std::vector<std::string>>;
using Status = VyxUpdate::VYX_DOWNLOAD_STATUS;
constexpr Status kNone = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
constexpr Status kDownloading = VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING;
constexpr Status kFinished = VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED;
constexpr Status kStopped = VyxUpdate::VYX_DOWNLOAD_STATUS_STOPPED;
constexpr Status kFailed = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED;

const char* kFeedPath = "/autoupdate/genRSS.php";
const char* kStatus = "/var/run/downloadVYX.status";
const char* kPid = "/var/run/downloadVYX.pid";
const char* kInfo = "/autoupd@te.info";
const std::string kFolder = "/volume1/@autoupdate";

// Polls cond every 50 ms for up to 30 s.
bool WaitFor(const std::function<bool()>& cond) {
    for (int i = 0; i < 600; ++i) {
        if (cond())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return false;
}

std::vector<std::string> Notification(bool ok) {
    return {"kytovyxnotify", "@administrators",
            ok ? "update:update_download_noti_title" : "update:update_download_noti_title_err",
            "<a style='font-size:12px;text-decoration:underline;' "
            "href=javascript:KYTO.QVS.AppLaunch('KYTO.QVS.ControlPanel.Instance',{fn:'KYTO.QVS."
            "ControlPanel.Upgrade.Main'})> {0} </a>",
            "update:update_download_noti_link"};
}

Json::Value ParseJson(const std::string& text) {
    Json::Value value;
    EXPECT_TRUE(Json::Reader().parse(text, value)) << text;
    return value;
}

bool EventLogged(const std::string& text) {
    return kytotest::ReadFile("/var/log/kytoevent.log").value_or("").find(text) !=
           std::string::npos;
}

class VyxServerTest : public kytotest::SandboxTest {
  protected:
    struct Model {
        std::string unique, link, sum;
    };
    void SetUp() override {
        SandboxTest::SetUp();
        server = std::make_unique<kytotest::UpdateServer>();
        server->PointRssServerHere();
        kytotest::MountVolume("/volume1", 300ULL << 20);
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
        std::string out;
        EXPECT_EQ(0,
                  kytotest::Shell("md5sum '" + server->PutFileOfSize(urlPath, bytes) + "'", &out));
        return {unique, server->Url(urlPath), out.substr(0, 32)};
    }
    // A download of a slowly served image running in a second process.
    pid_t StartSlowDownload(unsigned long long bytes) {
        ServeFeed({Image("demo_model", "/img/slow.img", bytes)});
        server->SlowPath("/img/slow.img", 64 << 10);
        pid_t pid = kytotest::Spawn([] { return VyxUpdate().DownloadVyx(); });
        // The pid file is written before wget starts: wait until bytes have arrived, so
        // the transfer is really under way.
        EXPECT_TRUE(WaitFor([] {
            struct stat st;
            return KLIBCReadPidFile(kPid) > 0 && stat((kFolder + "/slow.img").c_str(), &st) == 0 &&
                   st.st_size > 0;
        }));
        return pid;
    }
    std::unique_ptr<kytotest::UpdateServer> server;
};

TEST_F(VyxServerTest, CheckFindsNewerReleaseOnceAndIdentifiesTheDevice) {
    ServeFeed({{"demo_model", "http://h/demo.img", "00ff"}});
    VyxUpdate vyx;
    EXPECT_EQ("", vyx.GetFullVersion());
    bool haveNew = false;
    ASSERT_EQ(1, vyx.CheckNewRelease(haveNew));
    EXPECT_TRUE(haveNew);
    EXPECT_EQ("VYX 5.2-5700", vyx.GetFullVersion());
    EXPECT_STREQ("http://h/demo.img", vyx.m_release.link);
    EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));

    bool canStart = false;
    EXPECT_EQ(1, vyx.PreCheckDownload(canStart));
    EXPECT_TRUE(canStart);
    auto requests = server->RequestsFor(kFeedPath);
    ASSERT_EQ(1u, requests.size());  // the answer is reused
    EXPECT_EQ("tz=Europe/Berlin", requests[0].query);
    EXPECT_EQ("demo_model VYX5.2 5644 (autoupgrade)", requests[0].userAgent);
}

TEST_F(VyxServerTest, FeedThatCannotBeFetchedFailsTheCheck) {
    struct Case {
        std::string rssServer;  // "" removes the key
        std::string expectInCommand;
    };
    const Case cases[] = {
        {"",
         "Fail to exec command [/usr/kyto/bin/wget --user-agent='demo_model VYX5.2 5644 "
         "(autoupgrade)' -O /var/run/autoupdate_tmp_file_RSS "
         "http://update.kyto.local/autoupdate/genRSS.php?tz=Europe/Berlin 2> /dev/null]. [0x"},
        {server->Url(kFeedPath), server->Url(kFeedPath) + "?tz=Europe/Berlin 2> /dev/null]"},
        // A server that is down: nothing listens on port 1.
        {"http://127.0.0.1:1/autoupdate/genRSS.php",
         "http://127.0.0.1:1/autoupdate/genRSS.php?tz=Europe/Berlin 2> /dev/null]"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.rssServer);
        kytotest::ClearSyslog();
        kytotest::SetKeyValue(
            "/etc.defaults/kytoinfo.conf", "rss_server",
            c.rssServer.empty() ? std::nullopt : std::optional<std::string>(c.rssServer));
        VyxUpdate vyx;
        bool haveNew = false;
        EXPECT_EQ(0, vyx.CheckNewRelease(haveNew));
        EXPECT_FALSE(vyx.m_checked);
        EXPECT_TRUE(SyslogContains(c.expectInCommand));
        EXPECT_TRUE(SyslogContains("Fail to get RSS file"));
        EXPECT_TRUE(SyslogContains("Fail to get latest VYX info"));
        EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));
    }
    EXPECT_EQ(1u, server->Requests().size());  // the 404 of the second case
}

TEST_F(VyxServerTest, CheckReconcilesAnEarlierDownload) {
    const std::string image = "/volume9/@autoupdate/old.img";
    const std::string versions = R"("majorversion":"5","minorversion":"2","patchPath":")" + image;
    struct Case {
        const char* what;
        std::string info;
        bool infoKept;
        bool stateCleared;  // download state files removed with the info
    };
    const Case cases[] = {
        {"outdated build", R"({"updateType":"vyxupdate","buildnumber":"100",)" + versions + "\"}",
         false, true},
        {"same build written in hex", R"({"buildnumber":"0x1644",)" + versions + "\"}", true,
         false},
        {"small update info", R"({"updateType":"smallupdate","buildnumber":"1"})", true, false},
        {"no patchPath", R"({"updateType":"vyxupdate","buildnumber":"5700"})", false, false},
    };
    ServeFeed({{"demo_model", "http://h/demo.img", "00ff"}});
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        kytotest::WriteFile(kInfo, c.info);
        kytotest::WriteFile(image, "partial");
        kytotest::WriteFile("/var/run/downloadprogress", "Length: 7");
        bool haveNew = false;
        ASSERT_EQ(1, VyxUpdate().CheckNewRelease(haveNew));
        EXPECT_EQ(c.infoKept, PathExists(kInfo));
        EXPECT_TRUE(PathExists(image));  // images are never deleted by the check
        EXPECT_EQ(c.stateCleared, !PathExists("/var/run/downloadprogress"));
    }
}

TEST_F(VyxServerTest, RunningDownloadReportsProgressThenRecordsTheImageAndNotifies) {
    pid_t downloader = StartSlowDownload(256 << 10);
    auto keys = ReadKeyValueFile(kStatus);
    EXPECT_EQ("vyxupdate", keys["updateType"]);
    EXPECT_EQ("downloading", keys["downloadStatus"]);
    EXPECT_EQ("1", keys["downloadCount"]);
    EXPECT_EQ("1", keys["downloadNum"]);
    EXPECT_EQ(kFolder + "/slow.img", keys["patchPath"]);
    int wget = KLIBCReadPidFile(kPid);
    EXPECT_NE(downloader, wget);
    EXPECT_EQ(0, kill(wget, 0));

    int percentage = -1;
    Status status = kNone;
    EXPECT_TRUE(WaitFor(
        [&] { return VyxUpdate::GetDownloadStatus(percentage, status) && percentage > 0; }));
    EXPECT_EQ(kDownloading, status);
    EXPECT_LT(percentage, 100);

    EXPECT_EQ(1, kytotest::Wait(downloader));
    EXPECT_EQ(256u << 10, kytotest::ReadFile(kFolder + "/slow.img").value_or("").size());
    EXPECT_EQ(ParseJson(R"({"patchPath":")" + kFolder + R"(/slow.img","buildnumber":"5700",
                  "majorversion":"5","minorversion":"2","updateType":"vyxupdate"})"),
              ParseJson(kytotest::ReadFile(kInfo).value_or("")));
    for (const char* gone : {kStatus, kPid, "/var/run/downloadprogress"}) {
        EXPECT_FALSE(PathExists(gone)) << gone;
    }
    EXPECT_EQ(Calls{Notification(true)}, RecordedCalls());
    EXPECT_TRUE(EventLogged("1 1 0x11B01021 " + kFolder + "/slow.img"));
    ASSERT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(kFinished, status);
    EXPECT_EQ(100, percentage);
}

TEST_F(VyxServerTest, CancelFromAnotherProcess) {
    pid_t downloader = StartSlowDownload(4 << 20);
    // Hold the downloader still so the canceller's "stopped" can be seen before the
    // downloader clears the status file.
    ASSERT_EQ(0, kill(downloader, SIGSTOP));
    EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
    EXPECT_FALSE(PathExists(kPid));
    EXPECT_EQ("stopped", ReadKeyValueFile(kStatus)["downloadStatus"]);
    int percentage = -1;
    Status status = kNone;
    ASSERT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(kStopped, status);
    ASSERT_EQ(0, kill(downloader, SIGCONT));

    EXPECT_EQ(1, kytotest::Wait(downloader));
    EXPECT_TRUE(SyslogContains("Download process is cancelled"));
    EXPECT_FALSE(PathExists(kStatus));
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_TRUE(PathExists(kFolder + "/slow.img"));  // partial image stays
    EXPECT_TRUE(RecordedCalls().empty());            // no notification
    // No retry.  The server may log a request only once its connection ends: wait for it.
    EXPECT_TRUE(WaitFor([&] { return !server->RequestsFor("/img/slow.img").empty(); }));
    EXPECT_EQ(1u, server->RequestsFor("/img/slow.img").size());
}

TEST_F(VyxServerTest, TenAttemptsAtMost) {
    struct Case {
        const char* path;
        int failures;
        int result;
    };
    const Case cases[] = {{"/images/nine.img", 9, 1}, {"/images/ten.img", 10, 0}};
    for (const Case& c : cases) {
        SCOPED_TRACE(c.path);
        kytotest::ClearRecordedCalls();
        ServeFeed({Image("demo_model", c.path, 4096)});
        server->FailPath(c.path, 503, c.failures);
        EXPECT_EQ(c.result, VyxUpdate().DownloadVyx());
        EXPECT_EQ(10u, server->RequestsFor(c.path).size());
    }
    // The failed case leaves its status behind and tells the administrators; no image
    // was complete, so the event carries no path.
    EXPECT_TRUE(SyslogContains("Fail to download patch file"));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_EQ(Calls{Notification(false)}, RecordedCalls());
    EXPECT_TRUE(EventLogged("1 3 0x11B01022    \n"));
}

TEST_F(VyxServerTest, ChecksumMustMatchExactly) {
    Model image = Image("demo_model", "/images/vyx.img", 8192);
    for (char& ch : image.sum)
        ch = static_cast<char>(toupper(ch));
    ServeFeed({image});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Checksum not match"));
    EXPECT_TRUE(SyslogContains("Fail to verify checksum"));
    EXPECT_TRUE(PathExists(kFolder + "/vyx.img"));  // the image stays
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_TRUE(EventLogged("1 3 0x11B01022 " + kFolder + "/vyx.img"));
}

TEST_F(VyxServerTest, HybridPairFetchesBothImages) {
    kytotest::WriteFile("/var/run/kytoha.status",
                        "running=\"yes\"\nhybrid_dl=\"yes\"\npartner_unique=\"partner_model\"\n");
    ServeFeed(
        {Image("demo_model", "/a/mine.img", 4096), Image("partner_model", "/b/partner.img", 8192)});
    ASSERT_EQ(1, VyxUpdate().DownloadVyx());
    Json::Value info = ParseJson(kytotest::ReadFile(kInfo).value_or(""));
    EXPECT_EQ(kFolder + "/mine.img", info["patchPath"].asString());
    EXPECT_EQ(kFolder + "/partner.img", info["passivePatchPath"].asString());
    EXPECT_EQ(8192u, kytotest::ReadFile(kFolder + "/partner.img").value_or("").size());
}

TEST_F(VyxServerTest, NothingToDownloadOrAlreadyRunning) {
    ServeFeed({{"other_model", server->Url("/images/vyx.img"), "00"}});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Current VYX version is latest"));
    EXPECT_TRUE(SyslogContains("Fail to do pre check download"));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_EQ(Calls{Notification(false)}, RecordedCalls());

    // A live download (this process stands in for its wget) refuses a second one, which
    // still reports success and clears the shared files.
    kytotest::ClearRecordedCalls();
    ServeFeed({{"demo_model", server->Url("/images/vyx.img"), "00"}});
    kytotest::WriteFile(
        kStatus,
        "updateType=\"vyxupdate\"\ndownloadStatus=\"downloading\"\n"
        "downloadCount=\"1\"\ndownloadNum=\"1\"\npatchPath=\"/volume1/part.img\"\n");
    kytotest::WriteFile("/volume1/part.img", "part");
    kytotest::WriteFile("/var/run/downloadprogress", "Length: 100 [x]\n");
    kytotest::WriteFile(kPid, std::to_string(getpid()));
    EXPECT_EQ(1, VyxUpdate().DownloadVyx());
    EXPECT_EQ(0u, server->RequestsFor("/images/vyx.img").size());
    EXPECT_FALSE(PathExists(kStatus));
    EXPECT_FALSE(PathExists(kPid));
    EXPECT_EQ(Calls{Notification(true)}, RecordedCalls());
}

// Status, percentage and cancel as other processes see them, from files set up by hand.
using VyxStatusTest = kytotest::SandboxTest;

TEST_F(VyxStatusTest, StatusFileDecisions) {
    pid_t dead = kytotest::Spawn([] { return 0; });
    kytotest::Wait(dead);
    const std::string base =
        "updateType=\"vyxupdate\"\npatchPath=\"/tmp/"
        "img\"\ndownloadCount=\"2\"\ndownloadNum=\"2\"\n";
    struct Case {
        const char* what;
        std::string status;  // "" : no file
        std::string pid;     // "" : no file
        bool ok;
        Status expect;
        int percentage;
    };
    const Case cases[] = {
        {"no file", "", "", true, kNone, 0},
        {"small update", "updateType=smallupdate\ndownloadStatus=2\n", "", true, kNone, 0},
        {"stopped", base + "downloadStatus=stopped\n", "", true, kStopped, 0},
        {"failed", base + "downloadStatus=failed\n", "1", true, kFailed, 0},
        {"no pid file", base + "downloadStatus=downloading\n", "", true, kFailed, 0},
        {"dead process", base + "downloadStatus=downloading\n", std::to_string(dead), true, kFailed,
         0},
        {"second image half done", base + "downloadStatus=downloading\n", std::to_string(getpid()),
         true, kDownloading, 75},
        {"junk pid", base + "downloadStatus=finish\n", "junk", false, kNone, 0},
        {"missing count", "updateType=vyxupdate\npatchPath=/x\ndownloadStatus=failed\n", "", false,
         kNone, 0},
    };
    kytotest::WriteFile("/var/run/downloadprogress",
                        "--2026-01-01--  http://h/img\nLength: 1,000,000 (977K) [x]\n");
    kytotest::WriteFile("/tmp/img", std::string(500000, 'x'));  // 123 pages of 4 KiB: 50 %
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        unlink(kStatus);
        unlink(kPid);
        if (!c.status.empty())
            kytotest::WriteFile(kStatus, c.status);
        if (!c.pid.empty())
            kytotest::WriteFile(kPid, c.pid);
        int percentage = -1;
        Status status = kFailed;
        EXPECT_EQ(c.ok, VyxUpdate::GetDownloadStatus(percentage, status));
        EXPECT_EQ(c.expect, status);
        EXPECT_EQ(c.percentage, percentage);
    }
    EXPECT_TRUE(SyslogContains("Invalid pid [0] in pid file [/var/run/downloadVYX.pid]"));
    EXPECT_TRUE(SyslogContains("Fail to get [patchPath] from [/var/run/downloadVYX.status]"));

    // A complete newer download wins over whatever the status file says.
    kytotest::WriteFile("/autoupd@te.info", R"({"updateType":"vyxupdate","buildnumber":"5700",
        "majorversion":"5","minorversion":"2","patchPath":"/tmp/img"})");
    int percentage = 0;
    Status status = kNone;
    ASSERT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(kFinished, status);
    EXPECT_EQ(100, percentage);
}

TEST_F(VyxStatusTest, PercentageOfOneImage) {
    struct Case {
        std::string log;
        size_t bytes;
        int percentage;
    };
    const Case cases[] = {
        {"no size line here\n", 4096, 0},
        {"Length: 8,192 (8.0K) [application/octet-stream]\n", 8192, 100},
        {"Length: 1,234,567 (1.2M)\n", 617284, 50},  // 151 pages: 50.09 %
        {"Length: 1,000 (1K)\n", 1000, 409},         // a whole page is allocated
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.log);
        kytotest::WriteFile("/var/run/downloadprogress", c.log);
        kytotest::WriteFile("/tmp/img", std::string(c.bytes, 'x'));
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
    kytotest::WriteFile(kStatus, "downloadStatus=\"downloading\"\n");
    EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
    EXPECT_EQ("downloading", kytotest::ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_TRUE(SyslogContains("[/var/run/downloadVYX.pid] dose not exist", LOG_INFO));
    kytotest::WriteFile(kPid, "0");
    EXPECT_FALSE(VyxUpdate::CancelDownloadVyx());
    EXPECT_FALSE(VyxUpdate::UpdateProgressFile("downloadStatus", nullptr));
    EXPECT_EQ(0x0D00, KLIBCErrGet());

    struct Step {
        _tag_update_step_ step;
        int number;
        std::string text;
        std::string line;
    };
    const Step steps[] = {
        {UPDATE_STEP_U, -1, "unpacking", "U:unpacking\n"},
        {UPDATE_STEP_U, 30, "ignored", "U:30:\n"},
        {UPDATE_STEP_R, -1, "ignored", "R:-1:\n"},
    };
    for (const Step& s : steps) {
        SCOPED_TRACE(s.line);
        EXPECT_TRUE(VyxUpdate::ReportProgress(s.step, s.number, s.text.c_str()));
        EXPECT_EQ(s.line, kytotest::ReadFile("/tmp/update.progress").value_or(""));
    }
    // The command is built in 128 bytes: a long text loses its closing quote.  An unknown
    // step has no letter, which ends the command early.  The shell refuses both.
    EXPECT_FALSE(VyxUpdate::ReportProgress(UPDATE_STEP_U, -1, std::string(120, 't').c_str()));
    EXPECT_TRUE(
        SyslogContains("failed to system cmd=[/bin/echo \"U:" + std::string(114, 't') + "], r="));
    EXPECT_FALSE(VyxUpdate::ReportProgress(static_cast<_tag_update_step_>(9), 1, nullptr));
    EXPECT_TRUE(SyslogContains("failed to system cmd=[/bin/echo \"]"));
}

}  // namespace
