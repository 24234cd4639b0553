// Running programs (exit codes, signals, arguments, standard input) and pid files.
#include <signal.h>
#include <unistd.h>

#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

using namespace kytotest;
constexpr const char* kPidFile = "/var/run/test.pid";
using ProcessTest = SandboxTest;

TEST_F(ProcessTest, ExecReturnsTheExitStatusAndMinusOneOnSignalDeath) {
    WriteFile("/tmp/notexec.sh", "#!/bin/sh\nexit 0\n", 0644);
    WriteFile("/tmp/exec.sh", "#!/bin/sh\nexit 4\n", 0755);
    ASSERT_EQ(chdir("/tmp"), 0);
    // clang-format off
    struct Case { const char* prog; const char* script; int status; int err; } cases[] = {
        {"/bin/sh", "exit 255", 255, 0}, {"/bin/sh", "kill -TERM $$", -1, KYTO_ERR_EXEC},
        {"sh", "exit 0", 127, KYTO_ERR_EXEC},  // no PATH search
        {"/tmp/notexec.sh", nullptr, 127, KYTO_ERR_EXEC},
        {"./exec.sh", nullptr, 4, 0},  // relative to the working folder
        // Arguments end at the first null, argv[0] is the program, standard input /dev/null.
        {"/bin/sh", "[ $# = 0 ] && [ $0 = /bin/sh ] && [ $(readlink /proc/$$/fd/0) = /dev/null ]",
         0, 0},
        {nullptr, nullptr, -1, KYTO_ERR_BAD_PARAMETER}};
    // clang-format on
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.prog ? c.prog : "(null)") + " " + (c.script ? c.script : ""));
        ClearLastError();
        const char* dash = c.script ? "-c" : nullptr;
        EXPECT_EQ(KLIBCExec(c.prog, dash, c.script, nullptr, "ignored"), c.status);
        EXPECT_EQ(KLIBCErrGet(), c.err);
    }
    ASSERT_EQ(chdir("/"), 0);
}

// Without waiting: the child's pid; its arguments pass as they are (empty ones included).
TEST_F(ProcessTest, ExecvWithoutWaitReturnsAPidToReap) {
    std::string words[] = {"sh",   "-c", "[ -z \"$1\" ] && [ \"$2\" = '$HOME' ] && exit 5",
                           "zero", "",   "$HOME"};
    char* argv[] = {&words[0][0], &words[1][0], &words[2][0], &words[3][0],
                    &words[4][0], &words[5][0], nullptr};
    const int pid = KLIBCExecv("/bin/sh", argv, 0);
    ASSERT_GT(pid, 0);
    EXPECT_EQ(Wait(pid), 5);  // only a child of ours can be waited for
    char* noArgv0[] = {nullptr};
    EXPECT_EQ(KLIBCExecv("/bin/true", noArgv0, 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

TEST_F(ProcessTest, ReadPidFileAcceptsOnlyPositiveNumbers) {
    // clang-format off
    struct Case { const char* content; int pid; } cases[] = {
        {"123 \n", 123}, {"7\r\n", 7}, {"", 0}, {"0\n", 0}, {"-5", 0}, {"+5", 0}, {" 5", 0},
        {"12abc", 0}, {"12 34", 0}, {"2147483647", 2147483647}, {"2147483648", 0}};
    // clang-format on
    for (const Case& c : cases) {
        WriteFile(kPidFile, c.content);
        EXPECT_EQ(KLIBCReadPidFile(kPidFile), c.pid) << '"' << c.content << '"';
    }
    EXPECT_EQ(KLIBCReadPidFile("/var/run/missing.pid"), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);
}

TEST_F(ProcessTest, AliveAndKillFollowThePidInTheFile) {
    EXPECT_EQ(KLIBCKill("/var/run/missing.pid", 1), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_FILE_NOT_FOUND);

    // The plain kill sends SIGTERM, the forced one SIGKILL; a reaped process is gone.
    for (int force : {0, 1}) {
        pid_t child = SpawnIdle();
        WriteFile(kPidFile, std::to_string(child));
        EXPECT_EQ(KLIBCIsProcAlive(kPidFile), 1);
        EXPECT_EQ(KLIBCKill(kPidFile, force), 0);
        EXPECT_EQ(Wait(child), 128 + (force ? SIGKILL : SIGTERM));
    }
    EXPECT_EQ(KLIBCIsProcAlive(kPidFile), 0);
    ClearLastError();
    EXPECT_EQ(KLIBCKill(kPidFile, 0), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_PROCESS);
}

}  // namespace
