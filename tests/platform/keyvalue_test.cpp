// key=value files: reading both line forms, bad arguments, unreadable files, over-long
// lines, in-place update, and replacement that another process never sees half done.
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

using kytotest::ListDir;
using kytotest::ReadFile;
using kytotest::WriteFile;

constexpr const char* kFile = "/tmp/kv/test.conf";

class KeyValueTest : public kytotest::SandboxTest {};

TEST_F(KeyValueTest, ReadsBothLineFormsAndSkipsComments) {
    WriteFile(kFile,
              "# note=commented\n"
              "plain=1\n"
              "quoted=\"two words\"\n"
              "\n"
              "  spaced = \"x\" \n"
              "empty=\n"
              "emptyquoted=\"\"\n"
              "abc=prefix\n"
              "dup=first\n"
              "dup=second\n"
              "noequals\n"
              "inner=a\"b\"c\n"
              "eq=a=b\n"
              "last=no newline");
    struct Case {
        const char* key;
        int rc;
        const char* value;
    } cases[] = {
        {"plain", 1, "1"},
        {"quoted", 9, "two words"},
        {"spaced", 1, "x"},
        {"empty", 0, ""},
        {"emptyquoted", 0, ""},
        {"dup", 5, "first"},
        {"note", 0, ""},
        {"# note", 0, ""},
        {"ab", 0, ""},
        {"noequals", 0, ""},
        {"inner", 5, "a\"b\"c"},
        {"eq", 3, "a=b"},
        {"last", 10, "no newline"},
    };
    for (const Case& c : cases) {
        char buf[64];
        memset(buf, 'Z', sizeof buf);
        EXPECT_EQ(KLIBCFileGetKeyValue(kFile, c.key, buf, sizeof buf, 0), c.rc) << c.key;
        EXPECT_STREQ(buf, c.value) << c.key;
    }
}

TEST_F(KeyValueTest, CutsValueToBufferSize) {
    WriteFile(kFile, "k=\"abcdef\"\n");
    char buf[8];
    memset(buf, 'Z', sizeof buf);
    EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf, 1, 0), 0);
    EXPECT_EQ(buf[0], '\0');
    EXPECT_EQ(buf[1], 'Z');
    EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf, 4, 0), 3);
    EXPECT_STREQ(buf, "abc");
    EXPECT_EQ(buf[4], 'Z');
    EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf, 7, 0), 6);
    EXPECT_STREQ(buf, "abcdef");
}

TEST_F(KeyValueTest, BadArgumentsAndUnreadableFilesLeaveBufferAlone) {
    WriteFile(kFile, "k=v\n");
    ASSERT_EQ(mkdir("/tmp/kv/folder", 0755), 0);
    char buf[16];
    struct Case {
        const char* path;
        const char* key;
        char* buf;
        int size;
        int flags;
        int err;
    } cases[] = {
        {nullptr, "k", buf, 16, 0, KYTO_ERR_BAD_PARAMETER},
        {"", "k", buf, 16, 0, KYTO_ERR_BAD_PARAMETER},
        {kFile, nullptr, buf, 16, 0, KYTO_ERR_BAD_PARAMETER},
        {kFile, "", buf, 16, 0, KYTO_ERR_BAD_PARAMETER},
        {kFile, "k", nullptr, 16, 0, KYTO_ERR_BAD_PARAMETER},
        {kFile, "k", buf, 0, 0, KYTO_ERR_BAD_PARAMETER},
        {kFile, "k", buf, -1, 0, KYTO_ERR_BAD_PARAMETER},
        {kFile, "k", buf, 16, 1, KYTO_ERR_BAD_PARAMETER},
        {"/tmp/kv/missing", "k", buf, 16, 0, KYTO_ERR_FILE_NOT_FOUND},
        {"/tmp/nofolder/x", "k", buf, 16, 0, KYTO_ERR_FILE_NOT_FOUND},
        {"/tmp/kv/folder", "k", buf, 16, 0, KYTO_ERR_FILE_OPEN},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.path ? c.path : "(null)") + " size " + std::to_string(c.size));
        strcpy(buf, "untouched");
        KLIBCErrSetEx(0, "", 0);
        EXPECT_EQ(KLIBCFileGetKeyValue(c.path, c.key, c.buf, c.size, c.flags), -1);
        EXPECT_EQ(KLIBCErrGet(), c.err);
        EXPECT_STREQ(buf, "untouched");
        EXPECT_NE(strstr(KLIBCErrorGetFile(), "platform/src/"), nullptr);
        EXPECT_GT(KLIBCErrorGetLine(), 0);
    }
}

TEST_F(KeyValueTest, LinesUpToTheLimitReadAndLongerOnesMakeTheFileUnreadable) {
    // "k=" plus the value is exactly the limit.
    std::string value(KLIBC_KV_MAX_LINE - 2, 'v');
    value[0] = 'A';
    value.back() = 'Z';
    WriteFile(kFile, "first=1\nk=" + value + "\nafter=2\n");
    std::vector<char> buf(KLIBC_KV_MAX_LINE + 16);
    EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf.data(), buf.size(), 0),
              static_cast<int>(value.size()));
    EXPECT_EQ(std::string(buf.data()), value);
    EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "after", buf.data(), buf.size(), 0), 1);

    // One byte more anywhere in the file, even after the key asked for.
    std::string tooLong = "first=1\nk=" + value + "x\n";
    WriteFile(kFile, tooLong);
    strcpy(buf.data(), "untouched");
    EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "first", buf.data(), buf.size(), 0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_LINE_TOO_LONG);
    EXPECT_STREQ(buf.data(), "untouched");

    // Such a file is not rewritten either.
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "first", "2", nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_LINE_TOO_LONG);
    EXPECT_EQ(ReadFile(kFile), tooLong);
    EXPECT_EQ(ListDir("/tmp/kv"), std::vector<std::string>{"test.conf"});
}

TEST_F(KeyValueTest, SetReplacesInPlaceAndKeepsEverythingElse) {
    WriteFile(kFile,
              "# header comment\n"
              "a=1\n"
              "\n"
              "b=\"old\"\n"
              "#b=\"commented\"\n"
              "c=3\n"
              "b=second\n");
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "b", "new value", nullptr), 1);
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "d", "4", "%s=%s\n"), 1);
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "x", "%s=%s"), 1);  // newline added
    EXPECT_EQ(ReadFile(kFile),
              "# header comment\n"
              "a=x\n"
              "\n"
              "b=\"new value\"\n"
              "#b=\"commented\"\n"
              "c=3\n"
              "b=second\n"
              "d=4\n");
    EXPECT_EQ(ListDir("/tmp/kv"), std::vector<std::string>{"test.conf"});
}

TEST_F(KeyValueTest, SetCreatesFilesAndKeepsModes) {
    mode_t old = umask(0);
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "k", "", nullptr), -1);  // no folder
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
    EXPECT_FALSE(kytotest::PathExists("/tmp/kv"));

    WriteFile("/tmp/kv/other", "x");
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "k", "", nullptr), 1);
    EXPECT_EQ(ReadFile(kFile), "k=\"\"\n");
    struct stat st;
    ASSERT_EQ(stat(kFile, &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0644u);

    WriteFile("/tmp/kv/secret", "k=1", 0600);
    EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/kv/secret", "j", "2", nullptr), 1);
    EXPECT_EQ(ReadFile("/tmp/kv/secret"), "k=1\nj=\"2\"\n");
    ASSERT_EQ(stat("/tmp/kv/secret", &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
    umask(old);

    ASSERT_EQ(mkdir("/tmp/kv/folder", 0755), 0);
    EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/kv/folder", "k", "v", nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
    EXPECT_EQ(ListDir("/tmp/kv"),
              (std::vector<std::string>{"folder", "other", "secret", "test.conf"}));
}

TEST_F(KeyValueTest, SetRejectsBadArgumentsAndFormats) {
    const std::string before = "k=\"v\"\n";
    WriteFile(kFile, before);
    struct Case {
        const char* path;
        const char* key;
        const char* value;
        const char* format;
    } cases[] = {
        {nullptr, "k", "v", nullptr},    {"", "k", "v", nullptr},
        {kFile, nullptr, "v", nullptr},  {kFile, "", "v", nullptr},
        {kFile, "k", nullptr, nullptr},  {kFile, "a=b", "v", nullptr},
        {kFile, "a\nb", "v", nullptr},   {kFile, "#k", "v", nullptr},
        {kFile, " k", "v", nullptr},     {kFile, "k", "two\nlines", nullptr},
        {kFile, "k", "v", "%s"},         {kFile, "k", "v", "%s=%s=%s\n"},
        {kFile, "k", "v", "%d=%s\n"},    {kFile, "k", "v", "%s=%s%n"},
        {kFile, "k", "v", "%5s=%s\n"},   {kFile, "k", "v", "%s=%s%"},
        {kFile, "k", "v", "plain text"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.key ? c.key : "(null)") + " / " +
                     (c.format ? c.format : "(null)"));
        KLIBCErrSetEx(0, "", 0);
        EXPECT_EQ(KLIBCFileSetKeyValue(c.path, c.key, c.value, c.format), -1);
        EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    }
    EXPECT_EQ(ReadFile(kFile), before);
    // A literal percent sign is fine.
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "k", "50", "%s=%s%%\n"), 1);
    EXPECT_EQ(ReadFile(kFile), "k=50%\n");
}

TEST_F(KeyValueTest, ReaderInAnotherProcessNeverSeesATornOrMissingFile) {
    const std::string shortValue = "s";
    const std::string longValue(3000, 'L');
    WriteFile(kFile, "# settings\nbefore=1\nvalue=\"" + shortValue + "\"\nafter=2\n");
    pid_t reader = kytotest::Spawn([&]() {
        std::vector<char> buf(8192);
        int bad = 0;
        for (long i = 0; i < 50000000; ++i) {
            int n = KLIBCFileGetKeyValue(kFile, "value", buf.data(), buf.size(), 0);
            std::string got(buf.data());
            if (n < 0 || (got != shortValue && got != longValue))
                ++bad;
            if (KLIBCFileGetKeyValue(kFile, "after", buf.data(), buf.size(), 0) != 1)
                ++bad;
            if (KLIBCFileGetKeyValue(kFile, "stop", buf.data(), buf.size(), 0) == 3)
                break;
        }
        return bad == 0 ? 0 : 1;
    });
    for (int i = 0; i < 3000; ++i) {
        ASSERT_EQ(KLIBCFileSetKeyValue(kFile, "value",
                                       i % 2 ? shortValue.c_str() : longValue.c_str(), nullptr),
                  1);
    }
    ASSERT_EQ(KLIBCFileSetKeyValue(kFile, "stop", "yes", nullptr), 1);
    EXPECT_EQ(kytotest::Wait(reader), 0);
    EXPECT_EQ(ListDir("/tmp/kv"), std::vector<std::string>{"test.conf"});
}

TEST_F(KeyValueTest, FileExistFollowsLinks) {
    WriteFile(kFile, "");
    ASSERT_EQ(symlink(kFile, "/tmp/kv/link"), 0);
    ASSERT_EQ(symlink("/tmp/kv/none", "/tmp/kv/dangling"), 0);
    EXPECT_EQ(KLIBCFileExist(kFile), 1);
    EXPECT_EQ(KLIBCFileExist("/tmp/kv"), 1);
    EXPECT_EQ(KLIBCFileExist("/tmp/kv/link"), 1);
    EXPECT_EQ(KLIBCFileExist("/tmp/kv/dangling"), 0);
    EXPECT_EQ(KLIBCFileExist("/tmp/kv/none"), 0);
    EXPECT_EQ(KLIBCFileExist(nullptr), 0);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

}  // namespace
