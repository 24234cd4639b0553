// Test package builder: stages a package tree and packs it with dpkg-deb.
#include "deb_builder.h"

#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cerrno>
#include <cstring>
#include <fstream>

#include <gtest/gtest.h>

namespace kytotest {
namespace {

// Creates every folder of path (like mkdir -p), each 0755.
bool MakeDirs(const std::string& path) {
    if (path.empty())
        return true;
    std::string partial;
    size_t pos = 0;
    while (pos != std::string::npos) {
        pos = path.find('/', pos + 1);
        partial = path.substr(0, pos);
        if (partial.empty())
            continue;
        if (mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST)
            return false;
    }
    return true;
}

bool WriteWithMode(const std::string& path, const std::string& content, mode_t mode) {
    size_t slash = path.rfind('/');
    if (slash != std::string::npos && !MakeDirs(path.substr(0, slash)))
        return false;
    {
        std::ofstream out(path, std::ios::binary | std::ios::trunc);
        if (!out)
            return false;
        out << content;
        if (!out)
            return false;
    }
    return chmod(path.c_str(), mode) == 0;
}

// Single-quotes s for /bin/sh.
std::string ShellQuote(const std::string& s) {
    std::string out = "'";
    for (char c : s) {
        if (c == '\'') {
            out += "'\\''";
        } else {
            out += c;
        }
    }
    return out + "'";
}

// Runs a shell command; returns its exit status (or -1) and collects its output.
int RunCommand(const std::string& command, std::string* output) {
    FILE* p = popen((command + " 2>&1").c_str(), "r");
    if (!p)
        return -1;
    char buf[512];
    size_t n;
    while ((n = fread(buf, 1, sizeof buf, p)) > 0)
        output->append(buf, n);
    int status = pclose(p);
    if (status == -1 || !WIFEXITED(status))
        return -1;
    return WEXITSTATUS(status);
}

}  // namespace

DebPackage MakeDebPackage(const std::string& package, const std::string& version,
                          const std::string& arch) {
    DebPackage pkg;
    pkg.package = package;
    pkg.version = version;
    pkg.arch = arch;
    return pkg;
}

std::string DebFileName(const DebPackage& pkg) {
    return pkg.package + "_" + pkg.version + "_" + pkg.arch + ".deb";
}

std::string SmallFixVersion(const std::string& base, int build, int fix) {
    return base + "-" + std::to_string(build) + "-s" + std::to_string(fix);
}

std::string BuildDeb(const DebPackage& pkg, const std::string& outDir) {
    if (!MakeDirs(outDir)) {
        ADD_FAILURE() << "cannot create " << outDir << ": " << strerror(errno);
        return "";
    }
    std::string stageTemplate = outDir + "/.debstage-XXXXXX";
    if (!mkdtemp(&stageTemplate[0])) {
        ADD_FAILURE() << "mkdtemp in " << outDir << ": " << strerror(errno);
        return "";
    }
    const std::string stage = stageTemplate;
    // dpkg-deb refuses a control folder that is not 0755..0775.
    chmod(stage.c_str(), 0755);

    bool ok = MakeDirs(stage + "/DEBIAN");
    std::string control = "Package: " + pkg.package + "\nVersion: " + pkg.version +
                          "\nArchitecture: " + pkg.arch +
                          "\nMaintainer: Test Builder <tests@example.invalid>\n"
                          "Section: misc\nPriority: optional\n"
                          "Description: test package " +
                          pkg.package + "\n";
    ok = ok && WriteWithMode(stage + "/DEBIAN/control", control, 0644);
    const std::pair<const char*, const std::string*> scripts[] = {{"preinst", &pkg.preinst},
                                                                  {"postinst", &pkg.postinst},
                                                                  {"prerm", &pkg.prerm},
                                                                  {"postrm", &pkg.postrm}};
    for (const auto& script : scripts) {
        if (script.second->empty())
            continue;
        ok = ok && WriteWithMode(stage + "/DEBIAN/" + script.first, *script.second, 0755);
    }
    for (const auto& file : pkg.files) {
        mode_t mode = file.second.compare(0, 2, "#!") == 0 ? 0755 : 0644;
        std::string rel = file.first;
        if (rel.empty() || rel[0] != '/')
            rel = "/" + rel;
        ok = ok && WriteWithMode(stage + rel, file.second, mode);
    }

    const std::string target = outDir + "/" + DebFileName(pkg);
    std::string output;
    int rc = -1;
    if (ok) {
        rc = RunCommand("dpkg-deb --root-owner-group -Zgzip --build " + ShellQuote(stage) + " " +
                            ShellQuote(target),
                        &output);
    }
    std::string ignored;
    RunCommand("rm -rf " + ShellQuote(stage), &ignored);
    if (!ok) {
        ADD_FAILURE() << "cannot stage package " << pkg.package;
        return "";
    }
    if (rc != 0) {
        ADD_FAILURE() << "dpkg-deb failed (" << rc << ") for " << pkg.package << ": " << output;
        return "";
    }
    return target;
}

DebPackage OrderLoggingDeb(const std::string& package, const std::string& version,
                           const std::string& orderLog) {
    DebPackage pkg = MakeDebPackage(package, version);
    pkg.files["/usr/share/kytotest/" + package + ".txt"] = package + "\n";
    pkg.postinst = "#!/bin/sh\nset -e\nif [ \"$1\" = configure ]; then\n    echo " +
                   ShellQuote(package) + " >> " + ShellQuote(orderLog) + "\nfi\nexit 0\n";
    return pkg;
}

DebPackage FailingDeb(const std::string& package, const std::string& version) {
    DebPackage pkg = MakeDebPackage(package, version);
    pkg.files["/usr/share/kytotest/" + package + ".txt"] = package + "\n";
    pkg.postinst = "#!/bin/sh\necho 'postinst of " + package + " fails on purpose' >&2\nexit 1\n";
    return pkg;
}

bool DpkgInstalled(const std::string& package) {
    std::string out;
    return RunCommand("dpkg-query -W -f='${Status}' " + ShellQuote(package), &out) == 0 &&
           out == "install ok installed";
}

}  // namespace kytotest
