// Service stop and start around an apply, as the scripts and the apply status file show them.
#include "engine_fixtures.h"

namespace {

using namespace kytotest;
using Calls = std::vector<std::vector<std::string>>;
const char* kApplyStatus = "/var/run/applySmallUpd@te.status";
const char* kInvalidList = "/usr/kyto/etc.defaults/invalid_restart_service";
using ServicesTest = SandboxTest;

// Stop walks backwards, start forwards.  A reboot-type update goes through the platform; a
// restart-all skips the invalid scripts (trailing blanks do not hide one), counts 100 / 3
// per started script, ends with the add-ons, and without an invalid list or scripts switches
// nothing but still tells "finished"; a partial restart runs the listed scripts and packages.
TEST_F(ServicesTest, StopAndStartOfEachRestartType) {
    const std::vector<std::string> kScripts = {"S01iptables.sh", "S20samba.sh", "S99sshd.sh"};
    // clang-format off
    struct Row { std::function<void(SmallUpdate&)> set; Calls stop, start; int type;
                 std::string log; };
    const Row rows[] = {
        {[](SmallUpdate& u) { u.m_blNeedReboot = u.m_blRestartAllService = true; },
         {{"S99sshd.sh", "stop", "none"}, {"S20samba.sh", "stop", "none"},
          {"S01iptables.sh", "stop", "none"}},
         {{"S01iptables.sh", "start", "none"}, {"S20samba.sh", "start", "none"},
          {"S99sshd.sh", "start", "none"}}, 3, ""},
        {[](SmallUpdate& u) {
             u.m_blRestartAllService = true;
             u.m_vyxServiceRestartList = {"S01iptables.sh"};  // ignored by a restart-all
             WriteFile(kInvalidList, "S55none.sh\n\nS20samba.sh \t\r\n");
         },
         {{"S99sshd.sh", "stop", "none"}, {"S01iptables.sh", "stop", "none"},
          {"kytopkg", "stopall", "none"}},
         {{"S01iptables.sh", "start", "0/4"}, {"S99sshd.sh", "start", "33/4"},
          {"kytopkg", "startall", "66/4"}},
         2, "skip invalid service /usr/kyto/etc/rc.d/S20samba.sh[0x"},
        {[](SmallUpdate& u) { u.m_blRestartAllService = true; }, {}, {}, 2,
         "failed to get invalid service list"},
        {[](SmallUpdate& u) {
             u.m_blRestartAllService = true;
             WriteFile(kInvalidList, "");
             InstallServiceProbes({});
         }, {}, {}, 2, "  failed to list service under /usr/kyto/etc/rc.d"},
        {[](SmallUpdate& u) {
             u.m_vyxServiceRestartList = {"S99sshd.sh", "S01iptables.sh"};
             u.m_pkgRestartList = {"PkgB", "PkgA"};
         },
         {{"S99sshd.sh", "stop", "none"}, {"S01iptables.sh", "stop", "none"},
          {"kytopkg", "stop PkgB", "none"}, {"kytopkg", "stop PkgA", "none"}},
         {{"S99sshd.sh", "start", "none"}, {"S01iptables.sh", "start", "none"},
          {"kytopkg", "start PkgB", "none"}, {"kytopkg", "start PkgA", "none"}}, 1, ""},
        {[](SmallUpdate&) {}, {}, {}, 0, ""},  // nothing to restart
    };
    // clang-format on
    for (const Row& row : rows) {
        SCOPED_TRACE(row.log);
        InstallServiceProbes(kScripts);
        for (const char* path : {kApplyStatus, kInvalidList})
            RemoveTree(path);
        SmallUpdate u;
        u.m_newSmallFixNumber = 3;
        row.set(u);
        ClearSyslog();
        ClearRecordedCalls();
        u.SwitchServices(false);
        EXPECT_EQ(row.stop, RecordedCalls());
        EXPECT_FALSE(PathExists(kApplyStatus));
        ClearRecordedCalls();
        u.SwitchServices(true);
        EXPECT_EQ(row.start, RecordedCalls());
        EXPECT_EQ(row.type % 3 == 0 ? "" : "percentage=\"100\"\nstage=\"5\"\nErrMsg=\"\"\n",
                  ReadFile(kApplyStatus).value_or(""));
        EXPECT_TRUE(row.log.empty() || SyslogContains(row.log, LOG_ERR));
        EXPECT_EQ(row.type, u.GetServiceRestartType());
    }
    SmallUpdate notLoaded;  // and no info file to load
    notLoaded.m_blNeedReboot = true;
    EXPECT_EQ(0, notLoaded.GetServiceRestartType());
}

}  // namespace
