// Faults from outside the appliance: an update server that answers errors, sends a feed
// with a 10 MB line or no feed at all; a data volume that fills up while a download writes
// to it.  Each ends with the result, status and log line the engines prescribe, and leaves
// the volume's other files alone.
#include <sys/statvfs.h>

#include <algorithm>

#include <kytoplatform/klibc.h>

#include "engine_fixtures.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
const char *kFeed = "/autoupdate/genRSS.php", *kStatus = "/var/run/downloadVYX.status",
           *kInfo = "/autoupd@te.info", *kKeep = "/volume1/keep/photos.tar";

// Another user's file on the data volume, and a filler that takes all free space but
// `leave` bytes; both must survive a failed download untouched.
std::string KeepFile() {
    WriteFile(kKeep, std::string(300000, 'k'));
    return Md5Of(kKeep);
}
void FillVolume(unsigned long long leave) {
    struct statvfs vfs;
    ASSERT_EQ(0, statvfs("/volume1", &vfs));
    unsigned long long free = static_cast<unsigned long long>(vfs.f_bavail) * vfs.f_frsize;
    ASSERT_EQ(0, Shell("fallocate -l " + std::to_string(free - leave) + " /volume1/filler"));
}

using ReleaseFaultTest = ReleaseServerTest;

TEST_F(ReleaseFaultTest, BrokenFeedsGiveTheCheckResultAndNoFeedFileStays) {
    const std::string huge(10 << 20, 'x');
    const std::string item = FeedItem("5", "2", "5700", {{"demo_model", "http://h/i.img", "00"}});
    std::string itemOnOneLine = item;
    std::replace(itemOnOneLine.begin(), itemOnOneLine.end(), '\n', ' ');
    struct Row {
        const char* name;
        std::string feed;
        int status;  // answered by the server, 0 for the feed as it stands
        int result;
        bool haveNew;
    } rows[] = {
        {"10 MB line, then the item", FeedDocument("<title>" + huge + "</title>\n" + item), 0, 1,
         true},
        {"the item inside one 10 MB line", huge + itemOnOneLine, 0, 1, false},
        {"an error page", "<html><body>busy</body></html>", 0, 1, false},
        {"server error", FeedDocument(item), 500, 0, false},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        server->PutFile(kFeed, row.feed);
        if (row.status)
            server->FailPath(kFeed, row.status, 1);
        ClearSyslog();
        VyxUpdate vyx;
        bool haveNew = !row.haveNew;
        EXPECT_EQ(row.result, vyx.CheckNewRelease(haveNew));
        if (row.result) {
            EXPECT_EQ(row.haveNew, haveNew);
        }
        EXPECT_EQ(row.result == 0, SyslogContains("Fail to get RSS file", LOG_ERR));
        EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));
    }
}

TEST_F(ReleaseFaultTest, VolumeThatFillsUpDuringTheImageFailsTheDownload) {
    const std::string keep = KeepFile();
    pid_t pid = StartSlowDownload(4 << 20);
    FillVolume(16 << 10);
    const std::string filler = Md5Of("/volume1/filler");
    EXPECT_EQ(0, Wait(pid));  // DownloadVyx's result 0
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    int percentage = -1;
    VyxUpdate::VYX_DOWNLOAD_STATUS status = VyxUpdate::VYX_DOWNLOAD_STATUS_NONE;
    EXPECT_TRUE(VyxUpdate::GetDownloadStatus(percentage, status));
    EXPECT_EQ(VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED, status);
    EXPECT_TRUE(SyslogContains("Fail to download patch file", LOG_ERR));
    EXPECT_EQ(10u, server->RequestsFor("/img/slow.img").size());
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_FALSE(PathExists("/var/run/downloadVYX.pid"));
    EXPECT_EQ(keep, Md5Of(kKeep));
    EXPECT_EQ(filler, Md5Of("/volume1/filler"));
}

// The small update's packages (the small-update package comes last): the volume fills up
// while the second of three files is on its way.
using SmallFaultTest = SmallDownloadTest;

TEST_F(SmallFaultTest, VolumeThatFillsUpDuringThePackagesFailsTheDownload) {
    const std::string keep = KeepFile();
    Packages({"first", "second"}, 32 << 10);
    const std::string second = u.m_installDebs[1];
    pid_t pid = Spawn([&] { return u.Download(true) ? 1 : 0; });
    struct stat st;
    ASSERT_TRUE(WaitFor([&] {
        return stat(("/volume1/@smallupd@te_deb/" + second).c_str(), &st) == 0 && st.st_size > 0;
    }));
    FillVolume(16 << 10);
    const std::string filler = Md5Of("/volume1/filler");
    EXPECT_EQ(0, Wait(pid));
    EXPECT_EQ(10u, server->RequestsFor("/debs/" + second).size());
    // The first of three files had arrived; a poller sees the same.
    auto status = ReadKeyValueFile(kStatus);
    EXPECT_EQ("33 4", status["percentage"] + " " + status["downloadStatus"]);
    EXPECT_EQ("33 failed", SmallDownloadSeen());
    EXPECT_TRUE(
        SyslogContains("failed to exec cmd=[/usr/kyto/bin/wget http://127.0.0.1:", LOG_ERR));
    EXPECT_FALSE(PathExists("/volume1/@smallupd@te_deb"));  // no partial package stays
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_EQ(keep, Md5Of(kKeep));
    EXPECT_EQ(filler, Md5Of("/volume1/filler"));
}

}  // namespace
