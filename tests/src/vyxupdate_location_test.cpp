// Download location: free-space rules on tmpfs volumes of exact sizes, the download folder,
// output names and the clean-up of earlier results.
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>
#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "vyxupdate.h"

namespace {

using kytotest::MountVolume;
using kytotest::PathExists;
using kytotest::SyslogContains;
using kytotest::UnmountVolume;

constexpr unsigned long long kMiB = 1024ULL * 1024ULL;
constexpr unsigned long long kMin = 209715200ULL;  // 200 MiB
constexpr unsigned long long kPage = 4096ULL;
const char* kConf = "/etc.defaults/kytoinfo.conf";

using VyxLocationTest = kytotest::SandboxTest;

TEST_F(VyxLocationTest, FreeSpaceBoundaries) {
    struct Case {
        unsigned long long size;
        int ret;
        bool sufficient;
    };
    const Case cases[] = {
        {kMin - kPage, 0, false},
        {kMin, 1, false},
        {500 * kMiB, 1, false},
        {500 * kMiB + 1, 1, true},  // rounded up to a page: more than 500 MiB
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.size);
        MountVolume("/volume1", c.size);
        bool sufficient = !c.sufficient;
        EXPECT_EQ(c.ret, VyxUpdate::IsPathSufficient("/volume1", sufficient));
        EXPECT_EQ(c.ret == 1 ? c.sufficient : !c.sufficient, sufficient);  // untouched on failure
        UnmountVolume("/volume1");
    }
    EXPECT_TRUE(SyslogContains("Theres is no sufficient free space on [/volume1]"));
    bool sufficient = false;
    EXPECT_EQ(0, VyxUpdate::IsPathSufficient(nullptr, sufficient));
    EXPECT_EQ(0x0D00, KLIBCErrGet());
    EXPECT_EQ(0, VyxUpdate::IsPathSufficient("/no/such/dir", sufficient));
    EXPECT_TRUE(SyslogContains("Fail to do statfs to [/no/such/dir]. reason: ["));
}

TEST_F(VyxLocationTest, DownloadFolderOnAVolumeWithMoreThanTheMinimumElseRoot) {
    MountVolume("/volume1", kMin);               // exactly the minimum: not offered
    MountVolume("/volume2", 1024 * kMiB, true);  // read-only: not offered
    std::string folder;
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_EQ("//@autoupdate", folder);

    std::string path;
    MountVolume("/volume3", kMin + kPage);
    ASSERT_TRUE(VyxUpdate::FindDownloadVolume(path));
    EXPECT_EQ("/volume3", path);
    UnmountVolume("/volume3");
    MountVolume("/volume3", 300 * kMiB);
    kytotest::WriteFile("/volume3/@autoupdate/kept.img", "old image");
    for (const char* state :
         {"/autoupd@te.info", "/var/run/downloadprogress", "/var/run/download_vyx.pid"}) {
        kytotest::WriteFile(state, "x");
    }
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_EQ("/volume3/@autoupdate", folder);
    EXPECT_TRUE(PathExists("/volume3/@autoupdate/kept.img"));
    EXPECT_FALSE(PathExists("/autoupd@te.info"));
    EXPECT_FALSE(PathExists("/var/run/downloadprogress"));
    EXPECT_FALSE(PathExists("/var/run/download_vyx.pid"));

    kytotest::RemoveTree("/volume3/@autoupdate");
    kytotest::WriteFile("/volume3/@autoupdate", "a stray file");  // removed, then created
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    struct stat st;
    ASSERT_EQ(0, stat(folder.c_str(), &st));
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(0700u, st.st_mode & 0777);

    kytotest::RemoveTree("/volume3/@autoupdate");
    ASSERT_EQ(0, symlink("/no/such/target", "/volume3/@autoupdate"));
    EXPECT_EQ(0, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_TRUE(SyslogContains("Fail to mkdir [/volume3/@autoupdate]. [0x"));

    // The image is named after the link's last part, query included.
    std::string out = "unchanged";
    EXPECT_FALSE(VyxUpdate::GetOutputFilePath("no-slash.img", folder, out));
    EXPECT_EQ("unchanged", out);
    EXPECT_TRUE(SyslogContains("Wrong download link [no-slash.img]"));
    EXPECT_TRUE(VyxUpdate::GetOutputFilePath("http://h/a/b.img?sig=1", "/v/@autoupdate", out));
    EXPECT_EQ("/v/@autoupdate/b.img?sig=1", out);
}

TEST_F(VyxLocationTest, PlaceForSuppliedImageOnDataVolumes) {
    MountVolume("/volume1", 5 * 1024 * kMiB, true);
    MountVolume("/volume2", 100 * kMiB);
    MountVolume("/volume3", 5 * 1024 * kMiB);
    std::string path;
    bool sufficient = false;
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("/volume3", path);
    EXPECT_TRUE(sufficient);
    EXPECT_TRUE(SyslogContains("Got a volume /volume1.", LOG_ERR));
    EXPECT_TRUE(SyslogContains("sad.. /volume1 is not a writable volume.", LOG_ERR));
    EXPECT_TRUE(SyslogContains("104857600 < 209715200, check next volume.", LOG_ERR));
    EXPECT_TRUE(SyslogContains("We get /volume3 to upgrade.", LOG_INFO));

    UnmountVolume("/volume3");
    MountVolume("/volume3", 300 * kMiB);
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_FALSE(sufficient);

    UnmountVolume("/volume3");
    EXPECT_EQ(0, VyxUpdate::GetVolumePathForPatch(path, sufficient));
}

TEST_F(VyxLocationTest, PlaceForSuppliedImageOnOtherModels) {
    std::string path;
    bool sufficient = false;
    kytotest::SetKeyValue(kConf, "supportraid", "YES");
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("/", path);
    EXPECT_EQ("0\n", kytotest::ReadFile("/.upgrade_vol").value_or(""));
    kytotest::SetKeyValue(kConf, "supportraid", "no");
    kytotest::SetKeyValue(kConf, "support_buildin_storage", "yes");
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("1\n", kytotest::ReadFile("/.upgrade_vol").value_or(""));

    // Without internal disks: the first USB mount with room.
    kytotest::SetKeyValue(kConf, "support_buildin_storage", "no");
    kytotest::SetKeyValue(kConf, "maxdisks", "0");
    MountVolume("/volume1", 5 * 1024 * kMiB);  // not a USB mount
    MountVolume("/volumeUSB1", 100 * kMiB);
    MountVolume("/volumeUSB2", 300 * kMiB);
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("/volumeUSB2", path);
    EXPECT_FALSE(sufficient);
}

}  // namespace
