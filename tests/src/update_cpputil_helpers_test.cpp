// UpdateUtil: JSON files and string lists, archives, folders, volumes, the kind of the last
// download and the user agent.
#include <sys/stat.h>
#include <unistd.h>

#include <climits>

#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "update_cpputil.h"

namespace {

using namespace kytotest;
using Strings = std::vector<std::string>;
using UpdateUtilTest = SandboxTest;

TEST_F(UpdateUtilTest, BrokenJsonFilesAreDeletedAndDumpsRewriteInPlace) {
    const char* path = "/tmp/info.json";
    Json::Value scratch;  // a failed parse may leave partial content
    // Truncated, nested deeper than the JSON reader allows.
    for (const std::string& content : Strings{"{\"a\": ", std::string(100000, '[')}) {
        SCOPED_TRACE(content.substr(0, 10));
        ClearSyslog();
        WriteFile(path, content);
        EXPECT_NO_THROW(EXPECT_EQ(UpdateUtil::ParseJsonRootFromFile(path, scratch), 0));
        EXPECT_FALSE(PathExists(path));
        EXPECT_TRUE(SyslogContains("update_cpputil:", LOG_ERR) && SyslogContains(" Parse failed"));
    }

    // Rewritten in place: a second name of the same file sees the new, shorter text.
    WriteFile(path, std::string(4096, 'x'));
    ASSERT_EQ(link(path, "/tmp/info.link"), 0);
    Json::Value root, back;
    root["updateType"] = "smallupdate";
    root["list"].append("a");
    ASSERT_EQ(UpdateUtil::DumpJsonRootToFile(path, root), 1);
    EXPECT_EQ(ReadFile("/tmp/info.link"), "{\"list\":[\"a\"],\"updateType\":\"smallupdate\"}\n");
    ASSERT_EQ(UpdateUtil::ParseJsonRootFromFile(path, back), 1);
    EXPECT_EQ(back, root);
    EXPECT_EQ(UpdateUtil::DumpJsonRootToFile("/tmp/no/dir/x.json", root), 0);
    EXPECT_TRUE(SyslogContains(" Failed to open /tmp/no/dir/x.json", LOG_ERR));
}

constexpr unsigned long k200MiB = 209715200UL;

TEST_F(UpdateUtilTest, UntarKeepsPermissionsAndFoldersAreCleaned) {
    WriteFile("/tmp/src/bin/updater", "#!/bin/sh\n", 0750);
    WriteFile("/tmp/src/etc/conf", "k=v\n", 0600);
    ASSERT_EQ(Shell("tar cf /tmp/pkg.tar -C /tmp/src bin etc && mkdir /tmp/out"), 0);
    EXPECT_EQ(UpdateUtil::UntarFile(std::string("/tmp/pkg.tar"), std::string("/tmp/out")), 1);
    EXPECT_EQ(ModeOf("/tmp/out/bin/updater"), 0750u);
    EXPECT_EQ(ModeOf("/tmp/out/etc/conf"), 0600u);
    EXPECT_EQ(UpdateUtil::UntarFile("/tmp/missing.tar", "/tmp/out"), 0);
    EXPECT_TRUE(SyslogContains(" failed to [tar xpf /tmp/missing.tar -C /tmp/out]", LOG_ERR));

    // Cleaning and removing folders that exist: the package folders of the download tests.
    EXPECT_EQ(UpdateUtil::CleanFolder("/tmp/fresh"), 1);  // a missing folder is created
    EXPECT_TRUE(IsDirectory("/tmp/fresh"));
    // Parents are not made; the message and the caller see the platform's last error as it
    // stood, not one the helper made up.
    KLIBCErrSetEx(0x0D07, "earlier.c", 42);
    EXPECT_EQ(UpdateUtil::CleanFolder("/tmp/noparent/sub"), 0);
    EXPECT_TRUE(SyslogContains(" Fail to mkdir: /tmp/noparent/sub, KytoErr =[0x0D07 earlier.c:42]",
                               LOG_ERR));
    EXPECT_EQ(0x0D07, KLIBCErrGet());
}

TEST_F(UpdateUtilTest, FirstWritableDataVolumeWithEnoughRoomWinsElseRoot) {
    std::string path = "unchanged";
    auto walk = [&](unsigned long need, bool rootToo) {
        const int rc = UpdateUtil::IsThereAvailVolPath(path, need, rootToo);
        return std::to_string(rc) + " " + path;
    };
    EXPECT_EQ(walk(ULONG_MAX, true), "0 unchanged");
    EXPECT_TRUE(SyslogContains(" sad.. / do not have sufficient size.", LOG_ERR));
    EXPECT_EQ(walk(1, true), "1 /");
    MountVolume("/volumeUSB1", 2 * k200MiB);  // not a data volume
    MountVolume("/volume1", 2 * k200MiB, /*readOnly=*/true);
    MountVolume("/volume2", k200MiB);
    MountVolume("/volume3", 2 * k200MiB);
    EXPECT_EQ(walk(k200MiB, false), "1 /volume2");  // exactly enough
    EXPECT_TRUE(SyslogContains(" sad.. /volume1 is not a writable volume.", LOG_ERR));
    ClearSyslog();
    EXPECT_EQ(walk(k200MiB + 1, false), "1 /volume3");
    EXPECT_TRUE(SyslogContains(" 209715200 < 209715201, check next volume.", LOG_ERR));
    EXPECT_EQ(walk(2 * k200MiB + 1, false), "0 /volume3");
}

TEST_F(UpdateUtilTest, DownloadedPatchTypeFromInfoFile) {
    const char *info = "/autoupd@te.info",
               *kNoMember = " Unrecognized download info, no [updateType]";
    const auto kNone = UpdateUtil::PATCH_TYPE_NONE, kSmall = UpdateUtil::PATCH_TYPE_SMALL;
    // content (nullptr: no file), type, info message (nullptr: none).
    // clang-format off
    struct Case { const char* content; UpdateUtil::PATCH_TYPE type; const char* infoMessage; }
    cases[] = {
        {nullptr, kNone, nullptr}, {"{\"updateType\":\"vyxupdate\"}", UpdateUtil::PATCH_TYPE_VYX, nullptr},
        {"{\"updateType\":\"vyxupdate \"}", kSmall, nullptr}, {"{}", kNone, nullptr},
        {"{\"patchPath\":\"/x\"}", kNone, kNoMember}, {"[1]", kNone, kNoMember},
        {"{\"updateType\":", kNone, " [/autoupd@te.info] does not contain correct format"}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(c.content ? c.content : "(no file)");
        ClearSyslog();
        WriteOrRemove(info, c.content);
        UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_SMALL;
        UpdateUtil::CheckDownloadedPatchType(type);
        EXPECT_EQ(type, c.type);
        EXPECT_EQ(SyslogContains(c.infoMessage ? c.infoMessage : "update_cpputil", LOG_INFO),
                  c.infoMessage != nullptr);
    }
    EXPECT_FALSE(PathExists(info));  // the broken one was deleted
}

// The agent itself is seen in the release check's requests; here: unreadable files.
TEST_F(UpdateUtilTest, UserAgentNeedsTheVersionFiles) {
    std::string agent = "unchanged";
    RemoveTree("/etc.defaults/VERSION");
    ASSERT_EQ(mkdir("/etc.defaults/VERSION", 0755), 0);
    EXPECT_EQ(UpdateUtil::GetUserAgent(agent), 0);
    EXPECT_TRUE(SyslogContains(" Get buildnumber Fail[0x0D03 ", LOG_ERR));
    EXPECT_EQ(agent, "unchanged");
}

}  // namespace
