// Release feed reading: the line scanner, tag kinds, the version rules and the choice of
// release for this device.
#include "engine_fixtures.h"

namespace {

using namespace kytotest;

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
        {FeedItem("5", "2", "5700", {kMine}, "<ReqMajorVer>5</ReqMajorVer>\n<ReqMinorVer>3</ReqMinorVer>\n"
                                            "<ReqBuildNum>6000</ReqBuildNum>\n"),
         false, "5700", true},  // met by the major alone: the running one equals it
        {FeedItem("5", "2", "5700", {{"demo_mode", kMine.link, kMine.sum}}), false, nullptr,
         false},  // an identity that is only a prefix of the device's is another model's
        {FeedItem("5", "2", "5700", {{"demo_model2", kMine.link, kMine.sum}}), false, nullptr,
         false},  // and so is one that the device's is a prefix of
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

}  // namespace
