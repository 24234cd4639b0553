// Release feed reading (line scanner, tag kinds, version rules, the choice of release) and
// the download location (free-space rules on tmpfs volumes of exact sizes, the download
// folder, output names, the clean-up of earlier results).
#include "engine_fixtures.h"

namespace {

using namespace kytotest;
constexpr unsigned long long kMiB = 1024ULL * 1024ULL, kMin = 200 * kMiB, kPage = 4096ULL;
const char* kConf = "/etc.defaults/kytoinfo.conf";

const FeedModel kMine{"demo_model", "http://h/img/mine.img", "aa11"};
const FeedModel kOther{"other_model", "http://h/img/other.img", "bb22"};

using VyxFeedTest = ReleaseFeedTest;

TEST_F(VyxFeedTest, FirstMatchingItemWinsAndOtherModelsAreCleared) {
    ASSERT_EQ(1, Parse(FeedItem("5", "2", "5700", {kOther, kMine}) +
                       FeedItem("5", "3", "9000", {kMine})));
    EXPECT_TRUE(found);
    EXPECT_EQ("5700 demo_model http://h/img/mine.img aa11",
              std::string(release.buildNum) + " " + release.unique + " " + release.link + " " +
                  release.checksum);
}

TEST_F(VyxFeedTest, ItemsThatAreNotWantedAreSkipped) {
    const std::string reqNotMet = "<ReqMajorVer>6</ReqMajorVer>\n<ReqMinorVer>3</ReqMinorVer>\n";
    // items, hot fixes only, build found (nullptr: record cleared), found.
    // clang-format off
    struct Case { std::string items; bool hotfixOnly; const char* build; bool found; } cases[] = {
        {FeedItem("5", "2", "5644", {kMine}), false, nullptr, false},  // equal version
        {FeedItem("5", "1", "9999", {kMine}), false, nullptr, false},  // older version
        {FeedItem("5", "2", "5700", {kMine}, reqNotMet + "<ReqBuildNum>6000</ReqBuildNum>\n"),
         false, nullptr, false},  // the requirement fails all three tests
        {FeedItem("5", "2", "5700", {kMine}, reqNotMet), false, "5700", true},  // met by the build
        {FeedItem("5", "3", "100", {kMine}) + FeedItem("5", "2", "5650", {kMine}), true, "5650",
         true},  // hot fixes only: another minor is skipped
        {FeedItem("5", "2", "0x1700", {kMine}), false, "0x1700", true},  // hex build is newer
        {FeedItem("5", "2", "012000", {kMine}), false, nullptr, false},  // octal build is older
        {"<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n<BuildNum>5700</BuildNum>\n"
         "<model>\n<mUnique>demo_model</mUnique>\n</item>\n", false, nullptr, true}};  // closed
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(c.items);
        ASSERT_EQ(1, Parse(c.items, c.hotfixOnly));
        EXPECT_EQ(std::to_string(c.found) + " " +
                      (c.build ? c.build + std::string(" http://h/img/mine.img") : " "),
                  std::to_string(found) + " " + release.buildNum + " " + release.link);
    }
}

TEST_F(VyxFeedTest, ScannerAcceptsOnlyWellFormedBoundedLinesAndKeepsTheKind) {
    const std::string v4096(4096, 'v'), n128(128, 'n');
    // line, accepted, name, value, kind (starting from RSS_TAG_M_LINK).
    // clang-format off
    struct Case { std::string line; bool ok; std::string name, value; _tag_rss_tag_type_ kind; }
    const cases[] = {
        {"   <MajorVer>7</MajorVer>  trailing", true, "MajorVer", "7", RSS_TAG_MAJOR_VER},
        {"<title>t</title>", true, "title", "t", RSS_TAG_TITLE},  // the first row wins
        {"<mCheckSum> spaced </mCheckSum>", true, "mCheckSum", " spaced ", RSS_TAG_M_CHECKSUM},
        {"<mLink>" + v4096 + "</mLink>", true, "mLink", v4096, RSS_TAG_M_LINK},
        {"<mLink>" + v4096 + "v</mLink>", false, "", "", RSS_TAG_M_LINK},
        {"<" + n128 + ">x</" + n128 + ">", true, n128, "x", RSS_TAG_M_LINK},  // unknown name
        {"<" + n128 + "n>x</" + n128 + "n>", false, "", "", RSS_TAG_M_LINK},
        {"<BuildNum></BuildNum>", false, "", "", RSS_TAG_M_LINK},
        {"<MajorVer>5</MinorVer>", false, "", "", RSS_TAG_M_LINK}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(c.line.substr(0, 40));
        std::string name, value;
        _tag_rss_tag_type_ kind = RSS_TAG_M_LINK;
        EXPECT_EQ(c.ok, VyxUpdate::ParseTagValue(c.line, name, value, kind));
        EXPECT_EQ(c.name + "=" + c.value, name + "=" + value);
        EXPECT_EQ(c.kind, kind);
    }
    EXPECT_TRUE(SyslogContains("Left tag [MajorVer] and right tag [MinorVer] don't match"));
}

// An info object of any shape is judged without throwing and without gaining members.
TEST_F(VyxFeedTest, DownloadedInfoOfAnyShapeIsJudgedWithoutThrowing) {
    for (const char* text :
         {R"(["5","2","9999"])", R"({"majorversion":"5"})", R"("x")", "7", "true",
          R"({"majorversion":{},"minorversion":[],"buildnumber":true})"}) {
        SCOPED_TRACE(text);
        Json::Value info;
        ASSERT_TRUE(Json::Reader().parse(text, info));
        const Json::Value before = info;
        bool isNewer = false;
        EXPECT_TRUE(VyxUpdate::CheckPatchAndUpdateType(isNewer, info) && !isNewer);
        EXPECT_EQ(before, info);
    }
}

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
