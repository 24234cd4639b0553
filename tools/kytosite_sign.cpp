// kytosite sign and keygen: a detached signature "F.minisig" beside every published file
// of a site (the feed, the patch lists, the packages, the images), whose trusted comment
// names the file as published; and a new key pair, so that a vendor needs no other tool.
#include <dirent.h>
#include <stdio.h>
#include <sys/stat.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "kytosite_site.h"
#include "kytotrust.h"

namespace kytosite {

namespace {

// The first line of the password file ("" without one).
bool ReadPassword(const std::string& file, std::string& password, std::string& why) {
    password.clear();
    if (file.empty())
        return true;
    if (!ReadText(file, password, why))
        return false;
    password = password.substr(0, password.find('\n'));
    return true;
}

// A published file: a regular file that is neither a signature nor a file being written.
bool Published(const std::string& name) {
    const std::string sig = ".minisig";
    return name[0] != '.' &&
           (name.size() < sig.size() || name.compare(name.size() - sig.size(), sig.size(), sig));
}

// Every published file under folder, in name order (folders first found, then descended).
bool Collect(const std::string& folder, std::vector<std::string>& files, std::string& why) {
    std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(folder.c_str()), closedir);
    if (!dir) {
        why = "cannot list " + folder;
        return false;
    }
    std::vector<std::string> names;
    while (const dirent* e = readdir(dir.get()))
        names.emplace_back(e->d_name);
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) {
        const std::string path = folder + "/" + name;
        struct stat st;
        if (name[0] == '.' || lstat(path.c_str(), &st) != 0)
            continue;
        if (S_ISDIR(st.st_mode) && !Collect(path, files, why))
            return false;
        if (S_ISREG(st.st_mode) && Published(name))
            files.push_back(path);
    }
    return true;
}

}  // namespace

int CmdSign(const std::string& root, const std::string& keyPath, const std::string& passwordFile) {
    Site site;
    std::string why, password;
    kytotrust::SecretKey key;
    if (!OpenSite(root, site, why) || !ReadPassword(passwordFile, password, why))
        return Fail(why);
    if (!kytotrust::LoadSecretKey(keyPath, password, key, why))
        return Fail("cannot use the key " + keyPath + ": " + why);
    std::vector<std::string> files;
    for (const char* top : {"autoupdate", "smallupdate", "images"}) {
        if (Exists(site.Path(top)) && !Collect(site.Path(top), files, why))
            return Fail(why);
    }
    for (const std::string& file : files) {
        std::string sig;
        const std::string name = file.substr(file.rfind('/') + 1);
        if (!kytotrust::SignFile(key, file, name, sig, why) ||
            !kytotrust::WriteSignature(file, sig, why))
            return Fail("cannot sign " + file + ": " + why);
    }
    printf("signed %zu file(s) with key %s\n", files.size(), kytotrust::KeyIdHex(key.id).c_str());
    return kExitOk;
}

int CmdKeygen(const std::string& pub, const std::string& sec, const std::string& passwordFile) {
    std::string why, password;
    if (!ReadPassword(passwordFile, password, why))
        return Fail(why);
    if (!kytotrust::GenerateKeyPair(pub, sec, password, why))
        return Fail(why);
    if (password.empty())
        fprintf(stderr, "kytosite: note: %s is not encrypted (no --password-file)\n", sec.c_str());
    return kExitOk;
}

}  // namespace kytosite
