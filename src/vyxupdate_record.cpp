// VyxUpdate: version records (the running system's, filled from its version files, and
// a release's, filled line by line from the feed) and the three version comparisons.
#include "vyxupdate.h"

#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include <kytoplatform/klibc.h>

#include "kyto_paths.h"
#include "platform_error.h"
#include "vyxupdate_internal.h"
#include "version_file.h"

using namespace kyto::vyx;

bool kyto::vyx::ReadKeys(std::initializer_list<KeyRead> reads) {
    for (const KeyRead& r : reads) {
        if (KLIBCFileGetKeyValue(r.file, r.key, r.buf, r.size, 0) < 1) {
            syslog(LOG_ERR, "%s:%d Fail to get [%s] from [%s]. %s", kModule, __LINE__, r.reported,
                   r.file, kyto::LastErrorText().c_str());
            return false;
        }
    }
    return true;
}

int VyxUpdate::GetVyxInfo(_tag_vyxinfo_& info) {
    const char* version = kyto::VersionFile();
    return ReadKeys({
               {version, "majorversion", "majorversion", info.major, sizeof(info.major)},
               {version, "minorversion", "minorversion", info.minor, sizeof(info.minor)},
               {version, "buildphase", "buildphase", info.buildPhase, sizeof(info.buildPhase)},
               {version, "buildnumber", "buildnumber", info.buildNum, sizeof(info.buildNum)},
               {version, "builddate", "builddate", info.buildDate, sizeof(info.buildDate)},
               {kyto::InfoConfFile(), "unique", "unique", info.unique, sizeof(info.unique)},
           })
               ? 1
               : 0;
}

void VyxUpdate::SetVyxInfo(const _tag_rss_tag_type_& type, const char* value, _tag_vyxinfo_& info) {
    if (value == nullptr)
        return;
    char* field = nullptr;
    size_t size = 0;
    switch (type) {
        case RSS_TAG_MAJOR_VER:
            field = info.major, size = sizeof(info.major);
            break;
        case RSS_TAG_MINOR_VER:
            field = info.minor, size = sizeof(info.minor);
            break;
        case RSS_TAG_BUILD_PHASE:
            field = info.buildPhase, size = sizeof(info.buildPhase);
            break;
        case RSS_TAG_BUILD_NUM:
            field = info.buildNum, size = sizeof(info.buildNum);
            break;
        case RSS_TAG_BUILD_DATE:
            field = info.buildDate, size = sizeof(info.buildDate);
            break;
        case RSS_TAG_REQ_MAJOR_VER:
            field = info.reqMajor, size = sizeof(info.reqMajor);
            break;
        case RSS_TAG_REQ_MINOR_VER:
            field = info.reqMinor, size = sizeof(info.reqMinor);
            break;
        case RSS_TAG_REQ_BUILD_PHASE:
            field = info.reqBuildPhase, size = sizeof(info.reqBuildPhase);
            break;
        case RSS_TAG_REQ_BUILD_NUM:
            field = info.reqBuildNum, size = sizeof(info.reqBuildNum);
            break;
        case RSS_TAG_REQ_BUILD_DATE:
            field = info.reqBuildDate, size = sizeof(info.reqBuildDate);
            break;
        case RSS_TAG_M_UNIQUE:
            field = info.unique, size = sizeof(info.unique);
            break;
        case RSS_TAG_M_LINK:
            field = info.link, size = sizeof(info.link);
            break;
        case RSS_TAG_M_CHECKSUM:
            field = info.checksum, size = sizeof(info.checksum);
            break;
        default:  // channel and item framing, "model": nothing to store
            return;
    }
    snprintf(field, size, "%s", value);
}

int VyxUpdate::IsVersionNewer(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate) {
    long curMajor = ToNumber(current.major);
    long newMajor = ToNumber(candidate.major);
    if (newMajor != curMajor)
        return newMajor > curMajor ? 1 : 0;
    long curMinor = ToNumber(current.minor);
    long newMinor = ToNumber(candidate.minor);
    if (newMinor != curMinor)
        return newMinor > curMinor ? 1 : 0;
    return ToNumber(candidate.buildNum) > ToNumber(current.buildNum) ? 1 : 0;
}

int VyxUpdate::IsHotfix(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate) {
    return (ToNumber(candidate.major) == ToNumber(current.major) &&
            ToNumber(candidate.minor) == ToNumber(current.minor))
               ? 1
               : 0;
}

int VyxUpdate::SatisfyReqVersion(const _tag_vyxinfo_& current, const _tag_vyxinfo_& candidate) {
    // KEPT: any one of the three is enough: the requirement is deliberately not compared as a
    // version triple.
    if (ToNumber(current.major) >= ToNumber(candidate.reqMajor))
        return 1;
    if (ToNumber(current.minor) >= ToNumber(candidate.reqMinor))
        return 1;
    if (ToNumber(current.buildNum) >= ToNumber(candidate.reqBuildNum))
        return 1;
    return 0;
}
