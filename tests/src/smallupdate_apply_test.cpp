// The apply: its status file (writer, high-availability marker, reader in other processes)
// and the work steps with real packages and the real package tool: flash updater, unpack
// into the staging folder, installation in small-fix order with progress, and staging for
// the next boot.
#include <stdlib.h>
#include <unistd.h>

#include "engine_fixtures.h"

namespace {

using namespace kytotest;
const std::string kDebDir = "/volume1/@smallupd@te_deb";
const char *kStaging = "/smallupd@te/", *kApplyStatus = "/var/run/applySmallUpd@te.status",
           *kOrderLog = "/tmp/install_order.log";
using SmallUpdateApplyTest = ApplyStepsTest;

TEST_F(SmallUpdateApplyTest, StatusFileWriterAndReader) {
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(53, SmallUpdate::APPLY_STAGE_PROGRAM, "a b"));
    EXPECT_EQ("percentage=\"53\"\nstage=\"3\"\nErrMsg=\"a b\"\n", ReadFile(kApplyStatus));
    // A value the key=value writer refuses: the old file stays, no temporary file is left.
    EXPECT_FALSE(SmallUpdate::UpdateApplyProgress(99, SmallUpdate::APPLY_STAGE_REBOOT, "x\ny"));
    EXPECT_EQ("53 program a b", ApplyStageSeen());
    EXPECT_FALSE(AnyEntryStartsWith("/var/run", "applySmallUpd@te.status_"));
    SmallUpdate().HASetApplyProgressErr("peer upgrading");
    EXPECT_EQ("0 waiting_remote_upgrading peer upgrading", ApplyStageSeen());
    // An empty ErrMsg leaves the caller's text (the words of stages 2 to 6: the poller test).
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(0, SmallUpdate::APPLY_STAGE(0), ""));
    EXPECT_EQ("0 none caller-err", ApplyStageSeen());
    // Files written by others, missing (nullptr) or incomplete.  Stages beyond the table
    // (negative ones too) keep the caller's word and report an error.
    // clang-format off
    const std::pair<const char*, const char*> rows[] = {
        {"percentage=\"40\"\nstage=\"7\"\nErrMsg=\"\"\n", "40 caller-stage err_system"},
        {nullptr, "-7 none caller-err"}, {"stage=\"3\"\nErrMsg=\"\"\n", "-7 none err_system"},
        {"percentage=\"30\"\n", "-7 none err_system"}};
    // clang-format on
    for (const auto& [content, seen] : rows) {
        WriteOrRemove(kApplyStatus, content);
        EXPECT_EQ(seen, ApplyStageSeen()) << (content ? content : "(no file)");
    }
}

// A poller in another process sees only values that were written together, while the
// file is replaced thousands of times.
TEST_F(SmallUpdateApplyTest, PollerInAnotherProcessNeverSeesATornFile) {
    auto stageFor = [](int p) { return static_cast<SmallUpdate::APPLY_STAGE>(2 + p % 5); };
    auto seenFor = [&](int p) {
        return std::to_string(p) + " " + kApplyStageWords[stageFor(p)] + " e" + std::to_string(p);
    };
    auto write = [&](int i) {
        return SmallUpdate::UpdateApplyProgress(i % 101, stageFor(i % 101),
                                                "e" + std::to_string(i % 101));
    };
    ASSERT_TRUE(write(0));
    auto check = [&] {
        const std::string seen = ApplyStageSeen();
        const int p = atoi(seen.c_str());
        return p >= 0 && p <= 100 && seen == seenFor(p) ? 0 : 1;
    };
    EXPECT_EQ(0, RaceReaderAgainstWriter(3000, write, check)) << "a torn or missing record";
    EXPECT_FALSE(AnyEntryStartsWith("/var/run", "applySmallUpd@te.status_"));
}

TEST_F(SmallUpdateApplyTest, InstallsEveryPackageInSmallFixOrderWithProgress) {
    EXPECT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));  // nothing to install
    EXPECT_FALSE(PathExists(kApplyStatus));
    Shell("mkdir -p /smallupd@te/updater");
    const std::string broken = ApplyDeb("broken", 1, true);
    u.m_installDebs = {ApplyDeb("fixc", 12), broken, ApplyDeb("fixb", 5)};
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    // Sorted in place; the failing package does not stop the others.
    EXPECT_EQ(broken, u.m_installDebs.front());
    EXPECT_EQ((std::vector<std::string>{"fixb 53", "fixc 76"}), FileLines(kOrderLog));
    EXPECT_EQ(3u, FileLines("/var/log/dpkg_upgrade.log", "===========[-i " + kDebDir).size());
    EXPECT_EQ("percentage=\"99\"\nstage=\"3\"\nErrMsg=\"\"\n", ReadFile(kApplyStatus));
    EXPECT_TRUE(SyslogContains("Failed to install " + kDebDir + "/" + broken, LOG_ERR));
    EXPECT_FALSE(PathExists(kStaging)) << "a failed install drops the staging folder";
}

TEST_F(SmallUpdateApplyTest, RebootUpdateStagesPackagesForTheNextBoot) {
    u.m_blNeedReboot = true;
    const std::string second = ApplyDeb("stageb", 9), first = ApplyDeb("stagea", 1);
    u.m_installDebs = {second, first};
    ASSERT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_REBOOT));
    EXPECT_EQ(0700u, ModeOf(kStaging));
    EXPECT_EQ((std::vector<std::string>{first, second}), ListDir(kStaging));
    EXPECT_FALSE(PathExists(kDebDir + "/" + first) || DpkgInstalled("stagea"));

    // A package that is not there: the staging folder is dropped at once.
    u.m_installDebs = {ApplyDeb("stagec", 3), "missing_6.1-5644-s4_all.deb"};
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_FALSE(PathExists(kStaging));
    EXPECT_TRUE(SyslogContains("Failed to mv " + kDebDir + "/missing_6.1-5644-s4_all.deb to " +
                                   "/smallupd@te//missing_6.1-5644-s4_all.deb",
                               LOG_ERR));
}

TEST_F(SmallUpdateApplyTest, FlashUpdaterRunsInItsFolderAndUnpackStagesPayloads) {
    const std::string record =
        "#!/bin/sh\necho \"$@\" > /tmp/updater.args\npwd >> /tmp/updater.args\nexit ";
    u.m_blFlashUpdate = true;
    u.m_flashUpdateDeb = ApplyDeb("flashok", 4, false, {{"/updater", record + "0\n"}});
    ASSERT_TRUE(u.UpdateFlash());
    EXPECT_EQ("-r /\n/flashUpd@teTempFolder\n", ReadFile("/tmp/updater.args").value_or(""));
    char cwd[64];
    EXPECT_STREQ("/", getcwd(cwd, sizeof cwd));  // the caller's folder is restored
    u.m_flashUpdateDeb = ApplyDeb("flashbad", 4, false, {{"/updater", record + "3\n"}});
    EXPECT_FALSE(u.UpdateFlash());
    EXPECT_TRUE(SyslogContains("failed to exec updater -r", LOG_ERR));
    EXPECT_FALSE(PathExists("/flashUpd@teTempFolder"));  // a missing package: the pipeline test

    // A reboot stages the boot payload; the configuration updater only when asked for (the
    // pipeline test stages and runs it, and fails without it).
    u.m_smallUpdateDeb = ApplyDeb("smallfix", 6, false,
                                  {{"/configupdate", "#!/bin/sh\nexit 0\n"},
                                   {"/smallupd@ter/boot.sh", "#!/bin/sh\nexit 0\n"}});
    u.m_blNeedReboot = true;
    EXPECT_TRUE(u.UnpackSmallUpdate());
    EXPECT_EQ(std::vector<std::string>{"smallupd@ter"}, ListDir(kStaging));
    EXPECT_FALSE(PathExists("/smallUpd@teTempFolder"));
    WriteFile("/smallupd@te/configupdate", "#!/bin/sh\nexit 2\n", 0755);
    EXPECT_FALSE(u.UpdateConfig());
    EXPECT_TRUE(SyslogContains("failed to update config", LOG_ERR));
    u.m_smallUpdateDeb = "absent_6.1-5644-s6_all.deb";
    EXPECT_FALSE(u.UnpackSmallUpdate());
    EXPECT_FALSE(PathExists("/smallUpd@teTempFolder"));
}

}  // namespace
