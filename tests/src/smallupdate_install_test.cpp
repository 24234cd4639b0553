// The apply work steps with real packages and the real package tool: flash updater,
// unpack into the staging folder, configuration updater, installation in small-fix
// order with progress, and staging for the next boot.
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "deb_builder.h"
#include "sandbox.h"
#include "smallupdate.h"

using namespace kytotest;

namespace {

const char* const kDebDir = "/volume1/@smallupd@te_deb";
const char* const kStaging = "/smallupd@te/";
const char* const kOrderLog = "/tmp/install_order.log";
const char* const kSeenLog = "/tmp/install_seen_progress.log";

std::vector<std::string> Lines(const std::string& path) {
    std::vector<std::string> out;
    std::string text = ReadFile(path).value_or("");
    size_t start = 0;
    for (size_t nl; (nl = text.find('\n', start)) != std::string::npos; start = nl + 1) {
        out.push_back(text.substr(start, nl - start));
    }
    return out;
}

// A package whose postinst records its name and the apply percentage it sees, i.e. the
// progress written after the previous package.
std::string ProgressDeb(const std::string& name, int fix, bool fails = false) {
    DebSpec spec = fails ? FailingDeb(name, SmallFixVersion("6.1", 5644, fix))
                         : OrderLoggingDeb(name, SmallFixVersion("6.1", 5644, fix), kOrderLog);
    if (!fails) {
        spec.postinst = std::string("#!/bin/sh\necho ") + name + " >> " + kOrderLog +
                        "\nsed -n 's/^percentage=\"\\(.*\\)\"/\\1/p' "
                        "/var/run/applySmallUpd@te.status >> " +
                        kSeenLog + "\nexit 0\n";
    }
    std::string path = BuildDeb(spec, kDebDir);
    return path.substr(path.rfind('/') + 1);
}

bool Installed(const std::string& package) {
    std::string out;
    return Shell("dpkg-query -W -f='${Status}' " + package, &out) == 0 &&
           out == "install ok installed";
}

SmallUpdate Record() {
    SmallUpdate u;
    u.m_debDir = kDebDir;
    return u;
}

class SmallUpdateInstallTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        Shell(std::string("mkdir -p ") + kDebDir + " /tmp");
    }
};

TEST_F(SmallUpdateInstallTest, InstallsInSmallFixOrderWithProgress) {
    SmallUpdate u = Record();
    EXPECT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));  // nothing to install
    EXPECT_FALSE(PathExists("/var/run/applySmallUpd@te.status"));
    u.m_installDebs = {ProgressDeb("fixc", 12), ProgressDeb("fixa", 2), ProgressDeb("fixb", 5)};
    ASSERT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_EQ((std::vector<std::string>{"fixa", "fixb", "fixc"}), Lines(kOrderLog));
    EXPECT_EQ((std::vector<std::string>{"53", "76"}), Lines(kSeenLog));
    EXPECT_EQ("fixa_6.1-5644-s2_all.deb", u.m_installDebs.front());
    auto status = ReadKeyValueFile("/var/run/applySmallUpd@te.status");
    EXPECT_EQ("99", status["percentage"]);
    EXPECT_EQ("3", status["stage"]);
    EXPECT_EQ("", status["ErrMsg"]);
    for (const char* p : {"fixa", "fixb", "fixc"})
        EXPECT_TRUE(Installed(p)) << p;
    std::string log = ReadFile("/var/log/dpkg_upgrade.log").value_or("");
    EXPECT_NE(std::string::npos, log.find(std::string("[-i ") + kDebDir + "/fixa_"));
    EXPECT_EQ(std::string::npos, log.find("Failed to install"));
}

TEST_F(SmallUpdateInstallTest, AFailingPackageDoesNotStopTheOthers) {
    Shell("mkdir -p /smallupd@te/updater");
    SmallUpdate u = Record();
    u.m_installDebs = {ProgressDeb("okthree", 3), ProgressDeb("broken", 2, true),
                       ProgressDeb("okone", 1)};
    ClearSyslog();
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_EQ((std::vector<std::string>{"okone", "okthree"}), Lines(kOrderLog));
    EXPECT_TRUE(Installed("okone"));
    EXPECT_TRUE(Installed("okthree"));
    EXPECT_FALSE(PathExists(kStaging));
    EXPECT_TRUE(SyslogContains(
        std::string("Failed to install ") + kDebDir + "/broken_6.1-5644-s2_all.deb", LOG_ERR));
    EXPECT_NE(std::string::npos,
              ReadFile("/var/log/dpkg_upgrade.log").value_or("").find("Failed to install -i"));
    EXPECT_EQ("99", ReadKeyValueFile("/var/run/applySmallUpd@te.status")["percentage"]);
}

TEST_F(SmallUpdateInstallTest, RebootUpdateStagesPackagesForTheNextBoot) {
    SmallUpdate u = Record();
    u.m_blNeedReboot = true;
    const std::string second = ProgressDeb("stageb", 9), first = ProgressDeb("stagea", 1);
    u.m_installDebs = {second, first};
    ASSERT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    ASSERT_TRUE(IsDirectory(kStaging));
    struct stat st;
    ASSERT_EQ(0, stat(kStaging, &st));
    EXPECT_EQ(0700u, st.st_mode & 07777);
    EXPECT_EQ((std::vector<std::string>{first, second}), ListDir(kStaging));
    EXPECT_FALSE(PathExists(std::string(kDebDir) + "/" + first));
    EXPECT_EQ((std::vector<std::string>{second, first}), u.m_installDebs);  // not sorted
    EXPECT_FALSE(Installed("stagea"));
    EXPECT_EQ("100", ReadKeyValueFile("/var/run/applySmallUpd@te.status")["percentage"]);

    // A package that is not there: the staging folder is dropped at once.
    u.m_installDebs = {ProgressDeb("stagec", 3), "missing_6.1-5644-s4_all.deb"};
    ClearSyslog();
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_FALSE(PathExists(kStaging));
    EXPECT_TRUE(SyslogContains(std::string("Failed to mv ") + kDebDir +
                                   "/missing_6.1-5644-s4_all.deb to "
                                   "/smallupd@te//missing_6.1-5644-s4_all.deb",
                               LOG_ERR));

    // A file where the folder belongs cannot be replaced by the staging folder.
    WriteFile("/smallupd@te", "a file in the way");
    u.m_installDebs = {ProgressDeb("staged", 5)};
    ClearSyslog();
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_TRUE(SyslogContains("Failed to mkdir(/smallupd@te/) [", LOG_ERR));
    EXPECT_TRUE(PathExists(std::string(kDebDir) + "/" + u.m_installDebs[0]));
}

TEST_F(SmallUpdateInstallTest, FlashRunsTheUpdaterInsideItsFolder) {
    auto flashDeb = [](const std::string& name, int exitCode) {
        DebSpec spec;
        spec.package = name;
        spec.version = SmallFixVersion("6.1", 5644, 4);
        spec.files["/updater"] =
            "#!/bin/sh\necho \"$@\" > /tmp/updater.args\npwd > "
            "/tmp/updater.cwd\nexit " +
            std::to_string(exitCode) + "\n";
        std::string path = BuildDeb(spec, kDebDir);
        return path.substr(path.rfind('/') + 1);
    };
    char before[4096];
    ASSERT_NE(nullptr, getcwd(before, sizeof(before)));
    SmallUpdate u = Record();
    u.m_blFlashUpdate = true;
    u.m_flashUpdateDeb = flashDeb("flashok", 0);
    ASSERT_TRUE(u.UpdateFlash());
    EXPECT_EQ("-r /\n", ReadFile("/tmp/updater.args").value_or(""));
    EXPECT_EQ("/flashUpd@teTempFolder\n", ReadFile("/tmp/updater.cwd").value_or(""));
    EXPECT_FALSE(PathExists("/flashUpd@teTempFolder"));
    char after[4096];
    ASSERT_NE(nullptr, getcwd(after, sizeof(after)));
    EXPECT_STREQ(before, after);

    u.m_flashUpdateDeb = flashDeb("flashbad", 3);
    ClearSyslog();
    EXPECT_FALSE(u.UpdateFlash());
    EXPECT_TRUE(SyslogContains("failed to exec updater -r", LOG_ERR));
    EXPECT_FALSE(PathExists("/flashUpd@teTempFolder"));

    // Not extractable, or no package named: false, nothing left behind.
    RemoveTree("/var/log/dpkg_upgrade.log");
    u.m_flashUpdateDeb = "absent_6.1-5644-s4_all.deb";
    EXPECT_FALSE(u.UpdateFlash());
    EXPECT_FALSE(PathExists("/flashUpd@teTempFolder"));
    RemoveTree("/var/log/dpkg_upgrade.log");
    u.m_flashUpdateDeb = "";
    EXPECT_FALSE(u.UpdateFlash());
    EXPECT_FALSE(PathExists("/var/log/dpkg_upgrade.log")) << "the package tool was run";
}

TEST_F(SmallUpdateInstallTest, UnpackStagesPayloadsAndConfigUpdateRuns) {
    DebSpec spec;
    spec.package = "smallfix";
    spec.version = SmallFixVersion("6.1", 5644, 6);
    spec.files["/configupdate"] = "#!/bin/sh\necho \"$@\" > /tmp/configupdate.args\nexit 0\n";
    spec.files["/smallupd@ter/boot.sh"] = "#!/bin/sh\nexit 0\n";
    std::string path = BuildDeb(spec, kDebDir);
    SmallUpdate u = Record();
    u.m_smallUpdateDeb = path.substr(path.rfind('/') + 1);

    struct Row {
        bool reboot, config;
        std::vector<std::string> staged;
    } rows[] = {
        {false, false, {}},
        {true, false, {"smallupd@ter"}},
        {false, true, {"configupdate"}},
        {true, true, {"configupdate", "smallupd@ter"}},
    };
    for (const Row& row : rows) {
        Shell("rm -rf /smallupd@te");
        u.m_blNeedReboot = row.reboot;
        u.m_blConfigUpdate = row.config;
        EXPECT_TRUE(u.UnpackSmallUpdate());
        EXPECT_EQ(row.staged, ListDir(kStaging));
        EXPECT_FALSE(PathExists("/smallUpd@teTempFolder"));
    }
    EXPECT_TRUE(PathExists("/smallupd@te/smallupd@ter/boot.sh"));
    ASSERT_TRUE(u.UpdateConfig());
    EXPECT_EQ("-c all -p /etc.defaults/VERSION\n", ReadFile("/tmp/configupdate.args").value_or(""));
    EXPECT_TRUE(PathExists("/smallupd@te/configupdate"));

    WriteFile("/smallupd@te/configupdate", "#!/bin/sh\nexit 2\n", 0755);
    ClearSyslog();
    EXPECT_FALSE(u.UpdateConfig());
    EXPECT_TRUE(SyslogContains("failed to update config", LOG_ERR));

    Shell("rm -rf /smallupd@te");
    ClearSyslog();
    EXPECT_FALSE(u.UpdateConfig());
    EXPECT_TRUE(SyslogContains("configupdate not exist", LOG_ERR));

    u.m_smallUpdateDeb = "absent_6.1-5644-s6_all.deb";
    EXPECT_FALSE(u.UnpackSmallUpdate());
    EXPECT_FALSE(PathExists("/smallUpd@teTempFolder"));
}

}  // namespace
