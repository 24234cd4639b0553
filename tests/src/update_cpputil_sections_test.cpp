// UpdateUtil::GetServiceNameSectionKey: the table from start-up script to the interface's
// section and key, seen at its ends, at a script without a name to show and at names that
// several scripts share; only whole names match.
#include <string>

#include <gtest/gtest.h>

#include "update_cpputil.h"

namespace {

TEST(ServiceSectionTable, EndsSharedNamesAndOnlyWholeNames) {
    const char* rows[][3] = {
        {"S01iptables.sh", "helptoc", "system_network"},
        {"S01tc.sh", "helptoc", "system_network"},
        {"S02dbus.sh", "", ""},
        {"S66kytoindexd.sh", "helptoc", "media_index_service"},
        {"S77kytomkthumbd.sh", "helptoc", "media_index_service"},
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
