// The apply's endings as its status file, the update log and the version file show them.
#include "engine_fixtures.h"

namespace {

using namespace kytotest;
const char *kVersion = "/etc.defaults/VERSION", *kUpdateLog = "/var/log/kytoupdate.log",
           *kInfo = "/autoupd@te.info", *kPassive = "/passive_upd@te.info";
const std::string kDir = "/volume1/@smallupd@te_deb";
const std::string kStart =
    "start critical update to buildnumber: 5644 original smallfixnumbre: 3 new_smallfixnumber: 6";
using SmallUpdateApplyTest = ApplyStepsTest;

TEST_F(SmallUpdateApplyTest, EndingsFailingStepsAndTheCleanUp) {
    enum Kind { kPartial, kReboot, kCluster, kBadPackage, kNotLoaded, kNoConfigUpdater, kNoFlash };
    // ApplyStageSeen, stamped update log, "smallfixnumber" after, failing step's message.
    // clang-format off
    struct Row { Kind kind; std::string status; std::vector<std::string> log; const char* fix;
                 std::string syslog; } rows[] = {
        {kPartial, "100 program caller-err", {kStart, "Finished update!"}, "6", ""},
        {kReboot, "100 reboot caller-err", {kStart, "Finished update before reboot!"}, "6", ""},
        {kCluster, "100 reboot caller-err", {kStart, "Finished update before reboot!"}, "6", ""},
        {kBadPackage, "30 program err_system", {kStart}, "3", "failed to do install debain action"},
        {kNotLoaded, "0 analying err_system", {}, "3", ""},
        {kNoConfigUpdater, "20 program err_system", {kStart}, "3", "failed to do config update"},
        {kNoFlash, "0 program err_system", {kStart}, "3", "failed to update flash"},
    };
    // clang-format on
    const std::string configUpdate = "#!/bin/sh\necho \"$@\" > /tmp/configupdate.args\n";
    for (const Row& row : rows) {
        SCOPED_TRACE(row.kind);
        const std::string tag = std::to_string(row.kind);
        for (const char* path : {kUpdateLog, "/tmp/configupdate.args", "/smallupd@te"})
            RemoveTree(path);
        SetKeyValue(kVersion, "smallfixnumber", "3");
        SetKeyValue("/var/run/kytoha.status", "running", row.kind == kCluster ? "yes" : "no");
        // A package folder left by an earlier passive import is consumed as well.
        WriteFile("/volume1/passive/leftover", "x");
        SetKeyValue(kPassive, "debDir", "/volume1/passive");
        SmallUpdate a;
        a.m_buildNumber = 5644;
        a.m_debDir = kDir;
        a.m_newSmallFixNumber = row.kind == kNotLoaded ? -1 : 6;
        a.m_blNeedReboot = row.kind == kReboot;
        a.m_blConfigUpdate = row.kind == kPartial || row.kind == kNoConfigUpdater;
        a.m_blFlashUpdate = row.kind == kNoFlash;
        a.m_smallUpdateDeb =
            ApplyDeb("small" + tag, 6, false,
                     {{row.kind == kPartial ? "/configupdate" : "/usr/share/doc/x", configUpdate}});
        a.m_installDebs = {ApplyDeb("end" + tag, 6, row.kind == kBadPackage)};
        if (row.kind == kPartial) {  // the apply loads the downloaded record itself
            a.m_smallUpdateDebLink = "http://127.0.0.1/s";
            ASSERT_TRUE(a.DumpToInfoFile(false));
            a = SmallUpdate();
        }
        ClearSyslog();
        EXPECT_EQ(row.syslog.empty() && row.kind != kNotLoaded, a.Apply());
        EXPECT_EQ(row.status, ApplyStageSeen());
        EXPECT_EQ(row.log, StampedLines(kUpdateLog));
        EXPECT_EQ(row.fix, ReadKeyValueFile(kVersion)["smallfixnumber"]);
        EXPECT_TRUE(row.syslog.empty() || SyslogContains(row.syslog, LOG_ERR)) << row.syslog;
        EXPECT_EQ(row.kind == kPartial ? "-c all -p /etc.defaults/VERSION\n" : "",
                  ReadFile("/tmp/configupdate.args").value_or(""));
        EXPECT_EQ(row.kind == kReboot, PathExists("/smallupd@te//" + a.m_installDebs[0]));
        EXPECT_EQ(row.kind == kPartial || row.kind == kCluster, DpkgInstalled("end" + tag));
        EXPECT_FALSE(DpkgInstalled("small" + tag)) << "the small-update package is only unpacked";
        EXPECT_FALSE(PathExists(kDir) || PathExists(kInfo) || PathExists(kPassive) ||
                     PathExists("/volume1/passive"));
    }
}

}  // namespace
