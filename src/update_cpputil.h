// UpdateUtil: stateless helpers shared by both update engines: JSON files and string
// lists, archives and folders, volumes with room for a download, the kind of the last
// finished download and the HTTP user agent.
#ifndef KYTOINSTALLCPP_UPDATE_CPPUTIL_H
#define KYTOINSTALLCPP_UPDATE_CPPUTIL_H

#include <string>
#include <vector>

#include <json/json.h>

#include "kyto_export.h"

class KYTO_EXPORT UpdateUtil {
  public:
    // Kind of a downloaded update; the facade numbers its update type the same way.
    enum PATCH_TYPE {
        PATCH_TYPE_NONE = 0,   // no usable download info
        PATCH_TYPE_VYX = 1,    // full release image ("updateType" "vyxupdate")
        PATCH_TYPE_SMALL = 2,  // small update (any other "updateType")
    };

    // JSON files and string lists; 1 success, 0 failure.
    static int ParseJsonRootFromFile(const char* path, Json::Value& root);
    static int DumpJsonRootToFile(const char* path, const Json::Value& root);
    static int JsonArray2StringVector(const Json::Value& array, std::vector<std::string>& out);
    static int StringVector2JsonArray(const std::vector<std::string>& in, Json::Value& array);
    // 1 when both lists hold the same strings in any order, with the same multiplicities.
    static int CompareVector(std::vector<std::string> a, std::vector<std::string> b);

    // Archives, folders, volumes; 1 success, 0 failure.
    static int UntarFile(const char* archive, const char* folder);
    static int UntarFile(const std::string& archive, const std::string& folder);
    static int RemoveFolder(const char* path);
    static int RemoveFolder(const std::string& path);
    static int CleanFolder(const char* path);
    static int CleanFolder(const std::string& path);
    static int IsThereAvailVolPath(std::string& path, unsigned long minFreeBytes, bool allowRoot);

    // Kind of the download described by "/autoupd@te.info".
    static void CheckDownloadedPatchType(PATCH_TYPE& type);
    // "<unique> VYX<major>.<minor> <build> (autoupgrade)"; 1 success, 0 failure.
    static int GetUserAgent(std::string& agent);

    // Section and key of the interface's string table that name the service started by
    // `script` (a start-up script's file name, e.g. "S80samba.sh"); 1 when the script is
    // known, 0 (outputs untouched) when not.
    static int GetServiceNameSectionKey(const std::string& script, std::string& section,
                                        std::string& key);
};

#endif
