// Service stop and start around a small-update apply, as the start-up scripts, the package
// control program and the interface's poller of the apply status file see it; and the
// table from start-up script to the interface's section and key.
#include <syslog.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "smallupdate.h"
#include "update_cpputil.h"

namespace {

using kytotest::RecordedCalls;
using kytotest::SyslogContains;
using Calls = std::vector<std::vector<std::string>>;

const char* kApplyStatus = "/var/run/applySmallUpd@te.status";
const char* kInvalidList = "/usr/kyto/etc.defaults/invalid_restart_service";

// Replaces the provisioned start-up scripts and the package control program with probes
// that record their arguments and the apply status ("percentage/stage", or "none") a
// poller would have read at the moment they ran.
void InstallProbes(const std::vector<std::string>& scripts) {
    const std::string probe =
        "#!/bin/sh\n"
        "f=/var/run/applySmallUpd@te.status\n"
        "s=none\n"
        "[ -f \"$f\" ] && s=$(. \"$f\"; echo \"$percentage/$stage\")\n"
        "printf '%s\\t%s\\t%s\\n' \"${0##*/}\" \"$*\" \"$s\" >>/var/log/kyto-calls.log\n";
    kytotest::RemoveTree("/usr/kyto/etc/rc.d");
    for (const std::string& s : scripts)
        kytotest::WriteFile("/usr/kyto/etc/rc.d/" + s, probe, 0755);
    kytotest::WriteFile("/usr/kyto/bin/kytopkg", probe, 0755);
}

class ServicesTest : public kytotest::SandboxTest {
  protected:
    void SetUp() override {
        kytotest::SandboxTest::SetUp();
        InstallProbes({"S01iptables.sh", "S20samba.sh", "S99sshd.sh"});
        update.m_newSmallFixNumber = 3;
    }
    std::map<std::string, std::string> ApplyStatus() const {
        return kytotest::ReadKeyValueFile(kApplyStatus);
    }
    SmallUpdate update;
};

TEST_F(ServicesTest, RebootTypeSwitchesEverythingThroughThePlatformWithoutStatus) {
    update.m_blNeedReboot = true;
    update.m_blRestartAllService = true;  // the reboot type wins
    update.SwitchServices(false);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S99sshd.sh", "stop", "none"},
                                      {"S20samba.sh", "stop", "none"},
                                      {"S01iptables.sh", "stop", "none"}}));
    kytotest::ClearRecordedCalls();
    update.SwitchServices(true);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S01iptables.sh", "start", "none"},
                                      {"S20samba.sh", "start", "none"},
                                      {"S99sshd.sh", "start", "none"}}));
    EXPECT_FALSE(kytotest::PathExists(kApplyStatus));
    EXPECT_EQ(update.GetServiceRestartType(), 3);
}

TEST_F(ServicesTest, RestartAllSkipsInvalidScriptsAndReportsEachStart) {
    update.m_blRestartAllService = true;
    update.m_vyxServiceRestartList = {"S01iptables.sh"};  // ignored by a restart-all
    // Trailing blanks of a line do not hide a script from the list.
    kytotest::WriteFile(kInvalidList, "S55none.sh\n\nS20samba.sh \t\r\n");

    update.SwitchServices(false);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S99sshd.sh", "stop", "none"},
                                      {"S01iptables.sh", "stop", "none"},
                                      {"kytopkg", "stopall", "none"}}));
    EXPECT_TRUE(SyslogContains("skip invalid service /usr/kyto/etc/rc.d/S20samba.sh[0x", LOG_ERR));
    EXPECT_FALSE(kytotest::PathExists(kApplyStatus));

    kytotest::ClearRecordedCalls();
    update.SwitchServices(true);
    // 100 / 3 scripts = 33 per started script; the skipped one adds nothing.
    EXPECT_EQ(RecordedCalls(), (Calls{{"S01iptables.sh", "start", "0/4"},
                                      {"S99sshd.sh", "start", "33/4"},
                                      {"kytopkg", "startall", "66/4"}}));
    EXPECT_EQ(ApplyStatus(), (std::map<std::string, std::string>{
                                 {"percentage", "100"}, {"stage", "5"}, {"ErrMsg", ""}}));
    EXPECT_EQ(update.GetServiceRestartType(), 2);
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
        kytotest::RemoveTree(kInvalidList);
        if (c.haveList)
            kytotest::WriteFile(kInvalidList, "");
        InstallProbes(c.haveScripts ? std::vector<std::string>{"S01iptables.sh"}
                                    : std::vector<std::string>{});
        kytotest::ClearSyslog();
        kytotest::ClearRecordedCalls();
        update.SwitchServices(false);
        update.SwitchServices(true);
        EXPECT_EQ(RecordedCalls(), Calls{});
        EXPECT_TRUE(SyslogContains(c.log, LOG_ERR));
        EXPECT_EQ(ApplyStatus()["stage"], "5");
        EXPECT_EQ(ApplyStatus()["percentage"], "100");
        EXPECT_EQ(ApplyStatus()["ErrMsg"], "");
    }
}

TEST_F(ServicesTest, PartialRestartRunsListedScriptsThenPackagesInListOrder) {
    update.m_vyxServiceRestartList = {"S99sshd.sh", "S01iptables.sh"};
    update.m_pkgRestartList = {"PkgB", "PkgA"};
    std::vector<std::string> scripts, packages;
    update.GetRestartServiceList(scripts, packages);
    EXPECT_EQ(scripts, update.m_vyxServiceRestartList);
    EXPECT_EQ(packages, update.m_pkgRestartList);

    update.SwitchServices(false);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S99sshd.sh", "stop", "none"},
                                      {"S01iptables.sh", "stop", "none"},
                                      {"kytopkg", "stop PkgB", "none"},
                                      {"kytopkg", "stop PkgA", "none"}}));
    EXPECT_FALSE(kytotest::PathExists(kApplyStatus));
    kytotest::ClearRecordedCalls();
    update.SwitchServices(true);
    EXPECT_EQ(RecordedCalls(), (Calls{{"S99sshd.sh", "start", "none"},
                                      {"S01iptables.sh", "start", "none"},
                                      {"kytopkg", "start PkgB", "none"},
                                      {"kytopkg", "start PkgA", "none"}}));
    EXPECT_EQ(ApplyStatus()["stage"], "5");
    EXPECT_EQ(update.GetServiceRestartType(), 1);

    update.m_vyxServiceRestartList.clear();
    update.m_pkgRestartList.clear();
    EXPECT_EQ(update.GetServiceRestartType(), 0);
    SmallUpdate notLoaded;  // and no info file to load
    notLoaded.m_blNeedReboot = true;
    EXPECT_EQ(notLoaded.GetServiceRestartType(), 0);
}

TEST(ServiceSectionTable, EveryRowAndOnlyWholeNames) {
    const char* rows[][3] = {
        {"S01iptables.sh", "helptoc", "system_network"},
        {"S01tc.sh", "helptoc", "system_network"},
        {"S02dbus.sh", "", ""},
        {"S02pppoerelay.sh", "network", "pppoe_relay"},
        {"S02kytovpnclient.sh", "vpnc", "app_name"},
        {"S03inetd.sh", "firewall", "firewall_service_opt_telnet"},
        {"S04crond.sh", "schedule", "task_scheduler"},
        {"S08snmpd.sh", "helptoc", "snmp"},
        {"S09DDNS.sh", "helptoc", "leaf_wanconfig"},
        {"S11nslcd.sh", "ldap", "ldap_client"},
        {"S12upsmon.sh", "helptoc", "power_ups"},
        {"S13kytorelayd.sh", "helptoc", "hoplink"},
        {"S21mysql.sh", "tree", "leaf_mysql"},
        {"S22syslogng.sh", "syslog", "app_name"},
        {"S23ntpd.sh", "helptoc", "ntp_service"},
        {"S23kytologd.sh", "service", "file_transfer_log"},
        {"S55cupsd.sh", "service", "printing_service"},
        {"S56gcpd.sh", "service", "gcp_service"},
        {"S66S2S.sh", "helptoc", "s2s_app_title"},
        {"S66fileindexd.sh", "fileindex", "fileindex_title"},
        {"S66kytoindexd.sh", "helptoc", "media_index_service"},
        {"S77kytomkthumbd.sh", "helptoc", "media_index_service"},
        {"S78iscsitrg.sh", "tree", "leaf_iscsitrg"},
        {"S80samba.sh", "helptoc", "winmacnfs_win"},
        {"S81atalk.sh", "helptoc", "winmacnfs_mac"},
        {"S83nfsd.sh", "helptoc", "winmacnfs_nfs"},
        {"S84rsyncd.sh", "tree", "leaf_netbkp"},
        {"S85kytonetbkpd.sh", "tree", "leaf_netbkp"},
        {"S88kytomkflvd.sh", "helptoc", "media_index_service"},
        {"S90usbip.sh", "usb", "usb_printer_usbip"},
        {"S95sshd.sh", "firewall", "firewall_service_opt_ssh"},
        {"S96kytosnmpcd.sh", "tree", "leaf_rsrcmonitor"},
        {"S97apache-user.sh", "common", "web_portal"},
        {"S97apache-webdav.sh", "helptoc", "webserv_dav"},
        {"S99avahi.sh", "firewall", "firewall_service_desc_bonjour"},
        {"S99ftpd.sh", "tree", "leaf_ftp"},
        {"S99sftpd.sh", "tree", "leaf_sftp"},
        {"S99kytostoraged.sh", "volume", "volume_hot_spare"},
        {"S99tftpd.sh", "firewall", "firewall_service_opt_tftp"},
    };
    for (const auto& row : rows) {
        std::string section = "x", key = "x";
        EXPECT_EQ(UpdateUtil::GetServiceNameSectionKey(row[0], section, key), 1) << row[0];
        EXPECT_EQ(section + "/" + key, std::string(row[1]) + "/" + row[2]) << row[0];
    }
    for (const char* name : {"s80samba.sh", "S80samba", "S80samba.sh ", "S80samba.shx", "S80",
                             "S", "", "S80samba.sh/"}) {
        std::string section = "kept", key = "kept";
        EXPECT_EQ(UpdateUtil::GetServiceNameSectionKey(name, section, key), 0) << name;
        EXPECT_EQ(section + key, "keptkept") << name;
    }
}

}  // namespace
