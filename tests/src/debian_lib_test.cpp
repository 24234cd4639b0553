// DebianLib: real dpkg runs on packages built at test time, the update log stamp, and
// small-fix numbers read from package file names.
#include <syslog.h>
#include <time.h>

#include <algorithm>
#include <regex>

#include "deb_builder.h"
#include "debian_lib.h"
#include "sandbox.h"

namespace kytotest {
namespace {

const char* kDpkgLog = "/var/log/dpkg_upgrade.log";
const char* kDebDir = "/tmp/debs";

std::vector<std::string> Lines(const std::string& path) {
    std::vector<std::string> lines;
    std::string content = ReadFile(path).value_or("");
    size_t start = 0, end;
    while ((end = content.find('\n', start)) != std::string::npos) {
        lines.push_back(content.substr(start, end - start));
        start = end + 1;
    }
    return lines;
}

// Splits "YYYY/mm/dd HH:MM:SS\t<text>" and checks the stamp is local time close to now.
std::string TextAfterStamp(const std::string& line) {
    static const std::regex stamp(R"(^(\d{4}/\d{2}/\d{2} \d{2}:\d{2}:\d{2})\t)");
    std::smatch m;
    if (!std::regex_search(line, m, stamp)) {
        ADD_FAILURE() << "no time stamp in [" << line << "]";
        return line;
    }
    struct tm tm = {};
    strptime(m[1].str().c_str(), "%Y/%m/%d %H:%M:%S", &tm);
    tm.tm_isdst = -1;
    EXPECT_LE(std::abs(difftime(time(nullptr), mktime(&tm))), 120.0) << line;
    return m.suffix();
}

bool IsInstalled(const std::string& package) {
    std::string out;
    return Shell("dpkg-query -W -f='${Status}' " + package, &out) == 0 &&
           out == "install ok installed";
}

using DebianLibTest = SandboxTest;

TEST_F(DebianLibTest, InstallRunsDpkgWithOutputInLog) {
    WriteFile("/tmp/order.log", "");
    std::string deb =
        BuildDeb(OrderLoggingDeb("kytotest-dl-install", "1.0", "/tmp/order.log"), kDebDir);
    ASSERT_FALSE(deb.empty());

    // Two-argument form: no empty folder argument reaches dpkg, or -i would fail.
    EXPECT_TRUE(DebianLib::ExecDpkg("-i", deb));
    EXPECT_TRUE(IsInstalled("kytotest-dl-install"));
    EXPECT_TRUE(PathExists("/usr/share/kytotest/kytotest-dl-install.txt"));
    EXPECT_EQ(ReadFile("/tmp/order.log").value_or(""), "kytotest-dl-install\n");

    auto lines = Lines(kDpkgLog);
    ASSERT_FALSE(lines.empty());
    EXPECT_EQ(TextAfterStamp(lines[0]), " ===========[-i " + deb + " ]===========");
    std::string log = ReadFile(kDpkgLog).value_or("");
    EXPECT_NE(log.find("Setting up kytotest-dl-install (1.0)"), std::string::npos) << log;
    EXPECT_EQ(log.find("Failed to install"), std::string::npos);
}

TEST_F(DebianLibTest, ExtractUnpacksIntoFolderWithoutInstalling) {
    DebSpec spec = MakeDebSpec("kytotest-dl-extract", "2.0-5644-s1");
    spec.files["/updater"] = "#!/bin/sh\nexit 0\n";
    spec.files["/etc/kytotest/conf"] = "key=value\n";
    std::string deb = BuildDeb(spec, kDebDir);
    ASSERT_FALSE(deb.empty());

    EXPECT_TRUE(DebianLib::ExecDpkg("-x", deb, "/tmp/unpacked"));
    EXPECT_EQ(ReadFile("/tmp/unpacked/etc/kytotest/conf").value_or(""), "key=value\n");
    EXPECT_EQ(Shell("test -x /tmp/unpacked/updater"), 0);
    EXPECT_FALSE(IsInstalled("kytotest-dl-extract"));
    auto lines = Lines(kDpkgLog);
    ASSERT_FALSE(lines.empty());
    EXPECT_EQ(TextAfterStamp(lines[0]), " ===========[-x " + deb + " /tmp/unpacked]===========");
}

TEST_F(DebianLibTest, FailuresAreLoggedAndReturnFalse) {
    std::string deb = BuildDeb(FailingDeb("kytotest-dl-fail", "1.0"), kDebDir);
    ASSERT_FALSE(deb.empty());
    EXPECT_FALSE(DebianLib::ExecDpkg("-i", deb));
    auto lines = Lines(kDpkgLog);
    ASSERT_GE(lines.size(), 2u);
    EXPECT_EQ(TextAfterStamp(lines.back()), "Failed to install -i" + deb);
    // The script's error output went to the log too.
    EXPECT_NE(ReadFile(kDpkgLog)->find("fails on purpose"), std::string::npos);

    // Extraction without a target folder: dpkg refuses; option, package and folder are
    // joined without separators.
    EXPECT_FALSE(DebianLib::ExecDpkg("-x", deb, ""));
    lines = Lines(kDpkgLog);
    EXPECT_EQ(TextAfterStamp(lines.back()), "Failed to install -x" + deb);
}

TEST_F(DebianLibTest, DpkgKilledBySignalCountsAsSuccess) {
    // dpkg runs the preinst directly, so the script's parent is dpkg itself.
    DebSpec spec = MakeDebSpec("kytotest-dl-killed", "1.0");
    spec.preinst = "#!/bin/sh\nkill -9 $PPID\nexit 0\n";
    std::string deb = BuildDeb(spec, kDebDir);
    ASSERT_FALSE(deb.empty());
    EXPECT_TRUE(DebianLib::ExecDpkg("-i", deb));
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
        {"foo-5644-s_6.1_all.deb", -1, ""},
        {"foo_6.1-5645-s12_all.deb", -1,
         "different buildnumber of deb [foo_6.1-5645-s12_all.deb] with system buildnumber "
         "[5644]"},
        {"foo_bar_6.1-5644-s2_all.deb", -1, ""},
        {"foo_6.1-5644-s2_all.tar", -1, ""},
        {"foo_6.1-5644-s2.deb", -1, ""},
        {"foo-6.1-5644-s2-all.deb", -1, ""},
        {".deb", -1, ""},
        {"", -1, ""},
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
    EXPECT_EQ(DebianLib::FindSmallFixNumfromDeb("foo_6.1-5644-s12_all.deb"), -1);

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
    EXPECT_FALSE(DebianLib::InstallDebCompare("nothing.deb", "x_6.1-9999-s2_all.deb"));
}

}  // namespace
}  // namespace kytotest
