// Service stop and start around a small-update apply, as the start-up scripts, the package
// control program and the interface's poller of the apply status file see it.
#include "engine_fixtures.h"

namespace {

using namespace kytotest;
using Calls = std::vector<std::vector<std::string>>;
const char* kApplyStatus = "/var/run/applySmallUpd@te.status";
const char* kInvalidList = "/usr/kyto/etc.defaults/invalid_restart_service";

// Replaces the provisioned start-up scripts and the package control program with probes
// that record their arguments and the apply status ("percentage/stage", or "none") a
// poller would have read at the moment they ran.
void InstallProbes(const std::vector<std::string>& scripts) {
    const std::string probe =
        "#!/bin/sh\nf=/var/run/applySmallUpd@te.status\ns=none\n"
        "[ -f \"$f\" ] && s=$(. \"$f\"; echo \"$percentage/$stage\")\n"
        "printf '%s\\t%s\\t%s\\n' \"${0##*/}\" \"$*\" \"$s\" >>/var/log/kyto-calls.log\n";
    RemoveTree("/usr/kyto/etc/rc.d");
    for (const std::string& s : scripts)
        WriteFile("/usr/kyto/etc/rc.d/" + s, probe, 0755);
    WriteFile("/usr/kyto/bin/kytopkg", probe, 0755);
}

class ServicesTest : public SandboxTest {
  protected:
    void SetUp() override {
        SandboxTest::SetUp();
        InstallProbes({"S01iptables.sh", "S20samba.sh", "S99sshd.sh"});
        update.m_newSmallFixNumber = 3;
    }
    SmallUpdate update;
};

// Stop walks backwards, start forwards.  A reboot-type update goes through the platform
// (every script, no status); a restart-all skips the invalid scripts (trailing blanks of a
// list line do not hide one), counts 100 / 3 per started script and ends with the add-ons;
// a partial restart runs the listed scripts, then the listed packages, in list order.
TEST_F(ServicesTest, StopAndStartOfEachRestartType) {
    struct Row {
        std::function<void(SmallUpdate&)> set;
        Calls stop, start;
        int type;
    } rows[] = {
        {[](SmallUpdate& u) { u.m_blNeedReboot = u.m_blRestartAllService = true; },
         {{"S99sshd.sh", "stop", "none"},
          {"S20samba.sh", "stop", "none"},
          {"S01iptables.sh", "stop", "none"}},
         {{"S01iptables.sh", "start", "none"},
          {"S20samba.sh", "start", "none"},
          {"S99sshd.sh", "start", "none"}},
         3},
        {[](SmallUpdate& u) {
             u.m_blRestartAllService = true;
             u.m_vyxServiceRestartList = {"S01iptables.sh"};  // ignored by a restart-all
             WriteFile(kInvalidList, "S55none.sh\n\nS20samba.sh \t\r\n");
         },
         {{"S99sshd.sh", "stop", "none"},
          {"S01iptables.sh", "stop", "none"},
          {"kytopkg", "stopall", "none"}},
         {{"S01iptables.sh", "start", "0/4"},
          {"S99sshd.sh", "start", "33/4"},
          {"kytopkg", "startall", "66/4"}},
         2},
        {[](SmallUpdate& u) {
             u.m_vyxServiceRestartList = {"S99sshd.sh", "S01iptables.sh"};
             u.m_pkgRestartList = {"PkgB", "PkgA"};
         },
         {{"S99sshd.sh", "stop", "none"},
          {"S01iptables.sh", "stop", "none"},
          {"kytopkg", "stop PkgB", "none"},
          {"kytopkg", "stop PkgA", "none"}},
         {{"S99sshd.sh", "start", "none"},
          {"S01iptables.sh", "start", "none"},
          {"kytopkg", "start PkgB", "none"},
          {"kytopkg", "start PkgA", "none"}},
         1},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.type);
        RemoveTree(kApplyStatus);
        SmallUpdate u = update;
        row.set(u);
        ClearRecordedCalls();
        u.SwitchServices(false);
        EXPECT_EQ(row.stop, RecordedCalls());
        EXPECT_FALSE(PathExists(kApplyStatus));
        ClearRecordedCalls();
        u.SwitchServices(true);
        EXPECT_EQ(row.start, RecordedCalls());
        EXPECT_EQ(row.type == 3 ? "" : "percentage=\"100\"\nstage=\"5\"\nErrMsg=\"\"\n",
                  ReadFile(kApplyStatus).value_or(""));
        EXPECT_EQ(row.type, u.GetServiceRestartType());
    }
    EXPECT_TRUE(SyslogContains("skip invalid service /usr/kyto/etc/rc.d/S20samba.sh[0x", LOG_ERR));
    EXPECT_EQ(0, update.GetServiceRestartType());  // nothing to restart
    SmallUpdate notLoaded;                         // and no info file to load
    notLoaded.m_blNeedReboot = true;
    EXPECT_EQ(0, notLoaded.GetServiceRestartType());
}

TEST_F(ServicesTest, RestartAllWithoutListOrScriptsSwitchesNothingAndStillFinishes) {
    struct Case {
        bool haveList, haveScripts;
        const char* log;
    } cases[] = {
        {false, true, "failed to get invalid service list"},
        {true, false, "  failed to list service under /usr/kyto/etc/rc.d"},
    };
    update.m_blRestartAllService = true;
    for (const Case& c : cases) {
        SCOPED_TRACE(c.log);
        WriteOrRemove(kInvalidList, c.haveList ? "" : nullptr);
        InstallProbes(c.haveScripts ? std::vector<std::string>{"S01iptables.sh"}
                                    : std::vector<std::string>{});
        ClearSyslog();
        ClearRecordedCalls();
        update.SwitchServices(false);
        update.SwitchServices(true);
        EXPECT_EQ(RecordedCalls(), Calls{});
        EXPECT_TRUE(SyslogContains(c.log, LOG_ERR));
        EXPECT_EQ("percentage=\"100\"\nstage=\"5\"\nErrMsg=\"\"\n", ReadFile(kApplyStatus));
    }
}

}  // namespace
