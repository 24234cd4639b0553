// DebianLib: the package tool wrapper: runs dpkg with its output captured in the upgrade
// log, writes time-stamped update log lines and reads small-fix numbers from package
// file names.
#ifndef KYTOINSTALLCPP_DEBIAN_LIB_H
#define KYTOINSTALLCPP_DEBIAN_LIB_H

#include <string>

#include "kyto_export.h"

class KYTO_EXPORT DebianLib {
  public:
    // Appends "<local time>\t<text>" to logPath.
    static void WriteUpdateLog(const std::string& text, const std::string& logPath);
    // Runs /usr/bin/dpkg <option> <package> [<folder>]; true unless it exited non-zero.
    static bool ExecDpkg(const std::string& option, const std::string& package,
                         const std::string& folder);
    static bool ExecDpkg(const std::string& option, const std::string& package);
    // Small-fix number of a package named name_<...-build-sN>_arch.deb, -1 when none.
    static int FindSmallFixNumfromDeb(const std::string& debName);
    // Strict less-than by small-fix number, for sorting packages.
    static bool InstallDebCompare(const std::string& a, const std::string& b);
};

#endif
