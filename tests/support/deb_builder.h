// Builds real Debian package files at test time with `dpkg-deb --build`.
//
// Packages built here are root-owned, Architecture "all" by default, have no dependencies
// and carry Maintainer and Description fields, so the sandbox's dpkg can install them for
// real.  Give every package a distinct name (tests may install several into one sandbox).
//
// The API below is stable: other test programs rely on it.
#ifndef KYTO_TESTS_SUPPORT_DEB_BUILDER_H
#define KYTO_TESTS_SUPPORT_DEB_BUILDER_H

#include <map>
#include <string>

namespace kytotest {

// Description of one package to build.
struct DebPackage {
    // Package name (lower case, digits, '+', '-', '.'; no '_').
    std::string package;
    // Version, e.g. SmallFixVersion("6.1", 5644, 3) == "6.1-5644-s3".
    std::string version;
    // Architecture field and file-name component.
    std::string arch = "all";
    // Files shipped by the package: absolute path inside the package ("/usr/share/x/y")
    // -> content.  A file whose content starts with "#!" is made executable (0755),
    // others are 0644.  Parent folders are created.
    std::map<std::string, std::string> files;
    // Maintainer scripts; empty means the script is not included.  Each is written as
    // given (start it with "#!/bin/sh") and made executable.
    std::string preinst, postinst, prerm, postrm;
};

// A package with only name, version and architecture set (brace-initialising DebPackage with
// fewer fields trips -Wmissing-field-initializers).
DebPackage MakeDebPackage(const std::string& package, const std::string& version,
                          const std::string& arch = "all");

// "package_version_arch.deb" for pkg.
std::string DebFileName(const DebPackage& pkg);

// Builds pkg into outDir (created if missing) and returns outDir + "/" + DebFileName(pkg).
// The staging tree is made in a temporary folder under outDir and removed afterwards.
// Fails the current test (GoogleTest ADD_FAILURE) and returns "" when dpkg-deb fails.
std::string BuildDeb(const DebPackage& pkg, const std::string& outDir);

// Version text carrying a build and small-fix number: base + "-" + build + "-s" + fix,
// e.g. SmallFixVersion("6.1", 5644, 3) == "6.1-5644-s3".
std::string SmallFixVersion(const std::string& base, int build, int fix);

// A package whose postinst appends one line "<package>\n" to orderLog (the folder of
// orderLog must exist when the package is installed).  Installing several such packages
// and reading orderLog shows the order in which they were configured.
DebPackage OrderLoggingDeb(const std::string& package, const std::string& version,
                           const std::string& orderLog);

// A package whose postinst exits 1, so `dpkg -i` of it fails (dpkg exits non-zero and
// leaves the package half-configured).
DebPackage FailingDeb(const std::string& package, const std::string& version);

// True when the sandbox's dpkg database lists the package as "install ok installed".
bool DpkgInstalled(const std::string& package);

}  // namespace kytotest

#endif
