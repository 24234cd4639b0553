// Download progress, status and cancellation, seen from a second process as the
// administration interface sees them.
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include <gtest/gtest.h>
#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "update_server.h"
#include "vyxupdate.h"

namespace {

using kytotest::PathExists;
using kytotest::ReadKeyValueFile;
using kytotest::SyslogContains;
using kytotest::WriteFile;
using Status = VyxUpdate::VYX_DOWNLOAD_STATUS;

const char* kStatus = "/var/run/downloadVYX.status";
const char* kPid = "/var/run/downloadVYX.pid";
const char* kProgress = "/var/run/downloadprogress";

// Polls cond every 50 ms for up to 30 s.
bool WaitFor(const std::function<bool()>& cond) {
    for (int i = 0; i < 600; ++i) {
        if (cond())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return false;
}

class VyxProgressTest : public kytotest::SandboxTest {
  protected:
    void TearDown() override {
        server.reset();
        SandboxTest::TearDown();
    }
    // A download of a slowly served image running in a second process.
    pid_t StartSlowDownload(unsigned long long bytes) {
        server = std::make_unique<kytotest::UpdateServer>();
        server->PointRssServerHere();
        kytotest::MountVolume("/volume1", 300ULL << 20);
        std::string local = server->PutFileOfSize("/img/slow.img", bytes);
        std::string md5;
        kytotest::Shell("md5sum " + local, &md5);
        server->SlowPath("/img/slow.img", 64 << 10);
        server->PutFile("/autoupdate/genRSS.php",
                        "<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n"
                        "<BuildNum>5700</BuildNum>\n<model>\n<mUnique>demo_model</mUnique>\n"
                        "<mLink>" +
                            server->Url("/img/slow.img") + "</mLink>\n<mCheckSum>" +
                            md5.substr(0, 32) + "</mCheckSum>\n</model>\n</item>\n");
        pid_t pid = kytotest::Spawn([] { return VyxUpdate().DownloadVyx(); });
        EXPECT_TRUE(WaitFor([] { return KLIBCReadPidFile(kPid) > 0; }));
        return pid;
    }
    std::unique_ptr<kytotest::UpdateServer> server;
};

TEST_F(VyxProgressTest, ProgressOfARunningDownload) {
    pid_t downloader = StartSlowDownload(256 << 10);
    auto keys = ReadKeyValueFile(kStatus);
    EXPECT_EQ("vyxupdate", keys["updateType"]);
    EXPECT_EQ("downloading", keys["downloadStatus"]);
    EXPECT_EQ("1", keys["downloadCount"]);
    EXPECT_EQ("1", keys["downloadNum"]);
    EXPECT_EQ("/volume1/@autoupdate/slow.img", keys["patchPath"]);
    int wget = KLIBCReadPidFile(kPid);
    EXPECT_NE(downloader, wget);
    EXPECT_EQ(0, kill(wget, 0));

    int percentage = -1;
    Status status = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    EXPECT_TRUE(WaitFor(
        [&] { return VyxUpdate::GetDownloadStatus(percentage, status) && percentage > 0; }));
    EXPECT_EQ(VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING, status);
    EXPECT_LT(percentage, 100);

    EXPECT_EQ(1, kytotest::Wait(downloader));
    EXPECT_FALSE(PathExists(kStatus));
    EXPECT_TRUE(PathExists("/autoupd@te.info"));
    ASSERT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED, status);
    EXPECT_EQ(100, percentage);
}

TEST_F(VyxProgressTest, CancelFromAnotherProcess) {
    pid_t downloader = StartSlowDownload(4 << 20);
    // Hold the downloader still so the canceller's "stopped" can be seen before the
    // downloader clears the status file.
    ASSERT_EQ(0, kill(downloader, SIGSTOP));
    EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
    EXPECT_FALSE(PathExists(kPid));
    EXPECT_EQ("stopped", ReadKeyValueFile(kStatus)["downloadStatus"]);
    int percentage = -1;
    Status status = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    ASSERT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(VyxUpdate::VYX_DOWNLOAD_STATUS_STOPPED, status);
    ASSERT_EQ(0, kill(downloader, SIGCONT));

    EXPECT_EQ(1, kytotest::Wait(downloader));
    EXPECT_TRUE(SyslogContains("Download process is cancelled"));
    EXPECT_FALSE(PathExists(kStatus));
    EXPECT_FALSE(PathExists("/autoupd@te.info"));
    EXPECT_TRUE(PathExists("/volume1/@autoupdate/slow.img"));    // partial image stays
    EXPECT_TRUE(kytotest::RecordedCalls().empty());              // no notification
    EXPECT_EQ(1u, server->RequestsFor("/img/slow.img").size());  // no retry
}

TEST_F(VyxProgressTest, StatusFileDecisions) {
    pid_t dead = kytotest::Spawn([] { return 0; });
    kytotest::Wait(dead);
    const std::string base =
        "updateType=\"vyxupdate\"\npatchPath=\"/tmp/img\"\n"
        "downloadCount=\"2\"\ndownloadNum=\"2\"\n";
    struct Case {
        const char* what;
        std::string status;  // "" : no file
        std::string pid;     // "" : no file
        bool ok;
        Status expect;
        int percentage;
    };
    const Case cases[] = {
        {"no file", "", "", true, VyxUpdate::VYX_DOWNLOAD_STATUS_NONE, 0},
        {"small update", "updateType=smallupdate\ndownloadStatus=2\n", "", true,
         VyxUpdate::VYX_DOWNLOAD_STATUS_NONE, 0},
        {"stopped", base + "downloadStatus=stopped\n", "", true,
         VyxUpdate::VYX_DOWNLOAD_STATUS_STOPPED, 0},
        {"failed", base + "downloadStatus=failed\n", "1", true,
         VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED, 0},
        {"no pid file", base + "downloadStatus=downloading\n", "", true,
         VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED, 0},
        {"dead process", base + "downloadStatus=downloading\n", std::to_string(dead), true,
         VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED, 0},
        {"second image half done", base + "downloadStatus=downloading\n", std::to_string(getpid()),
         true, VyxUpdate::VYX_DOWNLOAD_STATUS_DOWNLOADING, 75},
        {"junk pid", base + "downloadStatus=finish\n", "junk", false,
         VyxUpdate::VYX_DOWNLOAD_STATUS_NONE, 0},
        {"missing count", "updateType=vyxupdate\npatchPath=/x\ndownloadStatus=failed\n", "", false,
         VyxUpdate::VYX_DOWNLOAD_STATUS_NONE, 0},
    };
    WriteFile(kProgress, "--2026-01-01--  http://h/img\nLength: 1,000,000 (977K) [x]\n");
    WriteFile("/tmp/img", std::string(500000, 'x'));  // 123 pages of 4 KiB: 50 %
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        unlink(kStatus);
        unlink(kPid);
        if (!c.status.empty())
            WriteFile(kStatus, c.status);
        if (!c.pid.empty())
            WriteFile(kPid, c.pid);
        int percentage = -1;
        Status status = VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED;
        EXPECT_EQ(c.ok, VyxUpdate::GetDownloadStatus(percentage, status));
        EXPECT_EQ(c.expect, status);
        EXPECT_EQ(c.percentage, percentage);
    }
    EXPECT_TRUE(SyslogContains("Invalid pid [0] in pid file [/var/run/downloadVYX.pid]"));
    EXPECT_TRUE(SyslogContains("Fail to get [patchPath] from [/var/run/downloadVYX.status]"));

    // A complete newer download wins over whatever the status file says.
    WriteFile("/autoupd@te.info", R"({"updateType":"vyxupdate","buildnumber":"5700",
        "majorversion":"5","minorversion":"2","patchPath":"/tmp/img"})");
    int percentage = 0;
    Status status = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    ASSERT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(VyxUpdate::VYX_DOWNLOAD_STATUS_FINISHED, status);
    EXPECT_EQ(100, percentage);
}

TEST_F(VyxProgressTest, PercentageWithoutSizeAndMissingFiles) {
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
        WriteFile(kProgress, c.log);
        WriteFile("/tmp/img", std::string(c.bytes, 'x'));
        int percentage = -1;
        ASSERT_TRUE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
        EXPECT_EQ(c.percentage, percentage);
    }
    int percentage = 0;
    EXPECT_FALSE(VyxUpdate::GetDownloadPercentage("/tmp/none", percentage));
    EXPECT_TRUE(SyslogContains("Fail to do stat to [/tmp/none]"));
    unlink(kProgress);
    EXPECT_FALSE(VyxUpdate::GetDownloadPercentage("/tmp/img", percentage));
    EXPECT_TRUE(SyslogContains("Fail to open file [/var/run/downloadprogress] for reading"));
}

TEST_F(VyxProgressTest, CancelWithoutDownloadAndSmallHelpers) {
    WriteFile(kStatus, "downloadStatus=\"downloading\"\n");
    EXPECT_TRUE(VyxUpdate::CancelDownloadVyx());
    EXPECT_EQ("downloading", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_TRUE(SyslogContains("[/var/run/downloadVYX.pid] dose not exist", LOG_INFO));
    WriteFile(kPid, "0");
    EXPECT_FALSE(VyxUpdate::CancelDownloadVyx());
    EXPECT_FALSE(VyxUpdate::UpdateProgressFile("downloadStatus", nullptr));
    EXPECT_EQ(0x0D00, KLIBCErrGet());

    struct Step {
        _tag_update_step_ step;
        int number;
        const char* text;
        const char* line;
    };
    const Step steps[] = {
        {UPDATE_STEP_U, -1, "unpacking", "U:unpacking\n"},
        {UPDATE_STEP_U, 30, "ignored", "U:30:\n"},
        {UPDATE_STEP_R, -1, "ignored", "R:-1:\n"},
    };
    for (const Step& s : steps) {
        EXPECT_TRUE(VyxUpdate::ReportProgress(s.step, s.number, s.text));
        EXPECT_EQ(s.line, kytotest::ReadFile("/tmp/update.progress").value_or(""));
    }
    // An unknown step has no letter: the command is cut short and the shell refuses it.
    EXPECT_FALSE(VyxUpdate::ReportProgress(static_cast<_tag_update_step_>(9), 1, nullptr));
    EXPECT_TRUE(SyslogContains("failed to system cmd=[/bin/echo \"]"));
}

}  // namespace
