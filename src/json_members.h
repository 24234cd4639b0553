// Readers of JSON documents that never throw: jsoncpp throws when a member is looked up on
// anything but an object or null, when a container is converted to text, and when a
// document nests deeper than its stack limit.  Every module reads the info files and the
// patch list through these, so a hostile or broken file is a parse failure or an empty
// value, never an exception in the caller's process.  Internal header: not installed.
#ifndef KYTOINSTALLCPP_JSON_MEMBERS_H
#define KYTOINSTALLCPP_JSON_MEMBERS_H

#include <string>
#include <vector>

#include <json/json.h>

#include "scoped.h"

namespace kyto {

// Parses text into root (comments not collected).  False when the text is not JSON or the
// parser gave up (nesting deeper than it allows, out of memory).
bool ParseJsonText(const std::string& text, Json::Value& root);

// Text of a member: strings, numbers and booleans as jsoncpp converts them; a missing
// member, a container, or a document that is not an object reads as "".
std::string MemberText(const Json::Value& object, const char* key);
// A member as jsoncpp converts it to a boolean (a missing member reads as false, a
// non-zero number as true); anything it cannot convert reads as false.
bool MemberBool(const Json::Value& object, const char* key);
// A member holding an array of strings; a missing member is an empty list.  False (with
// out emptied) when the member is something else or holds a non-string.
bool MemberStringList(const Json::Value& object, const char* key, std::vector<std::string>& out);

// Writes text to the open file, logging under reportedPath when logFailures is set.  A
// short but non-zero write counts as written.  1 written, 0 not; *flushFailed tells that
// the data did not reach the file when it was closed (the result stays as it is).
int WriteJsonText(UniqueFile& file, const std::string& text, const char* reportedPath,
                  bool logFailures, bool* flushFailed);

// Writes root in the compact one-line form to a temporary file next to path and renames
// it over path, so that a poller never reads (and then deletes as broken) a half-written
// document.  Results as UpdateUtil::DumpJsonRootToFile: 1 written (a short write counts,
// a failed flush is logged), 0 when the file cannot be made or nothing is written; with
// logFailures its messages are logged under path.  A write or flush that fails removes the
// old file at path, as a failed rewrite in place would have broken it.
int DumpJsonAtomically(const char* path, const Json::Value& root, bool logFailures);

}  // namespace kyto

#endif
