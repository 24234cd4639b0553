// Self-tests of the sandbox root (what keeps a test away from the host) and of the shared
// test helpers the other tests build on.
#include <fcntl.h>
#include <net/if.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/statvfs.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <set>

#include <gtest/gtest.h>

#include "sandbox.h"

using namespace kytotest;

namespace {

class SandboxSelfTest : public SandboxTest {};

bool ReadOnly(const std::string& path) {
    struct statvfs vfs;
    return statvfs(path.c_str(), &vfs) == 0 && (vfs.f_flag & ST_RDONLY) != 0;
}

TEST_F(SandboxSelfTest, HostIsOutOfReach) {
    // Own pid namespace: the launcher's init is pid 1 and no host process is visible.
    EXPECT_EQ(ReadFile("/proc/1/comm").value_or(""), "kyto-sandbox\n");
    std::set<std::string> processes;
    for (const std::string& pid : ListDir("/proc")) {
        if (pid.find_first_not_of("0123456789") == std::string::npos)
            processes.insert(ReadFile("/proc/" + pid + "/comm").value_or(""));
    }
    EXPECT_EQ(processes, (std::set<std::string>{"kyto-sandbox\n", "sandbox_sandbox\n"}));
    // A private /dev with the few nodes tests need, never the host's disks.
    EXPECT_EQ(ListDir("/dev"),
              (std::vector<std::string>{"fd", "full", "log", "null", "ptmx", "pts", "random", "shm",
                                        "stderr", "stdin", "stdout", "tty", "urandom", "zero"}));
    // Own network namespace: only the loopback interface, and it is up.
    std::string devs = ReadFile("/proc/net/dev").value_or("");
    EXPECT_EQ(std::count(devs.begin(), devs.end(), ':'), 1) << devs;
    int sock = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    struct ifreq ifr = {};
    strcpy(ifr.ifr_name, "lo");
    EXPECT_EQ(ioctl(sock, SIOCGIFFLAGS, &ifr), 0);
    close(sock);
    EXPECT_NE(ifr.ifr_flags & IFF_UP, 0);
    // Kernel settings, sysrq and /sys are read-only, every mount below them included.
    std::string out;
    ASSERT_EQ(
        Shell("awk '$2 ~ /^\\/(proc\\/)?sys/ && $4 !~ /^ro,/ {print $2}' /proc/self/mounts", &out),
        0);
    EXPECT_EQ(out, "");
    EXPECT_TRUE(ReadOnly("/sys") && ReadOnly("/proc/sys"));
    EXPECT_TRUE(!PathExists("/proc/sysrq-trigger") || ReadOnly("/proc/sysrq-trigger"));
}

TEST_F(SandboxSelfTest, TmpAndRunAreFreshTmpfsAndTmpIsEmpty) {
    // A checkout under /tmp is bound read-only at its own path; nothing else of the host's
    // /tmp shows.
    char exe[PATH_MAX] = {};
    ASSERT_GT(readlink("/proc/self/exe", exe, sizeof exe - 1), 0);
    std::string self = exe;
    std::vector<std::string> expected;
    if (self.rfind("/tmp/", 0) == 0) {
        expected.push_back(self.substr(5, self.find('/', 5) - 5));
        EXPECT_TRUE(ReadOnly("/tmp/" + expected[0]));
    }
    EXPECT_EQ(ListDir("/tmp"), expected);
    std::string out;
    ASSERT_EQ(Shell("stat -f -c %T /tmp /run && stat -c %a /tmp", &out), 0);
    EXPECT_EQ(out, "tmpfs\ntmpfs\n1777\n");
}

// Writes to appliance paths land in the overlay's scratch layer; scripts/test.sh checks
// after the run that none of them appeared on the host.
TEST_F(SandboxSelfTest, ApplianceWritesLandInTheOverlay) {
    SetKeyValue("/etc.defaults/VERSION", "smallfixnumber", std::string("9"));
    EXPECT_EQ(ReadKeyValueFile("/etc.defaults/VERSION")["smallfixnumber"], "9");
    EXPECT_EQ(ReadFile("/proc/self/mounts").value_or("").rfind("overlay / overlay ", 0), 0u);
    std::string out;
    EXPECT_EQ(Shell("/usr/kyto/bin/wget --version && /usr/kyto/bin/openssl version", &out), 0)
        << out;
}

TEST_F(SandboxSelfTest, RecordingScriptsKeepArgumentsAndExitOverride) {
    ClearRecordedCalls();
    EXPECT_EQ(Shell("/usr/kyto/bin/kytovyxnotify 'two words' '<a href=\"x\">' ''"), 0);
    WriteFile("/var/run/fake-exit/S20samba.sh", "3\n");
    EXPECT_EQ(Shell("/usr/kyto/etc/rc.d/S20samba.sh stop"), 3);
    EXPECT_EQ(RecordedCalls(),
              (std::vector<std::vector<std::string>>{
                  {"kytovyxnotify", "two words", "<a href=\"x\">", ""}, {"S20samba.sh", "stop"}}));
}

TEST_F(SandboxSelfTest, SyslogKeepsPriorityTagAndTextFromEveryProcess) {
    ClearSyslog();
    openlog("selftest", LOG_PID, LOG_USER);
    syslog(LOG_ERR, "broken \"thing\" with\nsecond line \\ end");
    EXPECT_EQ(Wait(Spawn([] {
                  syslog(LOG_INFO, "child says %d", 7);
                  return 0;
              })),
              0);
    closelog();
    std::vector<LogLine> lines = SyslogLines();
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0].priority, LOG_ERR);
    EXPECT_EQ(lines[0].tag, "selftest[" + std::to_string(getpid()) + "]");
    EXPECT_EQ(lines[0].message, "broken \"thing\" with\nsecond line \\ end");
    EXPECT_EQ(SyslogMessages(LOG_INFO), std::vector<std::string>{"child says 7"});
}

// The leak checks of the base fixture depend on these two probes seeing a leak.
TEST(SandboxLeakProbes, SeeNewDescriptorsAndUnreapedChildren) {
    std::vector<int> before = OpenFds();
    int fd = open("/etc.defaults/VERSION", O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    EXPECT_EQ(OpenFds().size(), before.size() + 1);
    close(fd);
    EXPECT_EQ(OpenFds(), before);
    pid_t pid = Spawn([] { return 0; });
    EXPECT_EQ(LiveChildren(), std::vector<pid_t>{pid});
    EXPECT_EQ(Wait(pid), 0);
    EXPECT_TRUE(LiveChildren().empty());
}

}  // namespace
