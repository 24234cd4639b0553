// kytosite check against a site on the loopback server: a consistent, signed site (a release
// and a fix) passes with every file and its size; each way of breaking it is named.
#include <sys/stat.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "deb_builder.h"
#include "kytotrust.h"
#include "sandbox.h"
#include "update_server.h"

using namespace kytotest;

namespace {

const char* const kFeed = "/autoupdate/genRSS.php";
const std::string kImg = "/images/5.2-5700/vyx_5.2-5700.img", kDebs = "/smallupdate/5644/debs/";
const std::string kApp = kDebs + "kyto-app_5.2-5644-s1_all.deb";
const std::string kSu = kDebs + "kyto-su_5.2-5644-s1_all.deb";
const std::string kList = UpdateServer::PatchListPath(5644, "demo_model");

std::string Site() {
    return std::filesystem::read_symlink("/proc/self/exe").parent_path().string() +
           "/../tools/kytosite";
}

class KytositeCheckTest : public UpdateServerTest {
  protected:
    void SetUp() override {
        UpdateServerTest::SetUp();
        ASSERT_EQ(0, mkdir("/tmp/trust", 0700));
        for (const std::string key : {"/tmp/trust/vendor", "/tmp/other"}) {
            std::string why;
            ASSERT_TRUE(kytotrust::GenerateKeyPair(key + ".pub", key + ".sec", "", why)) << why;
        }
        Publish();
    }
    // The consistent site: release 5.2-5700 for two models, fix 1 of build 5644, all signed.
    void Publish() {
        const std::string md5 = Md5Of(server->PutFileOfSize(kImg, 300 * 1024 + 5));
        Feed(md5);
        BuildDeb(MakeDebPackage("kyto-app", SmallFixVersion("5.2", 5644, 1)), Local(kDebs));
        BuildDeb(MakeDebPackage("kyto-su", SmallFixVersion("5.2", 5644, 1)), Local(kDebs));
        List(5644, "demo_model", kApp);
        for (const std::string& path : {std::string(kFeed), kImg, kList, kApp, kSu})
            Sign(path);
    }
    std::string Local(const std::string& urlPath) const { return server->Root() + urlPath; }
    void Feed(const std::string& md5) {
        server->PutFile(kFeed, FeedDocument(FeedItem("5", "2", "5700",
                                                     {{"other_model", server->Url("/x.img"), md5},
                                                      {"demo_model", server->Url(kImg), md5}})));
    }
    void List(int build, const std::string& unique, const std::string& app) {
        PatchEntry fix;
        fix.version = 1;
        fix.proj = {{"kyto-app", server->Url(app)}, {"smallupdate", server->Url(kSu)}};
        server->PutFile(kList, PatchListJson(build, unique, {fix}));
    }
    // Signs the published file under a name (its own by default) with a key.
    void Sign(const std::string& urlPath, std::string name = "",
              const std::string& sec = "/tmp/trust/vendor.sec") {
        kytotrust::SecretKey key;
        std::string why, text;
        name = name.empty() ? urlPath.substr(urlPath.rfind('/') + 1) : name;
        ASSERT_TRUE(kytotrust::LoadSecretKey(sec, "", key, why) &&
                    kytotrust::SignFile(key, Local(urlPath), name, text, why) &&
                    kytotrust::WriteSignature(Local(urlPath), text, why))
            << why;
    }
    int Check(const std::string& extra, std::string* out) {
        return Shell(Site() + " check " + server->BaseUrl() + " --model demo_model --build 5644 " +
                         extra + " 2>/tmp/err",
                     out);
    }
};

TEST_F(KytositeCheckTest, ConsistentSignedSitePassesWithEveryFileAndItsSize) {
    const std::string version = ReadFile("/etc.defaults/VERSION").value_or("");
    std::string out;
    ASSERT_EQ(0, Check("--version 5.1 --trust /tmp/trust --json", &out)) << out;
    const Json::Value doc = ParseJson(out);
    EXPECT_EQ("VYX 5.2-5700", doc["offered"]["release"].asString());
    EXPECT_EQ("VYX 5.1-5644 update 1", doc["offered"]["smallupdate"].asString());
    EXPECT_EQ(0u, doc["problems"].size()) << out;
    const std::vector<std::string> fetched = {kFeed, kImg, kList, kApp, kSu};
    ASSERT_EQ(fetched.size(), doc["files"].size()) << out;
    for (Json::ArrayIndex i = 0; i < fetched.size(); ++i) {
        EXPECT_EQ(server->Url(fetched[i]), doc["files"][i]["url"].asString());
        EXPECT_EQ(std::filesystem::file_size(Local(fetched[i])),
                  doc["files"][i]["size"].asUInt64());
        EXPECT_TRUE(doc["files"][i]["signed"].asBool()) << fetched[i];
    }
    // The appliance's own files are left alone, and nothing is left in /tmp.
    EXPECT_EQ(version, ReadFile("/etc.defaults/VERSION").value_or(""));
    EXPECT_FALSE(PathExists("/var/run/autoupdate_tmp_file_RSS"));
    EXPECT_FALSE(AnyEntryStartsWith("/tmp", "kytosite-check."));

    // An appliance at fix 1 without a version: the feed unread, and fix 1 (whose package
    // name would be refused) never merged, so nothing offered and nothing wrong.
    List(5644, "demo_model", kDebs + "kyto-app_1.0_all.deb");
    ASSERT_EQ(0, Check("--smallfix 1", &out)) << out;
    EXPECT_EQ("none\nfile " + server->Url(kList) + " " +
                  std::to_string(std::filesystem::file_size(Local(kList))) + "\n",
              out);
    // No server at all.
    const std::string base = server->BaseUrl();
    server.reset();
    EXPECT_EQ(2, Shell(Site() + " check " + base + " --model demo_model --build 5644 2>/dev/null"));
}

TEST_F(KytositeCheckTest, EachBrokenSiteIsNamed) {
    const struct {
        const char* what;
        std::function<void()> breakIt;
        std::string problem;
    } rows[] = {
        {"missing image", [&] { RemoveTree(Local(kImg)); },
         "missing file " + server->Url(kImg) + " (404)"},
        {"missing package", [&] { RemoveTree(Local(kApp)); },
         "missing file " + server->Url(kApp) + " (404)"},
        {"wrong MD5", [&] { Feed(std::string(32, 'a')), Sign(kFeed); },
         "wrong MD5 of " + server->Url(kImg)},
        {"not a package", [&] { server->PutFile(kApp, "hello"), Sign(kApp); },
         "not a Debian package: " + server->Url(kApp)},
        {"name rejected",
         [&] { List(5644, "demo_model", kDebs + "kyto-app_1.0_all.deb"), Sign(kList); },
         "package name rejected by the rules: kyto-app_1.0_all.deb"},
        {"other build", [&] { List(5700, "demo_model", kApp), Sign(kList); },
         "patch list " + server->Url(kList) + " is for another build"},
        {"other model", [&] { List(5644, "other_model", kApp), Sign(kList); },
         "patch list " + server->Url(kList) + " is for another model"},
        {"unsigned", [&] { RemoveTree(Local(kApp) + ".minisig"); },
         server->Url(kApp) + ": unsigned: no signature file " + server->Url(kApp) + ".minisig\n"},
        {"unknown key", [&] { Sign(kFeed, "", "/tmp/other.sec"); },
         server->Url(kFeed) + ": signed by an unknown key"},
        {"altered", [&] { server->PutFile(kList, *ReadFile(Local(kList)) + " "); },
         server->Url(kList) + ": altered"},
        {"another name", [&] { Sign(kSu, "kyto-app_5.2-5644-s1_all.deb"); },
         server->Url(kSu) + ": signed under another name"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.what);
        row.breakIt();
        std::string out;
        EXPECT_EQ(1, Check("--version 5.2 --trust /tmp/trust", &out));
        EXPECT_NE(std::string::npos, out.find("\nproblem: " + row.problem)) << out;
        Publish();
    }
}

}  // namespace
