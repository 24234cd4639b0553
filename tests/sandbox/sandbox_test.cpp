// Self-tests of the sandbox root and the shared test helpers.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/statvfs.h>
#include <syslog.h>
#include <unistd.h>

#include <climits>

#include <gtest/gtest.h>

#include "sandbox.h"

using namespace kytotest;

namespace {

class SandboxSelfTest : public SandboxTest {};

TEST_F(SandboxSelfTest, ProvisionedVersionAndModelFiles) {
    std::map<std::string, std::string> version = ReadKeyValueFile("/etc.defaults/VERSION");
    std::map<std::string, std::string> expected = {
        {"majorversion", "5"},   {"minorversion", "2"},       {"buildphase", "GM"},
        {"buildnumber", "5644"}, {"builddate", "2026/10/01"},
    };
    EXPECT_EQ(version, expected);

    std::map<std::string, std::string> info = ReadKeyValueFile("/etc.defaults/kytoinfo.conf");
    EXPECT_EQ(info["unique"], "demo_model");
    EXPECT_EQ(info["timezone"], "Europe/Berlin");
    EXPECT_EQ(info["supportraid"], "no");
    EXPECT_EQ(info["support_buildin_storage"], "no");
    EXPECT_EQ(info["maxdisks"], "4");

    for (const char* absent : {"/autoupd@te.info", "/passive_upd@te.info", "/var/run/kytoha.status",
                               "/var/log/kyto-calls.log"})
        EXPECT_FALSE(PathExists(absent)) << absent;
}

TEST_F(SandboxSelfTest, ToolsAreLinkedAndRunnable) {
    std::string out;
    EXPECT_EQ(Shell("/usr/kyto/bin/wget --version", &out), 0) << out;
    EXPECT_NE(out.find("Wget"), std::string::npos) << out;
    EXPECT_EQ(Shell("/usr/kyto/bin/openssl version", &out), 0) << out;
    EXPECT_NE(out.find("OpenSSL"), std::string::npos) << out;
    char target[PATH_MAX] = {};
    ASSERT_GT(readlink("/usr/kyto/bin/wget", target, sizeof target - 1), 0);
    EXPECT_EQ(target[0], '/') << "link must hold the tool's absolute real path";
}

TEST_F(SandboxSelfTest, WorkingFolderIsRootAndTmpIsSticky) {
    char cwd[PATH_MAX] = {};
    ASSERT_NE(getcwd(cwd, sizeof cwd), nullptr);
    EXPECT_STREQ(cwd, "/");
    struct stat st;
    ASSERT_EQ(stat("/tmp", &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 01777u);
    EXPECT_TRUE(IsDirectory("/var/run"));
    EXPECT_TRUE(IsDirectory("/var/log"));
}

TEST_F(SandboxSelfTest, ProcDevSysAreTheSandboxesOwn) {
    // Own pid namespace: the launcher's init is pid 1 and no host process is visible.
    EXPECT_EQ(ReadFile("/proc/1/comm").value_or(""), "kyto-sandbox\n");
    std::string out;
    ASSERT_EQ(Shell("ps -e -o comm= | sort -u | tr '\\n' ' '", &out), 0);
    EXPECT_EQ(out, "kyto-sandbox ps sandbox_sandbox sh sort tr ");

    // A private /dev: only the few nodes tests need, never the host's disks.
    std::vector<std::string> dev = {"fd",  "full",   "log",   "null",   "ptmx", "pts",     "random",
                                    "shm", "stderr", "stdin", "stdout", "tty",  "urandom", "zero"};
    EXPECT_EQ(ListDir("/dev"), dev);
    struct stat st;
    ASSERT_EQ(stat("/dev/log", &st), 0);
    EXPECT_TRUE(S_ISSOCK(st.st_mode));
    EXPECT_EQ(Shell("echo x > /dev/null && head -c 4 /dev/urandom | wc -c | grep -qx 4"), 0);

    // /sys and what is mounted below it are read-only; /tmp and /run are fresh and empty.
    struct statvfs vfs;
    ASSERT_EQ(statvfs("/sys", &vfs), 0);
    EXPECT_NE(vfs.f_flag & ST_RDONLY, 0u);
    if (statvfs("/sys/fs/cgroup", &vfs) == 0) {
        EXPECT_NE(vfs.f_flag & ST_RDONLY, 0u);
    }
    EXPECT_TRUE(ListDir("/tmp").empty());
    for (const char* dir : {"/tmp", "/run"}) {
        struct statfs fs;
        ASSERT_EQ(statfs(dir, &fs), 0);
        EXPECT_EQ(fs.f_type, static_cast<decltype(fs.f_type)>(0x01021994)) << dir << " not tmpfs";
    }
}

// Writes to the appliance paths land in the sandbox's overlay; scripts/test.sh checks after
// the run that none of them appeared on the host.
TEST_F(SandboxSelfTest, ApplianceWritesStayInsideTheSandbox) {
    WriteFile("/autoupd@te.info", "{}");
    WriteFile("/.upgrade_vol", "");
    WriteFile("/var/run/downloadVYX.status", "percentage=\"1\"\n");
    WriteFile("/var/log/kytoupdate.log", "x\n");
    SetKeyValue("/etc.defaults/VERSION", "smallfixnumber", std::string("9"));
    EXPECT_EQ(ReadKeyValueFile("/etc.defaults/VERSION")["smallfixnumber"], "9");
    EXPECT_EQ(ReadKeyValueFile("/var/run/downloadVYX.status")["percentage"], "1");
    std::string mounts = ReadFile("/proc/self/mounts").value_or("");
    EXPECT_EQ(mounts.rfind("overlay / overlay ", 0), 0u) << mounts;
}

TEST_F(SandboxSelfTest, RecordingScriptsKeepArgumentsAndHonourExitOverride) {
    ClearRecordedCalls();
    EXPECT_EQ(Shell("/usr/kyto/bin/kytopkg startall"), 0);
    EXPECT_EQ(Shell("/usr/kyto/bin/kytovyxnotify 'two words' '<a href=\"x\">' '{\"k\":1}' ''"), 0);
    WriteFile("/var/run/fake-exit/S20samba.sh", "3\n");
    EXPECT_EQ(Shell("/usr/kyto/etc/rc.d/S20samba.sh stop"), 3);
    EXPECT_EQ(Shell("/usr/kyto/etc/rc.d/S99sshd.sh start"), 0);

    std::vector<std::vector<std::string>> expected = {
        {"kytopkg", "startall"},
        {"kytovyxnotify", "two words", "<a href=\"x\">", "{\"k\":1}", ""},
        {"S20samba.sh", "stop"},
        {"S99sshd.sh", "start"},
    };
    EXPECT_EQ(RecordedCalls(), expected);
    ClearRecordedCalls();
    EXPECT_TRUE(RecordedCalls().empty());
}

TEST_F(SandboxSelfTest, SyslogRoundTripKeepsPriorityTagAndText) {
    ClearSyslog();
    openlog("selftest", LOG_PID, LOG_USER);
    syslog(LOG_ERR, "%s:%d broken \"thing\" with\nsecond line \\ end", "update_cpputil", 42);
    syslog(LOG_INFO, "just info");
    closelog();

    std::vector<LogLine> lines = SyslogLines();
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0].priority, LOG_ERR);
    EXPECT_EQ(lines[0].tag, "selftest[" + std::to_string(getpid()) + "]");
    EXPECT_EQ(lines[0].message, "update_cpputil:42 broken \"thing\" with\nsecond line \\ end");
    EXPECT_EQ(lines[1].priority, LOG_INFO);

    EXPECT_TRUE(SyslogContains("broken \"thing\"", LOG_ERR));
    EXPECT_FALSE(SyslogContains("broken", LOG_INFO));
    EXPECT_EQ(SyslogMessages(LOG_INFO), std::vector<std::string>{"just info"});

    ClearSyslog();
    EXPECT_TRUE(SyslogLines().empty());
    syslog(LOG_WARNING, "from a child");
    EXPECT_EQ(Wait(Spawn([] {
                  syslog(LOG_ERR, "child says %d", 7);
                  return 0;
              })),
              0);
    EXPECT_TRUE(SyslogContains("child says 7", LOG_ERR));
    EXPECT_EQ(SyslogMessages().size(), 2u);
}

TEST_F(SandboxSelfTest, VolumesHaveExactFreeSpaceAndReadOnlyFlag) {
    const unsigned long long size = 209715200ULL;
    MountVolume("/volume1", size);
    MountVolume("/volume2", 3 * 4096, true);
    struct statvfs vfs;
    ASSERT_EQ(statvfs("/volume1", &vfs), 0);
    EXPECT_EQ(static_cast<unsigned long long>(vfs.f_bavail) * vfs.f_frsize, size);
    EXPECT_EQ(vfs.f_flag & ST_RDONLY, 0u);
    ASSERT_EQ(statvfs("/volume2", &vfs), 0);
    EXPECT_EQ(static_cast<unsigned long long>(vfs.f_bavail) * vfs.f_frsize, 3 * 4096ULL);
    EXPECT_NE(vfs.f_flag & ST_RDONLY, 0u);
    EXPECT_LT(open("/volume2/x", O_WRONLY | O_CREAT | O_CLOEXEC, 0644), 0);

    std::string mounts = ReadFile("/proc/mounts").value_or("");
    EXPECT_NE(mounts.find(" /volume1 tmpfs "), std::string::npos);
    UnmountVolume("/volume1");
    UnmountVolume("/volume2");
    EXPECT_FALSE(PathExists("/volume1"));
    EXPECT_EQ(ReadFile("/proc/mounts").value_or("").find(" /volume1 "), std::string::npos);
}

TEST_F(SandboxSelfTest, KeyValueHelpersReadBothFormsAndRewriteOneKey) {
    WriteFile("/tmp/kv/conf", "# comment\nplain=1\nquoted=\"a b\"\n\nempty=\"\"\nplain=2\n");
    std::map<std::string, std::string> expected = {
        {"plain", "1"}, {"quoted", "a b"}, {"empty", ""}};
    EXPECT_EQ(ReadKeyValueFile("/tmp/kv/conf"), expected);

    SetKeyValue("/tmp/kv/conf", "quoted", std::string("c"));
    SetKeyValue("/tmp/kv/conf", "added", std::string("x=y"));
    SetKeyValue("/tmp/kv/conf", "plain", std::nullopt);
    EXPECT_EQ(ReadFile("/tmp/kv/conf").value_or(""),
              "# comment\nquoted=\"c\"\n\nempty=\"\"\nadded=\"x=y\"\n");
    EXPECT_TRUE(ReadKeyValueFile("/tmp/kv/missing").empty());
    EXPECT_FALSE(ReadFile("/tmp/kv/missing").has_value());
}

TEST_F(SandboxSelfTest, FileHelpersCreateListAndRemoveTrees) {
    WriteFile("/tmp/tree/b/deep/file", "x", 0600);
    WriteFile("/tmp/tree/a", "");
    symlink("/etc.defaults", "/tmp/tree/link");
    struct stat st;
    ASSERT_EQ(stat("/tmp/tree/b/deep/file", &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(ListDir("/tmp/tree"), (std::vector<std::string>{"a", "b", "link"}));
    EXPECT_TRUE(IsDirectory("/tmp/tree/link"));
    RemoveTree("/tmp/tree");
    EXPECT_FALSE(PathExists("/tmp/tree"));
    EXPECT_TRUE(PathExists("/etc.defaults/VERSION")) << "RemoveTree followed a symbolic link";
}

TEST_F(SandboxSelfTest, ProcessHelpersReportExitStatusSignalsAndOutput) {
    EXPECT_EQ(Wait(Spawn([] { return 7; })), 7);
    EXPECT_EQ(Wait(Spawn([] {
                  raise(SIGKILL);
                  return 0;
              })),
              128 + SIGKILL);
    std::string out;
    EXPECT_EQ(Shell("echo out; echo err >&2; exit 4", &out), 4);
    EXPECT_EQ(out, "out\nerr\n");
    EXPECT_TRUE(LiveChildren().empty());
}

// The leak checks of the base fixture depend on these two probes seeing a leak.
TEST(SandboxLeakProbes, SeeNewDescriptorsAndUnreapedChildren) {
    std::vector<int> before = OpenFds();
    int fd = open("/etc.defaults/VERSION", O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    std::vector<int> during = OpenFds();
    close(fd);
    EXPECT_EQ(during.size(), before.size() + 1);
    EXPECT_NE(std::find(during.begin(), during.end(), fd), during.end());
    EXPECT_EQ(OpenFds(), before);

    pid_t pid = Spawn([] { return 0; });
    usleep(50 * 1000);
    EXPECT_EQ(LiveChildren(), std::vector<pid_t>{pid}) << "an exited, unreaped child counts";
    EXPECT_EQ(Wait(pid), 0);
    EXPECT_TRUE(LiveChildren().empty());
}

}  // namespace
