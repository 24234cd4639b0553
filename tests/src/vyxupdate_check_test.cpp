// Release check against a loopback update server: feed fetch, identity sent, failures,
// reconciliation with an earlier download, hybrid HA pairs.
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "update_server.h"
#include "vyxupdate.h"

namespace {

using kytotest::PathExists;
using kytotest::SyslogContains;

const char* kFeedPath = "/autoupdate/genRSS.php";
const char* kInfo = "/autoupd@te.info";

std::string Item(const std::string& build, const std::vector<std::string>& uniques) {
    std::string s = "<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n<BuildNum>" + build +
                    "</BuildNum>\n";
    for (const std::string& u : uniques) {
        s += "<model>\n<mUnique>" + u + "</mUnique>\n<mLink>http://h/" + u + "-" + build +
             ".img</mLink>\n<mCheckSum>00ff</mCheckSum>\n</model>\n";
    }
    return s + "</item>\n";
}

class VyxCheckTest : public kytotest::SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        server = std::make_unique<kytotest::UpdateServer>();
    }
    void TearDown() override {
        server.reset();
        SandboxTest::TearDown();
    }
    void ServeFeed(const std::string& items) {
        server->PutFile(kFeedPath, "<rss><channel>\n" + items + "</channel></rss>\n");
        server->PointRssServerHere();
    }
    std::unique_ptr<kytotest::UpdateServer> server;
};

TEST_F(VyxCheckTest, FindsNewerReleaseOnceAndIdentifiesTheDevice) {
    ServeFeed(Item("5700", {"demo_model"}));
    VyxUpdate vyx;
    EXPECT_EQ("", vyx.GetFullVersion());
    bool haveNew = false;
    ASSERT_EQ(1, vyx.CheckNewRelease(haveNew));
    EXPECT_TRUE(haveNew);
    EXPECT_EQ("VYX 5.2-5700", vyx.GetFullVersion());
    EXPECT_STREQ("http://h/demo_model-5700.img", vyx.m_release.link);
    EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));

    bool canStart = false;
    EXPECT_EQ(1, vyx.PreCheckDownload(canStart));
    EXPECT_TRUE(canStart);
    auto requests = server->RequestsFor(kFeedPath);
    ASSERT_EQ(1u, requests.size());  // the answer is reused
    EXPECT_EQ("tz=Europe/Berlin", requests[0].query);
    EXPECT_EQ("demo_model VYX5.2 5644 (autoupgrade)", requests[0].userAgent);
}

TEST_F(VyxCheckTest, FeedThatCannotBeFetchedFailsTheCheck) {
    int stoppedPort = 0;
    {
        kytotest::UpdateServer gone;
        stoppedPort = gone.Port();
    }
    struct Case {
        const char* what;
        std::string rssServer;  // "" removes the key
        std::string expectInCommand;
    };
    const Case cases[] = {
        {"default server", "",
         "Fail to exec command [/usr/kyto/bin/wget --user-agent='demo_model VYX5.2 5644 "
         "(autoupgrade)' -O "
         "/var/run/autoupdate_tmp_file_RSS http://update.kyto.local/autoupdate/genRSS.php"
         "?tz=Europe/Berlin 2> /dev/null]"},
        {"feed missing on server", server->Url(kFeedPath), server->Url(kFeedPath) + "?tz="},
        {"server down", "http://127.0.0.1:" + std::to_string(stoppedPort) + kFeedPath,
         std::to_string(stoppedPort)},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        kytotest::ClearSyslog();
        kytotest::SetKeyValue(
            "/etc.defaults/kytoinfo.conf", "rss_server",
            c.rssServer.empty() ? std::nullopt : std::optional<std::string>(c.rssServer));
        VyxUpdate vyx;
        bool haveNew = false;
        EXPECT_EQ(0, vyx.CheckNewRelease(haveNew));
        EXPECT_FALSE(vyx.m_checked);
        EXPECT_TRUE(SyslogContains("Fail to exec command [/usr/kyto/bin/wget"));
        EXPECT_TRUE(SyslogContains(c.expectInCommand));
        EXPECT_TRUE(SyslogContains("Fail to get RSS file"));
        EXPECT_TRUE(SyslogContains("Fail to get latest VYX info"));
        EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));
    }
    // Only the 404 case reached the loopback server.
    EXPECT_EQ(1u, server->Requests().size());
}

TEST_F(VyxCheckTest, EarlierDownloadInfoIsReconciled) {
    struct Case {
        const char* what;
        std::string info;
        bool infoKept;
        bool stateCleared = false;  // download state files removed with the info
    };
    const std::string image = "/volume9/@autoupdate/old.img";
    const Case cases[] = {
        {"outdated build",
         R"({"updateType":"vyxupdate","buildnumber":"100","majorversion":"5",
           "minorversion":"2","patchPath":")" +
             image + "\"}",
         false, true},
        {"same build written in hex",
         R"({"buildnumber":"0x1644","majorversion":"5",
           "minorversion":"2","patchPath":")" +
             image + "\"}",
         true},
        {"small update info", R"({"updateType":"smallupdate","buildnumber":"1"})", true},
        {"no patchPath", R"({"updateType":"vyxupdate","buildnumber":"5700"})", false},
    };
    ServeFeed(Item("5700", {"demo_model"}));
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        kytotest::WriteFile(kInfo, c.info);
        kytotest::WriteFile(image, "partial");
        kytotest::WriteFile("/var/run/downloadprogress", "Length: 7");
        VyxUpdate vyx;
        bool haveNew = false;
        ASSERT_EQ(1, vyx.CheckNewRelease(haveNew));
        EXPECT_EQ(c.infoKept, PathExists(kInfo));
        EXPECT_TRUE(PathExists(image));  // images are never deleted by the check
        EXPECT_EQ(c.stateCleared, !PathExists("/var/run/downloadprogress"));
    }
}

}  // namespace
