// Shared test helpers for code that runs inside the sandbox (tests/sandbox/kyto-sandbox):
// syslog lines caught at /dev/log, files, key=value files, tmpfs data volumes, child
// processes, and the calls recorded by the provisioned fake programs.
//
// The sandbox is provisioned (tests/sandbox/provision.sh) with:
//   /etc.defaults/VERSION        majorversion="5" minorversion="2" buildphase="GM"
//                                buildnumber="5644" builddate="2026/10/01" (no smallfixnumber)
//   /etc.defaults/kytoinfo.conf  unique="demo_model" timezone="Europe/Berlin"
//                                supportraid="no" support_buildin_storage="no" maxdisks="4"
//   /usr/kyto/bin/wget, /usr/kyto/bin/openssl   symbolic links to the real tools
//   /usr/kyto/bin/kytovyxnotify, /usr/kyto/bin/kytopkg and the start-up scripts
//   /usr/kyto/etc/rc.d/S01iptables.sh S20samba.sh S99sshd.sh: recording scripts that
//   append one line per call to /var/log/kyto-calls.log (see RecordedCalls) and exit 0,
//   or with the number held in /var/run/fake-exit/<name> when that file exists.
// Working folder "/", fresh tmpfs on /tmp (1777) and /run (/var/run), syslog catcher on
// /dev/log writing /var/log/sandbox.syslog.
// No data volume is mounted, no HA state file, no /autoupd@te.info.
#ifndef KYTO_TESTS_SUPPORT_SANDBOX_H
#define KYTO_TESTS_SUPPORT_SANDBOX_H

#include <sys/types.h>
#include <syslog.h>

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

namespace kytotest {

// ---- Sandbox ----------------------------------------------------------------------------

// True when this process runs inside a kyto-sandbox root (marker file and overlay root).
bool InSandbox();

// Base fixture of every test that touches a fixed path.  SetUp fails the test unless it
// runs in the sandbox, and notes the open descriptors; TearDown fails the test when a
// descriptor was leaked or a child process is left behind.  Not counted as leaks: the
// syslog socket glibc keeps open (closed with closelog() before both snapshots) and a
// descriptor on /dev/urandom or /dev/random that a crypto library caches.
class SandboxTest : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;

  private:
    std::vector<int> fds_at_start_;
};

// ---- Syslog -----------------------------------------------------------------------------

struct LogLine {
    int priority = -1;    // LOG_ERR, LOG_INFO, ... (facility stripped)
    std::string tag;      // ident as sent ("program[pid]")
    std::string message;  // text after the "tag: " prefix
};
// Every line the syslog catcher received so far, in order.  Waits until everything sent
// before the call has been written (a marker line is sent and waited for).
std::vector<LogLine> SyslogLines();
// Messages only, optionally limited to one priority (-1: all).
std::vector<std::string> SyslogMessages(int priority = -1);
// True when some message contains the text.
bool SyslogContains(const std::string& text, int priority = -1);
// Forgets the lines received so far (later calls only see newer lines).
void ClearSyslog();
// Success when text contains part; a failure shows the whole text.
testing::AssertionResult Has(const std::string& text, const std::string& part);

// ---- Files ------------------------------------------------------------------------------

std::optional<std::string> ReadFile(const std::string& path);
// Writes content (creating parent folders), replacing the file; mode applied.
void WriteFile(const std::string& path, const std::string& content, mode_t mode = 0644);
// Writes content as WriteFile does, or removes path (a file or tree) when content is nullptr.
void WriteOrRemove(const std::string& path, const char* content);
bool PathExists(const std::string& path);  // lstat succeeds
bool IsDirectory(const std::string& path);
void RemoveTree(const std::string& path);
std::vector<std::string> ListDir(const std::string& path);  // sorted names, no . and ..
// True when some entry of folder has a name starting with prefix (a temporary file left).
bool AnyEntryStartsWith(const std::string& folder, const std::string& prefix);
// Parses a key=value file (both line forms; quotes removed).  Empty map when missing.
std::map<std::string, std::string> ReadKeyValueFile(const std::string& path);
// Sets or removes (value nullopt) one key of a key=value file, writing key="value".
void SetKeyValue(const std::string& path, const std::string& key,
                 const std::optional<std::string>& value);

// Lines of a file (without their newline), only those containing `onlyWith` when given.
std::vector<std::string> FileLines(const std::string& path, const std::string& onlyWith = "");
// The lines of a log file that carry a local time stamp "YYYY/MM/DD HH:MM:SS" and a tab,
// stamped within two minutes of now, without the stamp and the tab; other lines skipped.
std::vector<std::string> StampedLines(const std::string& path);
// Permission bits (07777) of path; fails the test and returns 0 when stat fails.
mode_t ModeOf(const std::string& path);
// Parses JSON text (strict: the whole text is one value); fails the test when it cannot.
Json::Value ParseJson(const std::string& text);
// Lower-case hex MD5 of a file's content, "" when it cannot be read.
std::string Md5Of(const std::string& path);

// ---- Volumes ----------------------------------------------------------------------------

// Mounts a tmpfs of exactly sizeBytes (rounded up to pages) at mountPoint (created), read
// only when asked.  The data volume then has exactly that many bytes free.
void MountVolume(const std::string& mountPoint, unsigned long long sizeBytes,
                 bool readOnly = false);
void UnmountVolume(const std::string& mountPoint);

// ---- Processes and commands -------------------------------------------------------------

// Runs fn in a forked child and returns the child's pid; the child exits with fn's result.
pid_t Spawn(const std::function<int()>& fn);
// Starts a child that only waits for signals; returns its pid.
pid_t SpawnIdle();
// Waits for pid; returns its exit status, or 128 + signal when it was killed.
int Wait(pid_t pid);
// Runs a shell command; returns its exit status; output (stdout+stderr) when asked.
int Shell(const std::string& command, std::string* output = nullptr);
// Calls cond every 20 ms until it returns true or timeoutMs has passed; returns the last
// result (a wait for another process, never an assertion about time).
bool WaitFor(const std::function<bool()>& cond, int timeoutMs = 30000);
// Pids of this process's children that are still alive (not yet reaped included).
std::vector<pid_t> LiveChildren();
// Open descriptors of this process.
std::vector<int> OpenFds();

// Runs `check` over and over in a child process while write(i) runs here for i = 1..writes,
// then lets the child read once more after the last write.  Returns the child's exit
// status: the first non-zero value check returned, 0 when every read was good, 99 when the
// child did not read at least twice.  Fails the test when a write returns false.
int RaceReaderAgainstWriter(int writes, const std::function<bool(int)>& write,
                            const std::function<int()>& check);

// Clears the platform's last error of this thread (KLIBCErrSetEx(0, "", 0)).
void ClearLastError();

// ---- Recorded calls of the fake appliance programs --------------------------------------

// One line per call of kytovyxnotify, kytopkg or a start-up script, in call order: the
// program's base name followed by its arguments.
std::vector<std::vector<std::string>> RecordedCalls();
void ClearRecordedCalls();

}  // namespace kytotest

#endif
