// Release download with the real wget and openssl against a loopback update server.
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

#include "sandbox.h"
#include "update_server.h"
#include "vyxupdate.h"

namespace {

using kytotest::PathExists;
using kytotest::ReadKeyValueFile;
using kytotest::SyslogContains;

const char* kStatus = "/var/run/downloadVYX.status";
const char* kInfo = "/autoupd@te.info";
const char* kFolder = "/volume1/@autoupdate";
const std::string kLinkText =
    "<a style='font-size:12px;text-decoration:underline;' "
    "href=javascript:KYTO.QVS.AppLaunch('KYTO.QVS.ControlPanel.Instance',{fn:'KYTO.QVS."
    "ControlPanel.Upgrade.Main'})> {0} </a>";

class VyxDownloadTest : public kytotest::SandboxTest {
  protected:
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
    // Serves an image and returns its MD5 as openssl prints it.
    std::string ServeImage(const std::string& urlPath, unsigned long long bytes) {
        std::string local = server->PutFileOfSize(urlPath, bytes);
        std::string out;
        EXPECT_EQ(0, kytotest::Shell("md5sum '" + local + "'", &out));
        return out.substr(0, 32);
    }
    // Feed with one item 5.2 build 5700 offering each (unique, url path, checksum).
    void ServeFeed(const std::vector<std::vector<std::string>>& models) {
        std::string feed =
            "<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n"
            "<BuildNum>5700</BuildNum>\n";
        for (const auto& m : models) {
            feed += "<model>\n<mUnique>" + m[0] + "</mUnique>\n<mLink>" + server->Url(m[1]) +
                    "</mLink>\n<mCheckSum>" + m[2] + "</mCheckSum>\n</model>\n";
        }
        server->PutFile("/autoupdate/genRSS.php", feed + "</item>\n");
    }
    std::vector<std::string> Notification(const char* title) {
        return {"kytovyxnotify", "@administrators", title, kLinkText,
                "update:update_download_noti_link"};
    }
    std::unique_ptr<kytotest::UpdateServer> server;
};

TEST_F(VyxDownloadTest, SuccessRecordsTheImageAndNotifies) {
    ServeFeed({{"demo_model", "/images/vyx.img", ServeImage("/images/vyx.img", 64 << 10)}});
    VyxUpdate vyx;
    ASSERT_EQ(1, vyx.DownloadVyx());

    const std::string image = std::string(kFolder) + "/vyx.img";
    EXPECT_EQ(64 << 10, static_cast<int>(kytotest::ReadFile(image).value_or("").size()));
    Json::Value info;
    ASSERT_TRUE(Json::Reader().parse(kytotest::ReadFile(kInfo).value_or(""), info));
    Json::Value expected;
    expected["patchPath"] = image;
    expected["buildnumber"] = "5700";
    expected["majorversion"] = "5";
    expected["minorversion"] = "2";
    expected["updateType"] = "vyxupdate";
    EXPECT_EQ(expected, info);
    for (const char* gone : {kStatus, "/var/run/downloadVYX.pid", "/var/run/downloadprogress"}) {
        EXPECT_FALSE(PathExists(gone)) << gone;
    }
    EXPECT_EQ(
        std::vector<std::vector<std::string>>{Notification("update:update_download_noti_title")},
        kytotest::RecordedCalls());
    EXPECT_NE(
        std::string::npos,
        kytotest::ReadFile("/var/log/kytoevent.log").value_or("").find("1 1 0x11B01021 " + image));
}

TEST_F(VyxDownloadTest, TenAttemptsAtMost) {
    struct Case {
        const char* path;
        int failures;
        int result;
    };
    const Case cases[] = {{"/images/nine.img", 9, 1}, {"/images/ten.img", 10, 0}};
    for (const Case& c : cases) {
        SCOPED_TRACE(c.path);
        kytotest::ClearRecordedCalls();
        ServeFeed({{"demo_model", c.path, ServeImage(c.path, 4096)}});
        server->FailPath(c.path, 503, c.failures);
        VyxUpdate vyx;
        EXPECT_EQ(c.result, vyx.DownloadVyx());
        EXPECT_EQ(10u, server->RequestsFor(c.path).size());
    }
    // The failed case leaves its status behind and tells the administrators.
    EXPECT_TRUE(SyslogContains("Fail to download patch file"));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_EQ(std::vector<std::vector<std::string>>{Notification(
                  "update:update_download_noti_title_err")},
              kytotest::RecordedCalls());
    // The image path is recorded only once an image is complete: the event carries none.
    EXPECT_NE(
        std::string::npos,
        kytotest::ReadFile("/var/log/kytoevent.log").value_or("").find("1 3 0x11B01022    \n"));
}

TEST_F(VyxDownloadTest, ChecksumMustMatchExactly) {
    std::string md5 = ServeImage("/images/vyx.img", 8192);
    for (char& ch : md5)
        ch = static_cast<char>(toupper(ch));
    ServeFeed({{"demo_model", "/images/vyx.img", md5}});
    VyxUpdate vyx;
    EXPECT_EQ(0, vyx.DownloadVyx());
    EXPECT_TRUE(SyslogContains("Checksum not match"));
    EXPECT_TRUE(SyslogContains("Fail to verify checksum"));
    EXPECT_TRUE(PathExists(std::string(kFolder) + "/vyx.img"));  // the image stays
    EXPECT_FALSE(PathExists(kInfo));
    auto status = ReadKeyValueFile(kStatus);
    EXPECT_EQ("failed", status["downloadStatus"]);
    EXPECT_EQ("vyxupdate", status["updateType"]);
    EXPECT_EQ("1", status["downloadCount"]);
    EXPECT_EQ(std::string(kFolder) + "/vyx.img", status["patchPath"]);
}

TEST_F(VyxDownloadTest, HybridPairFetchesBothImages) {
    kytotest::WriteFile("/var/run/kytoha.status",
                        "running=\"yes\"\nhybrid_dl=\"yes\"\npartner_unique=\"partner_model\"\n");
    ServeFeed({{"demo_model", "/a/mine.img", ServeImage("/a/mine.img", 4096)},
               {"partner_model", "/b/partner.img", ServeImage("/b/partner.img", 8192)}});
    VyxUpdate vyx;
    ASSERT_EQ(1, vyx.DownloadVyx());
    Json::Value info;
    ASSERT_TRUE(Json::Reader().parse(kytotest::ReadFile(kInfo).value_or(""), info));
    EXPECT_EQ(std::string(kFolder) + "/mine.img", info["patchPath"].asString());
    EXPECT_EQ(std::string(kFolder) + "/partner.img", info["passivePatchPath"].asString());
    EXPECT_EQ(8192u, kytotest::ReadFile(std::string(kFolder) + "/partner.img")->size());
}

TEST_F(VyxDownloadTest, NothingToDownloadOrAlreadyRunning) {
    ServeFeed({{"other_model", "/images/vyx.img", "00"}});
    EXPECT_EQ(0, VyxUpdate().DownloadVyx());
    EXPECT_TRUE(SyslogContains("Current VYX version is latest"));
    EXPECT_TRUE(SyslogContains("Fail to do pre check download"));
    EXPECT_EQ("failed", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_EQ(std::vector<std::vector<std::string>>{Notification(
                  "update:update_download_noti_title_err")},
              kytotest::RecordedCalls());

    // A live download (this process stands in for its wget) refuses a second one, which
    // still reports success and clears the shared files.
    kytotest::ClearRecordedCalls();
    ServeFeed({{"demo_model", "/images/vyx.img", "00"}});
    kytotest::WriteFile(kStatus,
                        "updateType=\"vyxupdate\"\ndownloadStatus=\"downloading\"\n"
                        "downloadCount=\"1\"\ndownloadNum=\"1\"\n"
                        "patchPath=\"/volume1/part.img\"\n");
    kytotest::WriteFile("/volume1/part.img", "part");
    kytotest::WriteFile("/var/run/downloadprogress", "Length: 100 [x]\n");
    kytotest::WriteFile("/var/run/downloadVYX.pid", std::to_string(getpid()));
    EXPECT_EQ(1, VyxUpdate().DownloadVyx());
    EXPECT_EQ(0u, server->RequestsFor("/images/vyx.img").size());
    EXPECT_FALSE(PathExists(kStatus));
    EXPECT_FALSE(PathExists("/var/run/downloadVYX.pid"));
    EXPECT_EQ(
        std::vector<std::vector<std::string>>{Notification("update:update_download_noti_title")},
        kytotest::RecordedCalls());
}

}  // namespace
