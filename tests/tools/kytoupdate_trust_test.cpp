// kytoupdate with the vendor's key in /etc/kytoupdate/trusted.d: each kind of bad signature
// at each place (patch list, package, image, feed) is refused with nothing usable left; a
// package altered in the package folder is refused at apply; a local archive must carry its
// signatures; signed updates pass, also when the minisign tool made the key and signed;
// without a trust folder, one notice and nothing checked.
#include <sys/stat.h>

#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "kytotrust.h"
#include "kytoupdate_fixture.h"
#include "sandbox.h"

using namespace kytotest;

namespace {

const char* const kTrustDir = "/etc/kytoupdate/trusted.d";
const char* const kDebDir = "/volume1/@smallupd@te_deb";
const char* const kImage = "/volume1/@autoupdate/vyx.img";
const char* const kSu = "/debs/kyto-su_5.2-5644-s1_all.deb";
const char* const kNotice =
    "kytoupdate: no trusted keys in /etc/kytoupdate/trusted.d: signatures are not checked\n";
// What is wrong with a signature, by the reason the refusal gives.
const std::vector<std::string> kBad = {"unsigned: ", "signed by an unknown key",
                                       "altered: ", "signed under another name"};

std::string Base(const std::string& p) {
    return p.substr(p.rfind('/') + 1);
}

class KytoupdateTrustTest : public KytoupdateTest {
  protected:
    void SetUp() override {
        KytoupdateTest::SetUp();
        mkdir("/tmp/keys", 0700);
        std::string why;
        for (const std::string who : {"vendor", "other"})
            ASSERT_TRUE(kytotrust::GenerateKeyPair("/tmp/keys/" + who + ".pub",
                                                   "/tmp/keys/" + who + ".sec", "", why));
        WriteFile(std::string(kTrustDir) + "/vendor.pub", *ReadFile("/tmp/keys/vendor.pub"));
    }
    // Signs the file served at urlPath as `name` (its base name when "") with who's key.
    void Sign(const std::string& urlPath, const std::string& who = "vendor",
              const std::string& name = "") {
        kytotrust::SecretKey key;
        std::string why, sig;
        const std::string path = server->Root() + urlPath;
        ASSERT_TRUE(kytotrust::LoadSecretKey("/tmp/keys/" + who + ".sec", "", key, why)) << why;
        ASSERT_TRUE(kytotrust::SignFile(key, path, name.empty() ? Base(urlPath) : name, sig, why));
        ASSERT_TRUE(kytotrust::WriteSignature(path, sig, why)) << why;
    }
    std::string ListPath() const { return UpdateServer::PatchListPath(5644, "demo_model"); }
    // Publishes a small update (or the 1 MiB release) with every file signed; the files.
    std::vector<std::string> SignedSite(bool release) {
        server->PutFile(kFeed, FeedDocument(""));
        release ? Release(1 << 20) : PublishSmallFix(*server);
        std::vector<std::string> files = {kFeed, "/img/vyx.img"};
        if (!release)
            files = {kFeed, ListPath(), "/debs/" + SmallFixDeb(), kSu};
        for (const std::string& f : files)
            Sign(f);
        return files;
    }
    // Spoils the signature of the file served at urlPath as kBad[bad] says.
    void Spoil(const std::string& urlPath, size_t bad) {
        const std::string path = server->Root() + urlPath;
        if (bad == 0)
            RemoveTree(path + ".minisig");
        if (bad == 1 || bad == 3)
            Sign(urlPath, bad == 1 ? "other" : "vendor", "renamed.bin");
        if (bad == 2 && urlPath != "/img/vyx.img")  // a trailing blank still reads the same
            WriteFile(path, *ReadFile(path) + "\n");
        if (bad == 2 && urlPath == "/img/vyx.img") {  // another image, its MD5 in a signed feed
            const std::string feed = *ReadFile(server->Root() + kFeed), old = Md5Of(path);
            ASSERT_EQ(0, Shell("printf x >>" + path));
            WriteFile(server->Root() + kFeed, feed.substr(0, feed.find(old)) + Md5Of(path) +
                                                  feed.substr(feed.find(old) + old.size()));
            Sign(kFeed);
        }
    }
    // Nothing of a refused download is left for the installer or an apply; the poller of
    // its kind sees it failed; the reason is in the system log.
    void ExpectNothingUsable(const std::string& err, bool release = false) {
        EXPECT_FALSE(PathExists("/autoupd@te.info") || PathExists(kDebDir) || PathExists(kImage));
        const Json::Value status = ParseJson(Cmd("status --json").out);
        EXPECT_EQ("failed", status[release ? "vyxupdate" : "smallupdate"]["status"].asString());
        ExpectRuns({{"apply", 1, "", "no downloaded update"}});
        EXPECT_TRUE(SyslogContains("refused: not signed by a trusted key: ")) << err;
        EXPECT_TRUE(SyslogContains(err)) << err;
    }
    static void ExpectDownloaded(const std::string& what) {
        const Outcome r = Cmd("download");
        EXPECT_EQ(0, r.rc) << r.err;
        EXPECT_TRUE(Has(r.out, "downloaded " + what));
        EXPECT_FALSE(Has(r.err, "HTTP request sent")) << "wget's log of the checking fetches";
    }
};

TEST_F(KytoupdateTrustTest, EachBadSignatureAtEachPlaceIsRefusedAndRemoved) {
    // Release or small update, the index of the spoilt file in SignedSite's, the command.
    const std::vector<std::tuple<bool, size_t, const char*>> places = {
        {false, 1, "download"}, {false, 2, "download"}, {false, 3, "auto"},
        {true, 1, "download"},  {true, 0, "download"},  {true, 0, "auto"}};
    for (const auto& [release, index, cmd] : places) {
        for (size_t bad = 0; bad < kBad.size(); ++bad) {
            const std::string file = SignedSite(release)[index];
            SCOPED_TRACE(std::string(cmd) + " " + file + ": " + kBad[bad]);
            Spoil(file, bad);
            const Outcome r = Cmd(cmd);
            EXPECT_EQ(5, r.rc) << r.out << r.err;
            EXPECT_TRUE(Has(r.err, "refused: not signed by a trusted key: " + Base(file)));
            EXPECT_TRUE(Has(r.err, kBad[bad]));
            EXPECT_FALSE(Has(r.out, "downloaded") || Has(r.out, "applied"));
            ExpectNothingUsable(kBad[bad], release);
        }
    }
    EXPECT_FALSE(DpkgInstalled("kyto-tool-fix"));
}

TEST_F(KytoupdateTrustTest, SignedUpdatesPassAndAPackageAlteredAfterwardsIsRefusedAtApply) {
    SignedSite(false);
    ExpectDownloaded("smallupdate VYX 5.2-5644 update 1\n");
    const std::string deb = std::string(kDebDir) + "/" + SmallFixDeb();
    WriteFile(deb, *ReadFile(deb) + "x");
    ClearRecordedCalls();
    ExpectRuns({{"apply", 5, "", "altered: "}});
    EXPECT_TRUE(RecordedCalls().empty());  // no service was stopped
    EXPECT_FALSE(DpkgInstalled("kyto-tool-fix"));
    ExpectNothingUsable("refused: not signed by a trusted key: " + SmallFixDeb());

    ExpectDownloaded("smallupdate VYX 5.2-5644 update 1\n");
    ExpectRuns({{"apply", 0, "applied VYX 5.2-5644 update 1\n", "starting services"}});
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
    SignedSite(true);
    ExpectDownloaded(std::string("vyx VYX 5.2-5700 ") + kImage + "\n");
    EXPECT_EQ(Md5Of(server->Root() + "/img/vyx.img"), Md5Of(kImage));
}

TEST_F(KytoupdateTrustTest, WhatTheMinisignToolSignsPasses) {
    // The vendor's key made by minisign (no password) and trusted alone; every file signed
    // by minisign -S under its own name.
    RemoveTree(std::string(kTrustDir) + "/vendor.pub");
    ASSERT_EQ(0, Shell("minisign -G -W -p /tmp/keys/m.pub -s /tmp/keys/m.key >/dev/null && cp "
                       "/tmp/keys/m.pub " +
                       std::string(kTrustDir)));
    server->PutFile(kFeed, FeedDocument(""));
    PublishSmallFix(*server);
    for (const std::string& f :
         {std::string(kFeed), ListPath(), "/debs/" + SmallFixDeb(), std::string(kSu)})
        ASSERT_EQ(0,
                  Shell("minisign -S -s /tmp/keys/m.key -m " + server->Root() + f + " >/dev/null"));
    ExpectDownloaded("smallupdate VYX 5.2-5644 update 1\n");
    ExpectRuns({{"apply", 0, "applied VYX 5.2-5644 update 1\n", "starting services"}});
    EXPECT_TRUE(DpkgInstalled("kyto-tool-fix"));
}

TEST_F(KytoupdateTrustTest, ASignedListOrFeedThatChangedDuringTheDownloadIsRefused) {
    for (const bool release : {false, true}) {
        SCOPED_TRACE(release ? "feed" : "patch list");
        SignedSite(release);
        const std::string slow = release ? "/img/vyx.img" : "/debs/" + SmallFixDeb();
        server->SlowPath(slow, release ? 256 << 10 : 256);
        const pid_t pid = Spawn([] { return Shell(Kyto() + " download >/dev/null 2>/tmp/d.err"); });
        const std::string local = release ? kImage : std::string(kDebDir) + "/" + SmallFixDeb();
        ASSERT_TRUE(WaitFor([&local] { return PathExists(local); }));  // checked, downloading
        // Now the site offers another MD5, or the same packages with a reboot.
        PatchEntry fix{1,
                       {{"kyto-tool-fix", server->Url(slow)}, {"smallupdate", server->Url(kSu)}},
                       false,
                       false,
                       "\"reboot\""};
        const std::string file = release ? kFeed : ListPath();
        server->PutFile(file, release ? FeedDocument(FeedItem("5", "2", "5700",
                                                              {{"demo_model", server->Url(slow),
                                                                std::string(32, '0')}}))
                                      : PatchListJson(5644, "demo_model", {fix}));
        Sign(file);
        EXPECT_EQ(5, Wait(pid));
        const std::string why = release ? "does not offer" : "does not name the update";
        EXPECT_TRUE(Has(ReadFile("/tmp/d.err").value_or(""), why));
        ExpectNothingUsable(why, release);
    }
}

TEST_F(KytoupdateTrustTest, AnArchiveMustCarryTheSignaturesOfItsListAndPackages) {
    SignedSite(false);  // the list and the further package with their signatures, packed
    const std::string dir = server->Root() + "/debs", files = "VYX-Security.json " + SmallFixDeb();
    ASSERT_EQ(0, Shell("cp " + server->Root() + ListPath() + "* " + dir));
    ASSERT_EQ(0, Shell("tar -cf /tmp/unsigned.tar -C " + dir + " " + files));
    ASSERT_EQ(0, Shell("tar -cf /tmp/signed.tar -C " + dir + " " + files +
                       " VYX-Security.json.minisig " + SmallFixDeb() + ".minisig"));
    ExpectRuns({{"import /tmp/unsigned.tar", 5, "", "VYX-Security.json: unsigned: "}});
    ExpectNothingUsable("refused: not signed by a trusted key: VYX-Security.json");
    ExpectRuns({{"import /tmp/signed.tar", 0, "imported VYX 5.2-5644 update 1\n", ""},
                {"apply", 0, "applied VYX 5.2-5644 update 1\n", "starting services"}});
}

TEST_F(KytoupdateTrustTest, WithoutTrustedKeysNothingIsCheckedAndOneNoticeSaysSo) {
    PublishSmallFix(*server);                 // nothing signed
    for (const bool empty : {true, false}) {  // a folder without *.pub, no folder
        RemoveTree(kTrustDir);
        if (empty)
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
