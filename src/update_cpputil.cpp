#include "update_cpputil.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_errors.h>
#include <kytoplatform/kyto_system.h>

#include "file_system.h"
#include "json_members.h"
#include "kyto_paths.h"
#include "platform_error.h"
#include "scoped.h"
#include "version_file.h"

namespace {

constexpr const char* kModule = "update_cpputil";

// Reads the whole file behind f; stops quietly at a read error (a folder opened as a file
// reads as nothing, which then fails to parse).
std::string ReadAll(FILE* f) {
    std::string text;
    char buf[8192];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), f)) > 0)
        text.append(buf, n);
    return text;
}

}  // namespace

// ---- JSON files and string lists ------------------------------------------------------------

int UpdateUtil::ParseJsonRootFromFile(const char* path, Json::Value& root) {
    if (!path) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, __FILE__, __LINE__);
        syslog(LOG_ERR, "%s:%d bad parameters!", kModule, __LINE__);
        return 0;
    }
    std::string text;
    {
        kyto::UniqueFile file(fopen(path, "re"));
        if (!file) {
            // A state file we cannot open is removed so that the next run starts clean.
            unlink(path);
            syslog(LOG_ERR, "%s:%d inFile failed\n", kModule, __LINE__);
            return 0;
        }
        text = ReadAll(file.get());
    }
    // A document the parser gives up on (nested deeper than it allows) is as broken as
    // one with a syntax error: deleted, so that the next run starts clean.
    if (!kyto::ParseJsonText(text, root)) {
        syslog(LOG_ERR, "%s:%d Parse failed\n", kModule, __LINE__);
        unlink(path);
        return 0;
    }
    return 1;
}

int UpdateUtil::DumpJsonRootToFile(const char* path, const Json::Value& root) {
    if (!path) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, __FILE__, __LINE__);
        syslog(LOG_ERR, "%s:%d bad parameter!", kModule, __LINE__);
        return 0;
    }
    Json::FastWriter writer;
    const std::string text = writer.write(root);

    // Rewritten in place; files that other processes poll go through
    // kyto::DumpJsonAtomically instead.
    kyto::UniqueFile file(fopen(path, "we"));
    if (!file) {
        syslog(LOG_ERR, "%s:%d Failed to open %s", kModule, __LINE__, path);
        return 0;
    }
    bool flushFailed = false;
    return kyto::WriteJsonText(file, text, path, true, &flushFailed);
}

int UpdateUtil::JsonArray2StringVector(const Json::Value& array, std::vector<std::string>& out) {
    if (!array.isArray()) {
        syslog(LOG_ERR, "%s:%d bad parameter!", kModule, __LINE__);
        out.clear();
        return 0;
    }
    out.clear();
    for (Json::ArrayIndex i = 0; i < array.size(); ++i) {
        const Json::Value item = array[i];
        if (!item.isString()) {
            syslog(LOG_ERR, "%s:%d not a string", kModule, __LINE__);
            out.clear();
            return 0;
        }
        out.push_back(item.asString());
    }
    return 1;
}

int UpdateUtil::StringVector2JsonArray(const std::vector<std::string>& in, Json::Value& array) {
    // Appending to a value that is neither null nor an array would throw inside the JSON
    // library; such a value is left as it is.
    if (!array.isNull() && !array.isArray())
        return 1;
    for (const std::string& s : in)
        array.append(Json::Value(s));
    return 1;
}

int UpdateUtil::CompareVector(std::vector<std::string> a, std::vector<std::string> b) {
    if (a.size() != b.size())
        return 0;
    std::sort(a.begin(), a.end());
    std::sort(b.begin(), b.end());
    for (size_t i = 0; i < a.size(); ++i) {
        if (a[i] != b[i])
            return 0;
    }
    return 1;
}

// ---- Archives and folders -------------------------------------------------------------------

int UpdateUtil::UntarFile(const char* archive, const char* folder) {
    if (!archive || !folder) {
        KLIBCErrSetEx(KYTO_ERR_BAD_PARAMETER, __FILE__, __LINE__);
        return 0;
    }
    if (KLIBCExec("/bin/tar", "xpf", archive, "-C", folder) != 0) {
        syslog(LOG_ERR, "%s:%d failed to [tar xpf %s -C %s]", kModule, __LINE__, archive, folder);
        return 0;
    }
    return 1;
}

int UpdateUtil::UntarFile(const std::string& archive, const std::string& folder) {
    return UntarFile(archive.c_str(), folder.c_str());
}

int UpdateUtil::RemoveFolder(const char* path) {
    return kyto::RemoveFolderWith("/bin/rm", path);
}

int UpdateUtil::RemoveFolder(const std::string& path) {
    return RemoveFolder(path.c_str());
}

int UpdateUtil::CleanFolder(const char* path) {
    if (!RemoveFolder(path))
        return 0;
    if (mkdir(path, 0755) != 0) {
        // The platform's last error as it stood: callers read it with KLIBCErrGet.
        syslog(LOG_ERR, "%s:%d Fail to mkdir: %s, KytoErr =%s", kModule, __LINE__, path,
               kyto::LastErrorText().c_str());
        return 0;
    }
    return 1;
}

int UpdateUtil::CleanFolder(const std::string& path) {
    return CleanFolder(path.c_str());
}

// ---- Volumes --------------------------------------------------------------------------------

int UpdateUtil::IsThereAvailVolPath(std::string& path, unsigned long minFreeBytes, bool allowRoot) {
    char szPath[4095] = {0};
    bool found = false;

    PKYTO_MOUNT_VOL_INFO node =
        kyto::FirstVolumeWithRoom(KYTOMountVolInfoEnum(0), minFreeBytes, kModule, false);
    if (node != nullptr) {
        const size_t n = strnlen(node->szMountPath, sizeof(szPath) - 1);
        memcpy(szPath, node->szMountPath, n);
        szPath[n] = '\0';
        found = true;
    }
    // Released from the node where the walk stopped; after running off the end there is
    // nothing left to release from.  The callers are short-lived processes.
    KYTOMountVolInfoFree(node);

    if (!found && allowRoot) {
        unsigned long long avail = 0;
        if (kyto::AvailableBytes("/", avail) != 0) {
            syslog(LOG_ERR, "%s:%d sad.. could not get the size of %s. reason=%s.", kModule,
                   __LINE__, "/", strerror(errno));
            return 0;
        }
        if (avail < minFreeBytes) {
            syslog(LOG_ERR, "%s:%d sad.. %s do not have sufficient size.", kModule, __LINE__, "/");
            return 0;
        }
        snprintf(szPath, sizeof(szPath), "%s", "/");
        found = true;
    }
    if (!found)
        return 0;

    syslog(LOG_INFO, "%s:%d We get %s to upgrade.", kModule, __LINE__, szPath);
    path = szPath;
    return 1;
}

// ---- Download kind and user agent -----------------------------------------------------------

void UpdateUtil::CheckDownloadedPatchType(PATCH_TYPE& type) {
    type = PATCH_TYPE_NONE;
    if (!KLIBCFileExist(kyto::kAutoUpdateInfoFile))
        return;

    Json::Value root;
    if (!ParseJsonRootFromFile(kyto::kAutoUpdateInfoFile, root)) {
        syslog(LOG_INFO, "%s:%d [%s] does not contain correct format", kModule, __LINE__,
               kyto::kAutoUpdateInfoFile);
        return;
    }
    if (root.empty())
        return;
    // Only an object can carry the member; any other document is as good as unknown.
    if (!root.isObject() || !root.isMember(kyto::kKeyUpdateType)) {
        syslog(LOG_INFO, "%s:%d Unrecognized download info, no [%s]", kModule, __LINE__,
               kyto::kKeyUpdateType);
        return;
    }
    const Json::Value& kind = root[kyto::kKeyUpdateType];
    type =
        (kind.isString() && kind.asString() == kyto::kTypeVyx) ? PATCH_TYPE_VYX : PATCH_TYPE_SMALL;
}

namespace {

// True when the key=value reader's answer for key is no error; logs the error otherwise.
bool KeyReadable(const char* key, int result) {
    if (result >= 0)
        return true;
    syslog(LOG_ERR, "%s:%d Get %s Fail%s", kModule, __LINE__, key, kyto::LastErrorText().c_str());
    return false;
}

}  // namespace

int UpdateUtil::GetUserAgent(std::string& agent) {
    char szUnique[128] = {0};
    if (!KeyReadable("unique", KLIBCFileGetKeyValue(kyto::InfoConfFile(), "unique", szUnique,
                                                    sizeof(szUnique), 0)))
        return 0;
    const kyto::VersionKey<64> build("buildnumber");
    if (!KeyReadable("buildnumber", build.result))
        return 0;
    const kyto::VersionKey<16> major("majorversion");
    if (!KeyReadable("majorversion", major.result))
        return 0;
    const kyto::VersionKey<16> minor("minorversion");
    if (!KeyReadable("minorversion", minor.result))
        return 0;
    char szAgent[512] = {0};
    snprintf(szAgent, sizeof(szAgent), "%s VYX%s.%s %s (autoupgrade)", szUnique, major.text,
             minor.text, build.text);
    agent = szAgent;
    return 1;
}
