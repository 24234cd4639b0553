// DebianLib: real dpkg runs on packages built at test time, the update log stamp, and
// small-fix numbers read from package file names.
#include <syslog.h>
#include <time.h>

#include <algorithm>
#include <regex>
#include <sstream>

#include "deb_builder.h"
#include "debian_lib.h"
#include "sandbox.h"

namespace kytotest {
namespace {

const char* kDpkgLog = "/var/log/dpkg_upgrade.log";
const char* kDebDir = "/tmp/debs";

// The lines of the log that carry a time stamp (our own lines, not the tool's output),
// with the stamp removed after checking that it is local time close to now.
std::vector<std::string> StampedLines(const std::string& path) {
    static const std::regex stamp(R"(^(\d{4}/\d{2}/\d{2} \d{2}:\d{2}:\d{2})\t)");
    std::vector<std::string> out;
    std::istringstream in(ReadFile(path).value_or(""));
    std::smatch m;
    for (std::string line; std::getline(in, line);) {
        if (!std::regex_search(line, m, stamp))
            continue;
        struct tm tm = {};
        strptime(m[1].str().c_str(), "%Y/%m/%d %H:%M:%S", &tm);
        tm.tm_isdst = -1;
        EXPECT_LE(std::abs(difftime(time(nullptr), mktime(&tm))), 120.0) << line;
        out.push_back(m.suffix());
    }
    return out;
}

bool IsInstalled(const std::string& package) {
    std::string out;
    return Shell("dpkg-query -W -f='${Status}' " + package, &out) == 0 &&
           out == "install ok installed";
}

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
    EXPECT_EQ(0, Shell("test -x /tmp/unpacked/updater"));
    EXPECT_FALSE(IsInstalled("kytotest-dl-extract"));
    // Two-argument form: no empty folder argument reaches dpkg, or -i would fail.
    EXPECT_TRUE(DebianLib::ExecDpkg("-i", ok));
    EXPECT_TRUE(IsInstalled("kytotest-dl-install"));
    EXPECT_EQ("kytotest-dl-install\n", ReadFile("/tmp/order.log").value_or(""));
    EXPECT_FALSE(DebianLib::ExecDpkg("-i", bad));
    EXPECT_FALSE(DebianLib::ExecDpkg("-x", bad, ""));  // no target folder: dpkg refuses

    EXPECT_EQ((std::vector<std::string>{
                  " ===========[-x " + extract + " /tmp/unpacked]===========",
                  " ===========[-i " + ok + " ]===========",
                  " ===========[-i " + bad + " ]===========",
                  "Failed to install -i" + bad,
                  " ===========[-x " + bad + " ]===========",
                  "Failed to install -x" + bad,
              }),
              StampedLines(kDpkgLog));
    // The tool's standard output and error went to the log as well.
    const std::string log = ReadFile(kDpkgLog).value_or("");
    EXPECT_NE(std::string::npos, log.find("Setting up kytotest-dl-install (1.0)")) << log;
    EXPECT_NE(std::string::npos, log.find("fails on purpose")) << log;
}

TEST_F(DebianLibTest, DpkgKilledBySignalCountsAsSuccess) {
    // dpkg runs the preinst directly, so the script's parent is dpkg itself.
    DebPackage pkg = MakeDebPackage("kytotest-dl-killed", "1.0");
    pkg.preinst = "#!/bin/sh\nkill -9 $PPID\nexit 0\n";
    EXPECT_TRUE(DebianLib::ExecDpkg("-i", BuildDeb(pkg, kDebDir)));
    EXPECT_FALSE(IsInstalled("kytotest-dl-killed"));
    EXPECT_EQ(ReadFile(kDpkgLog)->find("Failed to install"), std::string::npos);
}

TEST_F(DebianLibTest, SmallFixNumberFromFileName) {
    struct Case {
        std::string name;
        int expected;
        std::string logged;  // expected syslog text, "" for none
    } cases[] = {
        {"foo_6.1-5644-s12_all.deb", 12, ""},
        {"foo_6.1-5644-s7beta_all.deb", 7, ""},
        {"foo_6.1-s9-5644-s3_all.deb", 3, ""},
        {"foo_6.1-5644-s_all.deb", 0, ""},
        {"foo_6.1-5645-s12_all.deb", -1,
         "different buildnumber of deb [foo_6.1-5645-s12_all.deb] with system buildnumber "
         "[5644]"},
        {"foo_bar_6.1-5644-s2_all.deb", -1, ""},
        {"foo_6.1-5644-s2_all.tar", -1, ""},
    };
    for (const auto& c : cases) {
        ClearSyslog();
        EXPECT_EQ(DebianLib::FindSmallFixNumfromDeb(c.name), c.expected) << c.name;
        auto messages = SyslogMessages();
        if (c.logged.empty()) {
            EXPECT_TRUE(messages.empty()) << c.name << ": " << messages.front();
        } else {
            EXPECT_TRUE(SyslogContains(c.logged, LOG_ERR)) << c.name;
        }
    }

    // The build number is read from the version file on every call.
    SetKeyValue("/etc.defaults/VERSION", "buildnumber", "1234");
    EXPECT_EQ(DebianLib::FindSmallFixNumfromDeb("foo_1.0-1234-s12_any.deb"), 12);
    SetKeyValue("/etc.defaults/VERSION", "buildnumber", std::nullopt);
    EXPECT_EQ(DebianLib::FindSmallFixNumfromDeb("foo_1.0-1234-s12_any.deb"), -1);
    EXPECT_TRUE(SyslogContains("debian_lib:", LOG_ERR));
    EXPECT_TRUE(SyslogContains("Get buildnumber Fail", LOG_ERR));
}

TEST_F(DebianLibTest, CompareSortsBySmallFixNumber) {
    std::vector<std::string> debs = {"c_6.1-5644-s5_all.deb", "a_6.1-5644-s1_all.deb",
                                     "x_6.1-9999-s2_all.deb", "b_6.1-5644-s3_all.deb"};
    std::sort(debs.begin(), debs.end(), DebianLib::InstallDebCompare);
    EXPECT_EQ(debs, (std::vector<std::string>{"x_6.1-9999-s2_all.deb", "a_6.1-5644-s1_all.deb",
                                              "b_6.1-5644-s3_all.deb", "c_6.1-5644-s5_all.deb"}));
    EXPECT_FALSE(DebianLib::InstallDebCompare(debs[3], debs[3]));
}

}  // namespace
}  // namespace kytotest
