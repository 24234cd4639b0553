// What the files of VyxUpdate share: the module name in its log lines, the appliance paths
// more than one of them uses, the widths of its fixed text buffers, the feed's tag names
// and the words of its download states.  Internal header: not installed.
#ifndef KYTOINSTALLCPP_VYXUPDATE_INTERNAL_H
#define KYTOINSTALLCPP_VYXUPDATE_INTERNAL_H

#include <stddef.h>
#include <stdlib.h>
#include <string.h>

#include <initializer_list>

#include "vyxupdate.h"
#include "vyxupdate_plan.h"

namespace kyto {
namespace vyx {

// First field of every log line of the full-system update.
constexpr const char* kModule = "vyxupdate";

// Pid of the running wget child: written by the child, read by the pollers and the canceller.
constexpr const char* kPidFile = "/var/run/downloadVYX.pid";
// wget's progress log (its standard error), read for the announced length.
constexpr const char* kProgressLog = "/var/run/downloadprogress";

// Widths of the fixed text buffers, terminating NUL included.
// A version field of the record (major, minor, build phase, number and date, and their
// requirements) and a short value read from a key file (time zone, status-file keys).
constexpr size_t kVersionFieldSize = 64;
// The model identity and the image checksum of the record; the checksum scanned from the
// checksum tool's line (at most 255 characters) and the version text "VYX a.b-c".
constexpr size_t kIdentityFieldSize = 256;
// The image link of the record, a path, a shell command line and a line of the checksum tool.
constexpr size_t kPathSize = 4096;
// The installer-progress command line.
constexpr size_t kProgressCommandSize = 128;
// The length text wget announces in its progress log ("1,234,567").
constexpr size_t kLengthTextSize = 128;
// An element name (at most 128 characters) and a value (at most 4096) of a feed line.
constexpr size_t kTagNameWidth = 128;
constexpr size_t kTagValueWidth = 4096;

static_assert(sizeof(_tag_vyxinfo_::major) == kVersionFieldSize &&
                  sizeof(_tag_vyxinfo_::reqBuildDate) == kVersionFieldSize,
              "version fields");
static_assert(sizeof(_tag_vyxinfo_::unique) == kIdentityFieldSize &&
                  sizeof(_tag_vyxinfo_::checksum) == kIdentityFieldSize,
              "identity and checksum fields");
static_assert(sizeof(_tag_vyxinfo_::link) == kPathSize, "link field");

// Element names of the feed by tag kind (index = value of _tag_rss_tag_type_; 0 has no
// name).  "title" stands twice (the channel's and the item's); lookup takes the first, so
// the item's kind is never produced by a name.
constexpr const char* kTagNames[] = {
    nullptr,        "rss",       "channel",     "title",       "link",          "pubDate",
    "copyright",    "item",      "title",       "MajorVer",    "MinorVer",      "BuildPhase",
    "BuildNum",     "BuildDate", "ReqMajorVer", "ReqMinorVer", "ReqBuildPhase", "ReqBuildNum",
    "ReqBuildDate", "model",     "mUnique",     "mLink",       "mCheckSum",
};
static_assert(sizeof(kTagNames) / sizeof(kTagNames[0]) == RSS_TAG_M_CHECKSUM + 1,
              "one name for every tag kind");

// Words of the download states (index = value of VyxUpdate::VYX_DOWNLOAD_STATUS).
constexpr const char* kStatusWords[] = {"none", "downloading", "finished", "stopped", "failed"};
static_assert(sizeof(kStatusWords) / sizeof(kStatusWords[0]) ==
                  VyxUpdate::VYX_DOWNLOAD_STATUS_FAILED + 1,
              "one word for every download state");

// Letters of the installer-progress steps (index = value of _tag_update_step_ minus
// UPDATE_STEP_U).
constexpr char kStepLetters[] = "UAPCR";
static_assert(sizeof(kStepLetters) - 1 == UPDATE_STEP_R - UPDATE_STEP_U + 1,
              "one letter for every installer step");

// KEPT: version numbers are compared after conversion with automatic base: "0x" hex, a leading
// "0" octal, anything unparsable 0.
inline long ToNumber(const char* text) {
    return strtol(text, nullptr, 0);
}

inline void ClearRecord(_tag_vyxinfo_& info) {
    memset(&info, 0, sizeof(info));
}

// One key of a key=value file to read into a fixed buffer; reported is the key that a
// failure's message names.
struct KeyRead {
    const char* file;
    const char* key;
    const char* reported;
    char* buf;
    int size;
};

// Reads the keys in order and stops at the first one the reader does not find (a result
// below 1), logged as "Fail to get [reported] from [file]" with the platform's last error.
// True when every key was read.
bool ReadKeys(std::initializer_list<KeyRead> reads);

// The feed reader: the feed file at path read as VyxUpdate::ParseRssFile reads the fetched
// feed (which it calls with that file), for this device as current describes it.
int ReadFeed(const char* path, bool hotfixOnly, const _tag_vyxinfo_& current, bool& found,
             _tag_vyxinfo_& release);

}  // namespace vyx
}  // namespace kyto

#endif
