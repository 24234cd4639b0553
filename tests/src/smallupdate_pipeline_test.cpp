// A small update end to end with the real libcurl, wget and dpkg: looked up and downloaded
// from the loopback server, then applied in another record as the driving program does;
// and the apply's endings (reboot, high availability, failing steps) as the interface
// reads them from the apply status file and people from the update log.
#include <syslog.h>

#include <memory>
#include <regex>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "deb_builder.h"
#include "sandbox.h"
#include "smallupdate.h"
#include "update_server.h"

using namespace kytotest;

namespace {

const char* const kVersion = "/etc.defaults/VERSION";
const char* const kUpdateLog = "/var/log/kytoupdate.log";
const char* const kInfo = "/autoupd@te.info";
const char* const kPassive = "/passive_upd@te.info";
const std::string kDir = "/volume1//@smallupd@te_deb";

bool Installed(const std::string& package) {
    std::string out;
    return Shell("dpkg-query -W -f='${Status}' " + package, &out) == 0 &&
           out == "install ok installed";
}

std::vector<std::string> LogLines() {
    std::vector<std::string> out;
    const std::string text = ReadFile(kUpdateLog).value_or("");
    for (size_t start = 0, nl; (nl = text.find('\n', start)) != std::string::npos; start = nl + 1)
        out.push_back(text.substr(start, nl - start));
    return out;
}

std::string ApplyStatus() {
    int percentage = -1;
    std::string stage, err;
    SmallUpdate::GetApplyStage(percentage, stage, err);
    return std::to_string(percentage) + " " + stage + " " + err;
}

class SmallUpdatePipelineTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        MountVolume("/volume1", 300ULL << 20);
        SetKeyValue(kVersion, "smallfixnumber", "3");
    }
    // Builds a package of fix `fix` into folder; returns its file name.
    static std::string Deb(DebPackage pkg, const std::string& folder) {
        const std::string path = BuildDeb(pkg, folder);
        return path.substr(path.rfind('/') + 1);
    }
    static DebPackage Pkg(const std::string& name, int fix) {
        return MakeDebPackage(name, SmallFixVersion("6.1", 5644, fix));
    }
};

TEST_F(SmallUpdatePipelineTest, LookedUpDownloadedAndAppliedInAnotherRecord) {
    UpdateServer server;
    server.PointSmallInfoPathHere();
    const std::string debs = server.Root() + "/debs";
    DebPackage small = Pkg("pipesmall", 5);
    small.files["/configupdate"] = "#!/bin/sh\necho \"$@\" > /tmp/configupdate.args\n";
    auto url = [&](const std::string& file) { return server.Url("/debs/" + file); };
    PatchEntry four, five;
    four.version = 4;
    four.proj = {{"pipea", url(Deb(Pkg("pipea", 4), debs))}};
    five.version = 5;
    five.config = true;
    five.restart = "{\"vyx_service\":[\"samba\"],\"pkg\":[]}";
    five.proj = {{"pipeb", url(Deb(Pkg("pipeb", 5), debs))},
                 {"smallupdate", url(Deb(small, debs))}};
    server.PutFile(UpdateServer::PatchListPath(5644, "demo_model"),
                   PatchListJson(5644, "demo_model", {four, five}));

    ASSERT_TRUE(SmallUpdate().Download(true));  // an empty record looks the list up first
    EXPECT_EQ(4u, server.Requests().size());
    SmallUpdate applied;
    ASSERT_TRUE(applied.Apply());

    EXPECT_TRUE(Installed("pipea") && Installed("pipeb"));
    EXPECT_FALSE(Installed("pipesmall"));
    EXPECT_EQ("-c all -p /etc.defaults/VERSION\n", ReadFile("/tmp/configupdate.args").value_or(""));
    EXPECT_EQ("5", ReadKeyValueFile(kVersion)["smallfixnumber"]);
    EXPECT_EQ("100 program ", ApplyStatus()) << "the service start moves it on";
    const std::vector<std::string> lines = LogLines();
    ASSERT_EQ(2u, lines.size());
    const std::regex stamp("\\d{4}/\\d\\d/\\d\\d \\d\\d:\\d\\d:\\d\\d\t.*");
    EXPECT_TRUE(std::regex_match(lines[0], stamp)) << lines[0];
    EXPECT_EQ("start critical update to buildnumber: 5644 original smallfixnumbre: 3 "
              "new_smallfixnumber: 5",
              lines[0].substr(lines[0].find('\t') + 1));
    EXPECT_EQ("Finished update!", lines[1].substr(lines[1].find('\t') + 1));
    EXPECT_FALSE(PathExists(kDir));
    EXPECT_FALSE(PathExists(kInfo));
}

TEST_F(SmallUpdatePipelineTest, EndingsAndFailingStepsAndTheCleanUp) {
    enum Kind { kReboot, kCluster, kBadPackage, kNotLoaded, kNoConfigUpdater, kNoFlashPackage };
    struct Row {
        Kind kind;
        std::string status;    // percentage, stage word, error text
        std::string lastLog;   // last line of the update log, "" when none
        const char* fix;       // "smallfixnumber" afterwards
        std::string syslog;    // the failing step's message
    } rows[] = {
        {kReboot, "100 reboot ", "Finished update before reboot!", "6", ""},
        {kCluster, "100 reboot ", "Finished update before reboot!", "6", ""},
        {kBadPackage, "30 program err_system", "new_smallfixnumber: 6", "3",
         "failed to do install debain action"},
        {kNotLoaded, "0 analying err_system", "", "3", ""},
        {kNoConfigUpdater, "20 program err_system", "new_smallfixnumber: 6", "3",
         "failed to do config update"},
        {kNoFlashPackage, "0 program err_system", "new_smallfixnumber: 6", "3",
         "failed to update flash"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.kind);
        const std::string tag = std::to_string(row.kind);
        RemoveTree(kUpdateLog);
        SetKeyValue(kVersion, "smallfixnumber", "3");
        SetKeyValue("/var/run/kytoha.status", "running", row.kind == kCluster ? "yes" : "no");
        // A package folder left by an earlier passive import is consumed as well.
        WriteFile("/volume1/passive/leftover", "x");
        SetKeyValue(kPassive, "debDir", "/volume1/passive");
        SmallUpdate u;
        u.m_buildNumber = 5644;
        u.m_debDir = kDir;
        u.m_newSmallFixNumber = row.kind == kNotLoaded ? -1 : 6;
        u.m_blNeedReboot = row.kind == kReboot;
        u.m_blConfigUpdate = row.kind == kNoConfigUpdater;
        u.m_blFlashUpdate = row.kind == kNoFlashPackage;
        u.m_smallUpdateDeb = Deb(Pkg("nocfg" + tag, 6), kDir);
        u.m_installDebs = {Deb(row.kind == kBadPackage ? FailingDeb("bad" + tag, "6.1-5644-s6")
                                                       : Pkg("end" + tag, 6),
                               kDir)};
        ClearSyslog();
        EXPECT_EQ(row.syslog.empty() && row.kind != kNotLoaded, u.Apply());
        EXPECT_EQ(row.status, ApplyStatus());
        const std::vector<std::string> lines = LogLines();
        EXPECT_EQ(row.lastLog.empty(), lines.empty());
        if (!lines.empty()) {
            EXPECT_NE(std::string::npos, lines.back().find(row.lastLog)) << lines.back();
        }
        EXPECT_EQ(row.fix, ReadKeyValueFile(kVersion)["smallfixnumber"]);
        if (!row.syslog.empty()) {
            EXPECT_TRUE(SyslogContains(row.syslog, LOG_ERR));
        }
        EXPECT_EQ(row.kind == kReboot, PathExists("/smallupd@te//" + u.m_installDebs[0]));
        EXPECT_EQ(row.kind == kCluster, Installed("end" + tag));
        EXPECT_FALSE(PathExists(kDir) || PathExists(kInfo) || PathExists(kPassive) ||
                     PathExists("/volume1/passive"));
    }
}

}  // namespace
