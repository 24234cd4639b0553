// The facade as the interface and the auto-update job drive it: which kind of update a check
// offers (seen in the server's request log), the tidy-up of status files left by either
// engine, routing of download, apply and cancel, and a full release downloaded, observed only
// through files, logs, programs run and server requests.  A small fix end to end runs through the
// driver's tests.
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "engine_fixtures.h"
#include "systemupdate.h"

using namespace kytotest;

namespace {

const char* const kStatus = "/var/run/downloadVYX.status";
const char* const kInfo = "/autoupd@te.info";
const char* const kFeed = "/autoupdate/genRSS.php";
const char* const kStop = "/tmp/stop_download_smallfix";
const std::string kList = UpdateServer::PatchListPath(5644, "demo_model");

class SystemUpdateTest : public UpdateServerTest {
  protected:
    void SetUp() override {
        UpdateServerTest::SetUp();
        server->PointRssServerHere();
    }
};

TEST_F(SystemUpdateTest, CheckOffersTheFullReleaseFirstThenTheSmallFix) {
    enum Offer { kBoth, kOnlyFix, kNothing, kListError, kFeedError };
    struct Row {
        Offer offer;
        int result;
        bool flag;  // the caller's flag, which starts true to show "untouched"
        int type;
        std::string version;
        size_t listRequests;
    } rows[] = {
        {kBoth, 1, true, 1, "VYX 5.2-5700", 0}, {kOnlyFix, 1, true, 2, "VYX 5.2-5644 update 1", 1},
        {kNothing, 1, false, 0, "", 1},         {kListError, 0, true, 0, "", 1},
        {kFeedError, 0, true, 0, "", 0},
    };
    PublishSmallFix(*server);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.offer);
        server->ClearRequests();
        server->PublishRelease(row.offer == kBoth ? "5700" : "5600", "/img/full.img", 4096);
        if (row.offer == kFeedError)
            server->FailPath(kFeed, 500, 1);
        if (row.offer == kNothing || row.offer == kListError)
            server->FailPath(kList, row.offer == kNothing ? 404 : 500, 1);
        SystemUpdate facade;
        bool flag = true;
        EXPECT_EQ(row.result, facade.CheckNewUpdate(flag));
        EXPECT_TRUE(facade.m_blChecked);
        EXPECT_EQ(row.flag, flag);
        EXPECT_EQ(row.type, facade.m_updateType);
        EXPECT_EQ(row.version, facade.m_fullVersion);
        EXPECT_EQ(row.listRequests, server->RequestsFor(kList).size());
        // Only the full release answers "vyx"; after a check (failed ones included) the
        // type is given without checking again.
        EXPECT_EQ(row.offer == kBoth ? "vyx" : "smallupdate", facade.GetUpdateType());
        EXPECT_EQ(row.listRequests, server->RequestsFor(kList).size());
    }
    // A first GetUpdateType checks; a failed check gives "" and a log line.
    server->FailPath(kFeed, 500, 1);
    SystemUpdate fresh;
    EXPECT_EQ("", fresh.GetUpdateType());
    EXPECT_TRUE(SyslogContains("Fail to check new update", LOG_ERR));
}

TEST_F(SystemUpdateTest, CheckTidiesStatusFilesLeftByEitherEngine) {
    server->PublishRelease("5600", "/img/full.img", 4096);
    server->FailPath(kList, 404);
    const std::string vyx =
        "updateType=\"vyxupdate\"\npatchPath=\"/volume1/a.img\"\n"
        "downloadCount=\"1\"\ndownloadNum=\"1\"\ndownloadStatus=";
    struct Row {
        std::string status;
        bool liveDownloader, kept;
    } rows[] = {
        {"updateType=\"smallupdate\"\npercentage=\"40\"\ndownloadStatus=\"2\"\n", false, true},
        {"updateType=\"smallupdate\"\npercentage=\"0\"\ndownloadStatus=\"1\"\n", false, true},
        {"updateType=\"smallupdate\"\npercentage=\"40\"\ndownloadStatus=\"4\"\n", false, false},
        {"updateType=\"smallupdate\"\npercentage=\"40\"\ndownloadStatus=\"9\"\n", false, false},
        {"updateType=\"smallupdate\"\ndownloadStatus=\"2\"\n", false, false},
        // A running full-release download has no "percentage": the small-update reader
        // calls it failed, so it goes too; so do stale, stopped and failed ones.
        {vyx + "\"downloading\"\n", true, false},
        {vyx + "\"downloading\"\n", false, false},
        {vyx + "\"stopped\"\n", true, false},
    };
    WriteFile("/volume1/a.img", "partial");
    WriteFile("/var/run/downloadprogress", "Length: 100 [application/octet-stream]\n");
    for (const Row& row : rows) {
        SCOPED_TRACE(row.status + (row.liveDownloader ? " live" : " gone"));
        WriteFile(kStatus, row.status);
        WriteFile("/var/run/downloadVYX.pid",
                  row.liveDownloader ? std::to_string(getpid()) : "999999");
        bool flag = false;
        EXPECT_EQ(1, SystemUpdate().CheckNewUpdate(flag));
        EXPECT_EQ(row.kept, PathExists(kStatus));
    }
}

TEST_F(SystemUpdateTest, CancelReadsTheRunningKindFromTheStatusFile) {
    struct Row {
        std::string type;
        int result;
        std::string log;
    } rows[] = {
        {"", 0, "Fail to get [updateType] from [/var/run/downloadVYX.status]. [0x"},
        {"other", 0, "Unknown update type [other]"},
        {"smallupdate", 1, ""},
        {"vyxupdate", 1, ""},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.type);
        RemoveTree(kStatus);
        RemoveTree(kStop);
        if (!row.type.empty())
            SetKeyValue(kStatus, "updateType", row.type);
        ClearSyslog();
        EXPECT_EQ(row.result, SystemUpdate().CancelDownload());
        EXPECT_TRUE(row.log.empty() || SyslogContains(row.log, LOG_ERR));
        EXPECT_EQ(row.type == "smallupdate", PathExists(kStop));
        // With no pid file there is no full-release download to stop: nothing changes.
        EXPECT_EQ(row.type == "smallupdate" ? "5" : "",
                  ReadKeyValueFile(kStatus)["downloadStatus"]);
    }
}

// A fresh facade never takes the kind from the info file (the driving program loads the
// record into the engine); JSON that is not a record is refused the same way, not thrown.
TEST_F(SystemUpdateTest, FreshFacadeImportsNoKindFromTheInfoFile) {
    for (const char* root : {"{\"updateType\":\"smallupdate\"}", "{\"updateType\":\"vyxupdate\"}",
                             "[]", "\"x\"", "7", "true", "[{\"updateType\":1}]"}) {
        SCOPED_TRACE(root);
        WriteFile(kInfo, root);
        EXPECT_NO_THROW(EXPECT_EQ(0, SystemUpdate().ImportInfoFile()));
        EXPECT_NO_THROW(EXPECT_EQ(0, SystemUpdate().Apply()));
        EXPECT_TRUE(PathExists(kInfo));
    }
}

// A full release is downloaded and left for the installer (a cancel of either kind while it
// runs: the driver's and the engines' tests).
TEST_F(SystemUpdateTest, FullReleaseIsDownloadedAndLeftForTheInstaller) {
    server->PublishRelease("5700", "/img/full.img", 4096);
    SystemUpdate facade;
    EXPECT_EQ("VYX 5.2-5700", facade.GetFullVersion());
    ASSERT_EQ(1, facade.Download());
    EXPECT_EQ("vyxupdate", ParseJson(ReadFile(kInfo).value_or("{}"))["updateType"].asString());
    EXPECT_EQ(0, facade.Apply()) << "the installer, not the library, installs a release";
    EXPECT_EQ(1u, server->RequestsFor("/img/full.img").size());
    EXPECT_TRUE(server->RequestsFor(kList).empty());
}

}  // namespace
