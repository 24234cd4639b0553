// UpdateUtil::GetServiceNameSectionKey: the table from start-up script to the interface's
// section and key.
#include <string>

#include <gtest/gtest.h>

#include "update_cpputil.h"

namespace {

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
    for (const char* name : {"s80samba.sh", "S80samba", "S80samba.sh ", "S80samba.shx", "S80", "S",
                             "", "S80samba.sh/"}) {
        std::string section = "kept", key = "kept";
        EXPECT_EQ(UpdateUtil::GetServiceNameSectionKey(name, section, key), 0) << name;
        EXPECT_EQ(section + key, "keptkept") << name;
    }
}

}  // namespace
