// The small-update record: Equal and the info files, also as a poller in another process sees them.
#include "engine_fixtures.h"
#include "update_cpputil.h"

namespace {

using namespace kytotest;
const char *kInfo = "/autoupd@te.info", *kPassive = "/passive_upd@te.info";
using Change = std::function<void(SmallUpdate&)>;
using SmallUpdateInfoTest = SandboxTest;

TEST_F(SmallUpdateInfoTest, EqualIgnoresIdentityLinksAndListOrder) {
    SmallUpdate base = DumpableRecord();
    base.m_installDebs = {"a", "b", "b"};
    const std::pair<Change, bool> rows[] = {
        {[](SmallUpdate& u) { u.m_unique = u.m_smallUpdateDebLink = u.m_flashUpdateDebLink = "x"; },
         true},
        {[](SmallUpdate& u) { u.m_buildNumber = u.m_errno = 1; }, true},
        {[](SmallUpdate& u) { std::swap(u.m_installDebs[0], u.m_installDebs[1]); }, true},
        {[](SmallUpdate& u) { u.m_installDebs[1] = "a"; }, false},  // same items, other counts
        {[](SmallUpdate& u) { u.m_installDebs.pop_back(); }, false},
        {[](SmallUpdate& u) { u.m_blNeedReboot = true; }, false},
        {[](SmallUpdate& u) { u.m_vyxServiceRestartList.push_back("S99sshd.sh"); }, false},
    };
    for (const auto& [change, equal] : rows) {
        SmallUpdate other = base;
        change(other);
        EXPECT_EQ(equal, base.Equal(other)) << &change - &rows[0].first;
    }
}

TEST_F(SmallUpdateInfoTest, ImportRejectsBadFiles) {
    // key, new value (nullptr removes the key), error, m_buildNumber afterwards (stored once
    // the build matched), expected error log text ("" for none).
    // clang-format off
    struct Row { const char *key, *json; int err, build; const char* log; } rows[] = {
        {"updateType", R"("vyxupdate")", 3, -1, ""}, {"buildnumber", R"("5644")", 3, -1, ""},
        {"newSmallFixNumber", "true", 3, -1, ""},
        {"smallupdateDeb", nullptr, 3, -1, ""},  // no package named
        {"pkgRestartList", nullptr, 3, -1, ""},  // restart behaviour not stated
        {"buildnumber", "5645", 4, -1, ""}, {"installDeb", "{}", 3, 5644, ""},
        {"installDeb", R"(["foo.deb"])", 3, 5644, "format error of debian [foo.deb]"},
        {"installDeb", R"(["f_6.1-5643-s1_all.deb"])", 3, 5644, "error of debian [f_6.1-5643"},
        {"vyxServiceRestartList", R"("S20samba.sh")", 3, 5644, ""},
        {"pkgRestartList", "[1]", 3, 5644, ""}};
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(std::string(row.key) + "=" + (row.json ? row.json : "(none)"));
        WriteSmallInfo({{row.key, row.json}});
        ClearSyslog();
        SmallUpdate u;
        u.m_installDebs = {"kept"};  // the list is taken only when every package passes
        EXPECT_FALSE(u.ImportInfoFile(kInfo));
        EXPECT_EQ(row.err, u.GetErrno());
        EXPECT_TRUE(*row.log == '\0' || SyslogContains(row.log, LOG_ERR)) << row.log;
        EXPECT_EQ(row.build, u.m_buildNumber);
        EXPECT_TRUE(std::string(row.key) != "installDeb" ||
                    u.m_installDebs == std::vector<std::string>{"kept"});
    }
    WriteFile(kInfo, "[1,2]");  // not an object (broken files: the JSON reader's test)
    SmallUpdate u;
    EXPECT_TRUE(!u.ImportInfoFile(kInfo) && u.GetErrno() == 3);
}

TEST_F(SmallUpdateInfoTest, DumpWritesOneRestartBranchAndReadsBack) {
    // jsoncpp writes the members sorted by name.
    const std::string common = R"("buildnumber":5644,"debDir":"/volume1/d","newSmallFixNumber":7,)";
    const std::string tail =
        R"("smallupdateDeb":"smallfix_6.1-5644-s7_all.deb","updateType":"smallupdate")";
    // clang-format off
    struct Row { bool reboot, restartAll; std::string expected; } rows[] = {
        {true, true, R"({"blNeedReboot":true,)" + common + tail + "}\n"},
        {false, true, R"({"blRestartAllService":true,)" + common + tail + "}\n"},
        {false, false, "{" + common + R"("pkgRestartList":[],)" + tail +
                       R"(,"vyxServiceRestartList":[]})" + "\n"}};
    // clang-format on
    for (const Row& row : rows) {
        SmallUpdate u = DumpableRecord();
        u.m_blNeedReboot = row.reboot;
        u.m_blRestartAllService = row.restartAll;
        ASSERT_TRUE(u.DumpToInfoFile(false));
        EXPECT_EQ(row.expected, ReadFile(kInfo).value_or(""));
    }

    // Everything but the links survives a dump and an import; the flash flag comes back
    // from the flash package's name.
    SmallUpdate u = DumpableRecord(), back;
    u.m_blConfigUpdate = u.m_blFlashUpdate = true;
    u.m_flashUpdateDeb = "flash_6.1-5644-s7_all.deb";
    u.m_flashUpdateDebLink = "http://127.0.0.1/f";  // a package to fetch needs its link
    u.m_installDebs = {"b_6.1-5644-s5_all.deb", "a_6.1-5644-s6_all.deb"};
    u.m_vyxServiceRestartList = {"S20samba.sh"};
    u.m_pkgRestartList = {"pkgA", "pkgB"};
    ASSERT_TRUE(u.DumpToInfoFile(false));
    back.m_errno = 6;
    ASSERT_TRUE(back.ImportInfoFile(kInfo));
    EXPECT_TRUE(back.Equal(u) && back.GetErrno() == 0);

    // No installDeb, no lists: emptied; a flash flag set before is kept.  Members convert as
    // jsoncpp does (1 reads as true, an array for a text as empty, nothing throws).
    // clang-format off
    WriteSmallInfo({{"blNeedReboot", "true"}, {"blRestartAllService", "1"},
                    {"smallupdateDeb", "[]"}, {"flashupdateDeb", "\"\""},
                    {"vyxServiceRestartList", nullptr}, {"pkgRestartList", nullptr}});
    // clang-format on
    EXPECT_NO_THROW(EXPECT_TRUE(back.ImportInfoFile(kInfo)));
    EXPECT_TRUE(back.m_installDebs.empty() && back.m_pkgRestartList.empty() &&
                back.m_smallUpdateDeb.empty());
    EXPECT_TRUE(back.m_blNeedReboot && back.m_blRestartAllService && back.m_blFlashUpdate &&
                !back.m_blConfigUpdate);
}

TEST_F(SmallUpdateInfoTest, DumpFailuresLeaveNoInfoFiles) {
    // clang-format off
    struct Row { Change change; bool passive; std::string log; } rows[] = {
        {[](SmallUpdate& u) { u.m_smallUpdateDeb = u.m_smallUpdateDebLink = ""; }, false,
         "no flash and smallupdate or others debian file[0x"},
        {[](SmallUpdate& u) { u.m_smallUpdateDebLink = ""; }, false,
         "bad smallupdate debian [smallfix_6.1-5644-s7_all.deb][][0x"},
        {[](SmallUpdate& u) { u.m_flashUpdateDeb = "f.deb"; }, false,
         "bad flashupdate debian[f.deb][]"},
        {[](SmallUpdate& u) { u.m_debDir = "/no/dir"; }, true,
         "failed to dump json to file [/no/dir/autoupd@te.info]"},
        {[](SmallUpdate& u) { u.m_debDir = "/volume1/a\nb"; }, true,
         "failed to set debDri=/volume1/a"}};
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(row.log);
        WriteFile(kInfo, "{}");
        WriteFile(kPassive, "debDir=\"/old\"\n");
        SmallUpdate u = DumpableRecord();
        row.change(u);
        EXPECT_FALSE(u.DumpToInfoFile(row.passive));
        EXPECT_FALSE(PathExists(kInfo) || PathExists(kPassive));
        EXPECT_TRUE(SyslogContains(row.log, LOG_ERR));
    }
}

// A record that cannot be written whole must not leave the earlier one for a poller or apply.
TEST_F(SmallUpdateInfoTest, FullVolumeLeavesNoEarlierRecord) {
    MountVolume("/volume2", 16 << 10);
    SmallUpdate u = DumpableRecord();
    u.m_debDir = "/volume2";
    ASSERT_TRUE(u.DumpToInfoFile(true));
    ASSERT_TRUE(PathExists("/volume2/autoupd@te.info"));
    ASSERT_EQ(0, Shell("dd if=/dev/zero of=/volume2/filler bs=4096 2>/dev/null; true"));
    u.m_newSmallFixNumber = 9;
    u.DumpToInfoFile(true);
    EXPECT_FALSE(PathExists("/volume2/autoupd@te.info"));
}

// A poller must always find a whole record while a download rewrites the info file.
TEST_F(SmallUpdateInfoTest, PollerInAnotherProcessNeverSeesAHalfWrittenInfoFile) {
    SmallUpdate shortRecord = DumpableRecord(), longRecord = DumpableRecord();
    for (int i = 0; i < 200; ++i)
        longRecord.m_pkgRestartList.push_back("package-with-a-long-name-" + std::to_string(i));
    ASSERT_TRUE(shortRecord.DumpToInfoFile(false));
    auto write = [&](int i) { return (i % 2 ? shortRecord : longRecord).DumpToInfoFile(false); };
    long reads = 0;  // the poller's own copy counts its reads
    auto check = [&] {
        // Every other read as the plain JSON reader, which deletes a broken file.
        SmallUpdate seen;
        Json::Value root;
        if (++reads % 2 == 0)
            return UpdateUtil::ParseJsonRootFromFile(kInfo, root) == 1 ? 0 : 1;
        return !seen.ImportInfoFile(kInfo)                         ? 1
               : seen.Equal(shortRecord) || seen.Equal(longRecord) ? 0
                                                                   : 2;
    };
    EXPECT_EQ(0, RaceReaderAgainstWriter(2000, write, check))
        << "1: unreadable or missing file, 2: mixed record";
    EXPECT_FALSE(AnyEntryStartsWith("/", "autoupd@te.info."));  // no temporary file left
}

}  // namespace
