// The kytosite program as a vendor runs it: a site it writes (init, release, two fixes,
// sign), served by the loopback server, is read back by the library as the sandbox's
// appliance (build 5644, "demo_model"); the fix command's refusals leave the site as it
// was; its signatures verify with minisign.
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "deb_builder.h"
#include "sandbox.h"
#include "smallupdate.h"
#include "systemupdate.h"
#include "update_server.h"
#include "vyxupdate.h"

using namespace kytotest;

namespace {

std::string Tool() {
    return std::filesystem::read_symlink("/proc/self/exe").parent_path().string() +
           "/../tools/kytosite";
}

struct Outcome {
    int rc;
    std::string err;
};

Outcome Site(const std::string& args) {
    const int rc = Shell(Tool() + " " + args + " >/tmp/s.out 2>/tmp/s.err");
    return {rc, ReadFile("/tmp/s.err").value_or("")};
}

// Every published file and folder of the site with its content's MD5.
std::string Snapshot(const std::string& root) {
    std::string out;
    Shell("cd " + root +
              " && find autoupdate smallupdate images | sort && find autoupdate "
              "smallupdate images -type f | sort | xargs -r md5sum",
          &out);
    return out;
}

const char* const kPkgs = "/tmp/pkgs";

std::string Deb(const std::string& name, const std::string& version = "1.0") {
    return BuildDeb(MakeDebPackage(name, version), kPkgs);
}

class KytositeTest : public UpdateServerTest {
  protected:
    void SetUp() override {
        UpdateServerTest::SetUp();
        server->PointRssServerHere();
        root = server->Root();
        ASSERT_EQ(0, Site("init " + root + " --base-url " + server->BaseUrl() + "/").rc);
    }
    void Release() {
        image = "/tmp/upload.img";
        std::string bytes(3 << 20, 'v');
        for (size_t i = 0; i < bytes.size(); i += 4096)
            bytes[i] = static_cast<char>(i >> 12);
        WriteFile(image, bytes);
        // The newer release, published later, comes first in the feed.
        for (const char* version : {"5.2-5650", "5.2-5700"}) {
            const Outcome r = Site("release " + root + " " + image + " --version " + version +
                                   " --model other_model --model demo_model");
            ASSERT_EQ(0, r.rc) << r.err;
        }
    }
    // Fix 1: the small-update package and kyto-fix-a, restarting S01iptables.sh; fix 2: a
    // newer small-update package and kyto-fix-b, restarting the add-on DemoApp.
    void Fixes() {
        const std::string base = "fix " + root + " --build 5644 --model demo_model --model m2 ";
        Outcome r = Site(base + "--fix 1 --smallupdate " + Deb("kyto-su", "5.2") + " " +
                         Deb("kyto-fix-a") + " --restart-service S01iptables.sh");
        ASSERT_EQ(0, r.rc) << r.err;
        // A package after a restart name is a package, not a second name.
        r = Site(base + "--fix 2 --smallupdate " + Deb("kyto-su", "5.2.1") +
                 " --restart-package DemoApp " + Deb("kyto-fix-b", "2.0-5644-s2"));
        ASSERT_EQ(0, r.rc) << r.err;
    }
    std::string root, image;
};

TEST_F(KytositeTest, ReleaseIsFoundAndDownloadedWithItsMd5) {
    Release();
    SystemUpdate facade;
    bool have = false;
    ASSERT_EQ(1, facade.CheckNewUpdate(have));
    ASSERT_TRUE(have);
    EXPECT_EQ("vyx", facade.GetUpdateType());
    EXPECT_EQ("VYX 5.2-5700", facade.GetFullVersion());
    ASSERT_EQ(1, facade.Download());
    std::string path;
    ASSERT_TRUE(VyxUpdate::GetDownloadedPatchPath(have, path) && have);
    EXPECT_EQ(Md5Of(image), Md5Of(path));
    EXPECT_EQ(1u, server->RequestsFor("/images/5.2-5700/upload.img").size());
    // A second release of the same version is refused and leaves the site as it was.
    const std::string before = Snapshot(root);
    const Outcome again = Site("release " + root + " " + image + " --version 5.2-5700 --model x");
    EXPECT_EQ(1, again.rc);
    EXPECT_NE(std::string::npos, again.err.find("kytosite: release 5.2-5700 is already in"));
    EXPECT_EQ(before, Snapshot(root));
}

TEST_F(KytositeTest, FixesOfTwoPublicationsAreMergedDownloadedAndApplied) {
    Fixes();
    // The second model's list holds the same two fixes for its own identity.
    SmallUpdate m2("m2");
    ASSERT_TRUE(m2.SetUpdateList(root + "/smallupdate/5644/m2/VYX-Security.json"));
    EXPECT_EQ(2, m2.m_newSmallFixNumber);
    EXPECT_EQ(std::vector<std::string>(
                  {"kyto-fix-a_1.0-5644-s1_all.deb", "kyto-fix-b_2.0-5644-s2_all.deb"}),
              m2.m_installDebs);
    SystemUpdate facade;
    bool have = false;
    ASSERT_EQ(1, facade.CheckNewUpdate(have));
    ASSERT_TRUE(have);
    EXPECT_EQ("VYX 5.2-5644 update 2", facade.GetFullVersion());
    ASSERT_EQ(1, facade.Download());
    ASSERT_EQ(1, facade.Apply());
    EXPECT_FALSE(DpkgInstalled("kyto-su")) << "the small-update package is unpacked, not installed";
    for (const char* pkg : {"kyto-fix-a", "kyto-fix-b"})
        EXPECT_TRUE(DpkgInstalled(pkg)) << pkg;
    EXPECT_NE(std::string::npos,
              ReadFile("/etc.defaults/VERSION").value_or("").find("smallfixnumber=\"2\""));
}

// A package built without dpkg-deb's checks, whose name holds an underscore.
std::string OddDeb() {
    Shell(std::string("mkdir -p /tmp/odd/DEBIAN ") + kPkgs +
          " && printf 'Package: kyto_odd\\n"
          "Version: 1.0\\nArchitecture: all\\nMaintainer: t <t@t>\\nDescription: t\\n' "
          ">/tmp/odd/DEBIAN/control && dpkg-deb --nocheck --root-owner-group -b /tmp/odd " +
          kPkgs + "/odd.deb >/dev/null 2>&1");
    return std::string(kPkgs) + "/odd.deb";
}

TEST_F(KytositeTest, FixRefusalsWriteNothing) {
    Fixes();
    WriteFile("/tmp/notdeb.deb", "!<arch> but not really\n");
    const std::string su = " --smallupdate " + Deb("kyto-su", "5.3");
    const std::string base = "fix " + root + " --build 5644 --model demo_model --model m2 ";
    const struct {
        std::string args, err;
    } rows[] = {
        {"--fix 2" + su, "fix 2 is not above fix 2, the last in"},
        {"--fix 1" + su, "fix 1 is not above fix 2"},
        {"--fix 3 --smallupdate /tmp/notdeb.deb", "/tmp/notdeb.deb is not a Debian package"},
        {"--fix 3" + su + " /tmp/notdeb.deb", "/tmp/notdeb.deb is not a Debian package"},
        {"--fix 3 --smallupdate " + OddDeb(),
         "published as 'kyto_odd_1.0-5644-s3_all.deb', which the appliance's package rules "
         "reject for build 5644 fix 3"},
        {"--fix 3 " + Deb("kyto-fix-c"), "could not download fix 3 as published"},
        {"--fix 3 --config --flash " + Deb("kyto-flash"), "could not download fix 3"},
        {"--fix 3 --restart-all", "nothing to publish"},
    };
    const std::string before = Snapshot(root);
    for (const auto& row : rows) {
        SCOPED_TRACE(row.args);
        const Outcome r = Site(base + row.args);
        EXPECT_EQ(1, r.rc);
        EXPECT_NE(std::string::npos, r.err.find("kytosite: ")) << r.err;
        EXPECT_NE(std::string::npos, r.err.find(row.err)) << r.err;
        EXPECT_EQ(before, Snapshot(root));
    }
}

TEST_F(KytositeTest, SignaturesVerifyWithMinisign) {
    Release();
    Fixes();
    WriteFile("/tmp/pw", "demo password\n");
    ASSERT_EQ(0, Site("keygen /tmp/k.pub /tmp/k.key --password-file /tmp/pw").rc);
    const Outcome r = Site("sign " + root + " --key /tmp/k.key --password-file /tmp/pw");
    ASSERT_EQ(0, r.rc) << r.err;
    EXPECT_EQ(1, Site("sign " + root + " --key /tmp/k.key").rc) << "the password is needed";
    for (const std::string file :
         {"autoupdate/genRSS.php", "smallupdate/5644/demo_model/VYX-Security.json",
          "smallupdate/5644/debs/kyto-fix-b_2.0-5644-s2_all.deb", "images/5.2-5700/upload.img"}) {
        SCOPED_TRACE(file);
        const std::string path = root + "/" + file;
        EXPECT_EQ(0, Shell("minisign -V -q -p /tmp/k.pub -m " + path));
        const std::string name = file.substr(file.rfind('/') + 1);
        EXPECT_NE(std::string::npos,
                  ReadFile(path + ".minisig").value_or("").find("\tfile:" + name + "\t"));
    }
}

}  // namespace
