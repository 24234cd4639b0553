// Running programs (exit codes, signals, arguments, standard input) and pid files.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>
#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

using kytotest::ReadFile;
using kytotest::WriteFile;

constexpr const char* kPidFile = "/var/run/test.pid";

class ProcessTest : public kytotest::SandboxTest {};

TEST_F(ProcessTest, ExecReturnsExitStatus) {
    struct Case {
        const char* script;
        int status;
    } cases[] = {{"exit 0", 0}, {"exit 3", 3}, {"exit 255", 255}, {"exit 256", 0}};
    for (const Case& c : cases) {
        EXPECT_EQ(KLIBCExec("/bin/sh", "-c", c.script, nullptr, nullptr), c.status) << c.script;
    }
}

TEST_F(ProcessTest, ExecReportsSignalDeathAsError) {
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCExec("/bin/sh", "-c", "kill -TERM $$", nullptr, nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_EXEC);
    char* argv[] = {const_cast<char*>("sh"), const_cast<char*>("-c"),
                    const_cast<char*>("kill -KILL $$"), nullptr};
    EXPECT_EQ(KLIBCExecv("/bin/sh", argv, 1), -1);
}

TEST_F(ProcessTest, ExecPassesArgumentsUpToTheFirstNull) {
    const char* script = "printf '%s|' \"$0\" \"$@\" > /tmp/args";
    EXPECT_EQ(KLIBCExec("/bin/sh", "-c", script, "zero", "one two"), 0);
    EXPECT_EQ(ReadFile("/tmp/args"), "zero|one two|");
    EXPECT_EQ(KLIBCExec("/bin/sh", "-c", script, nullptr, "ignored"), 0);
    EXPECT_EQ(ReadFile("/tmp/args"), "/bin/sh|");  // $0 is argv[0], the program itself

    char* argv[] = {const_cast<char*>("name"),
                    const_cast<char*>("-c"),
                    const_cast<char*>(script),
                    const_cast<char*>("a"),
                    const_cast<char*>(""),
                    const_cast<char*>("$HOME"),
                    nullptr};
    EXPECT_EQ(KLIBCExecv("/bin/sh", argv, 1), 0);
    EXPECT_EQ(ReadFile("/tmp/args"), "a||$HOME|");
}

TEST_F(ProcessTest, ChildReadsStandardInputFromDevNull) {
    EXPECT_EQ(KLIBCExec("/bin/sh", "-c", "readlink /proc/$$/fd/0 > /tmp/stdin; cat > /tmp/read",
                        nullptr, nullptr),
              0);
    EXPECT_EQ(ReadFile("/tmp/stdin"), "/dev/null\n");
    EXPECT_EQ(ReadFile("/tmp/read"), "");
}

TEST_F(ProcessTest, NoPathSearchAndUnrunnableProgramsExit127) {
    ASSERT_EQ(chdir("/tmp"), 0);
    EXPECT_EQ(KLIBCExec("sh", "-c", "exit 0", nullptr, nullptr), 127);
    EXPECT_EQ(KLIBCExec("/nonexistent/program", nullptr, nullptr, nullptr, nullptr), 127);
    WriteFile("/tmp/notexec.sh", "#!/bin/sh\nexit 0\n", 0644);
    EXPECT_EQ(KLIBCExec("/tmp/notexec.sh", nullptr, nullptr, nullptr, nullptr), 127);
    // A relative path is taken from the working folder.
    WriteFile("/tmp/exec.sh", "#!/bin/sh\nexit 4\n", 0755);
    EXPECT_EQ(KLIBCExec("./exec.sh", nullptr, nullptr, nullptr, nullptr), 4);
    ASSERT_EQ(chdir("/"), 0);
}

TEST_F(ProcessTest, ExecRejectsBadArguments) {
    char* noArgv0[] = {nullptr};
    char* argv[] = {const_cast<char*>("true"), nullptr};
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCExec(nullptr, "a", nullptr, nullptr, nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCExec("", nullptr, nullptr, nullptr, nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCExecv(nullptr, argv, 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCExecv("/bin/true", nullptr, 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCExecv("/bin/true", noArgv0, 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

TEST_F(ProcessTest, ExecvWithoutWaitReturnsAPidToReap) {
    char* argv[] = {const_cast<char*>("sh"), const_cast<char*>("-c"),
                    const_cast<char*>("read x < /tmp/fifo; exit 5"), nullptr};
    ASSERT_EQ(mkfifo("/tmp/fifo", 0600), 0);
    int pid = KLIBCExecv("/bin/sh", argv, 0);
    ASSERT_GT(pid, 0);
    // Still running: it waits for the fifo.
    EXPECT_EQ(waitpid(pid, nullptr, WNOHANG), 0);
    EXPECT_EQ(KLIBCExec("/bin/sh", "-c", "echo go > /tmp/fifo", nullptr, nullptr), 0);
    EXPECT_EQ(kytotest::Wait(pid), 5);
}

TEST_F(ProcessTest, ReadPidFileAcceptsOnlyPositiveNumbers) {
    struct Case {
        const char* content;
        int pid;
    } cases[] = {
        {"123", 123},
        {"123\n", 123},
        {"123 \n", 123},
        {"7\r\n", 7},
        {"", 0},
        {"\n", 0},
        {"abc", 0},
        {"0", 0},
        {"0\n", 0},
        {"-5", 0},
        {"+5", 0},
        {" 5", 0},
        {"12abc", 0},
        {"12 34", 0},
        {"2147483647", 2147483647},
        {"2147483648", 0},
        {"99999999999999999999", 0},
    };
    for (const Case& c : cases) {
        WriteFile(kPidFile, c.content);
        EXPECT_EQ(KLIBCReadPidFile(kPidFile), c.pid) << '"' << c.content << '"';
    }
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCReadPidFile("/var/run/missing.pid"), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
    EXPECT_EQ(KLIBCReadPidFile("/var/run"), -1);  // a folder cannot be read as a file
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_OPEN);
    EXPECT_EQ(KLIBCReadPidFile(nullptr), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

TEST_F(ProcessTest, IsProcAliveFollowsThePidInTheFile) {
    WriteFile(kPidFile, std::to_string(getpid()) + "\n");
    EXPECT_EQ(KLIBCIsProcAlive(kPidFile), 1);

    pid_t dead = kytotest::Spawn([] { return 0; });
    ASSERT_EQ(kytotest::Wait(dead), 0);
    WriteFile(kPidFile, std::to_string(dead));
    EXPECT_EQ(KLIBCIsProcAlive(kPidFile), 0);

    for (const char* content : {"", "0", "-1", "garbage"}) {
        WriteFile(kPidFile, content);
        EXPECT_EQ(KLIBCIsProcAlive(kPidFile), 0) << content;
    }
    EXPECT_EQ(KLIBCIsProcAlive("/var/run/missing.pid"), 0);
    EXPECT_EQ(KLIBCIsProcAlive(nullptr), 0);
}

TEST_F(ProcessTest, KillSendsTermOrKill) {
    struct Case {
        int force;
        int status;
    } cases[] = {{0, 128 + SIGTERM}, {1, 128 + SIGKILL}};
    for (const Case& c : cases) {
        // The child waits until signalled.
        pid_t child = kytotest::Spawn([] {
            signal(SIGTERM, SIG_DFL);
            for (;;)
                pause();
            return 0;
        });
        WriteFile(kPidFile, std::to_string(child) + "\n");
        EXPECT_EQ(KLIBCKill(kPidFile, c.force), 0);
        EXPECT_EQ(kytotest::Wait(child), c.status);
    }
    // A process that ignores SIGTERM only goes with the forced kill.
    pid_t stubborn = kytotest::Spawn([] {
        signal(SIGTERM, SIG_IGN);
        WriteFile("/tmp/ready", "");
        for (;;)
            pause();
        return 0;
    });
    for (int i = 0; i < 10000 && !kytotest::PathExists("/tmp/ready"); ++i)
        usleep(1000);
    ASSERT_TRUE(kytotest::PathExists("/tmp/ready"));
    WriteFile(kPidFile, std::to_string(stubborn));
    EXPECT_EQ(KLIBCKill(kPidFile, 0), 0);
    EXPECT_EQ(waitpid(stubborn, nullptr, WNOHANG), 0);
    EXPECT_EQ(KLIBCKill(kPidFile, 1), 0);
    EXPECT_EQ(kytotest::Wait(stubborn), 128 + SIGKILL);

    // Now it is gone.
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KLIBCKill(kPidFile, 0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_PROCESS);
    WriteFile(kPidFile, "0");
    EXPECT_EQ(KLIBCKill(kPidFile, 1), -1);
    EXPECT_EQ(KLIBCKill("/var/run/missing.pid", 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
}

}  // namespace
