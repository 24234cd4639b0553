// Finding a small update: the patch list from the loopback server, or a local patch archive.
#include "engine_fixtures.h"

namespace {

using namespace kytotest;
const char *kVersion = "/etc.defaults/VERSION", *kApplyStatus = "/var/run/applySmallUpd@te.status",
           *kInfo = "/autoupd@te.info";
const auto Deb = [](const std::string& name, int fix) { return SmallFixDebName(name, fix); };

using SmallUpdateLookupTest = PatchListTest;

TEST_F(SmallUpdateLookupTest, NewerEntriesOfThisBuildAndModelFillTheRecord) {
    EXPECT_EQ("", SmallUpdate().GetFullVersion());
    SetKeyValue(kVersion, "smallfixnumber", "3");
    WriteFile(kApplyStatus, "percentage=\"100\"\nstage=\"5\"\nErrMsg=\"\"\n");
    server->PutFile(UpdateServer::PatchListPath(5644, "demo_model"),
                    PatchListJson(5644, "demo_model", RealisticList()));

    SmallUpdate u;
    u.m_errno = 99;
    ASSERT_TRUE(u.HaveNewFix());
    EXPECT_EQ(0, u.GetErrno());
    EXPECT_TRUE(u.m_newSmallFixNumber == 5 && u.m_buildNumber == 5644);
    EXPECT_EQ(Deb("smallfix", 5), u.m_smallUpdateDeb);
    EXPECT_EQ(server->Url("/debs/" + Deb("smallfix", 5)), u.m_smallUpdateDebLink);
    EXPECT_EQ(Deb("flash", 5), u.m_flashUpdateDeb);
    EXPECT_TRUE(u.m_blFlashUpdate && u.m_blConfigUpdate);
    EXPECT_FALSE(u.m_blNeedReboot || u.m_blRestartAllService) << "the reboot of fix 1 is older";
    EXPECT_EQ((std::vector<std::string>{Deb("fix5", 5), Deb("fix4", 4)}), u.m_installDebs);
    EXPECT_EQ((std::vector<std::string>{"samba", "sshd"}), u.m_vyxServiceRestartList);
    EXPECT_EQ((std::vector<std::string>{"web"}), u.m_pkgRestartList);
    EXPECT_EQ("VYX 5.2-5644 update 5", u.GetFullVersion());
    EXPECT_FALSE(PathExists(kApplyStatus)) << "an old apply result must not show";
}

TEST_F(SmallUpdateLookupTest, RefusedListsAndServerFailures) {
    enum Serve { kList, kNoList, kError500, kTruncated };
    PatchEntry wrongFix = Entry(4);
    wrongFix.proj[0].second = server->Url("/debs/" + Deb("smallfix", 3));
    const std::string url500 = server->Url(UpdateServer::PatchListPath(5644, "m500"));
    // Served document (for kList and kTruncated), installed "smallfixnumber", error code (99:
    // left unchanged), expected smallupdate or custombugfix message ("" for none).
    // clang-format off
    struct Row { const char* model; Serve serve; std::string list; const char* fixed; int err;
                 std::string log; };
    const Row rows[] = {
        {"build", kList, PatchListJson(5600, "build", {Entry(5)}), "3", 5,
         "verison not match, original buildnumber[5644], json buildnumber[5600]"},
        {"model", kList, PatchListJson(5644, "other_model", {Entry(5)}), "3", 7,
         "unique not match [model] unique in json[other_model]"},
        {"down", kList, PatchListJson(5644, "down", RealisticList()), "6", 6,
         "small fix can't downgrade, org_version[6], new_version[5]"},
        {"none", kNoList, "", "3", 99, ""},
        {"m500", kError500, "", "3", 1, "Error server " + url500},
        {"merge", kList, PatchListJson(5644, "merge", {wrongFix}), "3", 99,
         "proj [smallupdate] debversion [3] not match smallfixverion[4]"},
        {"lack", kList, "{\"smallupdate\":[],\"vyxversion\":5644}", "3", 99,
         "lack of smallUpdate/vyxversion/unique in Json"},
        {"array", kList, R"({"smallupdate":{},"vyxversion":5644,"unique":"array"})", "3", 99,
         "data[smallupdate] is not array"},
        {"html", kList, "<html>busy</html>", "3", 99,
         "failed to parse json file /tmp/smallupd@te_html.json"},
        {"cut", kTruncated, PatchListJson(5644, "cut", RealisticList()), "3", 99,
         "failed to exec curl command"},
    };
    // clang-format on
    for (const Row& row : rows) {
        const std::string path = UpdateServer::PatchListPath(5644, row.model);
        if (row.serve != kNoList)
            server->PutFile(path, row.list);
        if (row.serve == kError500)
            server->FailPath(path, 500);
        if (row.serve == kTruncated)
            server->TruncatePath(path, 10);
        SetKeyValue(kVersion, "smallfixnumber", row.fixed);
        ClearSyslog();
        SmallUpdate u(row.model);
        u.m_errno = 99;
        EXPECT_FALSE(u.Download(true)) << row.model;  // an empty record looks the list up first
        EXPECT_EQ(row.err, u.GetErrno()) << row.model;
        EXPECT_TRUE(row.log.empty() ? !SyslogContains("smallupdate:")
                                    : SyslogContains(row.log, LOG_ERR))
            << row.model << ": " << row.log;
        EXPECT_EQ(1u, server->RequestsFor(path).size()) << row.model;
        EXPECT_FALSE(PathExists("/tmp/smallupd@te_" + std::string(row.model) + ".json"));
    }
}

// A patch archive supplied by a person: the list and the packages in one tar file.
TEST_F(SmallUpdateLookupTest, LocalPatchArchiveIsImportedWithoutTheServer) {
    WriteFile("/tmp/patch/VYX-Security.json",
              PatchListJson(5644, "demo_model", {Entry(1), Entry(2, "\"reboot\"")}));
    for (const std::string& name : {Deb("smallfix", 2), Deb("fix1", 1), Deb("fix2", 2)})
        WriteFile("/tmp/patch/" + name, "package " + name);
    ASSERT_EQ(0, Shell("tar cf /tmp/patch.tar -C /tmp/patch . && mkdir -p /tmp/deep/sub && "
                       "cp /tmp/patch/VYX-Security.json /tmp/deep/sub && "
                       "tar cf /tmp/deep.tar -C /tmp deep && rm /tmp/patch/VYX-Security.json && "
                       "tar cf /tmp/nolist.tar -C /tmp/patch ."));
    // The list may lie anywhere in the archive; the name is matched as text.
    for (const char* archive : {"/tmp/patch.tar", "/tmp/deep.tar", "/tmp/nolist.tar"}) {
        bool isSmall = false;
        EXPECT_TRUE(SmallUpdate::CheckPatchIsSmallUpdate(archive, isSmall));
        EXPECT_EQ(std::string(archive) != "/tmp/nolist.tar", isSmall) << archive;
    }

    // Passive: the info file (naming the fixed folder) in the package folder, which the marker
    // names.
    SmallUpdate passive;
    ASSERT_TRUE(passive.ImportSmallPatch("/tmp/patch.tar", "/passive", true));
    EXPECT_EQ(
        "/@smallupd@te_deb",
        ParseJson(ReadFile("/volume1//passive/autoupd@te.info").value_or(""))["debDir"].asString());
    EXPECT_EQ("/volume1//passive", ReadKeyValueFile("/passive_upd@te.info")["debDir"]);
    EXPECT_FALSE(PathExists(kInfo));

    ASSERT_TRUE(SmallUpdate().ImportSmallPatch("/tmp/patch.tar"));
    EXPECT_TRUE(server->Requests().empty());

    SetKeyValue(kVersion, "smallfixnumber", "2");
    for (const auto& [archive, log] : std::vector<std::pair<std::string, std::string>>{
             {"/tmp/nolist.tar", "failed to set update list"},
             {"/tmp/absent.tar", "[/tmp/absent.tar] does not exist!"},
             {"/tmp/patch.tar", "check small fix version[2] error."}}) {
        EXPECT_FALSE(SmallUpdate().ImportSmallPatch(archive));
        EXPECT_TRUE(SyslogContains(log, LOG_ERR)) << log;
    }
}

}  // namespace
