// Release feed reading: line scanner, version rules and the choice of the release.
#include <string.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <kytoplatform/klibc.h>

#include "sandbox.h"
#include "vyxupdate.h"

namespace {

const char* kFeed = "/var/run/autoupdate_tmp_file_RSS";

struct Model {
    std::string unique, link, sum;
};

// One feed item; extra holds requirement elements or anything else placed before models.
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

std::string Feed(const std::string& items) {
    return "<rss>\n<channel>\n<title>feed</title>\n\n" + items + "</channel>\n</rss>\n";
}

_tag_vyxinfo_ Current() {
    _tag_vyxinfo_ cur;
    memset(&cur, 0, sizeof(cur));
    EXPECT_EQ(1, VyxUpdate::GetVyxInfo(cur));
    return cur;
}

class VyxFeedTest : public kytotest::SandboxTest {
  protected:
    // Parses feed text against the provisioned 5.2 build 5644 "demo_model".
    int Parse(const std::string& feed, bool hotfixOnly = false) {
        kytotest::WriteFile(kFeed, feed);
        memset(&release, 0x55, sizeof(release));
        return VyxUpdate::ParseRssFile(hotfixOnly, Current(), found, release);
    }
    bool found = false;
    _tag_vyxinfo_ release;
    const Model mine{"demo_model", "http://h/img/mine.img", "aa11"};
    const Model other{"other_model", "http://h/img/other.img", "bb22"};
};

TEST_F(VyxFeedTest, FirstMatchingItemWinsAndOtherModelsAreCleared) {
    ASSERT_EQ(1,
              Parse(Feed(Item("5", "2", "5700", {other, mine}) + Item("5", "3", "9000", {mine}))));
    EXPECT_TRUE(found);
    EXPECT_STREQ("5700", release.buildNum);
    EXPECT_STREQ("demo_model", release.unique);
    EXPECT_STREQ("http://h/img/mine.img", release.link);
    EXPECT_STREQ("aa11", release.checksum);

    unlink(kFeed);
    EXPECT_EQ(0, VyxUpdate::ParseRssFile(false, Current(), found, release));
    EXPECT_TRUE(kytotest::SyslogContains("Fail to open [/var/run/autoupdate_tmp_file_RSS]"));
}

TEST_F(VyxFeedTest, ItemsThatAreNotWantedAreSkipped) {
    struct Case {
        const char* what;
        std::string items;
        bool hotfixOnly;
        const char* expectBuild;  // nullptr: record cleared
        bool expectFound = expectBuild != nullptr;
    };
    const std::string reqNotMet =
        "<ReqMajorVer>6</ReqMajorVer>\n<ReqMinorVer>3</ReqMinorVer>\n"
        "<ReqBuildNum>6000</ReqBuildNum>\n";
    const std::string reqMinorMet = "<ReqMajorVer>6</ReqMajorVer>\n<ReqMinorVer>1</ReqMinorVer>\n";
    const Case cases[] = {
        {"equal version", Item("5", "2", "5644", {mine}), false, nullptr},
        {"older version", Item("5", "1", "9999", {mine}), false, nullptr},
        {"only another model", Item("6", "0", "1", {other}), false, nullptr},
        {"requirement fails all three tests", Item("5", "2", "5700", {mine}, reqNotMet), false,
         nullptr},
        {"requirement met by the minor alone", Item("5", "2", "5700", {mine}, reqMinorMet), false,
         "5700"},
        {"hotfix only skips another minor",
         Item("5", "3", "100", {mine}) + Item("5", "2", "5650", {mine}), true, "5650"},
        {"hex build number is newer", Item("5", "2", "0x1700", {mine}), false, "0x1700"},
        {"octal build number is older", Item("5", "2", "012000", {mine}), false, nullptr},
        {"octal major 05 equals 5", Item("05", "2", "5645", {mine}), true, "5645"},
        {"item closed inside the matched model",
         "<item>\n<MajorVer>5</MajorVer>\n<MinorVer>2</MinorVer>\n<BuildNum>5700</BuildNum>\n"
         "<model>\n<mUnique>demo_model</mUnique>\n</item>\n",
         false, nullptr, true},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        ASSERT_EQ(1, Parse(Feed(c.items), c.hotfixOnly));
        EXPECT_EQ(c.expectFound, found);
        EXPECT_STREQ(c.expectBuild ? c.expectBuild : "", release.buildNum);
        if (!c.expectBuild) {
            EXPECT_STREQ("", release.link);
        }
    }
}

TEST(VyxFeedLineTest, ScannerAcceptsOnlyWellFormedBoundedLines) {
    struct Case {
        std::string line;
        bool ok;
        std::string name, value;
    };
    const std::string v4096(4096, 'v');
    const std::string n128(128, 'n');
    const Case cases[] = {
        {"   <MajorVer>7</MajorVer>  trailing", true, "MajorVer", "7"},
        {"<mLink> spaced value </mLink>", true, "mLink", " spaced value "},
        {"<mLink>" + v4096 + "</mLink>", true, "mLink", v4096},
        {"<mLink>" + v4096 + "v</mLink>", false, "", ""},
        {"<" + n128 + ">x</" + n128 + ">", true, n128, "x"},
        {"<" + n128 + "n>x</" + n128 + "n>", false, "", ""},
        {"<BuildNum></BuildNum>", false, "", ""},
        {"<model>", false, "", ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.line.substr(0, 40));
        std::string name, value;
        _tag_rss_tag_type_ type = RSS_TAG_NONE;
        EXPECT_EQ(c.ok, VyxUpdate::ParseTagValue(c.line, name, value, type));
        EXPECT_EQ(c.name, name);
        EXPECT_EQ(c.value, value);
    }
}

TEST_F(VyxFeedTest, TagKindsAndMismatchedTags) {
    std::string name, value;
    _tag_rss_tag_type_ type = RSS_TAG_NONE;
    ASSERT_TRUE(VyxUpdate::ParseTagValue("<title>t</title>", name, value, type));
    EXPECT_EQ(RSS_TAG_TITLE, type);  // the first "title" row wins
    ASSERT_TRUE(VyxUpdate::ParseTagValue("<mCheckSum>c</mCheckSum>", name, value, type));
    EXPECT_EQ(RSS_TAG_M_CHECKSUM, type);
    ASSERT_TRUE(VyxUpdate::ParseTagValue("<unknown>u</unknown>", name, value, type));
    EXPECT_EQ(RSS_TAG_M_CHECKSUM, type);  // unknown names keep the previous kind

    EXPECT_FALSE(VyxUpdate::ParseTagValue("<MajorVer>5</MinorVer>", name, value, type));
    EXPECT_TRUE(
        kytotest::SyslogContains("Left tag [MajorVer] and right tag [MinorVer] don't match"));
    EXPECT_EQ(0x0D00, KLIBCErrGet());
}

}  // namespace
