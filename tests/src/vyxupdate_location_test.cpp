// The download location: free-space rules on tmpfs volumes of exact sizes, the download
// folder, output names, the clean-up of earlier results, the place for a supplied image.
#include "engine_fixtures.h"

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
}

// Which volumes have more than the minimum: the platform's volume test.
TEST_F(VyxLocationTest, DownloadFolderOnAVolumeWithMoreThanTheMinimumElseRoot) {
    std::string folder;
    ASSERT_EQ(1, VyxUpdate::PrepareDownloadEnv(folder));
    EXPECT_EQ("//@autoupdate", folder);
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
    EXPECT_TRUE(IsDirectory(folder) && ModeOf(folder) == 0700u);
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

// The data-volume walk is the engines' shared one; here: the comfortable-space flag and the
// other models' places (the root with a marker of the storage kind, or the first USB mount
// with room when there are no internal disks).
TEST_F(VyxLocationTest, PlaceForSuppliedImage) {
    EXPECT_EQ("0 ", SuppliedImagePlace());
    MountVolume("/volume2", 300 * kMiB);
    MountVolume("/volume3", 5 * 1024 * kMiB);
    EXPECT_EQ("1 /volume2", SuppliedImagePlace());
    UnmountVolume("/volume2");
    EXPECT_EQ("1 /volume3 sufficient", SuppliedImagePlace());
    for (const auto& [storage, marker] :
         {std::pair{"supportraid", "0\n"}, {"support_buildin_storage", "1\n"}}) {
        SetKeyValue(kConf, storage, "YES");
        const std::string root = SuppliedImagePlace().substr(0, 3);  // before the marker is read
        EXPECT_EQ("1 / " + std::string(marker), root + " " + *ReadFile("/.upgrade_vol"));
        SetKeyValue(kConf, storage, "no");
    }
    SetKeyValue(kConf, "maxdisks", "0");
    MountVolume("/volumeUSB1", 100 * kMiB);
    MountVolume("/volumeUSB2", 300 * kMiB);
    EXPECT_EQ("1 /volumeUSB2", SuppliedImagePlace());
}

}  // namespace
