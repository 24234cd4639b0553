#include "json_members.h"

#include <exception>
#include <sstream>

#include "update_cpputil.h"

namespace kyto {

namespace {

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

}  // namespace kyto
