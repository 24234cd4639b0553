// The small-update record: constructors, Equal, the info files, the download status
// writer and the folder helpers.
#include <syslog.h>

#include <functional>
#include <map>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

#include "sandbox.h"
#include "smallupdate.h"

using namespace kytotest;

namespace {

const char* const kInfo = "/autoupd@te.info";
const char* const kPassive = "/passive_upd@te.info";
using Change = std::function<void(SmallUpdate&)>;

Json::Value Parse(const std::string& text) {
    Json::Value v;
    EXPECT_TRUE(Json::Reader().parse(text, v, false)) << text;
    return v;
}

// An info file as a download on the sandbox's build 5644 writes it.
const char* const kValidInfo =
    R"({"updateType":"smallupdate","buildnumber":5644,"newSmallFixNumber":3,)"
    R"("debDir":"/volume1/d","smallupdateDeb":"smallfix_6.1-5644-s3_all.deb",)"
    R"("vyxServiceRestartList":["S20samba.sh"],"pkgRestartList":[]})";

// A record that dumps cleanly: one small-update package with its link.
SmallUpdate Dumpable() {
    SmallUpdate u;
    u.m_buildNumber = 5644;
    u.m_newSmallFixNumber = 7;
    u.m_debDir = "/volume1/d";
    u.m_smallUpdateDeb = "smallfix_6.1-5644-s7_all.deb";
    u.m_smallUpdateDebLink = "http://127.0.0.1/s7";
    return u;
}

using SmallUpdateInfoTest = SandboxTest;

TEST_F(SmallUpdateInfoTest, ConstructorsAndEqual) {
    EXPECT_EQ("demo_model", SmallUpdate(std::string()).m_unique);
    EXPECT_EQ("other", SmallUpdate("other").m_unique);
    SetKeyValue("/etc.defaults/kytoinfo.conf", "unique", std::nullopt);
    EXPECT_EQ("", SmallUpdate().m_unique);

    // Ignored fields and list order keep records equal; every compared field counts.
    SmallUpdate base = Dumpable();
    base.m_installDebs = {"a", "b"};
    const std::vector<std::pair<Change, bool>> rows = {
        {[](SmallUpdate& u) { u.m_unique = u.m_smallUpdateDebLink = u.m_flashUpdateDebLink = "x"; },
         true},
        {[](SmallUpdate& u) { u.m_buildNumber = u.m_errno = 1; }, true},
        {[](SmallUpdate& u) { std::swap(u.m_installDebs[0], u.m_installDebs[1]); }, true},
        {[](SmallUpdate& u) { u.m_blConfigUpdate = true; }, false},
        {[](SmallUpdate& u) { u.m_blFlashUpdate = true; }, false},
        {[](SmallUpdate& u) { u.m_newSmallFixNumber = 8; }, false},
        {[](SmallUpdate& u) { u.m_debDir += "x"; }, false},
        {[](SmallUpdate& u) { u.m_installDebLinks.push_back("l"); }, false},
        {[](SmallUpdate& u) { u.m_smallUpdateDeb = "z"; }, false},
        {[](SmallUpdate& u) { u.m_flashUpdateDeb = "z"; }, false},
        {[](SmallUpdate& u) { u.m_installDebs[1] = "a"; }, false},
        {[](SmallUpdate& u) { u.m_blRestartAllService = true; }, false},
        {[](SmallUpdate& u) { u.m_blNeedReboot = true; }, false},
        {[](SmallUpdate& u) { u.m_vyxServiceRestartList.push_back("S99sshd.sh"); }, false},
        {[](SmallUpdate& u) { u.m_pkgRestartList.push_back("pkg"); }, false},
    };
    for (size_t i = 0; i < rows.size(); ++i) {
        SmallUpdate other = base;
        rows[i].first(other);
        EXPECT_EQ(rows[i].second, base.Equal(other)) << "row " << i;
    }
}

TEST_F(SmallUpdateInfoTest, ImportRejectsBadFiles) {
    struct Row {
        const char* key;
        const char* json;  // new value, nullptr removes the key
        int err;
        int build;        // m_buildNumber afterwards: stored once the build matched
        const char* log;  // expected syslog text, "" for none
    } rows[] = {
        {"updateType", R"("vyxupdate")", 3, -1, ""},
        {"buildnumber", R"("5644")", 3, -1, ""},
        {"newSmallFixNumber", "true", 3, -1, ""},
        {"smallupdateDeb", nullptr, 3, -1, ""},  // no package named
        {"pkgRestartList", nullptr, 3, -1, ""},  // restart behaviour not stated
        {"buildnumber", "5645", 4, -1, ""},
        {"installDeb", "{}", 3, 5644, ""},
        {"installDeb", R"(["foo.deb"])", 3, 5644, "format error of debian [foo.deb]"},
        {"installDeb", R"(["f_6.1-5643-s1_all.deb"])", 3, 5644, "error of debian [f_6.1-5643"},
        {"vyxServiceRestartList", R"("S20samba.sh")", 3, 5644, ""},
        {"pkgRestartList", "[1]", 3, 5644, ""},
    };
    for (const Row& row : rows) {
        Json::Value v = Parse(kValidInfo);
        if (row.json) {
            v[row.key] = Parse(row.json);
        } else {
            v.removeMember(row.key);
        }
        WriteFile(kInfo, Json::FastWriter().write(v));
        ClearSyslog();
        SmallUpdate u;
        u.m_installDebs = {"kept"};
        const std::string what = std::string(row.key) + "=" + (row.json ? row.json : "(none)");
        EXPECT_FALSE(u.ImportInfoFile(kInfo)) << what;
        EXPECT_EQ(row.err, u.GetErrno()) << what;
        EXPECT_TRUE(*row.log == '\0' || SyslogContains(row.log, LOG_ERR)) << row.log;
        EXPECT_EQ(row.build, u.m_buildNumber) << what;
        if (std::string(row.key) == "installDeb") {  // the list is taken only when all pass
            EXPECT_EQ(std::vector<std::string>{"kept"}, u.m_installDebs) << what;
        }
    }
    SmallUpdate u;
    for (const char* text : {"[1,2]", "null", "{\"updateType\":"}) {
        WriteFile(kInfo, text);
        EXPECT_FALSE(u.ImportInfoFile(kInfo)) << text;
        EXPECT_EQ(3, u.GetErrno()) << text;
    }
    u.m_errno = 0;
    EXPECT_FALSE(u.ImportInfoFile("/no/such/info"));
    EXPECT_EQ(3, u.GetErrno());
    ClearSyslog();
    EXPECT_FALSE(u.ImportInfoFile(nullptr));
    EXPECT_TRUE(SyslogContains("smallupdate:", LOG_ERR) && SyslogContains(" bad parameter!"));
}

TEST_F(SmallUpdateInfoTest, DumpWritesOneRestartBranchAndReadsBack) {
    // jsoncpp writes the members sorted by name.
    const std::string common = R"("buildnumber":5644,"debDir":"/volume1/d","newSmallFixNumber":7,)";
    const std::string tail =
        R"("smallupdateDeb":"smallfix_6.1-5644-s7_all.deb","updateType":"smallupdate")";
    struct Row {
        bool reboot, restartAll;
        std::string expected;
    } rows[] = {
        {true, true, R"({"blNeedReboot":true,)" + common + tail + "}\n"},
        {false, true, R"({"blRestartAllService":true,)" + common + tail + "}\n"},
        {false, false,
         "{" + common + R"("pkgRestartList":[],)" + tail + R"(,"vyxServiceRestartList":[]})" +
             "\n"},
    };
    for (const Row& row : rows) {
        SmallUpdate u = Dumpable();
        u.m_blNeedReboot = row.reboot;
        u.m_blRestartAllService = row.restartAll;
        ASSERT_TRUE(u.DumpToInfoFile(false));
        EXPECT_EQ(row.expected, ReadFile(kInfo).value_or(""));
    }

    // Everything but the links survives a dump and an import; the flash flag comes back
    // from the flash package's name.
    SmallUpdate u = Dumpable();
    u.m_blConfigUpdate = u.m_blFlashUpdate = true;
    u.m_flashUpdateDeb = "flash_6.1-5644-s7_all.deb";
    u.m_flashUpdateDebLink = "http://127.0.0.1/f";
    u.m_installDebs = {"b_6.1-5644-s5_all.deb", "a_6.1-5644-s6_all.deb"};
    u.m_vyxServiceRestartList = {"S20samba.sh"};
    u.m_pkgRestartList = {"pkgA", "pkgB"};
    ASSERT_TRUE(u.DumpToInfoFile(false));
    SmallUpdate back;
    back.m_errno = 6;
    ASSERT_TRUE(back.ImportInfoFile(kInfo));
    EXPECT_TRUE(back.Equal(u));
    EXPECT_EQ(5644, back.m_buildNumber);
    EXPECT_EQ(0, back.GetErrno());

    // Reboot flag only, no installDeb: lists emptied; a flash flag set before is kept.
    WriteFile(kInfo, R"({"updateType":"smallupdate","buildnumber":5644,"newSmallFixNumber":3,)"
                     R"("debDir":"/d","smallupdateDeb":"s.deb","blNeedReboot":true})");
    ASSERT_TRUE(back.ImportInfoFile(kInfo));
    EXPECT_TRUE(back.m_installDebs.empty() && back.m_pkgRestartList.empty());
    EXPECT_TRUE(back.m_blNeedReboot && back.m_blFlashUpdate && !back.m_blConfigUpdate);

    // Passive: stored under debDir, naming the fixed folder; the marker names debDir.
    u.m_debDir = "/volume1/passive";
    WriteFile(u.m_debDir + "/keep", "");
    RemoveTree(kInfo);
    ASSERT_TRUE(u.DumpToInfoFile(true));
    EXPECT_FALSE(PathExists(kInfo));
    auto passive = Parse(ReadFile("/volume1/passive/autoupd@te.info").value_or(""));
    EXPECT_EQ("/@smallupd@te_deb", passive["debDir"].asString());
    EXPECT_EQ((std::map<std::string, std::string>{{"debDir", "/volume1/passive"}}),
              ReadKeyValueFile(kPassive));
}

// Optional members follow jsoncpp's conversions (a number reads as a boolean); values it
// cannot convert read as the default instead of throwing.
TEST_F(SmallUpdateInfoTest, ImportConvertsOptionalMembersLikeJsoncpp) {
    Json::Value v = Parse(kValidInfo);
    v["configUpdate"] = 1;
    v["blNeedReboot"] = 1;
    v["installDeb"] = Json::Value(Json::arrayValue);
    WriteFile(kInfo, Json::FastWriter().write(v));
    SmallUpdate u;
    ASSERT_TRUE(u.ImportInfoFile(kInfo));
    EXPECT_TRUE(u.m_blConfigUpdate && u.m_blNeedReboot);

    v["configUpdate"] = "yes";
    v["smallupdateDeb"] = Json::Value(Json::arrayValue);
    WriteFile(kInfo, Json::FastWriter().write(v));
    EXPECT_NO_THROW(EXPECT_TRUE(u.ImportInfoFile(kInfo)));
    EXPECT_FALSE(u.m_blConfigUpdate);
    EXPECT_EQ("", u.m_smallUpdateDeb);
}

TEST_F(SmallUpdateInfoTest, DumpFailuresLeaveNoInfoFiles) {
    struct Row {
        Change change;
        bool passive;
        std::string log;
    } rows[] = {
        {[](SmallUpdate& u) { u.m_smallUpdateDeb = u.m_smallUpdateDebLink = ""; }, false,
         "no flash and smallupdate or others debian file[0x"},
        {[](SmallUpdate& u) { u.m_smallUpdateDebLink = ""; }, false,
         "bad smallupdate debian [smallfix_6.1-5644-s7_all.deb][][0x"},
        {[](SmallUpdate& u) { u.m_flashUpdateDeb = "f.deb"; }, false,
         "bad flashupdate debian[f.deb][]"},
        {[](SmallUpdate& u) { u.m_debDir = "/no/dir"; }, true,
         "failed to dump json to file [/no/dir/autoupd@te.info]"},
        {[](SmallUpdate& u) { u.m_debDir = "/volume1/a\nb"; }, true,
         "failed to set debDri=/volume1/a"},
    };
    for (const Row& row : rows) {
        WriteFile(kInfo, "{}");
        WriteFile(kPassive, "debDir=\"/old\"\n");
        SmallUpdate u = Dumpable();
        row.change(u);
        ClearSyslog();
        EXPECT_FALSE(u.DumpToInfoFile(row.passive)) << row.log;
        EXPECT_FALSE(PathExists(kInfo) || PathExists(kPassive)) << row.log;
        EXPECT_TRUE(SyslogContains(row.log, LOG_ERR)) << row.log;
    }
}

TEST_F(SmallUpdateInfoTest, DownloadProgressAndFolders) {
    const std::string path = "/var/run/downloadVYX.status";
    ASSERT_EQ(1, SmallUpdate::UpdateDownloadProgress(0, SmallUpdate::DOWNLOAD_STATUS_INIT));
    ASSERT_EQ(1, SmallUpdate::UpdateDownloadProgress(42, SmallUpdate::DOWNLOAD_STATUS_DOWNLOADING));
    EXPECT_EQ((std::map<std::string, std::string>{
                  {"updateType", "smallupdate"}, {"percentage", "42"}, {"downloadStatus", "2"}}),
              ReadKeyValueFile(path));
    RemoveTree(path);
    Shell("mkdir -p " + path);  // a folder in the way: nothing can be written
    EXPECT_EQ(0, SmallUpdate::UpdateDownloadProgress(0, SmallUpdate::DOWNLOAD_STATUS_STOPPED));

    SmallUpdate u;
    std::string folder;
    MountVolume("/volume2", 209715200ULL);  // exactly the 200 MiB a download needs
    ASSERT_TRUE(u.GetSourceDir(folder, "@smallupd@te_deb"));
    EXPECT_EQ("/volume2/@smallupd@te_deb", folder);

    WriteFile("/volume2/d/a.deb", "x");
    EXPECT_TRUE(SmallUpdate::FilesExist("/volume2/d", std::vector<std::string>{"a.deb", ""}));
    EXPECT_TRUE(SmallUpdate::FilesExist("/volume2/d", std::vector<std::string>{}));
    ClearSyslog();
    EXPECT_FALSE(SmallUpdate::FilesExist("/volume2/d", {"a.deb", "c.deb", "e.deb"}));
    EXPECT_TRUE(SyslogContains("can't access [/volume2/d/c.deb]", LOG_ERR));
    EXPECT_FALSE(SyslogContains("e.deb"));  // stops at the first missing file
}

}  // namespace
