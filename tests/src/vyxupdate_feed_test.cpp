// Release feed reading: line scanner, tag kinds, version rules and the choice of release.
#include <string.h>

#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "vyxupdate.h"

namespace {

using namespace kytotest;
const char* kFeed = "/var/run/autoupdate_tmp_file_RSS";

struct Model {
    std::string unique, link, sum;
};
const Model kMine{"demo_model", "http://h/img/mine.img", "aa11"};
const Model kOther{"other_model", "http://h/img/other.img", "bb22"};

// One feed item; extra (requirement elements) goes before the model elements.
std::string Item(const std::string& major, const std::string& minor, const std::string& build,
                 const std::vector<Model>& models, const std::string& extra = "") {
    std::string s = "  <item>\n    <title>VYX</title>\n    <MajorVer>" + major +
                    "</MajorVer>\n    <MinorVer>" + minor + "</MinorVer>\n    <BuildNum>" + build +
                    "</BuildNum>\n" + extra;
    for (const Model& m : models) {
        s += "    <model>\n      <mUnique>" + m.unique + "</mUnique>\n      <mLink>" + m.link +
             "</mLink>\n      <mCheckSum>" + m.sum + "</mCheckSum>\n    </model>\n";
    }
    return s + "  </item>\n";
}

class VyxFeedTest : public SandboxTest {
  protected:
    // Parses the items against the provisioned 5.2 build 5644 "demo_model".
    int Parse(const std::string& items, bool hotfixOnly = false) {
        WriteFile(
            kFeed, "<rss>\n<channel>\n<title>feed</title>\n\n" + items + "</channel>\n</rss>\n");
        memset(&current, 0, sizeof(current));
        EXPECT_EQ(1, VyxUpdate::GetVyxInfo(current));
        memset(&release, 0x55, sizeof(release));
        return VyxUpdate::ParseRssFile(hotfixOnly, current, found, release);
    }
    bool found = false;
    _tag_vyxinfo_ current;
    _tag_vyxinfo_ release;
};

TEST_F(VyxFeedTest, FirstMatchingItemWinsAndOtherModelsAreCleared) {
    ASSERT_EQ(1, Parse(Item("5", "2", "5700", {kOther, kMine}) + Item("5", "3", "9000", {kMine})));
    EXPECT_TRUE(found);
    EXPECT_EQ("5700 demo_model http://h/img/mine.img aa11",
              std::string(release.buildNum) + " " + release.unique + " " + release.link + " " +
                  release.checksum);

    unlink(kFeed);
    EXPECT_EQ(0, VyxUpdate::ParseRssFile(false, current, found, release));
    EXPECT_TRUE(found);  // untouched
    EXPECT_TRUE(SyslogContains("Fail to open [/var/run/autoupdate_tmp_file_RSS]"));
}

TEST_F(VyxFeedTest, ItemsThatAreNotWantedAreSkipped) {
    struct Case {
        const char* what;
        std::string items;
        bool hotfixOnly;
        const char* expectBuild;  // nullptr: record cleared
        bool expectFound = expectBuild != nullptr;
    };  // clang-format off
    const std::string reqNotMet = "<ReqMajorVer>6</ReqMajorVer>\n<ReqMinorVer>3</ReqMinorVer>\n";
    const Case cases[] = {
        {"equal version", Item("5", "2", "5644", {kMine}), false, nullptr},
        {"older version", Item("5", "1", "9999", {kMine}), false, nullptr},
        {"requirement fails all three tests",
         Item("5", "2", "5700", {kMine}, reqNotMet + "<ReqBuildNum>6000</ReqBuildNum>\n"), false,
         nullptr},
        {"requirement met by the build alone", Item("5", "2", "5700", {kMine}, reqNotMet), false,
         "5700"},
        {"hotfix only skips another minor",
         Item("5", "3", "100", {kMine}) + Item("5", "2", "5650", {kMine}), true, "5650"},
        {"hex build number is newer", Item("5", "2", "0x1700", {kMine}), false, "0x1700"},
        {"octal build number is older", Item("5", "2", "012000", {kMine}), false, nullptr},
        {"item closed inside the matched model",
         "<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n<BuildNum>5700</BuildNum>\n"
         "<model>\n<mUnique>demo_model</mUnique>\n</item>\n",
         false, nullptr, true},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        ASSERT_EQ(1, Parse(c.items, c.hotfixOnly));
        EXPECT_EQ(c.expectFound, found);
        EXPECT_STREQ(c.expectBuild ? c.expectBuild : "", release.buildNum);
        if (!c.expectBuild) {
            EXPECT_STREQ("", release.link);
        }
    }
}

TEST_F(VyxFeedTest, ScannerAcceptsOnlyWellFormedBoundedLinesAndKeepsTheKind) {
    struct Case {
        std::string line;
        bool ok;
        std::string name, value;
        _tag_rss_tag_type_ kind;  // starting from RSS_TAG_M_LINK
    };
    const std::string v4096(4096, 'v');
    const std::string n128(128, 'n');
    const Case cases[] = {
        {"   <MajorVer>7</MajorVer>  trailing", true, "MajorVer", "7", RSS_TAG_MAJOR_VER},
        {"<title>t</title>", true, "title", "t", RSS_TAG_TITLE},  // the first row wins
        {"<mCheckSum> spaced </mCheckSum>", true, "mCheckSum", " spaced ", RSS_TAG_M_CHECKSUM},
        {"<mLink>" + v4096 + "</mLink>", true, "mLink", v4096, RSS_TAG_M_LINK},
        {"<mLink>" + v4096 + "v</mLink>", false, "", "", RSS_TAG_M_LINK},
        {"<" + n128 + ">x</" + n128 + ">", true, n128, "x", RSS_TAG_M_LINK},  // unknown name
        {"<" + n128 + "n>x</" + n128 + "n>", false, "", "", RSS_TAG_M_LINK},
        {"<BuildNum></BuildNum>", false, "", "", RSS_TAG_M_LINK},
        {"<MajorVer>5</MinorVer>", false, "", "", RSS_TAG_M_LINK},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.line.substr(0, 40));
        std::string name, value;
        _tag_rss_tag_type_ kind = RSS_TAG_M_LINK;
        EXPECT_EQ(c.ok, VyxUpdate::ParseTagValue(c.line, name, value, kind));
        EXPECT_EQ(c.name, name);
        EXPECT_EQ(c.value, value);
        EXPECT_EQ(c.kind, kind);
    }
    EXPECT_TRUE(
        SyslogContains("Left tag [MajorVer] and right tag [MinorVer] don't match"));
    EXPECT_EQ(0x0D00, KLIBCErrGet());
    // The longest value the scanner accepts still fits the record's field.
    _tag_vyxinfo_ info;
    VyxUpdate::SetVyxInfo(RSS_TAG_M_LINK, v4096.c_str(), info);
    EXPECT_EQ(4095u, strlen(info.link));
}

// An info object of any shape is judged without throwing and without gaining members.
TEST_F(VyxFeedTest, DownloadedInfoOfAnyShapeIsJudgedWithoutThrowing) {
    for (const char* text : {R"(["5","2","9999"])", "42", R"({"majorversion":"5"})"}) {
        SCOPED_TRACE(text);
        Json::Value info;
        ASSERT_TRUE(Json::Reader().parse(text, info));
        const Json::Value before = info;
        bool isNewer = false;
        EXPECT_TRUE(VyxUpdate::CheckPatchAndUpdateType(isNewer, info));
        EXPECT_FALSE(isNewer);
        EXPECT_EQ(before, info);
    }
}

}  // namespace
