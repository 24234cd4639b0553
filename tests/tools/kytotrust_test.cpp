// Signatures of published files: our key and signature files against the common signing
// tool's (/usr/bin/minisign) in both directions, plain and password-protected keys, and each
// refusal of a file that is not what a trusted key signed, by its own reason.
#include <sys/stat.h>

#include <functional>
#include <regex>

#include "kytotrust.h"
#include "sandbox.h"

using namespace kytotest;

namespace {

const std::string kDir = "/tmp/t/", kImg = kDir + "img", kSig = kImg + ".minisig";

std::string Tool(const std::string& cmd) {
    std::string out;
    const int rc = Shell("cd " + kDir + " && " + cmd, &out);
    return "rc=" + std::to_string(rc) + " " + out;
}

::testing::AssertionResult Ok(const std::string& out) {
    if (out.rfind("rc=0 ", 0) == 0)
        return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << out;
}

// A key pair written by the tool itself; with a password, fed on standard input.
void ToolKeyPair(const std::string& name, const std::string& pw) {
    const std::string keys = " -p " + name + ".pub -s " + name + ".key";
    ASSERT_TRUE(Ok(Tool(pw.empty() ? "minisign -G -W" + keys
                                   : "printf '" + pw + "\\n" + pw + "\\n' | minisign -G" + keys)));
}

bool Verify(const std::string& pub, const std::string& name, std::string& why) {
    kytotrust::PublicKey key;
    return kytotrust::LoadPublicKey(kDir + pub, key, why) &&
           kytotrust::VerifyFile({key}, kImg, kSig, name, why);
}

bool SignWith(const std::string& secPath, const std::string& pw, std::string& why) {
    kytotrust::SecretKey sk;
    std::string text;
    return kytotrust::LoadSecretKey(kDir + secPath, pw, sk, why) &&
           kytotrust::SignFile(sk, kImg, "img", text, why) &&
           kytotrust::WriteSignature(kImg, text, why);
}

class KytotrustTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        ASSERT_EQ(mkdir("/tmp/t", 0700), 0);
        std::string img(200 * 1024 + 7, '\0');  // several read blocks, the last one short
        for (size_t i = 0; i < img.size(); ++i)
            img[i] = static_cast<char>(i * 7 + i / 251);
        WriteFile(kImg, img);
    }
};

// Rows: no password (a plain key), and a password.
const char* const kPasswords[] = {"", "s3cret pw"};

TEST_F(KytotrustTest, OurKeysAndSignaturesWorkWithTheTool) {
    for (const std::string pw : kPasswords) {
        SCOPED_TRACE("password '" + pw + "'");
        std::string why;
        Shell("rm -f /tmp/t/our.* " + kSig);
        ASSERT_TRUE(kytotrust::GenerateKeyPair(kDir + "our.pub", kDir + "our.key", pw, why)) << why;
        struct stat st;
        ASSERT_EQ(stat((kDir + "our.key").c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0600u);
        EXPECT_FALSE(kytotrust::GenerateKeyPair(kDir + "new.pub", kDir + "our.key", pw, why));
        EXPECT_NE(why.find("exists already"), std::string::npos) << why;

        ASSERT_TRUE(SignWith("our.key", pw, why)) << why;
        const std::string out = Tool("minisign -V -p our.pub -m img");
        EXPECT_TRUE(Ok(out));
        EXPECT_TRUE(std::regex_search(
            out, std::regex("\nTrusted comment: timestamp:[0-9]+\tfile:img\thashed\n")))
            << out;
        // The tool signs with our secret key file; we verify with our public key file.
        Shell("rm " + kSig);
        ASSERT_TRUE(Ok(Tool("printf '" + pw + "\\n' | minisign -S -s our.key -m img")));
        EXPECT_TRUE(Verify("our.pub", "img", why)) << why;
        if (!pw.empty()) {
            kytotrust::SecretKey sk;
            EXPECT_FALSE(kytotrust::LoadSecretKey(kDir + "our.key", "s3cret pW", sk, why));
            EXPECT_NE(why.find("wrong password"), std::string::npos) << why;
        }
    }
}

TEST_F(KytotrustTest, TheToolsKeysAndSignaturesWorkWithOurs) {
    for (const std::string pw : kPasswords) {
        SCOPED_TRACE("password '" + pw + "'");
        std::string why;
        Shell("rm -f /tmp/t/tool.* " + kSig);
        ToolKeyPair("tool", pw);
        ASSERT_TRUE(Ok(Tool("printf '" + pw + "\\n' | minisign -S -s tool.key -m img")));
        EXPECT_TRUE(Verify("tool.pub", "img", why)) << why;
        // Our signature with the tool's secret key file, checked by the tool.
        ASSERT_TRUE(SignWith("tool.key", pw, why)) << why;
        EXPECT_TRUE(Ok(Tool("minisign -V -p tool.pub -m img")));
    }
}

TEST_F(KytotrustTest, EachRefusalGivesItsReason) {
    std::string why;
    ToolKeyPair("other", "");
    ASSERT_TRUE(kytotrust::GenerateKeyPair(kDir + "a.pub", kDir + "a.key", "", why)) << why;
    ASSERT_TRUE(SignWith("a.key", "", why)) << why;
    const std::string img = *ReadFile(kImg), sig = *ReadFile(kSig);
    const std::vector<std::string> lines = FileLines(kSig);
    struct Row {
        const char* what;
        std::function<void()> change;
        const char* name;
        const char* reason;
    } rows[] = {
        {"as signed", [] {}, "img", nullptr},
        {"no signature file", [] { unlink(kSig.c_str()); }, "img", "unsigned: "},
        {"another key", [&] { ASSERT_TRUE(SignWith("other.key", "", why)) << why; }, "img",
         "signed by an unknown key "},
        {"a byte flipped",
         [&] { WriteFile(kImg, img.substr(0, 70000) + "\x01" + img.substr(70001)); }, "img",
         "altered: "},
        {"trusted comment changed",
         [&] {
             WriteFile(kSig,
                       lines[0] + "\n" + lines[1] + "\n" + lines[2] + "0\n" + lines[3] + "\n");
         },
         "img", "trusted comment altered: "},
        {"another name", [] {}, "other.img", "signed under another name: "},
        {"bad base64",
         [&] {
             WriteFile(kSig, lines[0] + "\n" + lines[1].substr(1) + "\n" + lines[2] + "\n" +
                                 lines[3] + "\n");
         },
         "img", "malformed signature: "},
        {"cut short", [&] { WriteFile(kSig, sig.substr(0, sig.size() - 40)); }, "img",
         "malformed signature: "},
        {"legacy", [] { Tool("rm img.minisig && minisign -S -l -s a.key -m img"); }, "img",
         "legacy signature: "},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        WriteFile(kImg, img);
        WriteFile(kSig, sig);
        row.change();
        const bool ok = Verify("a.pub", row.name, why);
        EXPECT_EQ(ok, row.reason == nullptr) << why;
        if (row.reason != nullptr) {
            EXPECT_EQ(why.rfind(row.reason, 0), 0u) << why;
        }
    }
}

TEST_F(KytotrustTest, TrustFolderLoadsEveryReadableKey) {
    std::string why;
    std::vector<kytotrust::PublicKey> keys;
    ASSERT_EQ(mkdir("/tmp/t/trusted.d", 0755), 0);
    EXPECT_FALSE(kytotrust::LoadTrustFolder(kDir + "trusted.d", keys, why));
    WriteFile(kDir + "trusted.d/junk.pub", "untrusted comment: x\nRWQAAA==\n");
    EXPECT_FALSE(kytotrust::LoadTrustFolder(kDir + "trusted.d", keys, why));
    EXPECT_NE(why.find("junk.pub"), std::string::npos) << why;
    ASSERT_TRUE(kytotrust::GenerateKeyPair(kDir + "trusted.d/a.pub", kDir + "a.key", "", why));
    WriteFile(kDir + "trusted.d/a.txt", *ReadFile(kDir + "trusted.d/a.pub"));
    ASSERT_TRUE(kytotrust::LoadTrustFolder(kDir + "trusted.d", keys, why)) << why;
    ASSERT_EQ(keys.size(), 1u);
    EXPECT_EQ(keys[0].path, kDir + "trusted.d/a.pub");
    EXPECT_NE(why.find("junk.pub"), std::string::npos) << why;
}

}  // namespace
