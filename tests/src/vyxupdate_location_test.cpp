// Download location: free-space rules on tmpfs volumes of exact sizes, the download folder,
// output names and the clean-up of earlier results.
#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
constexpr unsigned long long kMiB = 1024ULL * 1024ULL, kMin = 200 * kMiB, kPage = 4096ULL;
const char* kConf = "/etc.defaults/kytoinfo.conf";
using VyxLocationTest = SandboxTest;

TEST_F(VyxLocationTest, FreeSpaceBoundaries) {
    // clang-format off
    struct Case { unsigned long long size; int ret; bool sufficient; } cases[] = {
        {kMin - kPage, 0, false}, {kMin, 1, false}, {500 * kMiB, 1, false},
        {500 * kMiB + 1, 1, true}};  // rounded up to a page: more than 500 MiB
    // clang-format on
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
    std::string folder, path;
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_EQ("//@autoupdate", folder);
    MountVolume("/volume3", kMin + kPage);
    ASSERT_TRUE(VyxUpdate::FindDownloadVolume(path));
    EXPECT_EQ("/volume3", path);
    UnmountVolume("/volume3");  // room for the files written below
    MountVolume("/volume3", 300 * kMiB);

    // Earlier results are cleared, earlier images kept; a stray file makes way for a 0700
    // folder; a folder that cannot be made fails.
    const char* state[] = {"/autoupd@te.info", "/var/run/downloadprogress",
                           "/var/run/download_vyx.pid"};
    for (const char* s : state)
        WriteFile(s, "x");
    WriteFile("/volume3/@autoupdate/kept.img", "old image");
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_EQ("/volume3/@autoupdate", folder);
    EXPECT_TRUE(PathExists("/volume3/@autoupdate/kept.img"));
    for (const char* s : state)
        EXPECT_FALSE(PathExists(s)) << s;
    RemoveTree(folder);
    WriteFile(folder, "a stray file");
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_TRUE(IsDirectory(folder));
    EXPECT_EQ(0700u, ModeOf(folder));
    RemoveTree(folder);
    ASSERT_EQ(0, symlink("/no/such/target", folder.c_str()));
    EXPECT_EQ(0, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_TRUE(SyslogContains("Fail to mkdir [/volume3/@autoupdate]. [0x"));

    // The image is named after the link's last part, query included.
    std::string out = "unchanged";
    EXPECT_FALSE(VyxUpdate::GetOutputFilePath("no-slash.img", folder, out));
    EXPECT_TRUE(SyslogContains("Wrong download link [no-slash.img]"));
    EXPECT_TRUE(VyxUpdate::GetOutputFilePath("http://h/a/b.img?sig=1", "/v/@autoupdate", out));
    EXPECT_EQ("/v/@autoupdate/b.img?sig=1", out);
}

TEST_F(VyxLocationTest, PlaceForSuppliedImage) {
    MountVolume("/volume1", 5 * 1024 * kMiB, true);
    MountVolume("/volume2", 100 * kMiB);
    MountVolume("/volume3", 5 * 1024 * kMiB);
    std::string path;
    bool sufficient = false;
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("/volume3", path);
    EXPECT_TRUE(sufficient);
    EXPECT_TRUE(SyslogContains("Got a volume /volume1.", LOG_ERR));
    UnmountVolume("/volume3");
    MountVolume("/volume3", 300 * kMiB);
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_FALSE(sufficient);
    UnmountVolume("/volume3");
    EXPECT_EQ(0, VyxUpdate::GetVolumePathForPatch(path, sufficient));

    // Other models: the root with a marker of the storage kind, or without internal disks
    // the first USB mount with room.
    SetKeyValue(kConf, "supportraid", "YES");
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("/", path);
    EXPECT_EQ("0\n", ReadFile("/.upgrade_vol").value_or(""));
    SetKeyValue(kConf, "supportraid", "no");
    SetKeyValue(kConf, "support_buildin_storage", "yes");
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("1\n", ReadFile("/.upgrade_vol").value_or(""));
    SetKeyValue(kConf, "support_buildin_storage", "no");
    SetKeyValue(kConf, "maxdisks", "0");
    MountVolume("/volumeUSB1", 100 * kMiB);
    MountVolume("/volumeUSB2", 300 * kMiB);
    ASSERT_EQ(1, VyxUpdate::GetVolumePathForPatch(path, sufficient));
    EXPECT_EQ("/volumeUSB2", path);
    EXPECT_FALSE(sufficient);
}

}  // namespace
