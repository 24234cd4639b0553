// kytoupdate with the vendor's key in /etc/kytoupdate/trusted.d: each kind of bad signature
// at each place (patch list, package, image, feed) is refused with nothing usable left; a
// package altered in the package folder is refused at apply; a local archive must carry its
// signatures; signed updates pass; without a trust folder, one notice and nothing checked.
#include <sys/stat.h>

#include <optional>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "kytotrust.h"
#include "kytoupdate_fixture.h"
#include "sandbox.h"

using namespace kytotest;

namespace {

const char* const kTrustDir = "/etc/kytoupdate/trusted.d";
const char* const kDebDir = "/volume1/@smallupd@te_deb";
const char* const kImage = "/volume1/@autoupdate/vyx.img";
const char* const kNotice =
    "kytoupdate: no trusted keys in /etc/kytoupdate/trusted.d: signatures are not checked\n";

enum class Bad { kUnsigned, kUnknownKey, kAltered, kOtherName };

class KytoupdateTrustTest : public KytoupdateTest {
  protected:
    void SetUp() override {
        KytoupdateTest::SetUp();
        mkdir("/tmp/keys", 0700);
        for (const char* who : {"vendor", "other"}) {
            std::string why;
            ASSERT_TRUE(kytotrust::GenerateKeyPair(Key(who, "pub"), Key(who, "sec"), "", why))
                << why;
        }
        WriteFile(std::string(kTrustDir) + "/vendor.pub", *ReadFile(Key("vendor", "pub")));
    }
    static std::string Key(const std::string& who, const std::string& ext) {
        return "/tmp/keys/" + who + "." + ext;
    }
    // Signs the file served at urlPath as `name` (its base name when "") with who's key.
    void Sign(const std::string& urlPath, const std::string& who = "vendor",
              const std::string& name = "") {
        kytotrust::SecretKey key;
        std::string why, sig;
        const std::string path = server->Root() + urlPath;
        ASSERT_TRUE(kytotrust::LoadSecretKey(Key(who, "sec"), "", key, why)) << why;
        ASSERT_TRUE(kytotrust::SignFile(key, path, name.empty() ? Base(urlPath) : name, sig, why));
        ASSERT_TRUE(kytotrust::WriteSignature(path, sig, why)) << why;
    }
    static std::string Base(const std::string& p) { return p.substr(p.rfind('/') + 1); }
    std::string ListPath() const { return UpdateServer::PatchListPath(5644, "demo_model"); }
    // Publishes a small update (or the 1 MiB release) with every file signed.
    std::vector<std::string> SignedSite(bool release) {
        release ? Release(1 << 20) : SmallFix();
        std::vector<std::string> files = {kFeed};
        if (release)
            files.push_back("/img/vyx.img");
        else
            files.insert(files.end(),
                         {ListPath(), "/debs/" + Deb(), "/debs/kyto-su_5.2-5644-s1_all.deb"});
        for (const std::string& f : files)
            Sign(f);
        return files;
    }
    // Spoils the signature of the served file at urlPath as `bad` says.
    void Spoil(const std::string& urlPath, Bad bad) {
        const std::string path = server->Root() + urlPath;
        if (bad == Bad::kUnsigned)
            RemoveTree(path + ".minisig");
        if (bad == Bad::kUnknownKey || bad == Bad::kOtherName)
            Sign(urlPath, bad == Bad::kUnknownKey ? "other" : "vendor", "renamed.bin");
        if (bad != Bad::kAltered)
            return;
        if (urlPath != "/img/vyx.img") {  // a trailing blank still reads the same
            WriteFile(path, *ReadFile(path) + "\n");
            return;
        }
        // Another image: the feed carries its MD5 and is signed again.
        const std::string old = Md5Of(path);
        ASSERT_EQ(0, Shell("printf x >>" + path));
        const std::string feed = *ReadFile(server->Root() + kFeed);
        WriteFile(server->Root() + kFeed, feed.substr(0, feed.find(old)) + Md5Of(path) +
                                              feed.substr(feed.find(old) + old.size()));
        Sign(kFeed);
    }
    static void ExpectDownloaded(const std::string& what) {
        const Outcome r = Cmd("download");
        EXPECT_EQ(0, r.rc) << r.err;
        EXPECT_TRUE(Has(r.out, "downloaded " + what));
    }
    // Nothing of a refused download is left for the installer or an apply.
    // The poller of that kind (release or small update) sees the download failed.
    void ExpectNothingUsable(const std::string& err, bool release = false) {
        EXPECT_FALSE(PathExists("/autoupd@te.info"));
        EXPECT_FALSE(PathExists(kDebDir));
        EXPECT_FALSE(PathExists(kImage));
        const Json::Value status = ParseJson(Cmd("status --json").out);
        EXPECT_EQ("failed", status[release ? "vyxupdate" : "smallupdate"]["status"].asString());
        ExpectRuns({{"apply", 1, "", "no downloaded update"}});
        EXPECT_TRUE(SyslogContains(err)) << err;
    }
};

TEST_F(KytoupdateTrustTest, EachBadSignatureAtEachPlaceIsRefusedAndRemoved) {
    const std::vector<std::pair<Bad, std::string>> kinds = {
        {Bad::kUnsigned, "unsigned: "},
        {Bad::kUnknownKey, "signed by an unknown key"},
        {Bad::kAltered, "altered: "},
        {Bad::kOtherName, "signed under another name"}};
    // Where (index into the signed files of SignedSite) and the command that downloads.
    const std::vector<std::tuple<bool, size_t, const char*>> places = {
        {false, 1, "download"}, {false, 2, "download"}, {false, 3, "auto"},
        {true, 1, "download"},  {true, 0, "download"},  {true, 0, "auto"}};
    for (const auto& [release, index, cmd] : places) {
        for (const auto& [bad, reason] : kinds) {
            server->PutFile(kFeed, FeedDocument(""));
            const std::string file = SignedSite(release)[index];
            SCOPED_TRACE(std::string(cmd) + " " + file + ": " + reason);
            Spoil(file, bad);
            const Outcome r = Cmd(cmd);
            EXPECT_EQ(5, r.rc) << r.out << r.err;
            EXPECT_TRUE(Has(r.err, "refused: not signed by a trusted key: " + Base(file)));
            EXPECT_TRUE(Has(r.err, reason));
            EXPECT_FALSE(Has(r.out, "downloaded") || Has(r.out, "applied"));
            ExpectNothingUsable(reason, release);
        }
    }
    EXPECT_FALSE(DpkgInstalled("kyto-tool-fix"));
}

TEST_F(KytoupdateTrustTest, SignedUpdatesPassAndAPackageAlteredAfterwardsIsRefusedAtApply) {
    SignedSite(false);
    ExpectDownloaded("smallupdate VYX 5.2-5644 update 1\n");
    WriteFile(std::string(kDebDir) + "/" + Deb(),
              *ReadFile(std::string(kDebDir) + "/" + Deb()) + "x");
    ClearRecordedCalls();
    ExpectRuns({{"apply", 5, "", "altered: "}});
    EXPECT_TRUE(RecordedCalls().empty());  // no service was stopped
    EXPECT_FALSE(DpkgInstalled("kyto-tool-fix"));
    ExpectNothingUsable("refused: not signed by a trusted key: " + Deb());

    ExpectDownloaded("smallupdate VYX 5.2-5644 update 1\n");
    ExpectRuns({{"apply", 0, "applied VYX 5.2-5644 update 1\n", "starting services"}});
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    SignedSite(true);
    ExpectDownloaded(std::string("vyx VYX 5.2-5700 ") + kImage + "\n");
    EXPECT_EQ(Md5Of(server->Root() + "/img/vyx.img"), Md5Of(kImage));
}

TEST_F(KytoupdateTrustTest, ASignedListOrFeedThatChangedDuringTheDownloadIsRefused) {
    for (const bool release : {false, true}) {
        SCOPED_TRACE(release ? "feed" : "patch list");
        server->PutFile(kFeed, FeedDocument(""));
        SignedSite(release);
        const std::string slow = release ? "/img/vyx.img" : "/debs/" + Deb();
        server->SlowPath(slow, release ? 256 << 10 : 256);
        const pid_t pid = Spawn([] { return Shell(Kyto() + " download >/dev/null 2>/tmp/d.err"); });
        const std::string local = release ? kImage : std::string(kDebDir) + "/" + Deb();
        ASSERT_TRUE(WaitFor([&local] { return PathExists(local); }));  // checked, downloading
        PatchEntry reboot{
            1, {{"kyto-tool-fix", server->Url("/debs/" + Deb())}}, false, false, "\"reboot\""};
        reboot.proj.push_back({"smallupdate", server->Url("/debs/kyto-su_5.2-5644-s1_all.deb")});
        const std::string other =
            FeedItem("5", "2", "5700", {{"demo_model", server->Url(slow), std::string(32, '0')}});
        server->PutFile(
            release ? kFeed : ListPath(),
            release ? FeedDocument(other) : PatchListJson(5644, "demo_model", {reboot}));
        Sign(release ? kFeed : ListPath());
        EXPECT_EQ(5, Wait(pid));
        const std::string err = ReadFile("/tmp/d.err").value_or("");
        EXPECT_TRUE(Has(err, release ? "does not offer" : "does not name the update"));
        ExpectNothingUsable(release ? "does not offer" : "does not name the update", release);
    }
}

TEST_F(KytoupdateTrustTest, AnArchiveMustCarryTheSignaturesOfItsListAndPackages) {
    SignedSite(false);  // signed files to pack: the list and the further package
    const std::string dir = server->Root() + "/debs";
    ASSERT_EQ(0, Shell("cp " + server->Root() + ListPath() + "* " + dir));
    const std::string files = "VYX-Security.json " + Deb();
    ASSERT_EQ(0, Shell("tar -cf /tmp/unsigned.tar -C " + dir + " " + files));
    ASSERT_EQ(0, Shell("tar -cf /tmp/signed.tar -C " + dir + " " + files +
                       " VYX-Security.json.minisig " + Deb() + ".minisig"));
    ExpectRuns({{"import /tmp/unsigned.tar", 5, "", "VYX-Security.json: unsigned: "}});
    ExpectNothingUsable("refused: not signed by a trusted key: VYX-Security.json");
    ExpectRuns({{"import /tmp/signed.tar", 0, "imported VYX 5.2-5644 update 1\n", ""},
                {"apply", 0, "applied VYX 5.2-5644 update 1\n", "starting services"}});
    EXPECT_TRUE(server->Requests().empty());
}

TEST_F(KytoupdateTrustTest, WithoutTrustedKeysNothingIsCheckedAndOneNoticeSaysSo) {
    SmallFix();  // nothing signed
    for (const char* folder : {"empty", "missing"}) {
        SCOPED_TRACE(folder);
        RemoveTree(kTrustDir);
        if (std::string(folder) == "empty")
            WriteFile(std::string(kTrustDir) + "/README", "keys go here as *.pub\n");
        Outcome r = Cmd("download");
        EXPECT_EQ(0, r.rc);
        EXPECT_EQ(
            "kytoupdate: downloading smallupdate VYX 5.2-5644 update 1\n" + std::string(kNotice),
            r.err);
        r = Cmd("apply");
        EXPECT_EQ(0, r.rc);
        EXPECT_EQ(kNotice, r.err.substr(0, r.err.find('\n') + 1));
        SetKeyValue("/etc.defaults/VERSION", "smallfixnumber", std::nullopt);
    }
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
}

}  // namespace
