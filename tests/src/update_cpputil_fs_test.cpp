// UpdateUtil: archives, folders, volumes, the kind of the last download and the user agent.
#include <sys/stat.h>
#include <syslog.h>

#include <climits>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "update_cpputil.h"

namespace {

using kytotest::IsDirectory;
using kytotest::ListDir;
using kytotest::MountVolume;
using kytotest::PathExists;
using kytotest::ReadFile;
using kytotest::SyslogContains;
using kytotest::WriteFile;

constexpr unsigned long k200MiB = 209715200UL;

class UpdateUtilFsTest : public kytotest::SandboxTest {};

mode_t ModeOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(stat(path.c_str(), &st), 0) << path;
    return st.st_mode & 07777;
}

TEST_F(UpdateUtilFsTest, UntarUnpacksWithPermissions) {
    WriteFile("/tmp/src/bin/updater", "#!/bin/sh\n", 0750);
    WriteFile("/tmp/src/etc/conf", "k=v\n", 0600);
    ASSERT_EQ(kytotest::Shell("/bin/tar cf /tmp/pkg.tar -C /tmp/src bin etc"), 0);
    ASSERT_EQ(kytotest::Shell("mkdir /tmp/out"), 0);

    EXPECT_EQ(UpdateUtil::UntarFile(std::string("/tmp/pkg.tar"), std::string("/tmp/out")), 1);
    EXPECT_EQ(ReadFile("/tmp/out/bin/updater"), "#!/bin/sh\n");
    EXPECT_EQ(ModeOf("/tmp/out/bin/updater"), 0750u);
    EXPECT_EQ(ModeOf("/tmp/out/etc/conf"), 0600u);

    EXPECT_EQ(UpdateUtil::UntarFile("/tmp/missing.tar", "/tmp/out"), 0);
    EXPECT_TRUE(SyslogContains(" failed to [tar xpf /tmp/missing.tar -C /tmp/out]", LOG_ERR));
}

TEST_F(UpdateUtilFsTest, RemoveAndCleanFolders) {
    WriteFile("/tmp/work/a/b/c.txt", "x");
    EXPECT_EQ(UpdateUtil::CleanFolder(std::string("/tmp/work")), 1);
    EXPECT_TRUE(IsDirectory("/tmp/work"));
    EXPECT_TRUE(ListDir("/tmp/work").empty());
    EXPECT_EQ(ModeOf("/tmp/work") & 0755, 0755u);

    EXPECT_EQ(UpdateUtil::CleanFolder("/tmp/fresh"), 1);  // missing folder is created
    EXPECT_TRUE(IsDirectory("/tmp/fresh"));

    EXPECT_EQ(UpdateUtil::RemoveFolder("/tmp/work"), 1);
    EXPECT_FALSE(PathExists("/tmp/work"));
    EXPECT_EQ(UpdateUtil::RemoveFolder(std::string("/tmp/work")), 1);  // already gone
}

TEST_F(UpdateUtilFsTest, CleanFolderDoesNotCreateParents) {
    EXPECT_EQ(UpdateUtil::CleanFolder("/tmp/noparent/sub"), 0);
    EXPECT_FALSE(PathExists("/tmp/noparent"));
    EXPECT_TRUE(SyslogContains(" Fail to mkdir: /tmp/noparent/sub, KytoErr =[0x0D09 ", LOG_ERR));
}

TEST_F(UpdateUtilFsTest, VolumeWithExactlyEnoughRoomIsChosen) {
    MountVolume("/volume1", k200MiB);
    std::string path = "unchanged";
    EXPECT_EQ(UpdateUtil::IsThereAvailVolPath(path, k200MiB + 1, false), 0);
    EXPECT_EQ(path, "unchanged");
    EXPECT_TRUE(SyslogContains(" 209715200 < 209715201, check next volume.", LOG_ERR));

    EXPECT_EQ(UpdateUtil::IsThereAvailVolPath(path, k200MiB, false), 1);
    EXPECT_EQ(path, "/volume1");
    EXPECT_TRUE(SyslogContains(" We get /volume1 to upgrade.", LOG_INFO));
}

TEST_F(UpdateUtilFsTest, FirstWritableDataVolumeWithRoomWins) {
    MountVolume("/volumeUSB1", k200MiB);  // not a data volume
    MountVolume("/volume1", k200MiB, /*readOnly=*/true);
    MountVolume("/volume2", 1048576);
    MountVolume("/volume3", k200MiB);
    MountVolume("/volume4", 2 * k200MiB);

    std::string path;
    EXPECT_EQ(UpdateUtil::IsThereAvailVolPath(path, 100 * 1048576UL, false), 1);
    EXPECT_EQ(path, "/volume3");
    EXPECT_TRUE(SyslogContains(" sad.. /volume1 is not a writable volume.", LOG_ERR));
    EXPECT_TRUE(SyslogContains(" 1048576 < 104857600, check next volume.", LOG_ERR));
    EXPECT_FALSE(SyslogContains("volumeUSB1"));
    EXPECT_FALSE(SyslogContains("volume4"));
}

TEST_F(UpdateUtilFsTest, RootIsTheLastResortWhenAllowed) {
    std::string path = "unchanged";
    EXPECT_EQ(UpdateUtil::IsThereAvailVolPath(path, 1, false), 0);
    EXPECT_EQ(path, "unchanged");
    for (const std::string& m : kytotest::SyslogMessages())
        EXPECT_EQ(m.find("update_cpputil"), std::string::npos) << m;

    EXPECT_EQ(UpdateUtil::IsThereAvailVolPath(path, ULONG_MAX, true), 0);
    EXPECT_EQ(path, "unchanged");
    EXPECT_TRUE(SyslogContains(" sad.. / do not have sufficient size.", LOG_ERR));

    MountVolume("/volume1", 1048576);
    EXPECT_EQ(UpdateUtil::IsThereAvailVolPath(path, 2 * 1048576, true), 1);
    EXPECT_EQ(path, "/");
    EXPECT_TRUE(SyslogContains(" We get / to upgrade.", LOG_INFO));
}

TEST_F(UpdateUtilFsTest, DownloadedPatchTypeFromInfoFile) {
    const char* info = "/autoupd@te.info";
    struct Case {
        const char* content;  // nullptr: no file
        UpdateUtil::PATCH_TYPE type;
        const char* infoMessage;
    } cases[] = {
        {nullptr, UpdateUtil::PATCH_TYPE_NONE, nullptr},
        {"{\"updateType\":\"vyxupdate\"}", UpdateUtil::PATCH_TYPE_VYX, nullptr},
        {"{\"updateType\":\"smallupdate\"}", UpdateUtil::PATCH_TYPE_SMALL, nullptr},
        {"{\"updateType\":\"vyxupdate \"}", UpdateUtil::PATCH_TYPE_SMALL, nullptr},
        {"{}", UpdateUtil::PATCH_TYPE_NONE, nullptr},
        {"{\"patchPath\":\"/x\"}", UpdateUtil::PATCH_TYPE_NONE,
         " Unrecognized download info, no [updateType]"},
        {"[1]", UpdateUtil::PATCH_TYPE_NONE, " Unrecognized download info, no [updateType]"},
        {"{\"updateType\":", UpdateUtil::PATCH_TYPE_NONE,
         " [/autoupd@te.info] does not contain correct format"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.content ? c.content : "(no file)");
        kytotest::ClearSyslog();
        kytotest::RemoveTree(info);
        if (c.content)
            WriteFile(info, c.content);
        UpdateUtil::PATCH_TYPE type = UpdateUtil::PATCH_TYPE_SMALL;
        UpdateUtil::CheckDownloadedPatchType(type);
        EXPECT_EQ(type, c.type);
        if (c.infoMessage) {
            EXPECT_TRUE(SyslogContains(c.infoMessage, LOG_INFO));
        } else {
            EXPECT_TRUE(kytotest::SyslogMessages(LOG_INFO).empty());
        }
    }
    EXPECT_FALSE(PathExists(info));  // the broken one was deleted
}

TEST_F(UpdateUtilFsTest, UserAgentFromVersionFiles) {
    std::string agent;
    ASSERT_EQ(UpdateUtil::GetUserAgent(agent), 1);
    EXPECT_EQ(agent, "demo_model VYX5.2 5644 (autoupgrade)");

    kytotest::SetKeyValue("/etc.defaults/VERSION", "minorversion", std::nullopt);
    kytotest::SetKeyValue("/etc.defaults/kytoinfo.conf", "unique", std::string(200, 'u'));
    ASSERT_EQ(UpdateUtil::GetUserAgent(agent), 1);
    EXPECT_EQ(agent, std::string(127, 'u') + " VYX5. 5644 (autoupgrade)");
}

TEST_F(UpdateUtilFsTest, UnreadableFilesFailTheUserAgent) {
    std::string agent = "unchanged";
    kytotest::RemoveTree("/etc.defaults/VERSION");
    ASSERT_EQ(mkdir("/etc.defaults/VERSION", 0755), 0);
    EXPECT_EQ(UpdateUtil::GetUserAgent(agent), 0);
    EXPECT_EQ(agent, "unchanged");
    EXPECT_TRUE(SyslogContains(" Get buildnumber Fail[0x0D0", LOG_ERR));

    kytotest::RemoveTree("/etc.defaults/kytoinfo.conf");
    EXPECT_EQ(UpdateUtil::GetUserAgent(agent), 0);
    EXPECT_TRUE(SyslogContains(" Get unique Fail[0x0D02 ", LOG_ERR));
}

}  // namespace
