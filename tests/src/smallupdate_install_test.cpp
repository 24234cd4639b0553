// The install steps with real packages and the real package tool: flash updater, unpack,
// configuration updater, installation in small-fix order, staging for the next boot.
#include <unistd.h>

#include "engine_fixtures.h"

namespace {

using namespace kytotest;
const std::string kDebDir = "/volume1/@smallupd@te_deb";
const char *kStaging = "/smallupd@te/", *kApplyStatus = "/var/run/applySmallUpd@te.status";
using SmallUpdateInstallTest = ApplyStepsTest;

TEST_F(SmallUpdateInstallTest, InstallsEveryPackageInSmallFixOrderWithProgress) {
    EXPECT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));  // nothing to install
    EXPECT_FALSE(PathExists(kApplyStatus));
    Shell("mkdir -p /smallupd@te/updater");
    const std::string broken = ApplyDeb("broken", 1, true);
    u.m_installDebs = {ApplyDeb("fixc", 12), broken, ApplyDeb("fixb", 5)};
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    // Sorted in place; the failing package does not stop the others.
    EXPECT_EQ(broken, u.m_installDebs.front());
    EXPECT_EQ((std::vector<std::string>{"fixb 53", "fixc 76"}),
              FileLines("/tmp/install_order.log"));
    EXPECT_EQ("percentage=\"99\"\nstage=\"3\"\nErrMsg=\"\"\n", ReadFile(kApplyStatus));
    EXPECT_TRUE(SyslogContains("Failed to install " + kDebDir + "/" + broken, LOG_ERR));
    EXPECT_FALSE(PathExists(kStaging)) << "a failed install drops the staging folder";
}

TEST_F(SmallUpdateInstallTest, RebootUpdateStagesPackagesForTheNextBoot) {
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

TEST_F(SmallUpdateInstallTest, FlashUpdaterRunsInItsFolderAndUnpackStagesPayloads) {
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
    EXPECT_FALSE(PathExists("/flashUpd@teTempFolder"));  // a missing package: the apply test

    // A reboot stages the boot payload; the configuration updater only when asked for (the
    // apply test stages and runs it, and fails without it).
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
