// The release download with the real wget and openssl against a loopback update server,
// as the downloading process and a second process see it.
#include <signal.h>
#include <unistd.h>

#include <kytoplatform/klibc.h>

#include "engine_fixtures.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
const char *kStatus = "/var/run/downloadVYX.status", *kPid = "/var/run/downloadVYX.pid",
           *kInfo = "/autoupd@te.info", *kProgress = "/var/run/downloadprogress";
const std::string kFolder = "/volume1/@autoupdate", kSlow = kFolder + "/slow.img";

using VyxServerTest = ReleaseServerTest;

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

}  // namespace
