// A small update end to end with libcurl, wget and dpkg, and the apply's endings as the
// apply status file and the update log show them.
#include <syslog.h>

#include <regex>
#include <string>

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
const std::string kStart =
    "start critical update to buildnumber: 5644 original smallfixnumbre: 3 new_smallfixnumber: ";

// The update log's last line without its time stamp, "" when there is no log.
std::string LastLogLine() {
    const std::string text = ReadFile(kUpdateLog).value_or("");
    return text.empty() ? "" : text.substr(text.rfind('\t') + 1);
}

std::string ApplyStatus() {
    int percentage = -1;
    std::string stage, err;
    SmallUpdate::GetApplyStage(percentage, stage, err);
    return std::to_string(percentage) + " " + stage + " " + err;
}

// Builds the package into folder; returns its file name.
std::string Deb(const DebPackage& pkg, const std::string& folder) {
    const std::string path = BuildDeb(pkg, folder);
    return path.substr(path.rfind('/') + 1);
}

DebPackage Pkg(const std::string& name, int fix) {
    return MakeDebPackage(name, SmallFixVersion("6.1", 5644, fix));
}

using SmallUpdatePipelineTest = UpdateServerTest;

TEST_F(SmallUpdatePipelineTest, LookedUpDownloadedAndAppliedInAnotherRecord) {
    SetKeyValue(kVersion, "smallfixnumber", "3");
    const std::string debs = server->Root() + "/debs";
    DebPackage small = Pkg("pipesmall", 5);
    small.files["/configupdate"] = "#!/bin/sh\necho \"$@\" > /tmp/configupdate.args\n";
    auto url = [&](const std::string& file) { return server->Url("/debs/" + file); };
    const PatchEntry four{
        4, {{"pipea", url(Deb(Pkg("pipea", 4), debs))}}, false, false, "\"none\""};
    const PatchEntry five{
        5,
        {{"pipeb", url(Deb(Pkg("pipeb", 5), debs))}, {"smallupdate", url(Deb(small, debs))}},
        false,
        true,
        "{\"vyx_service\":[\"samba\"],\"pkg\":[]}"};
    server->PutFile(UpdateServer::PatchListPath(5644, "demo_model"),
                    PatchListJson(5644, "demo_model", {four, five}));

    ASSERT_TRUE(SmallUpdate().Download(true));  // an empty record looks the list up first
    EXPECT_EQ(4u, server->Requests().size());
    SmallUpdate applied;
    ASSERT_TRUE(applied.Apply());

    EXPECT_TRUE(DpkgInstalled("pipea") && DpkgInstalled("pipeb") && !DpkgInstalled("pipesmall"));
    EXPECT_EQ("-c all -p /etc.defaults/VERSION\n", ReadFile("/tmp/configupdate.args").value_or(""));
    EXPECT_EQ("5", ReadKeyValueFile(kVersion)["smallfixnumber"]);
    EXPECT_EQ("100 program ", ApplyStatus()) << "the service start moves it on";
    const std::string stamp = "\\d{4}/\\d\\d/\\d\\d \\d\\d:\\d\\d:\\d\\d\t";
    const std::string log = ReadFile(kUpdateLog).value_or("");
    EXPECT_TRUE(
        std::regex_match(log, std::regex(stamp + kStart + "5\n" + stamp + "Finished update!\n")))
        << log;
    EXPECT_FALSE(PathExists(kDir) || PathExists(kInfo));
}

TEST_F(SmallUpdatePipelineTest, EndingsAndFailingStepsAndTheCleanUp) {
    enum Kind { kReboot, kCluster, kBadPackage, kNotLoaded, kNoConfigUpdater, kNoFlashPackage };
    // Apply status, last update log line, "smallfixnumber" afterwards, failing step's message.
    struct Row {
        Kind kind;
        std::string status, lastLog;
        const char* fix;
        std::string syslog;
    } rows[] = {
        {kReboot, "100 reboot ", "Finished update before reboot!\n", "6", ""},
        {kCluster, "100 reboot ", "Finished update before reboot!\n", "6", ""},
        {kBadPackage, "30 program err_system", kStart + "6\n", "3",
         "failed to do install debain action"},
        {kNotLoaded, "0 analying err_system", "", "3", ""},
        {kNoConfigUpdater, "20 program err_system", kStart + "6\n", "3",
         "failed to do config update"},
        {kNoFlashPackage, "0 program err_system", kStart + "6\n", "3", "failed to update flash"},
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
        u.m_installDebs = {Deb(
            row.kind == kBadPackage ? FailingDeb("bad" + tag, "6.1-5644-s6") : Pkg("end" + tag, 6),
            kDir)};
        ClearSyslog();
        EXPECT_EQ(row.syslog.empty() && row.kind != kNotLoaded, u.Apply());
        EXPECT_EQ(row.status, ApplyStatus());
        EXPECT_EQ(row.lastLog, LastLogLine());
        EXPECT_EQ(row.fix, ReadKeyValueFile(kVersion)["smallfixnumber"]);
        EXPECT_TRUE(row.syslog.empty() || SyslogContains(row.syslog, LOG_ERR)) << row.syslog;
        EXPECT_EQ(row.kind == kReboot, PathExists("/smallupd@te//" + u.m_installDebs[0]));
        EXPECT_EQ(row.kind == kCluster, DpkgInstalled("end" + tag));
        EXPECT_FALSE(PathExists(kDir) || PathExists(kInfo) || PathExists(kPassive) ||
                     PathExists("/volume1/passive"));
    }
}

}  // namespace
