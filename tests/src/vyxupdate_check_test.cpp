// The release check against a loopback update server (one question per object, the default
// server), the reconcile of an earlier download, and the judgement of a downloaded release.
#include "engine_fixtures.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
const char *kFeedPath = "/autoupdate/genRSS.php", *kInfo = "/autoupd@te.info",
           *kProgress = "/var/run/downloadprogress";

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

// An info object of any shape is judged without throwing and without gaining members.
using VyxCheckTest = SandboxTest;

TEST_F(VyxCheckTest, DownloadedInfoOfAnyShapeIsJudgedWithoutThrowing) {
    for (const char* text :
         {R"(["5","2","9999"])", R"({"majorversion":"5"})", R"("x")", "7", "true",
          R"({"majorversion":{},"minorversion":[],"buildnumber":true})"}) {
        SCOPED_TRACE(text);
        Json::Value info;
        ASSERT_TRUE(Json::Reader().parse(text, info));
        const Json::Value before = info;
        bool isNewer = false;
        EXPECT_TRUE(VyxUpdate::CheckPatchAndUpdateType(isNewer, info) && !isNewer);
        EXPECT_EQ(before, info);
    }
}

}  // namespace
