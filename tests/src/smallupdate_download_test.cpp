// Downloading a small update with wget from the loopback server: status, retries, stop marker.
#include <algorithm>

#include "engine_fixtures.h"

namespace {

using namespace kytotest;
const char *kStatus = "/var/run/downloadVYX.status", *kInfo = "/autoupd@te.info",
           *kMarker = "/tmp/stop_download_smallfix";
const std::string kDir = "/volume1//@smallupd@te_deb";
const auto Deb = [](const std::string& name) { return SmallFixDebName(name, 5); };

using SmallUpdateDownloadTest = SmallDownloadTest;

// Seven files: the first arrives at its fourth try, the fifth never; the status keeps the
// percentage of the last completed file, 4 of 7.
TEST_F(SmallUpdateDownloadTest, RetriesAreCountedAndTheTenthFailureEndsTheDownload) {
    Packages({"ra", "r2", "r3", "r4", "rb", "r6"});
    server->FailPath("/debs/" + Deb("ra"), 500, 3);
    server->FailPath("/debs/" + Deb("rb"), 503);
    EXPECT_FALSE(u.Download(true));
    EXPECT_EQ(4u, server->RequestsFor("/debs/" + Deb("ra")).size());
    EXPECT_EQ(10u, server->RequestsFor("/debs/" + Deb("rb")).size());
    EXPECT_TRUE(server->RequestsFor("/debs/" + Deb("r6")).empty());
    EXPECT_EQ("57 failed", SmallDownloadSeen());
    EXPECT_TRUE(SyslogContains("failed to exec cmd=[/usr/kyto/bin/wget " + u.m_installDebLinks[4] +
                                   " -O " + kDir + "/" + Deb("rb") +
                                   " --timeout=15 --tries=1], r=8",
                               LOG_ERR));
    EXPECT_FALSE(SmallUpdate::ExecWgetWithRetry("nolink.deb", "/tmp"));  // no folder: ten refusals
    const std::vector<std::string> logged = SyslogMessages(LOG_ERR);
    EXPECT_EQ(10, std::count_if(logged.begin(), logged.end(), [](const std::string& m) {
                  return m.find("Wrong download link [nolink.deb]") != std::string::npos;
              }));
}

// The stop marker: left over before the download, created by a cancel in another process
// while the first of three files is on its way, or while the last one is; a finished
// download is told by the info file alone.
TEST_F(SmallUpdateDownloadTest, StopMarkerBeforeBetweenAndAfterFiles) {
    enum When { kBefore, kBetween, kAfter };
    for (When when : {kBefore, kBetween, kAfter}) {
        SCOPED_TRACE(when);
        server->ClearRequests();
        const std::string tag = std::to_string(when);
        Packages({"a" + tag, "b" + tag}, when == kBefore ? 0 : 96 << 10);
        if (when == kBefore)
            WriteFile(kMarker, "");
        const std::string first =
            kDir + "/" + (when == kAfter ? u.m_smallUpdateDeb : u.m_installDebs[0]);
        // A poller sees each finished file: none while the first is on its way, two of three
        // when the last one is.
        const pid_t canceller = Spawn([&] {
            return when == kBefore ||
                           (WaitFor([&] { return PathExists(first); }) &&
                            SmallDownloadSeen() == (when == kAfter ? "66 downloading" : "0 init") &&
                            SmallUpdate().CancelDownload())
                       ? 0
                       : 1;
        });
        EXPECT_TRUE(u.Download(true));
        EXPECT_EQ(0, Wait(canceller));
        EXPECT_EQ(when == kBefore ? "100 finished" : "7 none", SmallDownloadSeen());
        EXPECT_EQ(when == kAfter, PathExists(kMarker));
        EXPECT_EQ(when == kBetween ? 1u : 3u, server->Requests().size());
        EXPECT_EQ(when == kBetween ? 0u : 3u, ListDir(kDir).size());
        Shell("rm -f /tmp/stop_download_smallfix /autoupd@te.info");
    }
    WriteFile(kMarker, "left by something else");  // a cancel leaves it empty
    EXPECT_TRUE(SmallUpdate().CancelDownload());
    EXPECT_EQ("", ReadFile(kMarker).value_or("missing"));
}

TEST_F(SmallUpdateDownloadTest, WhatIsFetchedAndWhatCountsAsDownloaded) {
    // A small-update package alone, without a configuration update, is not fetched.
    u.m_smallUpdateDeb = Deb("small");
    u.m_smallUpdateDebLink = server->Url("/debs/" + Deb("small"));
    WriteFile(kStatus, "updateType=smallupdate\npercentage=\"0\"\ndownloadStatus=\"4\"\n");
    ASSERT_TRUE(u.Download(true));
    EXPECT_TRUE(server->Requests().empty());
    EXPECT_EQ("100 finished", SmallDownloadSeen());

    // With a configuration update it is; a flash package only with its flag.
    u.m_blConfigUpdate = u.m_blFlashUpdate = true;
    u.m_flashUpdateDeb = Deb("flash");
    u.m_flashUpdateDebLink = server->Url("/debs/" + Deb("flash"));
    server->PutFile("/debs/" + Deb("small"), "s");
    server->PutFile("/debs/" + Deb("flash"), "f");
    u.m_installDebs = {Deb("absent"), Deb("after")};
    ASSERT_TRUE(u.Download(true));
    EXPECT_EQ((std::vector<std::string>{Deb("flash"), Deb("small")}), ListDir(kDir));
    EXPECT_TRUE(SmallUpdate().IsReadyApply()) << "the flash package is enough";
    RemoveTree(kDir + "/" + Deb("flash"));
    EXPECT_TRUE(SmallUpdate().IsReadyApply()) << "so is the small-update package";
    RemoveTree(kDir + "/" + Deb("small"));
    EXPECT_FALSE(SmallUpdate().IsReadyApply());
    EXPECT_TRUE(SyslogContains("can't access [" + kDir + "/" + Deb("absent") + "]", LOG_ERR) &&
                !SyslogContains(Deb("after")));  // the check stops at the first missing file

    // Without an info file the status file tells; a state beyond the table is a failure.
    RemoveTree(kInfo);
    WriteFile(kStatus, "percentage=\"42\"\ndownloadStatus=\"-1\"\n");
    EXPECT_EQ("42 failed", SmallDownloadSeen());
    RemoveTree(kStatus);
    EXPECT_EQ("7 none", SmallDownloadSeen());
}

}  // namespace
