#include "json_members.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <exception>
#include <sstream>

#include "scoped.h"
#include "update_cpputil.h"

namespace kyto {

namespace {

// The writers' messages belong to the helpers' module.
constexpr const char* kModule = "update_cpputil";

// The member, or a null value when object is not an object (where jsoncpp would throw).
const Json::Value& Member(const Json::Value& object, const char* key) {
    static const Json::Value kNull;
    return object.isObject() ? object[key] : kNull;
}

}  // namespace

bool ParseJsonText(const std::string& text, Json::Value& root) {
    try {
        std::istringstream stream(text);
        Json::Reader reader;
        return reader.parse(stream, root, false);
    } catch (const std::exception&) {
        return false;
    }
}

std::string MemberText(const Json::Value& object, const char* key) {
    const Json::Value& value = Member(object, key);
    return value.isConvertibleTo(Json::stringValue) ? value.asString() : std::string();
}

bool MemberBool(const Json::Value& object, const char* key) {
    const Json::Value& value = Member(object, key);
    return value.isConvertibleTo(Json::booleanValue) && value.asBool();
}

bool MemberStringList(const Json::Value& object, const char* key, std::vector<std::string>& out) {
    const Json::Value& value = Member(object, key);
    if (value.isNull()) {
        out.clear();
        return true;
    }
    return UpdateUtil::JsonArray2StringVector(value, out) == 1;
}

int WriteJsonText(UniqueFile& file, const std::string& text, const char* reportedPath,
                  bool logFailures, bool* flushFailed) {
    int ret = 1;
    if (fwrite(text.data(), 1, text.size(), file.get()) == 0) {
        if (logFailures)
            syslog(LOG_ERR, "%s:%d Failed to write to %s", kModule, __LINE__, reportedPath);
        ret = 0;
    }
    *flushFailed = file.close() != 0;
    if (*flushFailed && ret == 1 && logFailures)
        syslog(LOG_ERR, "%s:%d Failed to write to %s", kModule, __LINE__, reportedPath);
    return ret;
}

int DumpJsonAtomically(const char* path, const Json::Value& root, bool logFailures) {
    Json::FastWriter writer;
    const std::string text = writer.write(root);

    std::string tmpPath = std::string(path) + ".XXXXXX";
    UniqueFd fd(mkostemp(&tmpPath[0], O_CLOEXEC));
    UniqueFile file(fd.valid() ? fdopen(fd.get(), "w") : nullptr);
    if (!file) {
        if (fd.valid())
            unlink(tmpPath.c_str());
        if (logFailures)
            syslog(LOG_ERR, "%s:%d Failed to open %s", kModule, __LINE__, path);
        return 0;
    }
    fd.release();  // now owned by file
    ScopedUnlink removeTmp(tmpPath);
    // Readers in other processes and users (the interface, the installer): the mode of a
    // file created in place.
    fchmod(fileno(file.get()), 0644);
    bool flushFailed = false;
    const int ret = WriteJsonText(file, text, path, logFailures, &flushFailed);
    // Only a complete document replaces the old one; after a failed write no earlier
    // record stays at the target either, as after a failed rewrite in place (whose broken
    // file the next reader deletes): a reader must never take the old record for the new.
    if (ret != 1 || flushFailed) {
        unlink(path);
        return ret;
    }
    if (rename(tmpPath.c_str(), path) != 0) {
        // Where the rename is refused (a folder in the way) opening the path in place
        // would have failed too.
        if (logFailures)
            syslog(LOG_ERR, "%s:%d Failed to open %s", kModule, __LINE__, path);
        return 0;
    }
    removeTmp.release();
    return 1;
}

}  // namespace kyto
