// The thread's last error, the plain log appender and the system event log.
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <thread>

#include <gtest/gtest.h>
#include <kytoplatform/kytoplatform.h>
#include <syslog.h>

#include "sandbox.h"

namespace {

using kytotest::ReadFile;

class ErrorsLogTest : public kytotest::SandboxTest {};

TEST_F(ErrorsLogTest, LastErrorIsPerThreadAndCopiesTheFileName) {
    KLIBCErrSetEx(0, nullptr, 0);
    EXPECT_EQ(KLIBCErrGet(), 0);
    EXPECT_STREQ(KLIBCErrorGetFile(), "");
    EXPECT_EQ(KLIBCErrorGetLine(), 0);

    char name[] = "caller.cpp";
    KLIBCErrSetEx(KYTO_ERR_FILE_READ, name, 42);
    name[0] = 'X';
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_READ);
    EXPECT_STREQ(KLIBCErrorGetFile(), "caller.cpp");
    EXPECT_EQ(KLIBCErrorGetLine(), 42);

    std::string longName(1000, 'n');
    KLIBCErrSetEx(1, longName.c_str(), 1);
    EXPECT_EQ(std::string(KLIBCErrorGetFile()), longName.substr(0, 255));

    int otherCode = -1;
    std::string otherFile;
    std::thread([&] {
        otherCode = KLIBCErrGet();
        KLIBCErrSetEx(7, "thread.cpp", 7);
        otherFile = KLIBCErrorGetFile();
    }).join();
    EXPECT_EQ(otherCode, 0);
    EXPECT_EQ(otherFile, "thread.cpp");
    EXPECT_EQ(KLIBCErrGet(), 1);
}

TEST_F(ErrorsLogTest, FailuresRecordTheirSiteAndSuccessKeepsIt) {
    char buf[8];
    EXPECT_EQ(KLIBCFileGetKeyValue("/tmp/missing", "k", buf, sizeof buf, 0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
    std::string file = KLIBCErrorGetFile();
    int line = KLIBCErrorGetLine();
    EXPECT_NE(file.find("platform/src/keyvalue.cpp"), std::string::npos) << file;
    EXPECT_GT(line, 0);

    // A different failure site gives a different triple ...
    EXPECT_EQ(KLIBCFileGetKeyValue("/tmp/missing", "k", buf, 0, 0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    EXPECT_NE(KLIBCErrorGetLine(), line);
    EXPECT_EQ(KLIBCReadPidFile("/tmp/missing"), -1);
    EXPECT_NE(std::string(KLIBCErrorGetFile()).find("process.cpp"), std::string::npos);

    // ... and successful calls leave it alone.
    KLIBCErrSetEx(KYTO_ERR_SYSTEM, "mine.cpp", 9);
    EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/kv", "k", "v", nullptr), 1);
    EXPECT_EQ(KLIBCFileGetKeyValue("/tmp/kv", "k", buf, sizeof buf, 0), 1);
    EXPECT_EQ(KLIBCFileGetKeyValue("/tmp/kv", "absent", buf, sizeof buf, 0), 0);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_SYSTEM);
    EXPECT_STREQ(KLIBCErrorGetFile(), "mine.cpp");
    EXPECT_EQ(KLIBCErrorGetLine(), 9);
}

TEST_F(ErrorsLogTest, ErrLogSetAppendsLines) {
    mode_t old = umask(0);
    EXPECT_EQ(KLIBCErrLogSet("/tmp/log/err.log", "x"), -1);  // no folder
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
    EXPECT_FALSE(kytotest::PathExists("/tmp/log"));

    EXPECT_EQ(KLIBCErrLogSet("/tmp/err.log", "first line"), 0);
    EXPECT_EQ(KLIBCErrLogSet("/tmp/err.log", ""), 0);
    EXPECT_EQ(KLIBCErrLogSet("/tmp/err.log", "third"), 0);
    umask(old);
    EXPECT_EQ(ReadFile("/tmp/err.log"), "first line\n\nthird\n");
    struct stat st;
    ASSERT_EQ(stat("/tmp/err.log", &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0644u);

    EXPECT_EQ(KLIBCErrLogSet("/tmp", "x"), -1);  // a folder
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
    EXPECT_EQ(KLIBCErrLogSet(nullptr, "x"), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    EXPECT_EQ(KLIBCErrLogSet("/tmp/err.log", nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

TEST_F(ErrorsLogTest, EventLogGoesToTheFileAndSyslog) {
    kytotest::ClearSyslog();
    EXPECT_EQ(KYTOLogSet1(1, 2, 0x11300042, "update", "5.2-5644", nullptr, "done"), 0);
    EXPECT_EQ(KYTOLogSet1(3, 0, 7, nullptr, nullptr, nullptr, nullptr), 0);
    EXPECT_EQ(ReadFile(KYTO_EVENT_LOG_PATH),
              "1 2 0x11300042 update 5.2-5644  done\n"
              "3 0 0x00000007    \n");
    EXPECT_TRUE(kytotest::SyslogContains("1 2 0x11300042 update 5.2-5644  done", LOG_NOTICE));
    EXPECT_TRUE(kytotest::SyslogContains("3 0 0x00000007", LOG_NOTICE));

    // When the log file cannot be written (a folder in its place) syslog still gets the line.
    ASSERT_EQ(unlink(KYTO_EVENT_LOG_PATH), 0);
    ASSERT_EQ(mkdir(KYTO_EVENT_LOG_PATH, 0755), 0);
    EXPECT_EQ(KYTOLogSet1(4, 1, 0xFFFFFFFF, "a", "b", "c", "d"), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
    EXPECT_TRUE(kytotest::SyslogContains("4 1 0xFFFFFFFF a b c d", LOG_NOTICE));
}

}  // namespace
