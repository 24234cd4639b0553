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

// Runs the tool's command line in the work folder; its output goes to *out when asked.
::testing::AssertionResult Tool(const std::string& cmd, std::string* out = nullptr) {
    std::string text;
    if (Shell("cd " + kDir + " && " + cmd, &text) == 0 && (!out || (*out = text, true)))
        return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << cmd << ": " << text;
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

// The signature file with the text at `at` replaced by `with`.
std::string Edit(std::string sig, const std::string& at, const std::string& with) {
    return sig.replace(sig.find(at), at.size(), with);
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

// Key pairs made by us or by the tool, plain and with a password fed on standard input: the
// tool's signature verifies with ours and ours with the tool's, with our trusted comment.
void BothWays(bool ourKeys) {
    for (const std::string pw : {"", "s3cret pw"}) {
        SCOPED_TRACE("password '" + pw + "'");
        std::string why;
        Shell("rm -f /tmp/t/k.* " + kSig);
        if (ourKeys)
            ASSERT_TRUE(kytotrust::GenerateKeyPair(kDir + "k.pub", kDir + "k.key", pw, why));
        else
            ASSERT_TRUE(Tool("printf '" + pw + "\\n" + pw + "\\n' | minisign -G" +
                             (pw.empty() ? " -W" : "") + " -p k.pub -s k.key"));
        ASSERT_TRUE(Tool("printf '" + pw + "\\n' | minisign -S -s k.key -m img"));
        EXPECT_TRUE(Verify("k.pub", "img", why)) << why;
        ASSERT_TRUE(SignWith("k.key", pw, why)) << why;
        std::string out;
        EXPECT_TRUE(Tool("minisign -V -p k.pub -m img", &out));
        EXPECT_TRUE(std::regex_search(
            out, std::regex("\nTrusted comment: timestamp:[0-9]+\tfile:img\thashed\n")))
            << out;
        kytotrust::SecretKey sk;
        EXPECT_EQ(kytotrust::LoadSecretKey(kDir + "k.key", "s3cret pW", sk, why), pw.empty());
        EXPECT_TRUE(pw.empty() || why.find("wrong password") != std::string::npos) << why;
    }
}

TEST_F(KytotrustTest, OurKeysAndSignaturesWorkWithTheTool) {
    BothWays(true);
}

TEST_F(KytotrustTest, TheToolsKeysAndSignaturesWorkWithOurs) {
    BothWays(false);
}

TEST_F(KytotrustTest, EachRefusalGivesItsReason) {
    std::string why;
    ASSERT_TRUE(Tool("minisign -G -W -p other.pub -s other.key"));
    ASSERT_TRUE(kytotrust::GenerateKeyPair(kDir + "a.pub", kDir + "a.key", "", why)) << why;
    ASSERT_TRUE(SignWith("a.key", "", why)) << why;
    const std::string img = *ReadFile(kImg), sig = *ReadFile(kSig);
    struct Row {
        const char *what, *name, *reason;
        std::function<void()> change;
    } rows[] = {
        {"as signed", "img", "", [] {}},
        {"no signature file", "img", "unsigned: ", [] { unlink(kSig.c_str()); }},
        {"another key", "img", "signed by an unknown key ",
         [&] { ASSERT_TRUE(SignWith("other.key", "", why)) << why; }},
        {"a byte flipped", "img",
         "altered: ", [&] { WriteFile(kImg, img.substr(0, 70000) + "\x01" + img.substr(70001)); }},
        {"trusted comment changed", "img", "trusted comment altered: ",
         [&] { WriteFile(kSig, Edit(sig, "timestamp:", "timestamp:1")); }},
        {"another name", "other.img", "signed under another name: ", [] {}},
        {"bad base64", "img",
         "malformed signature: ", [&] { WriteFile(kSig, Edit(sig, "\ntrusted", "*\ntrusted")); }},
        {"cut short", "img",
         "malformed signature: ", [&] { WriteFile(kSig, sig.substr(0, sig.size() - 40)); }},
        {"legacy", "img", "legacy signature: ",
         [] { ASSERT_TRUE(Tool("rm img.minisig && minisign -S -l -s a.key -m img")); }},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        WriteFile(kImg, img);
        WriteFile(kSig, sig);
        row.change();
        why.clear();
        EXPECT_EQ(Verify("a.pub", row.name, why), !*row.reason) << why;
        EXPECT_EQ(why.rfind(row.reason, 0), 0u) << why;
    }
}

TEST_F(KytotrustTest, NewKeysAndTheTrustFolder) {
    std::string why;
    std::vector<kytotrust::PublicKey> keys;
    ASSERT_EQ(mkdir("/tmp/t/trusted.d", 0755), 0);
    EXPECT_FALSE(kytotrust::LoadTrustFolder(kDir + "trusted.d", keys, why));
    WriteFile(kDir + "trusted.d/junk.pub", "untrusted comment: x\nRWQAAA==\n");
    EXPECT_FALSE(kytotrust::LoadTrustFolder(kDir + "trusted.d", keys, why));
    EXPECT_NE(why.find("junk.pub"), std::string::npos) << why;
    ASSERT_TRUE(kytotrust::GenerateKeyPair(kDir + "trusted.d/a.pub", kDir + "a.key", "", why));
    struct stat st;
    ASSERT_EQ(stat((kDir + "a.key").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_FALSE(kytotrust::GenerateKeyPair(kDir + "b.pub", kDir + "a.key", "", why));
    EXPECT_NE(why.find("a.key exists already"), std::string::npos) << why;
    WriteFile(kDir + "trusted.d/a.txt", *ReadFile(kDir + "trusted.d/a.pub"));
    ASSERT_TRUE(kytotrust::LoadTrustFolder(kDir + "trusted.d", keys, why)) << why;
    ASSERT_EQ(keys.size(), 1u);
    EXPECT_EQ(keys[0].path, kDir + "trusted.d/a.pub");
    EXPECT_NE(why.find("junk.pub"), std::string::npos) << why;
}

}  // namespace
