// key=value files: both line forms, bad arguments, unreadable files, over-long lines,
// in-place update, and replacement that another process never sees half done.
#include <sys/stat.h>
#include <unistd.h>

#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

using namespace kytotest;
using Names = std::vector<std::string>;
constexpr const char* kFile = "/tmp/kv/test.conf";
using KeyValueTest = SandboxTest;

TEST_F(KeyValueTest, ReadsBothLineFormsIntoBoundedBuffers) {
    WriteFile(kFile,
              "# note=commented\nplain=1\nquoted=\"two words\"\n\n  spaced = \"x\" \nempty=\n"
              "abc=prefix\ndup=first\ndup=second\nnoequals\ninner=a\"b\"c\neq=a=b\n"
              "cut=\"abcdef\"\nlast=no newline");
    // clang-format off
    struct Case { const char* key; int size; int rc; const char* value; } cases[] = {
        {"plain", 64, 1, "1"}, {"quoted", 64, 9, "two words"}, {"spaced", 64, 1, "x"},
        {"dup", 64, 5, "first"}, {"note", 64, 0, ""}, {"ab", 64, 0, ""}, {"noequals", 64, 0, ""},
        {"inner", 64, 5, "a\"b\"c"}, {"eq", 64, 3, "a=b"}, {"last", 64, 10, "no newline"},
        {"cut", 4, 3, "abc"}, {"cut", 7, 6, "abcdef"}, {"cut", 1, 0, ""}};
    // clang-format on
    for (const Case& c : cases) {
        char buf[72];
        memset(buf, 'Z', sizeof buf);
        EXPECT_EQ(KLIBCFileGetKeyValue(kFile, c.key, buf, c.size, 0), c.rc) << c.key;
        EXPECT_EQ(std::string(c.value) + " Z", buf + std::string(" ") + buf[c.size]) << c.key;
    }
}

TEST_F(KeyValueTest, BadArgumentsAndUnreadableFilesLeaveTheBufferAlone) {
    WriteFile(kFile, "k=v\n");
    WriteFile("/tmp/kv/long", "first=1\nk=" + std::string(KLIBC_KV_MAX_LINE - 1, 'v') + "\n");
    ASSERT_EQ(mkdir("/tmp/kv/folder", 0755), 0);
    char buf[16];
    const int kBad = KYTO_ERR_BAD_PARAMETER;
    // One byte over the line limit makes the whole file unreadable, even for a key that
    // comes before the long line.
    // clang-format off
    struct Case { const char* path; const char* key; char* buf; int size; int flags; int err; }
    cases[] = {
        {kFile, "", buf, 16, 0, kBad}, {kFile, "k", buf, 0, 0, kBad},
        {kFile, "k", buf, 16, 1, kBad}, {"/tmp/kv/folder", "k", buf, 16, 0, KYTO_ERR_FILE_OPEN},
        {"/tmp/kv/missing", "k", buf, 16, 0, KYTO_ERR_FILE_NOT_FOUND},
        {"/tmp/kv/long", "first", buf, 16, 0, KYTO_ERR_LINE_TOO_LONG}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.path ? c.path : "(null)") + " " + (c.key ? c.key : "(null)"));
        strcpy(buf, "untouched");
        ClearLastError();
        EXPECT_EQ(KLIBCFileGetKeyValue(c.path, c.key, c.buf, c.size, c.flags), -1);
        EXPECT_EQ(KLIBCErrGet(), c.err);
        EXPECT_STREQ(buf, "untouched");
    }
}

TEST_F(KeyValueTest, SetReplacesTheFirstLineAndKeepsEverythingElse) {
    WriteFile(kFile, "# header\na=1\n\nb=\"old\"\n#b=\"commented\"\nc=3\nb=second", 0600);
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "b", "new value", nullptr), 1);
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "d", "4", "%s=%s\n"), 1);
    EXPECT_EQ(ReadFile(kFile),
              "# header\na=1\n\nb=\"new value\"\n#b=\"commented\"\nc=3\nb=second\nd=4\n");
    EXPECT_EQ(ModeOf(kFile), 0600u);

    // A new file is 0644 whatever the umask; a missing folder is not created.
    mode_t old = umask(077);
    EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/kv/new", "k", "", nullptr), 1);
    umask(old);
    EXPECT_EQ(ReadFile("/tmp/kv/new"), "k=\"\"\n");
    EXPECT_EQ(ModeOf("/tmp/kv/new"), 0644u);
    ASSERT_EQ(mkdir("/tmp/kv/folder", 0755), 0);
    EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/kv/folder", "k", "v", nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
    EXPECT_EQ(ListDir("/tmp/kv"), (Names{"folder", "new", "test.conf"}));  // no temporaries
}

TEST_F(KeyValueTest, SetRejectsBadArgumentsAndFormats) {
    WriteFile(kFile, "k=\"v\"\n");
    // clang-format off
    struct Case { const char* path; const char* key; const char* value; const char* format; }
    cases[] = {
        {nullptr, "k", "v", nullptr}, {kFile, "k", nullptr, nullptr}, {kFile, "a=b", "v", nullptr},
        {kFile, "#k", "v", nullptr}, {kFile, "k", "two\nlines", nullptr}, {kFile, "k", "v", "%s"},
        {kFile, "k", "v", "%d=%s\n"}, {kFile, "k", "v", "%s=%s%n"}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.key ? c.key : "(null)") + " / " +
                     (c.format ? c.format : "(null)"));
        ClearLastError();
        EXPECT_EQ(KLIBCFileSetKeyValue(c.path, c.key, c.value, c.format), -1);
        EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    }
    EXPECT_EQ(ReadFile(kFile), "k=\"v\"\n");
}

TEST_F(KeyValueTest, ReaderInAnotherProcessNeverSeesATornOrMissingFile) {
    const std::string longValue(3000, 'L');
    WriteFile(kFile, "# settings\nbefore=1\nvalue=\"s\"\nafter=2\n");
    auto write = [&](int i) {
        return KLIBCFileSetKeyValue(kFile, "value", i % 2 ? "s" : longValue.c_str(), nullptr) == 1;
    };
    auto check = [&] {
        std::vector<char> buf(8192);
        int n = KLIBCFileGetKeyValue(kFile, "value", buf.data(), buf.size(), 0);
        if (n < 0 || (std::string(buf.data()) != "s" && buf.data() != longValue))
            return 1;
        return KLIBCFileGetKeyValue(kFile, "after", buf.data(), buf.size(), 0) == 1 ? 0 : 2;
    };
    EXPECT_EQ(0, RaceReaderAgainstWriter(3000, write, check));
    EXPECT_EQ(ListDir("/tmp/kv"), Names{"test.conf"});
}

}  // namespace
