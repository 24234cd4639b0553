// The apply: its status file (writer, high-availability marker, reader in other
// processes) and the work steps with real packages and the real package tool: flash
// updater, unpack into the staging folder, configuration updater, installation in
// small-fix order with progress, and staging for the next boot.
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <map>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "deb_builder.h"
#include "sandbox.h"
#include "smallupdate.h"

using namespace kytotest;

namespace {

const std::string kDebDir = "/volume1/@smallupd@te_deb";
const char* const kStaging = "/smallupd@te/";
const char* const kApplyStatus = "/var/run/applySmallUpd@te.status";
const char* const kOrderLog = "/tmp/install_order.log";

std::vector<std::string> Lines(const std::string& path, const std::string& onlyWith = "") {
    std::vector<std::string> out;
    std::string text = ReadFile(path).value_or("");
    for (size_t start = 0, nl; (nl = text.find('\n', start)) != std::string::npos; start = nl + 1) {
        if (text.substr(start, nl - start).find(onlyWith) != std::string::npos)
            out.push_back(text.substr(start, nl - start));
    }
    return out;
}

// Builds a package of small fix `fix` into the download folder and returns its file name.
// Its postinst logs its name and the apply percentage it sees (written after the previous
// package); a failing one exits 1 instead; `updater` ships a script at `updaterPath`.
std::string Deb(const std::string& name, int fix, bool fails = false,
                const std::string& updaterPath = "", const std::string& updater = "") {
    DebPackage pkg = fails ? FailingDeb(name, SmallFixVersion("6.1", 5644, fix))
                           : MakeDebPackage(name, SmallFixVersion("6.1", 5644, fix));
    if (!fails && updaterPath.empty()) {
        pkg.postinst = "#!/bin/sh\necho " + name + " $(sed -n 's/^percentage=\"\\(.*\\)\"/\\1/p' " +
                       kApplyStatus + ") >> " + kOrderLog + "\n";
    }
    if (!updaterPath.empty())
        pkg.files[updaterPath] = updater;
    const std::string path = BuildDeb(pkg, kDebDir);
    return path.substr(path.rfind('/') + 1);
}

bool Installed(const std::string& package) {
    std::string out;
    return Shell("dpkg-query -W -f='${Status}' " + package, &out) == 0 &&
           out == "install ok installed";
}

class SmallUpdateApplyTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        Shell("mkdir -p " + kDebDir);
        u.m_debDir = kDebDir;
    }
    SmallUpdate u;
};

const char* const kWords[] = {
    "none",  "waiting_remote_upgrading", "analying", "program", "startService", "finished",
    "reboot"};

struct Stage {
    int percentage = -7;
    std::string word = "caller-stage";
    std::string err = "caller-err";
};

Stage Read() {
    Stage s;
    SmallUpdate::GetApplyStage(s.percentage, s.word, s.err);
    return s;
}

bool TempFilesLeft() {
    for (const auto& name : ListDir("/var/run")) {
        if (name.rfind("applySmallUpd@te.status_", 0) == 0)
            return true;
    }
    return false;
}

TEST_F(SmallUpdateApplyTest, WriterReplacesTheFileWithThreeQuotedKeys) {
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(10, SmallUpdate::APPLY_STAGE_PROGRAM, ""));
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(53, SmallUpdate::APPLY_STAGE_PROGRAM, "a b"));
    EXPECT_EQ("percentage=\"53\"\nstage=\"3\"\nErrMsg=\"a b\"\n",
              ReadFile(kApplyStatus).value_or(""));

    // A value the key=value writer refuses: the old file stays, no temporary file is left.
    EXPECT_FALSE(SmallUpdate::UpdateApplyProgress(99, SmallUpdate::APPLY_STAGE_REBOOT, "x\ny"));
    EXPECT_EQ("53", ReadKeyValueFile(kApplyStatus)["percentage"]);
    EXPECT_FALSE(TempFilesLeft());

    SmallUpdate().HASetApplyProgressErr("peer upgrading");
    Stage s = Read();
    EXPECT_EQ(0, s.percentage);
    EXPECT_EQ("waiting_remote_upgrading", s.word);
    EXPECT_EQ("peer upgrading", s.err);
}

TEST_F(SmallUpdateApplyTest, ReaderGivesTheWordOfEveryStage) {
    for (int stage = 0; stage <= 6; ++stage) {
        ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(
            stage * 10, static_cast<SmallUpdate::APPLY_STAGE>(stage), ""));
        Stage s = Read();
        EXPECT_EQ(stage * 10, s.percentage);
        EXPECT_EQ(kWords[stage], s.word);
        EXPECT_EQ("caller-err", s.err) << "an empty ErrMsg leaves the caller's text";
    }
    // Files written by others, or missing and incomplete ones (nullptr: no file).  Stages
    // beyond the table (negative ones too) keep the caller's word and report an error.
    struct Row {
        const char* content;
        int percentage;
        const char* word;
        const char* err;
    } rows[] = {
        {"percentage=\"40\"\nstage=\"7\"\nErrMsg=\"\"\n", 40, "caller-stage", "err_system"},
        {"percentage=\"40\"\nstage=\"-1\"\n", 40, "caller-stage", "err_system"},
        {"percentage=\"40\"\nstage=\"9\"\nErrMsg=\"disk full\"\n", 40, "caller-stage", "disk full"},
        {"percentage=\"77\"\nstage=\"5\"\nErrMsg=\"err_system\"\n", 77, "finished", "err_system"},
        {nullptr, -7, "none", "caller-err"},
        {"stage=\"3\"\nErrMsg=\"\"\n", -7, "none", "err_system"},
        {"percentage=\"30\"\n", -7, "none", "err_system"},
        {"percentage=\"\"\nstage=\"3\"\n", -7, "none", "err_system"},
    };
    for (const Row& row : rows) {
        RemoveTree(kApplyStatus);
        if (row.content)
            WriteFile(kApplyStatus, row.content);
        Stage s = Read();
        const std::string what = row.content ? row.content : "(no file)";
        EXPECT_EQ(row.percentage, s.percentage) << what;
        EXPECT_EQ(row.word, s.word) << what;
        EXPECT_EQ(row.err, s.err) << what;
    }
}

// A poller in another process sees only values that were written together, while the
// file is replaced thousands of times.
TEST_F(SmallUpdateApplyTest, PollerInAnotherProcessNeverSeesATornFile) {
    const std::string stopMarker = "/tmp/apply_status_writer_done";
    auto stageFor = [](int percentage) {
        return static_cast<SmallUpdate::APPLY_STAGE>(2 + percentage % 5);
    };
    auto errFor = [](int percentage) { return "e" + std::to_string(percentage); };
    ASSERT_TRUE(SmallUpdate::UpdateApplyProgress(0, stageFor(0), errFor(0)));

    pid_t reader = Spawn([&]() {
        long reads = 0;
        for (bool done = false; !done; ++reads) {
            done = access(stopMarker.c_str(), F_OK) == 0;  // one last read after the writer
            Stage s = Read();
            if (s.percentage < 0 || s.percentage > 100)
                return 1;
            if (s.word != kWords[stageFor(s.percentage)])
                return 2;
            if (s.err != errFor(s.percentage))
                return 3;
        }
        return reads > 1 ? 0 : 4;
    });
    int written = 0;
    for (int i = 1; i <= 3000; ++i) {
        const int percentage = i % 101;
        if (!SmallUpdate::UpdateApplyProgress(percentage, stageFor(percentage), errFor(percentage)))
            break;  // the reader must still be stopped below
        ++written;
    }
    WriteFile(stopMarker, "");
    EXPECT_EQ(3000, written);
    EXPECT_EQ(0, Wait(reader)) << "1: bad percentage, 2: stage torn, 3: message torn";
    EXPECT_FALSE(TempFilesLeft());
}

TEST_F(SmallUpdateApplyTest, InstallsEveryPackageInSmallFixOrderWithProgress) {
    EXPECT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));  // nothing to install
    EXPECT_FALSE(PathExists(kApplyStatus));

    Shell("mkdir -p /smallupd@te/updater");
    const std::string broken = Deb("broken", 1, true);
    u.m_installDebs = {Deb("fixc", 12), broken, Deb("fixb", 5)};
    ClearSyslog();
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    // Sorted in place; the failing package does not stop the others.
    EXPECT_EQ(broken, u.m_installDebs.front());
    EXPECT_EQ((std::vector<std::string>{"fixb 53", "fixc 76"}), Lines(kOrderLog));
    EXPECT_EQ(3u, Lines("/var/log/dpkg_upgrade.log", "===========[-i " + kDebDir).size());
    EXPECT_TRUE(Installed("fixb") && Installed("fixc"));
    EXPECT_EQ(
        (std::map<std::string, std::string>{{"percentage", "99"}, {"stage", "3"}, {"ErrMsg", ""}}),
        ReadKeyValueFile(kApplyStatus));
    EXPECT_TRUE(SyslogContains("Failed to install " + kDebDir + "/" + broken, LOG_ERR));
    EXPECT_FALSE(PathExists(kStaging)) << "a failed install drops the staging folder";
}

TEST_F(SmallUpdateApplyTest, RebootUpdateStagesPackagesForTheNextBoot) {
    u.m_blNeedReboot = true;
    const std::string second = Deb("stageb", 9), first = Deb("stagea", 1);
    u.m_installDebs = {second, first};
    ASSERT_TRUE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_REBOOT));
    struct stat st;
    ASSERT_EQ(0, stat(kStaging, &st));
    EXPECT_EQ(0700u, st.st_mode & 07777);
    EXPECT_EQ((std::vector<std::string>{first, second}), ListDir(kStaging));
    EXPECT_FALSE(PathExists(kDebDir + "/" + first));
    EXPECT_EQ((std::vector<std::string>{second, first}), u.m_installDebs);  // not sorted
    EXPECT_FALSE(Installed("stagea"));
    EXPECT_EQ("100", ReadKeyValueFile(kApplyStatus)["percentage"]);
    EXPECT_EQ("6", ReadKeyValueFile(kApplyStatus)["stage"]);

    // A package that is not there: the staging folder is dropped at once.
    u.m_installDebs = {Deb("stagec", 3), "missing_6.1-5644-s4_all.deb"};
    ClearSyslog();
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_FALSE(PathExists(kStaging));
    EXPECT_TRUE(SyslogContains("Failed to mv " + kDebDir +
                                   "/missing_6.1-5644-s4_all.deb to "
                                   "/smallupd@te//missing_6.1-5644-s4_all.deb",
                               LOG_ERR));

    // A file where the folder belongs cannot be replaced by the staging folder.
    WriteFile("/smallupd@te", "a file in the way");
    u.m_installDebs = {Deb("staged", 5)};
    ClearSyslog();
    EXPECT_FALSE(u.InstallDeb(30, SmallUpdate::APPLY_STAGE_PROGRAM));
    EXPECT_TRUE(SyslogContains("Failed to mkdir(/smallupd@te/) [", LOG_ERR));
    EXPECT_TRUE(PathExists(kDebDir + "/" + u.m_installDebs[0]));
}

TEST_F(SmallUpdateApplyTest, FlashRunsTheUpdaterInsideItsFolder) {
    const std::string record =
        "#!/bin/sh\necho \"$@\" > /tmp/updater.args\npwd >> /tmp/updater.args\n";
    char before[4096], after[4096];
    ASSERT_NE(nullptr, getcwd(before, sizeof(before)));
    u.m_blFlashUpdate = true;
    u.m_flashUpdateDeb = Deb("flashok", 4, false, "/updater", record + "exit 0\n");
    ASSERT_TRUE(u.UpdateFlash());
    EXPECT_EQ("-r /\n/flashUpd@teTempFolder\n", ReadFile("/tmp/updater.args").value_or(""));
    ASSERT_NE(nullptr, getcwd(after, sizeof(after)));
    EXPECT_STREQ(before, after);

    u.m_flashUpdateDeb = Deb("flashbad", 4, false, "/updater", record + "exit 3\n");
    ClearSyslog();
    EXPECT_FALSE(u.UpdateFlash());
    EXPECT_TRUE(SyslogContains("failed to exec updater -r", LOG_ERR));

    // Not extractable, or flagged without a package: false, nothing left behind, and in
    // the second case the package tool is not even run.
    for (const char* name : {"absent_6.1-5644-s4_all.deb", ""}) {
        RemoveTree("/var/log/dpkg_upgrade.log");
        u.m_flashUpdateDeb = name;
        EXPECT_FALSE(u.UpdateFlash()) << name;
        EXPECT_FALSE(PathExists("/flashUpd@teTempFolder")) << name;
    }
    EXPECT_FALSE(PathExists("/var/log/dpkg_upgrade.log"));
}

TEST_F(SmallUpdateApplyTest, UnpackStagesPayloadsAndConfigUpdateRuns) {
    DebPackage pkg = MakeDebPackage("smallfix", SmallFixVersion("6.1", 5644, 6));
    pkg.files["/configupdate"] = "#!/bin/sh\necho \"$@\" > /tmp/configupdate.args\nexit 0\n";
    pkg.files["/smallupd@ter/boot.sh"] = "#!/bin/sh\nexit 0\n";
    const std::string path = BuildDeb(pkg, kDebDir);
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
    EXPECT_FALSE(u.UpdateConfig());
    EXPECT_TRUE(SyslogContains("configupdate not exist", LOG_ERR));

    u.m_smallUpdateDeb = "absent_6.1-5644-s6_all.deb";
    EXPECT_FALSE(u.UnpackSmallUpdate());
    EXPECT_FALSE(PathExists("/smallUpd@teTempFolder"));
}

}  // namespace
