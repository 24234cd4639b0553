// DebianLib: real dpkg runs on packages built at test time, the update log stamp, and
// small-fix numbers read from package file names.
#include "deb_builder.h"
#include "debian_lib.h"
#include "sandbox.h"

namespace {

using namespace kytotest;
const char* kDpkgLog = "/var/log/dpkg_upgrade.log";
const char* kDebDir = "/tmp/debs";
using DebianLibTest = SandboxTest;

TEST_F(DebianLibTest, RunsDpkgWithBannersAndOutputInTheLog) {
    WriteFile("/tmp/order.log", "");
    const std::string ok =
        BuildDeb(OrderLoggingDeb("kytotest-dl-install", "1.0", "/tmp/order.log"), kDebDir);
    DebPackage pkg = MakeDebPackage("kytotest-dl-extract", "2.0-5644-s1");
    pkg.files["/updater"] = "#!/bin/sh\nexit 0\n";
    const std::string extract = BuildDeb(pkg, kDebDir);
    const std::string bad = BuildDeb(FailingDeb("kytotest-dl-fail", "1.0"), kDebDir);

    EXPECT_TRUE(DebianLib::ExecDpkg("-x", extract, "/tmp/unpacked"));
    EXPECT_EQ(0755u, ModeOf("/tmp/unpacked/updater"));
    EXPECT_FALSE(DpkgInstalled("kytotest-dl-extract"));
    // Two-argument form: no empty folder argument reaches dpkg, or -i would fail.
    EXPECT_TRUE(DebianLib::ExecDpkg("-i", ok));
    EXPECT_EQ("kytotest-dl-install\n", ReadFile("/tmp/order.log").value_or(""));  // installed
    EXPECT_FALSE(DebianLib::ExecDpkg("-i", bad));
    EXPECT_FALSE(DebianLib::ExecDpkg("-x", bad, ""));  // no target folder: dpkg refuses

    // Our own lines carry a local time stamp close to now; the tool's output is logged too.
    EXPECT_EQ((std::vector<std::string>{
                  " ===========[-x " + extract + " /tmp/unpacked]===========",
                  " ===========[-i " + ok + " ]===========",
                  " ===========[-i " + bad + " ]===========", "Failed to install -i" + bad,
                  " ===========[-x " + bad + " ]===========", "Failed to install -x" + bad}),
              StampedLines(kDpkgLog));
    EXPECT_FALSE(FileLines(kDpkgLog, "Setting up kytotest-dl-install (1.0)").empty());
}

TEST_F(DebianLibTest, DpkgKilledBySignalCountsAsSuccess) {
    // dpkg runs the preinst directly, so the script's parent is dpkg itself.
    DebPackage pkg = MakeDebPackage("kytotest-dl-killed", "1.0");
    pkg.preinst = "#!/bin/sh\nkill -9 $PPID\nexit 0\n";
    EXPECT_TRUE(DebianLib::ExecDpkg("-i", BuildDeb(pkg, kDebDir)));
    EXPECT_FALSE(DpkgInstalled("kytotest-dl-killed"));
    EXPECT_TRUE(FileLines(kDpkgLog, "Failed to install").empty());
}

// The install order these numbers give is seen in the apply's install test.
TEST_F(DebianLibTest, SmallFixNumberFromFileName) {
    // clang-format off
    struct Case { std::string name; int expected; } cases[] = {
        {"foo_6.1-5644-s12_all.deb", 12}, {"foo_6.1-5644-s7beta_all.deb", 7},
        {"foo_6.1-s9-5644-s3_all.deb", 3}, {"foo_6.1-5644-s_all.deb", 0},
        {"foo_6.1-5645-s12_all.deb", -1}, {"foo_bar_6.1-5644-s2_all.deb", -1}};
    // clang-format on
    for (const auto& c : cases) {
        ClearSyslog();
        EXPECT_EQ(DebianLib::FindSmallFixNumfromDeb(c.name), c.expected) << c.name;
        // Only another build is worth a log line.
        const bool otherBuild = c.name.find("5645") != std::string::npos;
        EXPECT_EQ(otherBuild ? 1u : 0u, SyslogMessages().size()) << c.name;
        EXPECT_EQ(otherBuild, SyslogContains("different buildnumber of deb [" + c.name +
                                                 "] with system buildnumber [5644]",
                                             LOG_ERR));
    }
    // The build number is read from the version file on every call.
    SetKeyValue("/etc.defaults/VERSION", "buildnumber", std::nullopt);
    EXPECT_EQ(DebianLib::FindSmallFixNumfromDeb("foo_1.0-1234-s12_any.deb"), -1);
    EXPECT_TRUE(SyslogContains("debian_lib:", LOG_ERR) && SyslogContains("Get buildnumber Fail"));
}

}  // namespace
