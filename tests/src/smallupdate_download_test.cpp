// Downloading a small update's packages with the real wget from the loopback server: the
// status file as the interface's poller sees it from another process, retries counted in
// the server's log, the stop marker from another process, and the info file at the end.
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "smallupdate.h"
#include "update_server.h"

using namespace kytotest;

namespace {

const char* const kStatus = "/var/run/downloadVYX.status";
const char* const kInfo = "/autoupd@te.info";
const char* const kMarker = "/tmp/stop_download_smallfix";
const std::string kDir = "/volume1//@smallupd@te_deb";

std::string Deb(const std::string& name) {
    return name + "_6.1-5644-s5_all.deb";
}

// Waits (up to 30 s) until wget has started writing the file.
bool Started(const std::string& path) {
    struct stat st;
    for (int i = 0; i < 3000; ++i, std::this_thread::sleep_for(std::chrono::milliseconds(10))) {
        if (stat(path.c_str(), &st) == 0 && st.st_size > 0)
            return true;
    }
    return false;
}

class SmallUpdateDownloadTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        server = std::make_unique<UpdateServer>();
        MountVolume("/volume1", 300ULL << 20);
        u.m_newSmallFixNumber = 5;  // a filled record: the server's list is not asked
        u.m_buildNumber = 5644;
        u.m_blRestartAllService = true;
    }
    void TearDown() override {
        server.reset();
        SandboxTest::TearDown();
    }
    // Serves further packages of 48 KiB each and puts them into the record.
    void Packages(const std::vector<std::string>& names, long bytesPerSecond = 0) {
        for (const std::string& name : names) {
            server->PutFileOfSize("/debs/" + Deb(name), 48 << 10);
            if (bytesPerSecond)
                server->SlowPath("/debs/" + Deb(name), bytesPerSecond);
            u.m_installDebs.push_back(Deb(name));
            u.m_installDebLinks.push_back(server->Url("/debs/" + Deb(name)));
        }
    }
    std::unique_ptr<UpdateServer> server;
    SmallUpdate u;
};

TEST_F(SmallUpdateDownloadTest, PollerInAnotherProcessSeesEveryFileAndThenTheInfoFile) {
    Packages({"pa", "pb", "pc"}, 192 << 10);
    const pid_t poller = Spawn([] {
        std::vector<std::string> seen;
        int percentage = -1;
        std::string word;
        for (int i = 0; i < 30000 && word != "finished"; ++i) {
            SmallUpdate().GetDownloadStatus(percentage, word);
            const std::string now = std::to_string(percentage) + " " + word;
            if (word != "none" && (seen.empty() || seen.back() != now))
                seen.push_back(now);
            usleep(2000);
        }
        std::string text;
        for (const std::string& s : seen)
            text += s + "\n";
        WriteFile("/tmp/polled", text);
        return 0;
    });
    ASSERT_TRUE(u.Download(true));
    EXPECT_EQ(0, Wait(poller));
    // Between two key writes a poller may see a mixed pair; the steady states must all show.
    const std::string polled = ReadFile("/tmp/polled").value_or("");
    size_t at = 0;
    for (const char* state : {"0 init\n", "33 downloading\n", "66 downloading\n", "100 finished\n"}) {
        at = polled.find(state, at);
        ASSERT_NE(std::string::npos, at) << state << " missing in order from\n" << polled;
    }
    EXPECT_EQ((std::vector<std::string>{Deb("pa"), Deb("pb"), Deb("pc")}), ListDir(kDir));
    EXPECT_FALSE(PathExists(kStatus)) << "a finished download is told by the info file";
    SmallUpdate imported;
    ASSERT_TRUE(imported.ImportInfoFile(kInfo));
    EXPECT_EQ(kDir, imported.m_debDir);
    EXPECT_TRUE(imported.IsReadyApply());
}

TEST_F(SmallUpdateDownloadTest, RetriesAreCountedAndTheTenthFailureEndsTheDownload) {
    Packages({"ra", "rb", "rc"});
    server->FailPath("/debs/" + Deb("ra"), 500, 3);
    server->FailPath("/debs/" + Deb("rb"), 503);
    ClearSyslog();
    EXPECT_FALSE(u.Download(true));
    EXPECT_EQ(4u, server->RequestsFor("/debs/" + Deb("ra")).size());
    EXPECT_EQ(10u, server->RequestsFor("/debs/" + Deb("rb")).size());
    EXPECT_TRUE(server->RequestsFor("/debs/" + Deb("rc")).empty());
    EXPECT_EQ("33", ReadKeyValueFile(kStatus)["percentage"]) << "the last completed file";
    EXPECT_EQ("4", ReadKeyValueFile(kStatus)["downloadStatus"]);
    EXPECT_FALSE(PathExists(kDir));
    EXPECT_FALSE(PathExists(kInfo));
    EXPECT_TRUE(SyslogContains("failed to exec cmd=[/usr/kyto/bin/wget " + u.m_installDebLinks[1] +
                                   " -O " + kDir + "/" + Deb("rb") +
                                   " --timeout=15 --tries=1], r=8",
                               LOG_ERR));

    // A link without a folder is refused before wget runs, ten times.
    ClearSyslog();
    EXPECT_FALSE(SmallUpdate::ExecWgetWithRetry("nolink.deb", "/tmp"));
    int refused = 0;
    for (const std::string& m : SyslogMessages(LOG_ERR))
        refused += m.find("Wrong download link [nolink.deb]") != std::string::npos;
    EXPECT_EQ(10, refused);
}

// The stop marker: left over before the download, created by a cancel in another process
// while the first of three files is on its way, or while the last one is.
TEST_F(SmallUpdateDownloadTest, StopMarkerBeforeBetweenAndAfterFiles) {
    enum When { kBefore, kBetween, kAfter };
    for (When when : {kBefore, kBetween, kAfter}) {
        SCOPED_TRACE(when);
        server->ClearRequests();
        u.m_installDebs.clear();
        u.m_installDebLinks.clear();
        const std::string tag = std::to_string(when);
        if (when == kAfter)
            Packages({"last" + tag}, 96 << 10);
        else
            Packages({"a" + tag, "b" + tag, "c" + tag}, when == kBetween ? 96 << 10 : 0);
        if (when == kBefore)
            WriteFile(kMarker, "");
        const std::string first = kDir + "/" + u.m_installDebs[0];
        const pid_t canceller = Spawn([&] {
            return when == kBefore || (Started(first) && SmallUpdate().CancelDownload()) ? 0 : 1;
        });
        EXPECT_TRUE(u.Download(true));
        EXPECT_EQ(0, Wait(canceller));
        EXPECT_FALSE(PathExists(kStatus));
        EXPECT_EQ(when == kBefore, PathExists(kInfo));
        EXPECT_EQ(when == kAfter, PathExists(kMarker));
        EXPECT_EQ(when == kBetween ? 1u : u.m_installDebs.size(), server->Requests().size());
        EXPECT_EQ(when == kBetween ? 0u : u.m_installDebs.size(),
                  PathExists(kDir) ? ListDir(kDir).size() : 0u);
        RemoveTree(kMarker);
        RemoveTree(kInfo);
    }
}

TEST_F(SmallUpdateDownloadTest, WhatIsFetchedAndWhatCountsAsDownloaded) {
    // A small-update package alone, without a configuration update, is not fetched.
    u.m_smallUpdateDeb = Deb("small");
    u.m_smallUpdateDebLink = server->Url("/debs/" + Deb("small"));
    WriteFile(kStatus, "updateType=smallupdate\npercentage=\"0\"\ndownloadStatus=\"4\"\n");
    ASSERT_TRUE(u.Download(true));
    EXPECT_TRUE(server->Requests().empty());
    int percentage = 0;
    std::string word;
    SmallUpdate().GetDownloadStatus(percentage, word);
    EXPECT_EQ("100 finished", std::to_string(percentage) + " " + word);

    // With a configuration update it is; a flash package only with its flag.
    u.m_blConfigUpdate = true;
    u.m_flashUpdateDeb = Deb("flash");
    u.m_flashUpdateDebLink = server->Url("/debs/" + Deb("flash"));
    server->PutFile("/debs/" + Deb("small"), "s");
    server->PutFile("/debs/" + Deb("flash"), "f");
    ASSERT_TRUE(u.Download(false));
    EXPECT_EQ((std::vector<std::string>{Deb("small")}), ListDir(kDir));
    u.m_blFlashUpdate = true;
    u.m_installDebs = {Deb("absent")};
    ASSERT_TRUE(u.Download(true));
    EXPECT_EQ((std::vector<std::string>{Deb("flash"), Deb("small")}), ListDir(kDir));
    SmallUpdate ready;
    EXPECT_TRUE(ready.IsReadyApply()) << "the flash package is enough";
    RemoveTree(kDir + "/" + Deb("flash"));
    EXPECT_TRUE(SmallUpdate().IsReadyApply()) << "so is the small-update package";
    RemoveTree(kDir + "/" + Deb("small"));
    EXPECT_FALSE(SmallUpdate().IsReadyApply());

    // The status file read by a poller when no info file exists.
    RemoveTree(kInfo);
    const struct {
        const char* content;
        const char* expected;
    } rows[] = {
        {nullptr, "7 none"},
        {"percentage=\"42\"\ndownloadStatus=\"2\"\n", "42 downloading"},
        {"percentage=\"42\"\ndownloadStatus=\"-1\"\n", "42 failed"},
        {"percentage=\"42\"\ndownloadStatus=\"5\"\n", "42 stopped"},
        {"updateType=vyxupdate\ndownloadStatus=downloading\n", "7 failed"},
    };
    for (const auto& row : rows) {
        RemoveTree(kStatus);
        if (row.content)
            WriteFile(kStatus, row.content);
        percentage = 7;
        SmallUpdate().GetDownloadStatus(percentage, word);
        EXPECT_EQ(row.expected, std::to_string(percentage) + " " + word);
    }
}

}  // namespace
